// Loading the sync password: the first line of a file (or of standard input), where a file other
// users can read is refused, or else the environment, whose variable is then removed so no child
// inherits it. The copy read from a file is wiped before it is freed.
#include "tools/s2s/password.h"

#include <algorithm>
#include <cstdlib>

#include "tools/s2s/file_util.h"

namespace s2s_cli {

const char kPasswordEnv[] = "S2S_PASSWORD";

namespace {

constexpr size_t kMaxPasswordFile = 4096;

std::string FirstLine(const std::string& content) {
    std::string line = content.substr(0, content.find('\n'));
    if (!line.empty() && line.back() == '\r') {
        line.pop_back();
    }
    return line;
}

}  // namespace

bool IsReadableByOthers(const std::string& path) {
    struct stat st;
    if (stat(path.c_str(), &st) != 0) {
        return true;
    }
    return (st.st_mode & (S_IRGRP | S_IROTH)) != 0;
}

bool ReadPasswordFile(const std::string& path, std::string& password, std::string& error) {
    struct stat st;
    std::string reason;
    UniqueFd fd(path == "-" ? 0 : OpenRegularFile(path, st, reason));
    if (fd.get() < 0) {
        error = "password file '" + path + "' " + reason;
        return false;
    }
    if (path != "-" && (st.st_mode & (S_IRGRP | S_IROTH)) != 0) {
        error = "password file '" + path +
                "' can be read by other users; restrict it first (chmod 600)";
        return false;
    }
    std::string content;
    const bool ok = ReadAllBounded(fd.get(), kMaxPasswordFile, content, reason);
    if (ok) {
        password = FirstLine(content);
    } else {
        error = "password file '" + path + "' " + reason;
    }
    // The copy in `content` is wiped before it is freed.
    std::fill(content.begin(), content.end(), '\0');
    return ok;
}

bool LoadPassword(const std::string& file, std::string& password, bool& found, std::string& error) {
    found = false;
    if (!file.empty()) {
        if (!ReadPasswordFile(file, password, error)) {
            return false;
        }
        found = true;
    } else if (const char* value = std::getenv(kPasswordEnv)) {
        password = value;
        found = true;
    }
    unsetenv(kPasswordEnv);
    return true;
}

}  // namespace s2s_cli
