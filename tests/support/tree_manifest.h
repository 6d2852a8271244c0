// The tree manifest: what a copy must reproduce of a directory tree, as one comparable value.
#ifndef S2S_TESTS_SUPPORT_TREE_MANIFEST_H
#define S2S_TESTS_SUPPORT_TREE_MANIFEST_H

#include <sys/stat.h>

#include <filesystem>
#include <functional>
#include <map>
#include <string>
#include <utility>

#include "support/test_util.h"

namespace s2s_test {

// Every entry below `root` (not following links; the root itself left out), keyed by its path
// relative to the root ("/dir/file"): type, permission bits, numeric owner, modification time
// (of directories too when `dirTimes`), size and content hash of files, target of links, and for
// files with several hard links the first path of their link group. Two trees with equal
// manifests are the same for a sync's purposes.
inline std::map<std::string, std::string> TreeManifest(const std::string& root,
                                                       bool dirTimes = true) {
    std::map<std::string, struct stat> entries;  // sorted: a link group's first path comes first
    for (const auto& entry : std::filesystem::recursive_directory_iterator(root)) {
        struct stat st;
        if (lstat(entry.path().c_str(), &st) == 0) {
            entries[entry.path().string().substr(root.size())] = st;
        }
    }
    std::map<std::pair<dev_t, ino_t>, std::string> firstOfInode;
    std::map<std::string, std::string> out;
    for (const auto& [path, st] : entries) {
        const char type = S_ISDIR(st.st_mode)   ? 'd'
                          : S_ISREG(st.st_mode) ? 'f'
                          : S_ISLNK(st.st_mode) ? 'l'
                                                : '?';
        std::string& d = out[path];
        d = std::string(1, type) + " " + std::to_string(st.st_mode & 07777) + " " +
            std::to_string(st.st_uid) + ":" + std::to_string(st.st_gid);
        if (type != 'd' || dirTimes) {
            d += " t" + std::to_string(st.st_mtime);
        }
        if (type == 'f') {
            d += " s" + std::to_string(st.st_size) + " h" +
                 std::to_string(std::hash<std::string>()(ReadFile(root + path)));
        }
        if (type == 'f' && st.st_nlink > 1) {
            d += " =" +
                 firstOfInode.emplace(std::make_pair(st.st_dev, st.st_ino), path).first->second;
        }
        if (type == 'l') {
            d += " -> " + std::filesystem::read_symlink(root + path).string();
        }
    }
    return out;
}

}  // namespace s2s_test

#endif  // S2S_TESTS_SUPPORT_TREE_MANIFEST_H
