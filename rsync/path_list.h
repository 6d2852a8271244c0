// PathList: a private temporary file naming the paths a transfer is limited to (rsync's
// --files-from with --from0: relative paths separated by NUL bytes). The file lives in the
// program's private temporary directory and is removed when the object goes.
#ifndef S2S_RSYNC_PATH_LIST_H
#define S2S_RSYNC_PATH_LIST_H

#include <string>
#include <vector>

namespace S2S {

class PathList {
  public:
    PathList() = default;
    ~PathList();
    PathList(const PathList&) = delete;
    PathList& operator=(const PathList&) = delete;

    // Writes `paths`; false with `error` set when the file cannot be made or written.
    bool Write(const std::vector<std::string>& paths, std::string& error);
    const std::string& File() const { return file_; }

  private:
    std::string file_;
};

}  // namespace S2S

#endif  // S2S_RSYNC_PATH_LIST_H
