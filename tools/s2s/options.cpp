#include "tools/s2s/options.h"

#include <algorithm>

namespace s2s_cli {

namespace {

const OptionSpec* FindSpec(const std::vector<OptionSpec>& specs, const std::string& name) {
    for (const OptionSpec& option : specs) {
        if (option.name == name) {
            return &option;
        }
    }
    return nullptr;
}

}  // namespace

bool ParseUnsigned(const std::string& text, unsigned long long max, unsigned long long& out) {
    if (text.empty() || text.size() > 20) {
        return false;
    }
    unsigned long long value = 0;
    for (char c : text) {
        if (c < '0' || c > '9') {
            return false;
        }
        const unsigned digit = static_cast<unsigned>(c - '0');
        if (value > (max - digit) / 10) {
            return false;
        }
        value = value * 10 + digit;
    }
    out = value;
    return true;
}

bool Options::Parse(const std::vector<OptionSpec>& specs, const std::vector<std::string>& args,
                    std::string& error) {
    values_.clear();
    positional_.clear();
    bool options_done = false;
    for (size_t i = 0; i < args.size(); ++i) {
        const std::string& arg = args[i];
        if (options_done || arg.size() < 2 || arg[0] != '-') {
            positional_.push_back(arg);
            continue;
        }
        if (arg == "--") {
            options_done = true;
            continue;
        }
        std::string name;
        std::string value;
        bool has_inline_value = false;
        if (arg == "-h") {
            name = "help";
        } else if (arg.compare(0, 2, "--") == 0) {
            name = arg.substr(2);
            const size_t eq = name.find('=');
            if (eq != std::string::npos) {
                value = name.substr(eq + 1);
                name.resize(eq);
                has_inline_value = true;
            }
        } else {
            error = "unknown option '" + arg + "'";
            return false;
        }
        const OptionSpec* option = FindSpec(specs, name);
        if (option == nullptr) {
            error = "unknown option '--" + name + "'";
            return false;
        }
        if (option->value_name.empty()) {
            if (has_inline_value) {
                error = "option '--" + name + "' takes no value";
                return false;
            }
        } else if (!has_inline_value) {
            if (i + 1 >= args.size()) {
                error = "option '--" + name + "' needs a value (" + option->value_name + ")";
                return false;
            }
            value = args[++i];
        }
        std::vector<std::string>& slot = values_[name];
        if (!slot.empty() && !option->repeatable) {
            error = "option '--" + name + "' given more than once";
            return false;
        }
        slot.push_back(value);
    }
    return true;
}

std::string Options::Get(const std::string& name, const std::string& fallback) const {
    auto it = values_.find(name);
    if (it == values_.end() || it->second.empty()) {
        return fallback;
    }
    return it->second.back();
}

std::vector<std::string> Options::GetAll(const std::string& name) const {
    auto it = values_.find(name);
    if (it == values_.end()) {
        return {};
    }
    return it->second;
}

bool Options::GetUnsigned(const std::string& name, unsigned long long max, unsigned long long& out,
                          std::string& error) const {
    const std::string text = Get(name);
    if (!ParseUnsigned(text, max, out)) {
        error = "option '--" + name + "': '" + text + "' is not a whole number from 0 to " +
                std::to_string(max);
        return false;
    }
    return true;
}

std::string FormatHelp(const std::string& usage, const std::string& description,
                       const std::vector<OptionSpec>& specs, const std::string& epilogue) {
    std::string text = "Usage: " + usage + "\n\n" + description + "\n";
    if (!specs.empty()) {
        size_t width = 0;
        std::vector<std::string> heads;
        for (const OptionSpec& option : specs) {
            std::string head = "  --" + option.name;
            if (!option.value_name.empty()) {
                head += " " + option.value_name;
            }
            width = std::max(width, head.size());
            heads.push_back(head);
        }
        text += "\nOptions:\n";
        for (size_t i = 0; i < specs.size(); ++i) {
            text += heads[i] + std::string(width + 2 - heads[i].size(), ' ') + specs[i].help;
            if (specs[i].repeatable) {
                text += " (repeatable)";
            }
            text += "\n";
        }
    }
    if (!epilogue.empty()) {
        text += "\n" + epilogue;
        if (epilogue.back() != '\n') {
            text += "\n";
        }
    }
    return text;
}

}  // namespace s2s_cli
