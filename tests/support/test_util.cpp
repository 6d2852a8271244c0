// The shared test helpers of test_util.h.
#include "support/test_util.h"

#include <arpa/inet.h>
#include <signal.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>
#include <filesystem>
#include <fstream>
#include <sstream>
#include <thread>

namespace s2s_test {

bool WaitFor(const std::function<bool()>& done, std::chrono::milliseconds limit) {
    const auto deadline = std::chrono::steady_clock::now() + limit;
    bool ok = false;
    for (auto pause = std::chrono::milliseconds(1);
         !(ok = done()) && std::chrono::steady_clock::now() < deadline;) {
        std::this_thread::sleep_for(pause = std::min(pause * 2, std::chrono::milliseconds(50)));
    }
    return ok;
}
int FreeTcpPort() {
    int fd = socket(AF_INET, SOCK_STREAM, 0);
    sockaddr_in addr{AF_INET, 0, {htonl(INADDR_LOOPBACK)}, {}};
    socklen_t len = sizeof(addr);
    bool ok = fd >= 0 && bind(fd, reinterpret_cast<sockaddr*>(&addr), len) == 0 &&
              getsockname(fd, reinterpret_cast<sockaddr*>(&addr), &len) == 0;
    if (fd < 0 || close(fd) != 0 || !ok) {
        throw std::runtime_error("no free loopback port");
    }
    return ntohs(addr.sin_port);
}
std::string ReadFile(const std::string& path) {
    std::ostringstream content;
    content << std::ifstream(path, std::ios::binary).rdbuf();
    return content.str();
}
void WriteFile(const std::string& path, const std::string& content) {
    std::ofstream(path, std::ios::binary | std::ios::trunc) << content;
}
void MakeDirs(const std::string& path, mode_t mode) {
    for (size_t end = path.find('/', 1); end != std::string::npos; end = path.find('/', end + 1)) {
        mkdir(path.substr(0, end).c_str(), mode);
    }
    if (mkdir(path.c_str(), mode) != 0 && !std::filesystem::is_directory(path)) {
        throw std::runtime_error("cannot create " + path);
    }
}
void RemoveTree(const std::string& path) {
    std::error_code ignored;
    std::filesystem::remove_all(path, ignored);
}
Child::Child(const std::function<int()>& body) : pid_(fork()) {
    if (pid_ == 0) {
        int code = 120;
        try {
            code = body();
        } catch (...) {
        }
        _exit(code);
    }
}
int Child::Wait(std::chrono::milliseconds limit) {
    int status = 0;
    bool done = pid_ > 0 && WaitFor([&] { return waitpid(pid_, &status, WNOHANG) == pid_; }, limit);
    if (pid_ > 0 && !done) {
        kill(pid_, SIGKILL);
        waitpid(pid_, &status, 0);
    }
    pid_ = -1;
    return !done ? -2 : WIFEXITED(status) ? WEXITSTATUS(status) : -1;
}

}  // namespace s2s_test
