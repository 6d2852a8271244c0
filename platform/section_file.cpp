// Section files: parsing, atomic replacement, and the exported VLIBCFile* functions.
#include "platform/section_file.h"

#include <errno.h>
#include <fcntl.h>
#include <limits.h>
#include <pthread.h>
#include <sys/file.h>
#include <sys/stat.h>
#include <time.h>
#include <unistd.h>

#include <algorithm>
#include <cstdlib>
#include <cstring>
#include <list>
#include <mutex>
#include <new>

#include "platform/env.h"
#include "platform/platform_internal.h"
#include "s2s_logger.h"
#include "s2s_platform.h"

namespace s2s_platform {

namespace {

using S2S::Logger;

bool HasLineBreak(const char* text) {
    return std::strpbrk(text, "\r\n") != nullptr;
}

bool HasOuterBlank(const char* text) {
    size_t len = std::strlen(text);
    auto blank = [](char c) { return c == ' ' || c == '\t'; };
    return len > 0 && (blank(text[0]) || blank(text[len - 1]));
}

// Replaces `target` by a file holding `content`, with the mode and owner of `old`.
int ReplaceFile(const std::string& target, const struct stat& old, const std::string& content) {
    ReplaceOptions options;
    options.mode = old.st_mode & 07777;
    options.uid = old.st_uid;
    options.gid = old.st_gid;
    // Only the holder of the lock on the current file can have a temporary file in flight.
    options.sweep_stale = true;
    options.log_tag = "section_file.cpp";
    if (Env::Default()->ReplaceFile(target, content, options) != 0) {
        return Fail(ErrorFromErrno(errno));
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
    DropIndex();
    bad_line = 0;
    const char* const data = text.data();
    const char* const stop = data + text.size();
    if (const void* nul = std::memchr(data, '\0', text.size())) {
        bad_line = 1 + static_cast<int>(std::count(data, static_cast<const char*>(nul), '\n'));
        return false;
    }
    lines_.reserve(static_cast<size_t>(std::count(data, stop, '\n')) + 1);
    // Lines are taken apart in place; only what a line keeps (its text, name and value) is copied.
    auto blank = [](char c) { return c == ' ' || c == '\t' || c == '\r' || c == '\n'; };
    auto trim = [&blank](const char*& begin, const char*& end) {
        while (begin < end && blank(*begin)) {
            ++begin;
        }
        while (end > begin && blank(end[-1])) {
            --end;
        }
    };
    bool in_section = false;
    int number = 0;
    for (const char* pos = data; pos < stop;) {
        const char* newline = static_cast<const char*>(std::memchr(pos, '\n', stop - pos));
        const char* eol = newline != nullptr ? newline : stop;
        const char* raw_end = eol > pos && eol[-1] == '\r' ? eol - 1 : eol;
        const char* begin = pos;
        pos = eol + 1;
        ++number;
        if (static_cast<size_t>(raw_end - begin) > kSectionLineMax) {
            bad_line = number;
            return false;
        }
        Line line;
        line.raw.assign(begin, raw_end);
        const char* first = begin;
        const char* last = raw_end;
        trim(first, last);
        if (first == last) {
            line.kind = Line::kBlank;
        } else if (*first == '#' || *first == ';') {
            line.kind = Line::kComment;
        } else if (*first == '[' && last[-1] == ']') {
            const char* name = first + 1;
            const char* name_end = last - 1;
            trim(name, name_end);
            if (name >= name_end) {
                bad_line = number;
                return false;
            }
            line.kind = Line::kHeader;
            line.name_at = static_cast<size_t>(name - begin);
            line.name_size = static_cast<size_t>(name_end - name);
            headers_.emplace(line.name(), lines_.size());
            in_section = true;
        } else {
            const char* eq = static_cast<const char*>(std::memchr(first, '=', last - first));
            if (eq == nullptr || !in_section) {
                bad_line = number;
                return false;
            }
            const char* key = first;
            const char* key_end = eq;
            const char* value = eq + 1;
            const char* value_end = last;
            trim(key, key_end);
            trim(value, value_end);
            if (key == key_end) {
                bad_line = number;
                return false;
            }
            if (value < value_end && *value == '"') {
                // The value runs to the last quote of the line, so a value holding quotes reads
                // back unchanged.
                if (value_end - value < 2 || value_end[-1] != '"') {
                    bad_line = number;
                    return false;
                }
                ++value;
                --value_end;
            }
            line.kind = Line::kPair;
            line.name_at = static_cast<size_t>(key - begin);
            line.name_size = static_cast<size_t>(key_end - key);
            line.value_at = static_cast<size_t>(value - begin);
            line.value_size = static_cast<size_t>(value_end - value);
        }
        lines_.push_back(std::move(line));
    }
    indexed_ = true;
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
    Line line;
    line.kind = Line::kPair;
    line.raw = "\t" + key + "=\"" + value + "\"";
    line.name_at = 1;
    line.name_size = key.size();
    line.value_at = key.size() + 3;
    line.value_size = value.size();
    return line;
}

SectionDoc::Line SectionDoc::MakeHeader(const std::string& name) {
    Line line;
    line.kind = Line::kHeader;
    line.raw = "[" + name + "]";
    line.name_at = 1;
    line.name_size = name.size();
    return line;
}

void SectionDoc::DropIndex() {
    headers_.clear();
    indexed_ = false;
}

int SectionDoc::FindHeader(const std::string& name) const {
    if (indexed_) {
        auto it = headers_.find(name);
        return it == headers_.end() ? -1 : static_cast<int>(it->second);
    }
    for (size_t i = 0; i < lines_.size(); ++i) {
        if (lines_[i].kind == Line::kHeader && lines_[i].name() == name) {
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
            names.emplace_back(line.name());
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
            seen = seen || lines_[i].name() == pair.first;
        }
        if (!seen) {
            pairs.emplace_back(lines_[i].name(), lines_[i].value());
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
        if (lines_[i].kind == Line::kPair && lines_[i].name() == key) {
            value = lines_[i].value();
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
    DropIndex();
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
            if (lines_[i].name() == pair.first) {
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
    DropIndex();
    lines_[static_cast<size_t>(header)] = MakeHeader(to);
    return true;
}

void SectionDoc::AppendSection(const std::string& name, const Pairs& pairs) {
    DropIndex();
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
    DropIndex();
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
    DropIndex();
    size_t end = SectionEnd(static_cast<size_t>(header));
    lines_.erase(lines_.begin() + header, lines_.begin() + static_cast<std::ptrdiff_t>(end));
    return true;
}

// --- files -------------------------------------------------------------------

namespace {

// What a cached document was read from. Any write by rename gives a new inode, an edit in place
// a new ctime, a change of mode or owner a new ctime too; a change of the reading process's
// identity could change whether the file may be read at all.
struct FileIdentity {
    dev_t dev;
    ino_t ino;
    off_t size;
    mode_t mode;
    struct timespec mtime;
    struct timespec ctime;
    uid_t euid;
    gid_t egid;

    static FileIdentity Of(const struct stat& st) {
        return FileIdentity{st.st_dev,  st.st_ino,  st.st_size, st.st_mode,
                            st.st_mtim, st.st_ctim, geteuid(),  getegid()};
    }
    bool operator==(const FileIdentity& o) const {
        return dev == o.dev && ino == o.ino && size == o.size && mode == o.mode &&
               mtime.tv_sec == o.mtime.tv_sec && mtime.tv_nsec == o.mtime.tv_nsec &&
               ctime.tv_sec == o.ctime.tv_sec && ctime.tv_nsec == o.ctime.tv_nsec &&
               euid == o.euid && egid == o.egid;
    }
};

// File times come from a clock that advances in ticks (and on some file systems in whole
// seconds), so an edit made within a tick of the last one may leave every field of stat() as it
// was. A file whose ctime lies at least this far before a read began cannot be changed unseen
// after that read: any later change stamps a later ctime. Times without a fraction of a second
// suggest a file system that keeps only seconds (or two), hence the wider margin.
constexpr long long kSettleFineNs = 1000000000LL;
constexpr long long kSettleCoarseNs = 3000000000LL;

long long Nanoseconds(const struct timespec& t) {
    return static_cast<long long>(t.tv_sec) * 1000000000LL + t.tv_nsec;
}

bool Settled(const FileIdentity& id, const struct timespec& read_start) {
    long long margin = id.ctime.tv_nsec == 0 ? kSettleCoarseNs : kSettleFineNs;
    return Nanoseconds(read_start) - Nanoseconds(id.ctime) >= margin;
}

struct CachedFile {
    std::string path;
    FileIdentity id;
    bool settled;
    std::shared_ptr<const std::string> text;
    std::shared_ptr<const SectionDoc> doc;
};

// A handful of files (the pairing store, the share registry, the host file) are read over and
// over; larger files than this are read anew each time rather than held in memory.
constexpr size_t kCachedFiles = 4;
constexpr size_t kCachedFileMax = 4u << 20;

class DocCache {
  public:
    static DocCache& Instance() {
        // Leaked on purpose: readers in other threads or atexit handlers may still use it while
        // static objects are destroyed at exit.
        static DocCache* cache = new DocCache();
        return *cache;
    }

    // The cached entry of `path` when it was read from the file `id` names; false otherwise.
    bool Find(const std::string& path, const FileIdentity& id, CachedFile& out) {
        std::lock_guard<std::mutex> hold(mutex_);
        for (auto it = files_.begin(); it != files_.end(); ++it) {
            if (it->path == path) {
                if (!(it->id == id)) {
                    return false;
                }
                files_.splice(files_.begin(), files_, it);
                out = *it;
                return true;
            }
        }
        return false;
    }

    void Store(CachedFile entry) {
        std::lock_guard<std::mutex> hold(mutex_);
        EraseLocked(entry.path);
        files_.push_front(std::move(entry));
        while (files_.size() > kCachedFiles) {
            files_.pop_back();
        }
    }

    void Forget(const std::string& path) {
        std::lock_guard<std::mutex> hold(mutex_);
        EraseLocked(path);
    }

  private:
    DocCache() {
        // A child forked while another thread holds the lock would wait for it forever.
        pthread_atfork([] { Instance().mutex_.lock(); }, [] { Instance().mutex_.unlock(); },
                       [] { Instance().mutex_.unlock(); });
    }

    void EraseLocked(const std::string& path) {
        files_.remove_if([&path](const CachedFile& f) { return f.path == path; });
    }

    std::mutex mutex_;
    std::list<CachedFile> files_;
};

int ReadFailure(const std::string& path, int saved) {
    if (saved == ENOENT) {
        return Fail(VLIB_ERR_FILE_NOT_FOUND);
    }
    Logger::LogMsg(Logger::Error,
                   "[ERROR] section_file.cpp(%d): Fail to read section file '%s', error:'%s'\n",
                   __LINE__, path.c_str(), std::strerror(saved));
    return Fail(saved == EFBIG ? VLIB_ERR_BAD_FORMAT : ErrorFromErrno(saved));
}

}  // namespace

int LoadSectionFileShared(const std::string& path, std::shared_ptr<const SectionDoc>& doc) {
    DocCache& cache = DocCache::Instance();
    CachedFile cached;
    bool have_cached = false;
    struct stat st;
    if (stat(path.c_str(), &st) == 0 && S_ISREG(st.st_mode)) {
        have_cached = cache.Find(path, FileIdentity::Of(st), cached);
        if (have_cached && cached.settled) {
            doc = cached.doc;
            return Succeed(0);
        }
    }
    // Taken before the file is opened: whatever changes it after this moment stamps a ctime no
    // earlier than about now.
    struct timespec read_start = Env::Default()->WallClock();
    int fd = open(path.c_str(), O_RDONLY | O_CLOEXEC);
    if (fd < 0) {
        return ReadFailure(path, errno);
    }
    struct stat opened;
    bool known = fstat(fd, &opened) == 0 && S_ISREG(opened.st_mode);
    auto text = std::make_shared<std::string>();
    if (Env::Default()->ReadWholeFd(fd, *text, kSectionFileMax) != 0) {
        int saved = errno;
        close(fd);
        return ReadFailure(path, saved);
    }
    close(fd);
    // A file changed while it was read may not match what fstat() saw; it is not kept.
    FileIdentity id = FileIdentity::Of(opened);
    known = known && static_cast<size_t>(opened.st_size) == text->size() &&
            text->size() <= kCachedFileMax;
    if (have_cached && known && id == cached.id && *text == *cached.text) {
        cached.settled = Settled(id, read_start);
        doc = cached.doc;
        cache.Store(std::move(cached));
        return Succeed(0);
    }
    auto parsed = std::make_shared<SectionDoc>();
    int bad_line = 0;
    if (!parsed->Parse(*text, bad_line)) {
        cache.Forget(path);
        return ParseFailure(path, bad_line);
    }
    doc = parsed;
    if (known) {
        cache.Store(CachedFile{path, id, Settled(id, read_start), std::move(text), parsed});
    }
    return Succeed(0);
}

int LoadSectionFile(const std::string& path, SectionDoc& doc) {
    std::shared_ptr<const SectionDoc> shared;
    if (LoadSectionFileShared(path, shared) != 0) {
        return -1;
    }
    doc = *shared;
    return Succeed(0);
}

void ForgetSectionFile(const std::string& path) {
    DocCache::Instance().Forget(path);
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
        int rc = Env::Default()->LockFd(fd);
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
        if (Env::Default()->ReadWholeFd(fd, text, kSectionFileMax) != 0) {
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
            if (result == 1) {
                // A file its own readers would refuse must never be written: checked on the
                // whole new content, before the old file is touched.
                std::string content = doc.Serialize();
                if (content.size() > kSectionFileMax) {
                    Logger::LogMsg(Logger::Error,
                                   "[ERROR] section_file.cpp(%d): Section file '%s' would grow "
                                   "to %zu bytes (at most %zu): not written\n",
                                   __LINE__, target.c_str(), content.size(), kSectionFileMax);
                    result = Fail(VLIB_ERR_TOO_LARGE);
                } else if (ReplaceFile(target, held, content) != 0) {
                    result = -1;
                }
                // The replacement has a new inode, which readers notice by themselves; dropping
                // the old document here just frees it sooner.
                ForgetSectionFile(path);
                ForgetSectionFile(target);
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

// An update that found nothing to change (0) reports the section absent; one that wrote, none.
int AbsentAsNotFound(int result) {
    if (result == 0) {
        s2s_platform::SetError(VLIB_ERR_NOT_FOUND);
    } else if (result > 0) {
        s2s_platform::SetError(VLIB_ERR_NONE);
    }
    return result;
}

bool NullOrEmpty(const char* text) {
    return text == nullptr || text[0] == '\0';
}

// Add and replace: the table's pairs set in the section (added to its own, or instead of them),
// or the section appended when the file has none of that name.
int PutSection(const char* file, const char* section, const VLIBSzHash* table,
               const char* lineFormat, bool replace) {
    Pairs pairs;
    if (NullOrEmpty(file) || !s2s_platform::ValidSectionName(section) || !ValidFormat(lineFormat) ||
        !TablePairs(table, pairs)) {
        return Fail(VLIB_ERR_BAD_PARAMETER);
    }
    return s2s_platform::UpdateSectionFile(file, true, [&](SectionDoc& doc) {
        bool found =
            replace ? doc.ReplacePairs(section, pairs) : doc.SetPairs(section, pairs, true);
        if (!found) {
            doc.AppendSection(section, pairs);
        }
        return 1;
    });
}

}  // namespace

extern "C" {

int VLIBCFileGetSection(const char* file, const char* section, VLIBSzHash** table) {
    if (NullOrEmpty(file) || NullOrEmpty(section) || table == nullptr || *table == nullptr) {
        return Fail(VLIB_ERR_BAD_PARAMETER);
    }
    try {
        std::shared_ptr<const SectionDoc> doc;
        if (s2s_platform::LoadSectionFileShared(file, doc) != 0) {
            return -1;
        }
        if (!doc->HasSection(section)) {
            s2s_platform::SetError(VLIB_ERR_NOT_FOUND);
            return 0;
        }
        for (const auto& pair : doc->SectionPairs(section)) {
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
        std::shared_ptr<const SectionDoc> doc;
        if (s2s_platform::LoadSectionFileShared(file, doc) != 0) {
            buf[0] = '\0';
            return -1;
        }
        std::string value;
        if (!doc->GetValue(section, key, value)) {
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
    return PutSection(file, section, table, lineFormat, false);
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
    return AbsentAsNotFound(result);
}

int VLIBCFileReplaceSection(const char* file, const char* section, const VLIBSzHash* table,
                            const char* lineFormat) {
    return PutSection(file, section, table, lineFormat, true);
}

int VLIBCFileRemoveSection(const char* file, const char* section) {
    if (NullOrEmpty(file) || NullOrEmpty(section)) {
        return Fail(VLIB_ERR_BAD_PARAMETER);
    }
    int result = s2s_platform::UpdateSectionFile(
        file, false, [&](SectionDoc& doc) { return doc.RemoveSection(section) ? 1 : 0; });
    return AbsentAsNotFound(result);
}

int VLIBCFileEnumSection(const char* file, VLIBSzList** list) {
    if (NullOrEmpty(file) || list == nullptr || *list == nullptr) {
        return Fail(VLIB_ERR_BAD_PARAMETER);
    }
    try {
        std::shared_ptr<const SectionDoc> doc;
        if (s2s_platform::LoadSectionFileShared(file, doc) != 0) {
            return -1;
        }
        std::vector<std::string> names = doc->SectionNames();
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
