// The command exchange's lines and tokens, and the one share-name rule (core/protocol.h).
#include "core/protocol.h"

#include <cctype>
#include <cstring>
#include <filesystem>
#include <system_error>

namespace S2S {
namespace protocol {

namespace {

constexpr const char* kTokenPrefix = "token=\"";

// Decodes one UTF-8 sequence at `p`; its length, or 0 when it is not valid UTF-8.
size_t Utf8Length(const unsigned char* p) {
    unsigned char c = p[0];
    size_t len;
    unsigned int code;
    if (c < 0x80) {
        return 1;
    } else if ((c & 0xE0) == 0xC0) {
        len = 2;
        code = c & 0x1F;
    } else if ((c & 0xF0) == 0xE0) {
        len = 3;
        code = c & 0x0F;
    } else if ((c & 0xF8) == 0xF0) {
        len = 4;
        code = c & 0x07;
    } else {
        return 0;
    }
    for (size_t i = 1; i < len; ++i) {
        if ((p[i] & 0xC0) != 0x80) {
            return 0;
        }
        code = (code << 6) | (p[i] & 0x3F);
    }
    // Overlong forms, surrogates and code points past U+10FFFF are not valid.
    static const unsigned int kMin[] = {0, 0, 0x80, 0x800, 0x10000};
    if (code < kMin[len] || code > 0x10FFFF || (code >= 0xD800 && code <= 0xDFFF)) {
        return 0;
    }
    return len;
}

}  // namespace

std::string Line(const std::string& key, const std::string& value) {
    return key + "=\"" + value + "\"";
}

std::string TokenLine(const std::string& token) {
    return kTokenPrefix + token + "\"\n";
}

std::string TokenOfLine(const std::string& line) {
    const size_t prefix = std::strlen(kTokenPrefix);
    if (line.size() != prefix + 2 * kTokenBytes + 1 || line.compare(0, prefix, kTokenPrefix) != 0 ||
        line.back() != '"') {
        return std::string();
    }
    std::string token = line.substr(prefix, 2 * kTokenBytes);
    return ValidToken(token) ? token : std::string();
}

bool ValidToken(const std::string& token) {
    if (token.size() != 2 * kTokenBytes) {
        return false;
    }
    for (char c : token) {
        if (!((c >= '0' && c <= '9') || (c >= 'a' && c <= 'f'))) {
            return false;
        }
    }
    return true;
}

bool ParseResult(const std::string& text, int* result) {
    std::string digits = text;
    if (!digits.empty() && digits.back() == '\n') {
        digits.pop_back();
    }
    if (digits.empty() || digits.size() > 5) {
        return false;
    }
    int value = 0;
    for (char c : digits) {
        if (!std::isdigit(static_cast<unsigned char>(c))) {
            return false;
        }
        value = value * 10 + (c - '0');
    }
    if (value > 65535) {
        return false;
    }
    *result = value;
    return true;
}

void RemoveTree(const std::string& path) {
    std::error_code ec;
    std::filesystem::remove_all(path, ec);
}

bool HasControl(const std::string& text) {
    for (unsigned char c : text) {
        if (c < 0x20 || c == 0x7f) {
            return true;
        }
    }
    return false;
}

bool TaskNameValid(const std::string& name) {
    return !name.empty() && name.size() <= kShareNameMax && !HasControl(name) &&
           name.find_first_of("/\"'`[]\\") == std::string::npos &&
           name.find("..") == std::string::npos && name.front() != ' ' && name.front() != '@' &&
           name.back() != ' ';
}

bool ShareNameValid(const std::string& name) {
    const size_t len = name.size();
    if (len == 0 || len > kShareNameMax || name == "." || name == ".." || name.front() == ' ' ||
        name.back() == ' ') {
        return false;
    }
    // A NUL inside the string ends the name for every C caller: it is refused like any control
    // character.
    const unsigned char* p = reinterpret_cast<const unsigned char*>(name.data());
    const unsigned char* end = p + len;
    while (p < end) {
        if (*p < 0x20 || *p == 0x7F || std::strchr("/\\[]", *p) != nullptr) {
            return false;
        }
        // The string's own terminator stops a sequence cut short at the end.
        size_t step = Utf8Length(p);
        if (step == 0) {
            return false;
        }
        p += step;
    }
    return true;
}

bool ShareNameSyncable(const std::string& name) {
    return ShareNameValid(name) && name.front() != '@' &&
           name.find_first_of("\"'`%:") == std::string::npos &&
           name.find("..") == std::string::npos && name.find("  ") == std::string::npos &&
           ShareModuleKey(name) != "global";
}

std::string ShareModuleKey(const std::string& name) {
    std::string key;
    for (char c : name) {
        if (c != ' ' && c != '\t') {
            key += static_cast<char>(c >= 'A' && c <= 'Z' ? c - 'A' + 'a' : c);
        }
    }
    return key;
}

}  // namespace protocol
}  // namespace S2S
