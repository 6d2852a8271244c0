// Section files inside the platform layer: the parsed document, whole-file reads, and the locked,
// crash-safe read-modify-write that every writer goes through. The exported VLIBCFile* functions
// and the share registry are built on these.
#ifndef S2S_PLATFORM_SECTION_FILE_H
#define S2S_PLATFORM_SECTION_FILE_H

#include <functional>
#include <memory>
#include <string>
#include <string_view>
#include <unordered_map>
#include <utility>
#include <vector>

#include "s2s_platform.h"

namespace s2s_platform {

typedef std::vector<std::pair<std::string, std::string>> Pairs;

// A section file as lines. Lines that are not edited are written back byte for byte (apart from a
// CR before the newline), so comments and hand formatting survive a rewrite.
class SectionDoc {
  public:
    // False on a line that is no header, pair, comment or blank line (or a pair before the first
    // header, a NUL byte, an over-long line); `bad_line` then holds its 1-based number.
    bool Parse(const std::string& text, int& bad_line);
    std::string Serialize() const;

    bool HasSection(const std::string& name) const { return FindHeader(name) >= 0; }
    // Section names in file order, a name repeated by hand once per header.
    std::vector<std::string> SectionNames() const;
    // The pairs of a section in file order; a key repeated by hand counts with its first value.
    Pairs SectionPairs(const std::string& name) const;
    bool GetValue(const std::string& section, const std::string& key, std::string& value) const;

    // Sets `pairs` in the existing section `name`: present keys in place, missing ones appended
    // after its last pair when `add_missing`. False when the section is absent.
    bool SetPairs(const std::string& name, const Pairs& pairs, bool add_missing);
    // Renames a section. False when it is absent.
    bool Rename(const std::string& from, const std::string& to);
    void AppendSection(const std::string& name, const Pairs& pairs);
    // Drops the section's pairs (its comments stay) and writes `pairs` after its header.
    bool ReplacePairs(const std::string& name, const Pairs& pairs);
    bool RemoveSection(const std::string& name);

  private:
    // The name and value are pieces of the text as written, so a parsed line costs one string.
    struct Line {
        enum Kind { kBlank, kComment, kHeader, kPair };
        Kind kind = kBlank;
        std::string raw;  // the text as written, without its newline
        size_t name_at = 0;
        size_t name_size = 0;
        size_t value_at = 0;
        size_t value_size = 0;

        // Section name (header) or key (pair).
        std::string_view name() const { return std::string_view(raw).substr(name_at, name_size); }
        // Pair value.
        std::string_view value() const {
            return std::string_view(raw).substr(value_at, value_size);
        }
    };
    static Line MakePair(const std::string& key, const std::string& value);
    static Line MakeHeader(const std::string& name);
    int FindHeader(const std::string& name) const;
    // One past the last line of the section whose header is at `header`.
    size_t SectionEnd(size_t header) const;
    // Every edit may move or rename headers; lookups then scan the lines until the next parse.
    void DropIndex();

    std::vector<Line> lines_;
    // First header line of each section name, built by Parse so that a read of one section in a
    // large file does not walk every line. Valid only while `indexed_`.
    std::unordered_map<std::string, size_t> headers_;
    bool indexed_ = false;
};

// Largest section file read (bytes) and longest line accepted.
constexpr size_t kSectionFileMax = VLIB_SECTION_FILE_MAX;
constexpr size_t kSectionLineMax = 65536;

// Reads and parses `path` without locking (writers replace the file atomically, so a reader sees
// one whole version). 0; -1 with the platform error set: VLIB_ERR_FILE_NOT_FOUND (not logged, the
// caller knows whether that is normal), VLIB_ERR_ACCESS / VLIB_ERR_IO / VLIB_ERR_BAD_FORMAT
// (logged).
int LoadSectionFile(const std::string& path, SectionDoc& doc);

// The same, handing out the parsed document shared with a per-process cache of the last few
// files read. A cached document is used only while the file's identity (device, inode, size,
// mode, mtime, ctime) is unchanged and the file changed long enough before it was read that a
// later change must show in its ctime; until then the file is read again and compared byte for
// byte. Writers replace the file by rename, so any write gives a new inode. Failures are never
// cached: each read of a malformed file is refused and logged again. Thread-safe.
int LoadSectionFileShared(const std::string& path, std::shared_ptr<const SectionDoc>& doc);

// Drops what the cache holds for `path` (this process's own writes call it).
void ForgetSectionFile(const std::string& path);

// The one writer path. Locks the file against other writers, reads and parses it (creating it
// empty first when `create` and it is missing), lets `edit` change the document, and when `edit`
// returns 1 replaces the file through Env::ReplaceFile (keeping the file's mode and owner). `edit`
// returns 1 (write), 0 (leave the file alone) or -1 (failure, error set). Returns what `edit`
// returned, or -1 with the error set (and logged) when the file cannot be read, parsed or replaced;
// on every failure the old file stays as it was.
int UpdateSectionFile(const std::string& path, bool create,
                      const std::function<int(SectionDoc&)>& edit);

// Checks for names, keys and values the file syntax cannot carry (see s2s_platform.h).
bool ValidSectionName(const char* name);
bool ValidKey(const char* key);
bool ValidValue(const char* value);

}  // namespace s2s_platform

#endif  // S2S_PLATFORM_SECTION_FILE_H
