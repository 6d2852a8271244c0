// The temporary list of paths a limited transfer sends.
#include "rsync/path_list.h"

#include <fstream>

#include "s2s_host.h"

namespace S2S {

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
