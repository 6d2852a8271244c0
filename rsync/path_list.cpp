// The temporary list of paths a limited transfer sends.
#include "rsync/path_list.h"

#include <sys/stat.h>

#include <fstream>
#include <set>

#include "s2s_host.h"

namespace S2S {

std::vector<std::string> SettledPaths(const std::string& root,
                                      const std::vector<std::string>& paths) {
    std::set<std::string> settled;
    for (const std::string& path : paths) {
        std::string kept = path;
        for (size_t slash = path.find('/'); slash != std::string::npos;
             slash = path.find('/', slash + 1)) {
            const std::string parent = path.substr(0, slash);
            struct stat st;
            if (lstat((root + "/" + parent).c_str(), &st) != 0 || !S_ISDIR(st.st_mode)) {
                kept = parent;
                break;
            }
        }
        settled.insert(kept);
    }
    return std::vector<std::string>(settled.begin(), settled.end());
}

PathList::~PathList() {
    PutTempFile(file_);
}

bool PathList::Write(const std::vector<std::string>& paths, std::string& error) {
    PutTempFile(file_);
    file_ = GetTempFile(error);
    if (file_.empty()) {
        return false;
    }
    std::ofstream out(file_, std::ios::binary | std::ios::trunc);
    for (const std::string& path : paths) {
        out << path << '\0';
    }
    out.flush();
    if (!out) {
        error = "cannot write the list of changed paths " + file_;
        return false;
    }
    return true;
}

}  // namespace S2S
