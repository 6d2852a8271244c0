// The tables and texts `s2s` prints from the sync service's replies: aligned columns, local times,
// and "-" for a key the reply does not carry.
#include "tools/s2s/service_view.h"

#include <ctime>
#include <sstream>
#include <vector>

#include "s2s_control.h"
#include "s2s_sync_obj.h"
#include "tools/s2s/progress.h"

namespace s2s_cli {

namespace {

namespace Control = S2S::Control;
using Row = std::vector<std::string>;

// Columns padded to their widest cell; the last column is not padded.
std::string Table(const std::vector<Row>& rows) {
    std::vector<size_t> widths;
    for (const Row& row : rows) {
        widths.resize(std::max(widths.size(), row.size()), 0);
        for (size_t i = 0; i < row.size(); ++i) {
            widths[i] = std::max(widths[i], row[i].size());
        }
    }
    std::string text;
    for (const Row& row : rows) {
        std::string line;
        for (size_t i = 0; i < row.size(); ++i) {
            line += row[i];
            if (i + 1 < row.size()) {
                line += std::string(widths[i] - row[i].size() + 2, ' ');
            }
        }
        text += line + "\n";
    }
    return text;
}

// A value of a reply as text: strings as they are, numbers in decimal, anything else "-".
std::string Text(const S2S::PObject& value) {
    if (value.isString()) {
        return value.asString().empty() ? "-" : value.asString();
    }
    if (value.isInteger()) {
        return std::to_string(value.asUInt64());
    }
    return "-";
}

std::string Join(const S2S::PObject& items) {
    std::string text;
    for (const S2S::PObject& item : items.asArray()) {
        text += (text.empty() ? "" : ", ") + item.asString();
    }
    return text.empty() ? "-" : text;
}

std::string NextRun(const S2S::PObject& entry, const S2S::SyncTask* task) {
    const unsigned long long next = entry[Control::kKeyNextRun].asUInt64();
    if (next != 0 || task == nullptr) {
        return FormatLocalTime(next);
    }
    switch (task->GetInfo().GetSchedule().GetMode()) {
        case S2S::SCHD_MANUAL:
            return "manual";
        case S2S::SCHD_REALTIME:
            return "on change";
        default:
            return "-";
    }
}

std::string Progress(const S2S::PObject& entry) {
    const unsigned long long done = entry[Control::kKeyBytesDone].asUInt64();
    const unsigned long long total = entry[Control::kKeyBytesTotal].asUInt64();
    if (entry[Control::kKeyState].asString() != Control::kStateRunning) {
        return "-";
    }
    if (total == 0) {
        return FormatBytes(done);
    }
    const unsigned long long percent = done >= total ? 100 : done * 100 / total;
    return std::to_string(percent) + "% " + FormatBytes(done) + " of " + FormatBytes(total);
}

// A run's result in the history and the status (the classes of a run's first failure, see
// docs/service.md) as "name (number)".
std::string RunResult(const S2S::PObject& value) {
    if (!value.isInteger()) {
        return "-";
    }
    static const char* const kNames[] = {"ok",        "local",         "unreachable", "auth",
                                         "conflict",  "refused",       "transfer",    "key-sync",
                                         "cancelled", "unsafe-source", "max-delete"};
    const unsigned long long code = value.asUInt64();
    const char* name = code < sizeof(kNames) / sizeof(kNames[0]) ? kNames[code]
                       : code == 99                              ? "interrupted"
                                                                 : nullptr;
    return name != nullptr ? std::string(name) + " (" + std::to_string(code) + ")"
                           : "result " + std::to_string(code);
}

// A share of a run: its remote result, or what the source check refused it for.
std::string ShareResult(const S2S::PObject& share) {
    const std::string guard = share[Control::kKeyGuard].asString();
    if (guard.empty()) {
        return "result " + Text(share[Control::kKeyResult]);
    }
    std::string text = "refused: " + guard;
    if (share.hasMember(Control::kKeyWouldDelete)) {
        text += ", would delete " + std::to_string(share[Control::kKeyWouldDelete].asUInt64());
    }
    return text;
}

}  // namespace

std::string FormatLocalTime(unsigned long long epoch) {
    if (epoch == 0) {
        return "-";
    }
    return LocalTimeText(static_cast<long long>(epoch), "%a %Y-%m-%d %H:%M:%S");
}

std::string LocalTimeText(long long epoch, const char* format) {
    const time_t t = static_cast<time_t>(epoch);
    struct tm tm = {};
    localtime_r(&t, &tm);
    char text[64];
    strftime(text, sizeof(text), format, &tm);
    return text;
}

unsigned long long TaskIdOf(const S2S::PObject& task) {
    return task.hasMember(Control::kKeyTaskId) ? task[Control::kKeyTaskId].asUInt64()
                                               : task["id"].asUInt64();
}

std::string TaskListTable(const S2S::PObject& tasks) {
    if (tasks.asArray().empty()) {
        return "no tasks\n";
    }
    std::vector<Row> rows = {{"ID", "NAME", "STATE", "SCHEDULE", "NEXT RUN", "SERVER", "SHARES"}};
    for (const S2S::PObject& entry : tasks.asArray()) {
        S2S::SyncTask task;
        S2S::PObj2SyncTask(entry, task);
        const S2S::SyncInfo& sync = task.GetInfo().GetSyncInfo();
        rows.push_back(
            {std::to_string(TaskIdOf(entry)), Text(entry["name"]), Text(entry[Control::kKeyState]),
             task.GetInfo().GetSchedule().GetModeStr(), NextRun(entry, &task),
             sync.GetServerIP().empty() ? Text(entry["server_name"]) : sync.GetServerIP(),
             Join(entry["share_list"])});
    }
    return Table(rows);
}

std::string TaskDetails(const S2S::PObject& entry) {
    S2S::SyncTask task;
    S2S::PObj2SyncTask(entry, task);
    std::ostringstream text;
    text << task << "\n";
    text << "allow empty source: " << (entry[Control::kKeyAllowEmptySource].asBool() ? "yes" : "no")
         << "\n";
    text << "max delete: " << Text(entry[Control::kKeyMaxDelete]) << "\n";
    text << "state: " << Text(entry[Control::kKeyState]) << "\n";
    text << "next run: " << NextRun(entry, &task) << "\n";
    return text.str();
}

std::string StatusTable(const S2S::PObject& tasks) {
    if (tasks.asArray().empty()) {
        return "no tasks\n";
    }
    std::vector<Row> rows = {{"ID", "NAME", "STATE", "SHARE", "PROGRESS", "NEXT RUN", "LAST"}};
    std::string failures;
    for (const S2S::PObject& entry : tasks.asArray()) {
        rows.push_back({std::to_string(TaskIdOf(entry)), Text(entry[Control::kKeyName]),
                        Text(entry[Control::kKeyState]), Text(entry[Control::kKeyShare]),
                        Progress(entry), NextRun(entry, nullptr),
                        RunResult(entry[Control::kKeyLastResult])});
        const std::string message = entry[Control::kKeyLastMessage].asString();
        if (entry[Control::kKeyLastResult].asUInt64() != 0 && !message.empty()) {
            failures += "task " + std::to_string(TaskIdOf(entry)) + ": last run: " + message + "\n";
        }
    }
    return Table(rows) + failures;
}

std::string HistoryText(const S2S::PObject& runs) {
    if (runs.asArray().empty()) {
        return "no runs recorded\n";
    }
    std::string text;
    for (const S2S::PObject& run : runs.asArray()) {
        const unsigned long long start = run[Control::kKeyStart].asUInt64();
        const unsigned long long end = run[Control::kKeyEnd].asUInt64();
        text += FormatLocalTime(start) + "  task " + std::to_string(TaskIdOf(run)) + "  " +
                (end >= start && end != 0 ? FormatDuration(static_cast<double>(end - start))
                                          : "running") +
                "  " + RunResult(run[Control::kKeyResult]);
        const std::string message = run[Control::kKeyMessage].asString();
        text += message.empty() ? "\n" : "  " + message + "\n";
        std::vector<Row> rows;
        for (const S2S::PObject& share : run[Control::kKeyShares].asArray()) {
            Row row = {"   ",
                       Text(share[Control::kKeyName]),
                       ShareResult(share),
                       std::to_string(share[Control::kKeyFiles].asUInt64()) + " files",
                       FormatBytes(share[Control::kKeyBytes].asUInt64()),
                       "(read " + FormatBytes(share[Control::kKeyReadBytes].asUInt64()) + ")"};
            const std::string share_message = share[Control::kKeyMessage].asString();
            if (!share_message.empty()) {
                row.push_back(share_message);
            }
            rows.push_back(row);
        }
        text += Table(rows);
    }
    return text;
}

bool AnyActive(const S2S::PObject& tasks) {
    for (const S2S::PObject& entry : tasks.asArray()) {
        const std::string state = entry[Control::kKeyState].asString();
        if (state == Control::kStateRunning || state == Control::kStateQueued) {
            return true;
        }
    }
    return false;
}

}  // namespace s2s_cli
