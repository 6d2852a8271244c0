// Section files: parsing, atomic replacement, and the exported VLIBCFile* functions.
#include "platform/section_file.h"

#include <dirent.h>
#include <errno.h>
#include <fcntl.h>
#include <limits.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <unistd.h>

#include <algorithm>
#include <cstdlib>
#include <cstring>
#include <new>

#include "platform/platform_internal.h"
#include "s2s_logger.h"
#include "s2s_platform.h"

namespace s2s_platform {

namespace {

using S2S::Logger;

std::function<int(const char*)>& WriteFault() {
    static std::function<int(const char*)> fault;
    return fault;
}

int InjectedFault(const char* step) {
    const auto& fault = WriteFault();
    return fault ? fault(step) : 0;
}

bool HasLineBreak(const char* text) {
    return std::strpbrk(text, "\r\n") != nullptr;
}

bool HasOuterBlank(const char* text) {
    size_t len = std::strlen(text);
    auto blank = [](char c) { return c == ' ' || c == '\t'; };
    return len > 0 && (blank(text[0]) || blank(text[len - 1]));
}

std::string DirName(const std::string& path) {
    size_t slash = path.find_last_of('/');
    if (slash == std::string::npos) {
        return ".";
    }
    return slash == 0 ? "/" : path.substr(0, slash);
}

std::string BaseName(const std::string& path) {
    size_t slash = path.find_last_of('/');
    return slash == std::string::npos ? path : path.substr(slash + 1);
}

// A writer that died between creating its temporary file and renaming it leaves the file behind.
// Only the holder of the lock on the current file can have a temporary file in flight, so while
// holding it every leftover with our prefix is stale.
void RemoveStaleTemporaries(const std::string& dir, const std::string& prefix) {
    DIR* d = opendir(dir.c_str());
    if (d == nullptr) {
        return;
    }
    while (dirent* entry = readdir(d)) {
        if (std::strncmp(entry->d_name, prefix.c_str(), prefix.size()) == 0) {
            unlinkat(dirfd(d), entry->d_name, 0);
        }
    }
    closedir(d);
}

int WriteAll(int fd, const std::string& data) {
    size_t done = 0;
    while (done < data.size()) {
        ssize_t n = write(fd, data.data() + done, data.size() - done);
        if (n < 0) {
            if (errno == EINTR) {
                continue;
            }
            return -1;
        }
        done += static_cast<size_t>(n);
    }
    return 0;
}

// Replaces `target` by a file holding `content`, with the mode and owner of `old`.
int ReplaceFile(const std::string& target, const struct stat& old, const std::string& content) {
    std::string dir = DirName(target);
    std::string prefix = "." + BaseName(target) + ".s2stmp-";
    RemoveStaleTemporaries(dir, prefix);
    std::string temp = dir + "/" + prefix + "XXXXXX";
    int fd = mkostemp(&temp[0], O_CLOEXEC);
    if (fd < 0) {
        int saved = errno;
        Logger::LogMsg(Logger::Error,
                       "[ERROR] section_file.cpp(%d): Fail to create a temporary file in '%s', "
                       "error:'%s'\n",
                       __LINE__, dir.c_str(), std::strerror(saved));
        return Fail(ErrorFromErrno(saved));
    }
    const char* step = "chmod";
    int err = 0;
    if (fchmod(fd, old.st_mode & 07777) != 0) {
        err = errno;
    }
    if (err == 0 && (old.st_uid != geteuid() || old.st_gid != getegid())) {
        // Only root can hand the file back to its owner; anyone else keeps writing as themselves.
        if (fchown(fd, old.st_uid, old.st_gid) != 0 && errno != EPERM) {
            step = "chown";
            err = errno;
        }
    }
    if (err == 0) {
        step = "write";
        err = InjectedFault(step);
        if (err == 0 && WriteAll(fd, content) != 0) {
            err = errno;
        }
    }
    if (err == 0) {
        step = "fsync";
        err = InjectedFault(step);
        if (err == 0 && fsync(fd) != 0) {
            err = errno;
        }
    }
    if (close(fd) != 0 && err == 0) {
        step = "close";
        err = errno;
    }
    if (err == 0) {
        step = "rename";
        err = InjectedFault(step);
        if (err == 0 && rename(temp.c_str(), target.c_str()) != 0) {
            err = errno;
        }
    }
    if (err != 0) {
        unlink(temp.c_str());
        Logger::LogMsg(Logger::Error,
                       "[ERROR] section_file.cpp(%d): Fail to %s the new content of '%s', "
                       "error:'%s'\n",
                       __LINE__, step, target.c_str(), std::strerror(err));
        return Fail(ErrorFromErrno(err));
    }
    // The new name is in place; syncing the directory makes the rename itself durable.
    int dfd = open(dir.c_str(), O_RDONLY | O_DIRECTORY | O_CLOEXEC);
    if (dfd >= 0) {
        if (fsync(dfd) != 0) {
            Logger::LogMsg(Logger::Warning,
                           "[WARNING] section_file.cpp(%d): Fail to sync directory '%s', "
                           "error:'%s'\n",
                           __LINE__, dir.c_str(), std::strerror(errno));
        }
        close(dfd);
    }
    return 0;
}

int ParseFailure(const std::string& path, int bad_line) {
    Logger::LogMsg(Logger::Error,
                   "[ERROR] section_file.cpp(%d): Malformed line %d in section file '%s'\n",
                   __LINE__, bad_line, path.c_str());
    return Fail(VLIB_ERR_BAD_FORMAT);
}

}  // namespace

// --- the document ----------------------------------------------------------

bool SectionDoc::Parse(const std::string& text, int& bad_line) {
    lines_.clear();
    bad_line = 0;
    if (text.find('\0') != std::string::npos) {
        bad_line =
            1 + static_cast<int>(std::count(text.begin(), text.begin() + text.find('\0'), '\n'));
        return false;
    }
    bool in_section = false;
    size_t pos = 0;
    int number = 0;
    while (pos < text.size()) {
        size_t end = text.find('\n', pos);
        if (end == std::string::npos) {
            end = text.size();
        }
        ++number;
        std::string raw = text.substr(pos, end - pos);
        pos = end + 1;
        if (!raw.empty() && raw.back() == '\r') {
            raw.pop_back();
        }
        if (raw.size() > kSectionLineMax) {
            bad_line = number;
            return false;
        }
        Line line{Line::kBlank, raw, std::string(), std::string()};
        std::string trimmed = Trim(raw);
        if (trimmed.empty()) {
            line.kind = Line::kBlank;
        } else if (trimmed[0] == '#' || trimmed[0] == ';') {
            line.kind = Line::kComment;
        } else if (trimmed[0] == '[' && trimmed.back() == ']') {
            line.kind = Line::kHeader;
            line.name = Trim(trimmed.substr(1, trimmed.size() - 2));
            if (line.name.empty()) {
                bad_line = number;
                return false;
            }
            in_section = true;
        } else {
            size_t eq = trimmed.find('=');
            if (eq == std::string::npos || !in_section) {
                bad_line = number;
                return false;
            }
            line.kind = Line::kPair;
            line.name = Trim(trimmed.substr(0, eq));
            std::string value = Trim(trimmed.substr(eq + 1));
            if (line.name.empty()) {
                bad_line = number;
                return false;
            }
            if (!value.empty() && value[0] == '"') {
                // The value runs to the last quote of the line, so a value holding quotes reads
                // back unchanged.
                if (value.size() < 2 || value.back() != '"') {
                    bad_line = number;
                    return false;
                }
                value = value.substr(1, value.size() - 2);
            }
            line.value = value;
        }
        lines_.push_back(std::move(line));
    }
    return true;
}

std::string SectionDoc::Serialize() const {
    std::string out;
    for (const Line& line : lines_) {
        out += line.raw;
        out += '\n';
    }
    return out;
}

SectionDoc::Line SectionDoc::MakePair(const std::string& key, const std::string& value) {
    return Line{Line::kPair, "\t" + key + "=\"" + value + "\"", key, value};
}

SectionDoc::Line SectionDoc::MakeHeader(const std::string& name) {
    return Line{Line::kHeader, "[" + name + "]", name, std::string()};
}

int SectionDoc::FindHeader(const std::string& name) const {
    for (size_t i = 0; i < lines_.size(); ++i) {
        if (lines_[i].kind == Line::kHeader && lines_[i].name == name) {
            return static_cast<int>(i);
        }
    }
    return -1;
}

size_t SectionDoc::SectionEnd(size_t header) const {
    size_t i = header + 1;
    while (i < lines_.size() && lines_[i].kind != Line::kHeader) {
        ++i;
    }
    return i;
}

std::vector<std::string> SectionDoc::SectionNames() const {
    std::vector<std::string> names;
    for (const Line& line : lines_) {
        if (line.kind == Line::kHeader) {
            names.push_back(line.name);
        }
    }
    return names;
}

Pairs SectionDoc::SectionPairs(const std::string& name) const {
    Pairs pairs;
    int header = FindHeader(name);
    if (header < 0) {
        return pairs;
    }
    size_t end = SectionEnd(static_cast<size_t>(header));
    for (size_t i = static_cast<size_t>(header) + 1; i < end; ++i) {
        if (lines_[i].kind != Line::kPair) {
            continue;
        }
        bool seen = false;
        for (const auto& pair : pairs) {
            seen = seen || pair.first == lines_[i].name;
        }
        if (!seen) {
            pairs.emplace_back(lines_[i].name, lines_[i].value);
        }
    }
    return pairs;
}

bool SectionDoc::GetValue(const std::string& section, const std::string& key,
                          std::string& value) const {
    int header = FindHeader(section);
    if (header < 0) {
        return false;
    }
    size_t end = SectionEnd(static_cast<size_t>(header));
    for (size_t i = static_cast<size_t>(header) + 1; i < end; ++i) {
        if (lines_[i].kind == Line::kPair && lines_[i].name == key) {
            value = lines_[i].value;
            return true;
        }
    }
    return false;
}

bool SectionDoc::SetPairs(const std::string& name, const Pairs& pairs, bool add_missing) {
    int header = FindHeader(name);
    if (header < 0) {
        return false;
    }
    for (const auto& pair : pairs) {
        size_t begin = static_cast<size_t>(header) + 1;
        size_t end = SectionEnd(static_cast<size_t>(header));
        size_t insert_at = begin;
        bool found = false;
        for (size_t i = begin; i < end; ++i) {
            if (lines_[i].kind != Line::kPair) {
                continue;
            }
            insert_at = i + 1;
            if (lines_[i].name == pair.first) {
                lines_[i] = MakePair(pair.first, pair.second);
                found = true;
                break;
            }
        }
        if (!found && add_missing) {
            lines_.insert(lines_.begin() + static_cast<std::ptrdiff_t>(insert_at),
                          MakePair(pair.first, pair.second));
        }
    }
    return true;
}

bool SectionDoc::Rename(const std::string& from, const std::string& to) {
    int header = FindHeader(from);
    if (header < 0) {
        return false;
    }
    lines_[static_cast<size_t>(header)] = MakeHeader(to);
    return true;
}

void SectionDoc::AppendSection(const std::string& name, const Pairs& pairs) {
    lines_.push_back(MakeHeader(name));
    for (const auto& pair : pairs) {
        lines_.push_back(MakePair(pair.first, pair.second));
    }
}

bool SectionDoc::ReplacePairs(const std::string& name, const Pairs& pairs) {
    int header = FindHeader(name);
    if (header < 0) {
        return false;
    }
    size_t begin = static_cast<size_t>(header) + 1;
    size_t end = SectionEnd(static_cast<size_t>(header));
    std::vector<Line> kept;
    for (size_t i = begin; i < end; ++i) {
        if (lines_[i].kind != Line::kPair) {
            kept.push_back(lines_[i]);
        }
    }
    std::vector<Line> fresh;
    for (const auto& pair : pairs) {
        fresh.push_back(MakePair(pair.first, pair.second));
    }
    fresh.insert(fresh.end(), kept.begin(), kept.end());
    lines_.erase(lines_.begin() + static_cast<std::ptrdiff_t>(begin),
                 lines_.begin() + static_cast<std::ptrdiff_t>(end));
    lines_.insert(lines_.begin() + static_cast<std::ptrdiff_t>(begin), fresh.begin(), fresh.end());
    return true;
}

bool SectionDoc::RemoveSection(const std::string& name) {
    int header = FindHeader(name);
    if (header < 0) {
        return false;
    }
    size_t end = SectionEnd(static_cast<size_t>(header));
    lines_.erase(lines_.begin() + header, lines_.begin() + static_cast<std::ptrdiff_t>(end));
    return true;
}

// --- files -------------------------------------------------------------------

int LoadSectionFile(const std::string& path, SectionDoc& doc) {
    std::string text;
    if (ReadWholeFile(path, text, kSectionFileMax) != 0) {
        int saved = errno;
        if (saved == ENOENT) {
            return Fail(VLIB_ERR_FILE_NOT_FOUND);
        }
        Logger::LogMsg(Logger::Error,
                       "[ERROR] section_file.cpp(%d): Fail to read section file '%s', error:'%s'\n",
                       __LINE__, path.c_str(), std::strerror(saved));
        return Fail(saved == EFBIG ? VLIB_ERR_BAD_FORMAT : ErrorFromErrno(saved));
    }
    int bad_line = 0;
    if (!doc.Parse(text, bad_line)) {
        return ParseFailure(path, bad_line);
    }
    return Succeed(0);
}

int UpdateSectionFile(const std::string& path, bool create,
                      const std::function<int(SectionDoc&)>& edit) {
    // Writers lock the file they are about to replace. A writer that waited may wake up holding
    // the lock of a file that was replaced meanwhile; it then starts over on the current one.
    std::string target = path;
    char resolved[PATH_MAX];
    if (realpath(path.c_str(), resolved) != nullptr) {
        target = resolved;
    }
    for (int attempt = 0; attempt < 1000; ++attempt) {
        int fd = open(target.c_str(), O_RDONLY | O_CLOEXEC);
        if (fd < 0 && errno == ENOENT && create) {
            fd = open(target.c_str(), O_RDWR | O_CREAT | O_EXCL | O_CLOEXEC, 0644);
            if (fd < 0 && errno == EEXIST) {
                continue;
            }
        }
        if (fd < 0) {
            int saved = errno;
            if (saved == ENOENT) {
                return Fail(VLIB_ERR_FILE_NOT_FOUND);
            }
            Logger::LogMsg(Logger::Error,
                           "[ERROR] section_file.cpp(%d): Fail to open section file '%s', "
                           "error:'%s'\n",
                           __LINE__, target.c_str(), std::strerror(saved));
            return Fail(ErrorFromErrno(saved));
        }
        int rc;
        while ((rc = flock(fd, LOCK_EX)) != 0 && errno == EINTR) {
        }
        struct stat held;
        struct stat current;
        if (rc != 0 || fstat(fd, &held) != 0) {
            int saved = errno;
            close(fd);
            Logger::LogMsg(Logger::Error,
                           "[ERROR] section_file.cpp(%d): Fail to lock section file '%s', "
                           "error:'%s'\n",
                           __LINE__, target.c_str(), std::strerror(saved));
            return Fail(ErrorFromErrno(saved));
        }
        if (stat(target.c_str(), &current) != 0 || current.st_ino != held.st_ino ||
            current.st_dev != held.st_dev) {
            close(fd);
            continue;
        }
        std::string text;
        if (ReadWholeFd(fd, text, kSectionFileMax) != 0) {
            int saved = errno;
            close(fd);
            Logger::LogMsg(Logger::Error,
                           "[ERROR] section_file.cpp(%d): Fail to read section file '%s', "
                           "error:'%s'\n",
                           __LINE__, target.c_str(), std::strerror(saved));
            return Fail(saved == EFBIG ? VLIB_ERR_BAD_FORMAT : ErrorFromErrno(saved));
        }
        SectionDoc doc;
        int bad_line = 0;
        if (!doc.Parse(text, bad_line)) {
            close(fd);
            return ParseFailure(target, bad_line);
        }
        int result;
        try {
            result = edit(doc);
            if (result == 1 && ReplaceFile(target, held, doc.Serialize()) != 0) {
                result = -1;
            }
        } catch (const std::bad_alloc&) {
            result = Fail(VLIB_ERR_OUT_OF_MEMORY);
        }
        close(fd);
        if (result >= 0) {
            SetError(VLIB_ERR_NONE);
        }
        return result;
    }
    Logger::LogMsg(Logger::Error,
                   "[ERROR] section_file.cpp(%d): Section file '%s' keeps being replaced\n",
                   __LINE__, target.c_str());
    return Fail(VLIB_ERR_IO);
}

void SetSectionWriteFault(std::function<int(const char* step)> fault) {
    WriteFault() = std::move(fault);
}

bool ValidSectionName(const char* name) {
    return name != nullptr && name[0] != '\0' && !HasLineBreak(name) && !HasOuterBlank(name);
}

bool ValidKey(const char* key) {
    return key != nullptr && key[0] != '\0' && !HasLineBreak(key) && !HasOuterBlank(key) &&
           std::strchr(key, '=') == nullptr && key[0] != '#' && key[0] != ';' && key[0] != '[';
}

bool ValidValue(const char* value) {
    return value != nullptr && !HasLineBreak(value) && std::strlen(value) <= VLIB_SECTION_VALUE_MAX;
}

}  // namespace s2s_platform

// --- the exported functions ----------------------------------------------------

using s2s_platform::Fail;
using s2s_platform::Pairs;
using s2s_platform::SectionDoc;
using s2s_platform::Succeed;

namespace {

bool ValidFormat(const char* format) {
    return format == nullptr || std::strcmp(format, VLIB_SECTION_LINE_FORMAT) == 0;
}

// The table's pairs, or false when one of them cannot be written into a section file.
bool TablePairs(const VLIBSzHash* table, Pairs& pairs) {
    if (table == nullptr) {
        return false;
    }
    int count = VLIBCSzHashCount(table);
    for (int i = 0; i < count; ++i) {
        const char* key = VLIBCSzHashKeyAt(table, i);
        const char* value = VLIBCSzHashValueAt(table, i);
        if (!s2s_platform::ValidKey(key) || !s2s_platform::ValidValue(value)) {
            S2S::Logger::LogMsg(S2S::Logger::Error,
                                "[ERROR] section_file.cpp(%d): Refuse to write key '%s': the key "
                                "or its value cannot be stored in a section file\n",
                                __LINE__, key == nullptr ? "" : key);
            return false;
        }
        pairs.emplace_back(key, value);
    }
    return true;
}

bool NullOrEmpty(const char* text) {
    return text == nullptr || text[0] == '\0';
}

}  // namespace

extern "C" {

int VLIBCFileGetSection(const char* file, const char* section, VLIBSzHash** table) {
    if (NullOrEmpty(file) || NullOrEmpty(section) || table == nullptr || *table == nullptr) {
        return Fail(VLIB_ERR_BAD_PARAMETER);
    }
    try {
        SectionDoc doc;
        if (s2s_platform::LoadSectionFile(file, doc) != 0) {
            return -1;
        }
        if (!doc.HasSection(section)) {
            s2s_platform::SetError(VLIB_ERR_NOT_FOUND);
            return 0;
        }
        for (const auto& pair : doc.SectionPairs(section)) {
            if (VLIBCSzHashSetValue(table, pair.first.c_str(), pair.second.c_str()) < 0) {
                return -1;
            }
        }
    } catch (const std::bad_alloc&) {
        return Fail(VLIB_ERR_OUT_OF_MEMORY);
    }
    return Succeed(1);
}

int VLIBCFileGetSectionValue(const char* file, const char* section, const char* key, char* buf,
                             int size) {
    if (NullOrEmpty(file) || NullOrEmpty(section) || NullOrEmpty(key) || buf == nullptr ||
        size <= 0) {
        return Fail(VLIB_ERR_BAD_PARAMETER);
    }
    try {
        SectionDoc doc;
        if (s2s_platform::LoadSectionFile(file, doc) != 0) {
            buf[0] = '\0';
            return -1;
        }
        std::string value;
        if (!doc.GetValue(section, key, value)) {
            buf[0] = '\0';
            return Fail(VLIB_ERR_NOT_FOUND);
        }
        return s2s_platform::CopyOut(value, buf, size);
    } catch (const std::bad_alloc&) {
        return Fail(VLIB_ERR_OUT_OF_MEMORY);
    }
}

int VLIBCFileSetSection(const char* file, const char* section, const char* oldName,
                        const VLIBSzHash* table, const char* lineFormat) {
    Pairs pairs;
    if (NullOrEmpty(file) || !s2s_platform::ValidSectionName(section) ||
        (oldName != nullptr && oldName[0] == '\0') || !ValidFormat(lineFormat) ||
        !TablePairs(table, pairs)) {
        return Fail(VLIB_ERR_BAD_PARAMETER);
    }
    std::string target(section);
    std::string from(oldName != nullptr ? oldName : section);
    return s2s_platform::UpdateSectionFile(file, true, [&](SectionDoc& doc) {
        if (!doc.HasSection(from)) {
            if (doc.HasSection(target)) {
                return doc.SetPairs(target, pairs, true) ? 1 : -1;
            }
            doc.AppendSection(target, pairs);
            return 1;
        }
        if (from != target) {
            if (doc.HasSection(target)) {
                // Renaming onto another section would leave two sections of one name.
                return Fail(VLIB_ERR_BAD_PARAMETER);
            }
            doc.Rename(from, target);
        }
        doc.SetPairs(target, pairs, true);
        return 1;
    });
}

int VLIBCFileAddSection(const char* file, const char* section, const VLIBSzHash* table,
                        const char* lineFormat) {
    Pairs pairs;
    if (NullOrEmpty(file) || !s2s_platform::ValidSectionName(section) || !ValidFormat(lineFormat) ||
        !TablePairs(table, pairs)) {
        return Fail(VLIB_ERR_BAD_PARAMETER);
    }
    return s2s_platform::UpdateSectionFile(file, true, [&](SectionDoc& doc) {
        if (!doc.SetPairs(section, pairs, true)) {
            doc.AppendSection(section, pairs);
        }
        return 1;
    });
}

int VLIBCIFileModifySection(const char* file, const char* section, const char* newName,
                            const VLIBSzHash* table, int addKeys, const char* lineFormat) {
    Pairs pairs;
    if (NullOrEmpty(file) || NullOrEmpty(section) ||
        (newName != nullptr && !s2s_platform::ValidSectionName(newName)) ||
        !ValidFormat(lineFormat) || !TablePairs(table, pairs)) {
        return Fail(VLIB_ERR_BAD_PARAMETER);
    }
    int result = s2s_platform::UpdateSectionFile(file, false, [&](SectionDoc& doc) {
        if (!doc.HasSection(section)) {
            return 0;
        }
        std::string name(section);
        if (newName != nullptr && name != newName) {
            if (doc.HasSection(newName)) {
                return Fail(VLIB_ERR_BAD_PARAMETER);
            }
            doc.Rename(name, newName);
            name = newName;
        }
        doc.SetPairs(name, pairs, addKeys != 0);
        return 1;
    });
    if (result == 0) {
        s2s_platform::SetError(VLIB_ERR_NOT_FOUND);
    } else if (result > 0) {
        s2s_platform::SetError(VLIB_ERR_NONE);
    }
    return result;
}

int VLIBCFileReplaceSection(const char* file, const char* section, const VLIBSzHash* table,
                            const char* lineFormat) {
    Pairs pairs;
    if (NullOrEmpty(file) || !s2s_platform::ValidSectionName(section) || !ValidFormat(lineFormat) ||
        !TablePairs(table, pairs)) {
        return Fail(VLIB_ERR_BAD_PARAMETER);
    }
    return s2s_platform::UpdateSectionFile(file, true, [&](SectionDoc& doc) {
        if (!doc.ReplacePairs(section, pairs)) {
            doc.AppendSection(section, pairs);
        }
        return 1;
    });
}

int VLIBCFileRemoveSection(const char* file, const char* section) {
    if (NullOrEmpty(file) || NullOrEmpty(section)) {
        return Fail(VLIB_ERR_BAD_PARAMETER);
    }
    int result = s2s_platform::UpdateSectionFile(
        file, false, [&](SectionDoc& doc) { return doc.RemoveSection(section) ? 1 : 0; });
    if (result == 0) {
        s2s_platform::SetError(VLIB_ERR_NOT_FOUND);
    } else if (result > 0) {
        s2s_platform::SetError(VLIB_ERR_NONE);
    }
    return result;
}

int VLIBCFileEnumSection(const char* file, VLIBSzList** list) {
    if (NullOrEmpty(file) || list == nullptr || *list == nullptr) {
        return Fail(VLIB_ERR_BAD_PARAMETER);
    }
    try {
        SectionDoc doc;
        if (s2s_platform::LoadSectionFile(file, doc) != 0) {
            return -1;
        }
        std::vector<std::string> names = doc.SectionNames();
        for (const std::string& name : names) {
            if (VLIBCSzListPush(list, name.c_str()) < 0) {
                return -1;
            }
        }
        return Succeed(static_cast<int>(names.size()));
    } catch (const std::bad_alloc&) {
        return Fail(VLIB_ERR_OUT_OF_MEMORY);
    }
}

int VLIBCFileExist(const char* path) {
    struct stat st;
    return path != nullptr && stat(path, &st) == 0 && S_ISREG(st.st_mode) ? 1 : 0;
}

}  // extern "C"
