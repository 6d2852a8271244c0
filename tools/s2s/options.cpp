// The parsed options of a command (Options) and the strict unsigned-number parse that the option
// checks use: digits only, no sign, no blanks, no overflow.
#include "tools/s2s/options.h"

namespace s2s_cli {

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

void Options::Set(const std::string& name, std::vector<std::string> values) {
    values_[name] = std::move(values);
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

}  // namespace s2s_cli
