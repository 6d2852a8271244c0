// The token line, the check of a reply token, the reading of a reply's result file and the
// removal of a reply directory: the pieces of the command exchange both ends share.
#include "rsync/command_reply.h"

#include <cctype>
#include <filesystem>
#include <system_error>

namespace S2S {
namespace command_reply {

std::string TokenLine(const std::string& token) {
    return "token=\"" + token + "\"\n";
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

}  // namespace command_reply
}  // namespace S2S
