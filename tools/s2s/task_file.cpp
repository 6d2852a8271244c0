// Task files in JSON: the strict reader (known keys only, each with its type and range) that
// turns a file into the sync model's task map, and the writer that turns a task map back into
// JSON.
#include "tools/s2s/task_file.h"

#include <climits>
#include <nlohmann/json.hpp>
#include <set>

#include "tools/s2s/file_util.h"

namespace s2s_cli {

namespace {

using nlohmann::json;

constexpr size_t kMaxTaskFile = 1 << 20;

enum class Kind { UInt64, UInt32, Int32, String, Bool, StringArray };

struct KeySpec {
    const char* key;
    Kind kind;
};

// The task map's keys with the kinds they travel as. "status" and "sync_result" are written by
// the daemon, not by people, but a map saved from the daemon may carry them.
const KeySpec kKeys[] = {
    {"id", Kind::UInt64},
    {"name", Kind::String},
    {"share_list", Kind::StringArray},
    {"user", Kind::String},
    {"pswd", Kind::String},
    {"server_ip", Kind::String},
    {"server_name", Kind::String},
    {"compress", Kind::Bool},
    {"block", Kind::Bool},
    {"ssh", Kind::Bool},
    {"ssh_port", Kind::UInt32},
    {"max_bandwidth", Kind::UInt32},
    {"schedule_mode", Kind::Int32},
    {"schedule_begin_year", Kind::Int32},
    {"schedule_begin_month", Kind::Int32},
    {"schedule_begin_day", Kind::Int32},
    {"schedule_begin_hour", Kind::Int32},
    {"schedule_begin_min", Kind::Int32},
    {"week_schd", Kind::String},
    {"period_hour", Kind::Int32},
    {"period_minute", Kind::Int32},
    {"repeat_times_in_day", Kind::Int32},
    {"status", Kind::Int32},
    {"sync_result", Kind::Int32},
    {"allow_empty_source", Kind::Bool},
    {"max_delete", Kind::String},
};

const KeySpec* FindKey(const std::string& key) {
    for (const KeySpec& field : kKeys) {
        if (key == field.key) {
            return &field;
        }
    }
    return nullptr;
}

// Strings travel through the map as byte strings of at most 64 KiB less one (the stream format's
// 16-bit length); NUL bytes would be cut off on the way.
bool CheckString(const std::string& key, const std::string& value, std::string& error) {
    if (value.size() > 65535) {
        error = "key \"" + key + "\": text longer than 65535 bytes";
        return false;
    }
    if (value.find('\0') != std::string::npos) {
        error = "key \"" + key + "\": text contains a NUL character";
        return false;
    }
    return true;
}

bool ConvertValue(const KeySpec& field, const json& value, S2S::PObject& out, std::string& error) {
    const std::string key = field.key;
    switch (field.kind) {
        case Kind::String:
            if (!value.is_string()) {
                error = "key \"" + key + "\" must be a string";
                return false;
            }
            if (!CheckString(key, value.get<std::string>(), error)) {
                return false;
            }
            out = value.get<std::string>();
            return true;
        case Kind::Bool:
            if (value.is_boolean()) {
                out = value.get<bool>();
                return true;
            }
            if (value.is_number_unsigned() && value.get<unsigned long long>() <= 1) {
                out = value.get<unsigned long long>() == 1;
                return true;
            }
            error = "key \"" + key + "\" must be true, false, 1 or 0";
            return false;
        case Kind::UInt64:
            if (!value.is_number_unsigned()) {
                error = "key \"" + key + "\" must be a whole number from 0 to " +
                        std::to_string(ULLONG_MAX);
                return false;
            }
            out = value.get<unsigned long long>();
            return true;
        case Kind::UInt32:
            if (!value.is_number_unsigned() || value.get<unsigned long long>() > UINT_MAX) {
                error = "key \"" + key + "\" must be a whole number from 0 to " +
                        std::to_string(UINT_MAX);
                return false;
            }
            out = static_cast<unsigned int>(value.get<unsigned long long>());
            return true;
        case Kind::Int32:
            if (!value.is_number_integer() || value.get<long long>() < INT_MIN ||
                value.get<long long>() > INT_MAX ||
                (value.is_number_unsigned() && value.get<unsigned long long>() > INT_MAX)) {
                error = "key \"" + key + "\" must be a whole number from " +
                        std::to_string(INT_MIN) + " to " + std::to_string(INT_MAX);
                return false;
            }
            out = static_cast<int>(value.get<long long>());
            return true;
        case Kind::StringArray: {
            if (!value.is_array()) {
                error = "key \"" + key + "\" must be a list of share names";
                return false;
            }
            S2S::PObject::Array items;
            for (const json& item : value) {
                if (!item.is_string()) {
                    error = "key \"" + key + "\": every entry must be a string";
                    return false;
                }
                if (!CheckString(key, item.get<std::string>(), error)) {
                    return false;
                }
                items.emplace_back(item.get<std::string>());
            }
            out = items;
            return true;
        }
    }
    return false;
}

// nlohmann's messages start with "[json.exception.parse_error.101] "; people need the rest.
std::string CleanJsonError(const char* what) {
    std::string text = what;
    const size_t pos = text.find("] ");
    if (pos != std::string::npos && text[0] == '[') {
        text = text.substr(pos + 2);
    }
    return text;
}

}  // namespace

bool ParseTaskJson(const std::string& text, S2S::PObject& map, std::string& error) {
    std::set<std::string> seen;
    std::string duplicate;
    // The parser keeps the last of repeated keys; a repeated key in a task is a mistake worth
    // reporting, so the keys of the top object are watched as they are read.
    const json::parser_callback_t watch = [&](int depth, json::parse_event_t event, json& parsed) {
        if (event == json::parse_event_t::key && depth == 1 && duplicate.empty() &&
            !seen.insert(parsed.get<std::string>()).second) {
            duplicate = parsed.get<std::string>();
        }
        return true;
    };
    json doc;
    try {
        doc = json::parse(text, watch);
    } catch (const json::exception& e) {
        error = "not valid JSON: " + CleanJsonError(e.what());
        return false;
    }
    if (!doc.is_object()) {
        error = "a task file holds one JSON object";
        return false;
    }
    if (!duplicate.empty()) {
        error = "key \"" + duplicate + "\" appears more than once";
        return false;
    }
    S2S::PObject result;
    result.asMap();
    for (auto it = doc.begin(); it != doc.end(); ++it) {
        const KeySpec* field = FindKey(it.key());
        if (field == nullptr) {
            error = "unknown key \"" + it.key() + "\"";
            return false;
        }
        S2S::PObject value;
        if (!ConvertValue(*field, it.value(), value, error)) {
            return false;
        }
        result[it.key()] = value;
    }
    if (result.hasMember("week_schd")) {
        const std::string days = result["week_schd"].asString();
        if (days.size() != 7 || days.find_first_not_of("01") != std::string::npos) {
            error = "key \"week_schd\" must be seven '0'/'1' characters, from Sunday";
            return false;
        }
    }
    S2S::SourceGuardOptions guard;
    if (!GuardOptionsFromMap(result, guard, error)) {
        return false;
    }
    map = result;
    return true;
}

bool GuardOptionsFromMap(const S2S::PObject& map, S2S::SourceGuardOptions& options,
                         std::string& error) {
    if (map.hasMember("allow_empty_source")) {
        options.allowEmptySource = map["allow_empty_source"].asBool();
    }
    if (map.hasMember("max_delete") &&
        !S2S::DeleteLimit::Parse(map["max_delete"].asString(), options.maxDelete, error)) {
        error = "key \"max_delete\": " + error;
        return false;
    }
    return true;
}

bool LoadTaskFile(const std::string& path, S2S::PObject& map, bool& has_password,
                  std::string& error) {
    has_password = false;
    struct stat st;
    UniqueFd fd(OpenRegularFile(path, st, error));
    if (fd.get() < 0) {
        error = "task file '" + path + "' " + error;
        return false;
    }
    std::string text;
    if (!ReadAllBounded(fd.get(), kMaxTaskFile, text, error)) {
        error = "task file '" + path + "' " + error;
        return false;
    }
    if (!ParseTaskJson(text, map, error)) {
        error = "task file '" + path + "': " + error;
        return false;
    }
    has_password = map.hasMember("pswd");
    if (has_password && (st.st_mode & (S_IRGRP | S_IROTH)) != 0) {
        error = "task file '" + path +
                "' holds a password (\"pswd\") but other users can read it; restrict it "
                "(chmod 600) or keep the password in a password file";
        return false;
    }
    return true;
}

bool LoadTask(const std::string& path, S2S::SyncTask& task, bool& has_password,
              std::string& error) {
    S2S::PObject map;
    if (!LoadTaskFile(path, map, has_password, error)) {
        return false;
    }
    S2S::PObj2SyncTask(map, task);
    return true;
}

bool LoadTask(const std::string& path, S2S::SyncTask& task, S2S::SourceGuardOptions& guard,
              bool& has_password, std::string& error) {
    S2S::PObject map;
    if (!LoadTaskFile(path, map, has_password, error)) {
        return false;
    }
    if (!GuardOptionsFromMap(map, guard, error)) {
        error = "task file '" + path + "': " + error;
        return false;
    }
    S2S::PObj2SyncTask(map, task);
    return true;
}

json PObjectToJson(const S2S::PObject& value) {
    if (value.isMap()) {
        json doc = json::object();
        for (const auto& entry : value.asMap()) {
            if (entry.first != "pswd") {
                doc[entry.first] = PObjectToJson(entry.second);
            }
        }
        return doc;
    }
    if (value.isArray()) {
        json items = json::array();
        for (const S2S::PObject& item : value.asArray()) {
            items.push_back(PObjectToJson(item));
        }
        return items;
    }
    if (value.isInteger()) {
        return value.asUInt64();
    }
    if (value.isString()) {
        return value.asString();
    }
    return nullptr;
}

json TaskMapToJson(const S2S::PObject& map) {
    json doc = json::object();
    for (const auto& entry : map.asMap()) {
        const KeySpec* field = FindKey(entry.first);
        if (entry.first == "pswd") {
            continue;
        }
        const S2S::PObject& value = entry.second;
        if (field != nullptr && field->kind == Kind::StringArray) {
            json items = json::array();
            for (const S2S::PObject& item : value.asArray()) {
                items.push_back(item.asString());
            }
            doc[entry.first] = items;
        } else if (field != nullptr && field->kind == Kind::Bool) {
            doc[entry.first] = value.asBool();
        } else if (field != nullptr && field->kind == Kind::Int32) {
            doc[entry.first] = value.asInt32();
        } else {
            doc[entry.first] = PObjectToJson(value);
        }
    }
    return doc;
}

}  // namespace s2s_cli
