// PathList: a private temporary file naming the paths a transfer is limited to (rsync's
// --files-from with --from0: relative paths separated by NUL bytes). The file lives in the
// program's private temporary directory and is removed when the object goes.
#ifndef S2S_RSYNC_PATH_LIST_H
#define S2S_RSYNC_PATH_LIST_H

#include <string>
#include <vector>

namespace S2S {

// `paths` (relative to `root`) as they stand now: a path below a component that is gone or is no
// longer a directory (a folder replaced by a file) is replaced by that component, so rsync is
// never asked for a path it cannot even look up; duplicates go. The order is sorted.
std::vector<std::string> SettledPaths(const std::string& root,
                                      const std::vector<std::string>& paths);

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
