// Small file helpers shared by the commands: an owned descriptor and a bounded whole-file read.
#ifndef S2S_TOOLS_S2S_FILE_UTIL_H
#define S2S_TOOLS_S2S_FILE_UTIL_H

#include <sys/stat.h>
#include <unistd.h>

#include <string>

namespace s2s_cli {

// Owns a descriptor and closes it on destruction; standard input is never closed.
class UniqueFd {
  public:
    explicit UniqueFd(int fd) : fd_(fd) {}
    ~UniqueFd() {
        if (fd_ > 2) {
            close(fd_);
        }
    }
    UniqueFd(const UniqueFd&) = delete;
    UniqueFd& operator=(const UniqueFd&) = delete;
    int get() const { return fd_; }

  private:
    int fd_;
};

// Reads everything from `fd` into `content`, failing once it passes `limit` bytes.
// false with `error` set to a phrase that follows the file's name: "is larger than 4 KiB",
// "cannot be read: <reason>".
bool ReadAllBounded(int fd, size_t limit, std::string& content, std::string& error);

// Opens `path` for reading as a regular file; -1 with `error` set otherwise (a phrase as above:
// "is not a regular file", "cannot be opened: <reason>"). `st` receives its status.
int OpenRegularFile(const std::string& path, struct stat& st, std::string& error);

}  // namespace s2s_cli

#endif  // S2S_TOOLS_S2S_FILE_UTIL_H
