// The check in front of a share's data run: the source's folder and volume, an empty folder
// against a full copy on the receiver, and the deletion limit (see s2s_source_guard.h).
#include "s2s_source_guard.h"

#include <dirent.h>
#include <sys/stat.h>

#include <cerrno>
#include <climits>
#include <cstring>
#include <string>
#include <vector>

#include "rsync/path_list.h"
#include "s2s_logger.h"
#include "s2s_platform.h"

namespace S2S {

namespace {

// rsync's --max-delete takes an int: a larger count would fail every copy.
constexpr unsigned long long kMaxDeleteCount = INT_MAX;
constexpr int kRsyncVanished = 24;

std::string Entries(unsigned long long n) {
    return std::to_string(n) + (n == 1 ? " entry" : " entries");
}

bool IsContent(unsigned char type) {
    return type == DT_REG || type == DT_LNK;
}

// 1 when no regular file or link lies anywhere below `path` (empty folders, such as a recycle
// bin's, hold nothing a copy would keep), 0 when one does, -1 when a folder cannot be read. The
// walk ends at the first file found; links are not followed.
int HoldsNoFiles(const std::string& path) {
    std::vector<std::string> folders{path};
    while (!folders.empty()) {
        const std::string folder = folders.back();
        folders.pop_back();
        DIR* dir = opendir(folder.c_str());
        if (dir == nullptr) {
            return -1;
        }
        int found = 0;
        errno = 0;
        while (struct dirent* entry = readdir(dir)) {
            if (std::strcmp(entry->d_name, ".") == 0 || std::strcmp(entry->d_name, "..") == 0) {
                continue;
            }
            const std::string child = folder + "/" + entry->d_name;
            unsigned char type = entry->d_type;
            struct stat st;
            if (type == DT_UNKNOWN && lstat(child.c_str(), &st) == 0) {
                type = S_ISDIR(st.st_mode)   ? DT_DIR
                       : S_ISREG(st.st_mode) ? DT_REG
                       : S_ISLNK(st.st_mode) ? DT_LNK
                                             : DT_UNKNOWN;
            }
            if (IsContent(type)) {
                found = 1;
                break;
            }
            if (type == DT_DIR) {
                folders.push_back(child);
            }
            errno = 0;
        }
        const int saved = errno;
        closedir(dir);
        if (found == 1) {
            return 0;
        }
        if (saved != 0) {
            errno = saved;
            return -1;
        }
    }
    return 1;
}

SourceGuardReport Refuse(SourceGuardResult result, const std::string& message) {
    SourceGuardReport report;
    report.result = result;
    report.message = message;
    return report;
}

}  // namespace

const char* SourceGuardResultName(SourceGuardResult result) {
    switch (result) {
        case SourceGuardResult::kSafe:
            return "safe";
        case SourceGuardResult::kFolderMissing:
            return "folder-missing";
        case SourceGuardResult::kVolumeNotMounted:
            return "volume-not-mounted";
        case SourceGuardResult::kEmptySource:
            return "empty-source";
        case SourceGuardResult::kTooManyDeletions:
            return "max-delete";
        case SourceGuardResult::kCheckFailed:
            return "check-failed";
    }
    return "unknown";
}

bool DeleteLimit::Parse(const std::string& text, DeleteLimit& limit, std::string& error) {
    std::string digits = text;
    const bool percent = !digits.empty() && digits.back() == '%';
    if (percent) {
        digits.pop_back();
    }
    if (digits.empty() || digits.find_first_not_of("0123456789") != std::string::npos) {
        error = "deletion limit '" + text + "' is not a number of files (N) or a percentage (N%)";
        return false;
    }
    const size_t first = digits.find_first_not_of('0');
    const unsigned long long value = first == std::string::npos ? 0
                                     : digits.size() - first > 18
                                         ? ULLONG_MAX
                                         : std::stoull(digits.substr(first));
    if ((percent && value > 100) || value > kMaxDeleteCount) {
        error = "deletion limit '" + text + "' is out of range" +
                (percent ? std::string(" (a percentage is at most 100%)")
                         : " (at most " + std::to_string(kMaxDeleteCount) + ")");
        return false;
    }
    limit.set = true;
    limit.percent = percent;
    limit.value = value;
    return true;
}

unsigned long long DeleteLimit::Allowed(unsigned long long entries) const {
    if (!percent) {
        return value;
    }
    // entries / 100 * value + the remainder's share: exact and free of overflow.
    return entries / 100 * value + entries % 100 * value / 100;
}

std::string DeleteLimit::ToString() const {
    if (!set) {
        return std::string();
    }
    return std::to_string(value) + (percent ? "%" : "");
}

int InspectShareSource(const std::string& shareName, const ShareInfo& info, SourceState& state) {
    state = SourceState();
    state.folder = info.GetModulePath();
    struct stat st;
    state.folderExists =
        !state.folder.empty() && stat(state.folder.c_str(), &st) == 0 && S_ISDIR(st.st_mode);
    if (!state.folderExists) {
        return 0;
    }
    VolumeInfo volume;
    if (GetVolumeInfo(shareName, volume) < 0) {
        Logger::LogMsg(Logger::Error,
                       "[ERROR] source_guard.cpp(%d): Fail to get the volume of share '%s'\n",
                       __LINE__, shareName.c_str());
        return -1;
    }
    state.volume = volume.GetPath();
    const int mounted = VURNVolumeIsMounted(state.volume.c_str());
    if (mounted < 0) {
        Logger::LogMsg(Logger::Error,
                       "[ERROR] source_guard.cpp(%d): Fail to tell whether volume '%s' is "
                       "mounted\n",
                       __LINE__, state.volume.c_str());
        return -1;
    }
    state.volumeMounted = mounted == 1;
    const int empty = HoldsNoFiles(state.folder);
    if (empty < 0) {
        const int saved = errno;
        Logger::LogMsg(Logger::Error, "[ERROR] source_guard.cpp(%d): Fail to read '%s': %s\n",
                       __LINE__, state.folder.c_str(), std::strerror(saved));
        return -1;
    }
    state.folderEmpty = empty == 1;
    return 0;
}

bool NeedsReceiverCopy(const SourceState& source, const SourceGuardOptions& options) {
    if (!source.folderExists || !source.volumeMounted) {
        return false;
    }
    // Whether the copy would send no file only its file list tells (exclude rules apply), and the
    // deletions it is allowed come from the same listing: it is made unless emptiness is allowed
    // and nothing limits the deletions.
    return !options.allowEmptySource || options.maxDelete.set;
}

SourceGuardReport JudgeShareSource(const std::string& shareName, const SourceState& source,
                                   const SourceGuardOptions& options,
                                   const ReceiverCopy& receiver) {
    const std::string share = "share '" + shareName + "'";
    const std::string kept = "; nothing was copied or deleted";
    // The dry run's file list is what the copy sends; without one the local walk answers.
    const bool sendsNothing = receiver.known ? receiver.sourceFiles == 0 : source.folderEmpty;
    SourceGuardReport report;
    if (!source.folderExists) {
        report = Refuse(SourceGuardResult::kFolderMissing,
                        share + ": its folder " + source.folder +
                            " does not exist (is its volume mounted?)" + kept);
    } else if (!source.volumeMounted) {
        report = Refuse(SourceGuardResult::kVolumeNotMounted,
                        share + ": its volume " + source.volume +
                            " is not mounted (a volume that is a plain directory is listed as "
                            "\"internal,directory\" in " +
                            S2SPath(S2S_PATH_HOST_CONF) + ")" + kept);
    } else if (NeedsReceiverCopy(source, options) && !receiver.known) {
        report = Refuse(SourceGuardResult::kCheckFailed,
                        share + ": what the receiver holds could not be learnt" + kept);
    } else if (sendsNothing && !options.allowEmptySource && receiver.deletions > 0) {
        report = Refuse(SourceGuardResult::kEmptySource,
                        share + ": its folder " + source.folder +
                            " holds no file to copy (empty folders and excluded files do not "
                            "count) while the receiver's copy holds " +
                            Entries(receiver.deletions) + ", which the run would delete" + kept);
    } else if (options.maxDelete.set &&
               receiver.deletions > options.maxDelete.Allowed(receiver.entries)) {
        report = Refuse(SourceGuardResult::kTooManyDeletions,
                        share + ": the run would delete " + Entries(receiver.deletions) +
                            " of the receiver's " + std::to_string(receiver.entries) +
                            ", more than the limit of " +
                            std::to_string(options.maxDelete.Allowed(receiver.entries)) +
                            (options.maxDelete.percent ? " (" + options.maxDelete.ToString() + ")"
                                                       : std::string()) +
                            kept);
    }
    if (report.result == SourceGuardResult::kSafe && options.maxDelete.set) {
        report.allowedDeletions =
            static_cast<long long>(options.maxDelete.Allowed(receiver.entries));
    } else if (report.result == SourceGuardResult::kSafe && receiver.known) {
        // No limit asked for: the copy may still delete no more than the listing found, so a
        // folder emptied after the check cannot empty the receiver's copy.
        report.allowedDeletions = static_cast<long long>(receiver.deletions);
    }
    report.source = source;
    report.receiver = receiver;
    return report;
}

namespace {

// The dry run of a data run of the share, limited to the paths of `listFile` when it is not empty.
int DryRun(Rsyncer& rsyncer, const std::string& shareName, const std::string& listFile,
           const std::list<std::string>& excludes, bool (*cancel)(), ReceiverCopy& copy,
           int& result) {
    copy = ReceiverCopy();
    ShareInfo info;
    if (rsyncer.GetShareInfo(shareName, info) < 0) {
        Logger::LogMsg(Logger::Error, "[ERROR] source_guard.cpp(%d): Fail to get share info\n",
                       __LINE__);
        return -1;
    }
    // The same transfer as the data run (RunSync), without its debug log.
    Rsyncer::RsyncTask task;
    rsyncer.InitRsyncTask(task, true);
    task.SetSyncACL(true);
    task.setFilesFrom(listFile);
    unsigned long long entries = 0;
    unsigned long long deletions = 0;
    unsigned long long files = 0;
    task.setDryRun([&](const std::string& change, const std::string& path) {
        if (change == "*deleting") {
            ++deletions;
            ++entries;
            return;
        }
        // "YXcstpoguax": X is the entry's type, 'f' a regular file, 'L' a link.
        if (change.size() > 1 && (change[1] == 'f' || change[1] == 'L')) {
            ++files;
        }
        if (path != "./" && change.find("+++++++++") == std::string::npos) {
            ++entries;  // there on both sides
        }
    });
    result = task.Execute(info.GetModulePath() + "/", info.GetModuleName(), cancel, "", excludes);
    if (result == 0 || result == kRsyncVanished) {
        copy.known = true;
        copy.entries = entries;
        copy.deletions = deletions;
        copy.sourceFiles = files;
    }
    return 0;
}

}  // namespace

int DryRunShareSync(Rsyncer& rsyncer, const std::string& shareName,
                    const std::list<std::string>& excludes, bool (*cancel)(), ReceiverCopy& copy,
                    int& result) {
    return DryRun(rsyncer, shareName, "", excludes, cancel, copy, result);
}

int DryRunSharePaths(Rsyncer& rsyncer, const std::string& shareName,
                     const std::vector<std::string>& paths, const std::list<std::string>& excludes,
                     bool (*cancel)(), ReceiverCopy& copy, int& result) {
    PathList list;
    std::string error;
    if (!list.Write(paths, error)) {
        copy = ReceiverCopy();
        Logger::LogMsg(Logger::Error, "[ERROR] source_guard.cpp(%d): %s\n", __LINE__,
                       error.c_str());
        return -1;
    }
    return DryRun(rsyncer, shareName, list.File(), excludes, cancel, copy, result);
}

namespace {

// Looks at the share's folder and volume. False, with `report` refusing the run, when they could
// not be examined.
bool Examine(Rsyncer& rsyncer, const std::string& shareName, SourceState& source,
             SourceGuardReport& report) {
    ShareInfo info;
    if (rsyncer.GetShareInfo(shareName, info) < 0 ||
        InspectShareSource(shareName, info, source) < 0) {
        report = Refuse(SourceGuardResult::kCheckFailed,
                        "share '" + shareName + "': its folder or volume could not be examined");
        return false;
    }
    return true;
}

SourceGuardReport DryRunFailed(const std::string& shareName, int result) {
    SourceGuardReport report =
        Refuse(SourceGuardResult::kCheckFailed,
               "share '" + shareName + "': the dry run that counts the receiver's files failed");
    report.dryRunResult = result;
    return report;
}

}  // namespace

// Puts the verdict on the coming data run: its deletion limit, or no deletion at all when the
// run is refused (the refusal is logged).
SourceGuardReport EnforceShareSource(Rsyncer& rsyncer, const SourceGuardReport& report) {
    rsyncer.SetMaxDelete(report.result == SourceGuardResult::kSafe ? report.allowedDeletions : 0);
    if (report.result != SourceGuardResult::kSafe) {
        Logger::LogMsg(Logger::Warning, "[WARNING] source_guard.cpp(%d): %s\n", __LINE__,
                       report.message.c_str());
    }
    return report;
}

SourceGuardReport CheckShareSource(Rsyncer& rsyncer, const std::string& shareName,
                                   const std::list<std::string>& excludes,
                                   const SourceGuardOptions& options, bool (*cancel)()) {
    return EnforceShareSource(rsyncer,
                              AssessShareSource(rsyncer, shareName, excludes, options, cancel));
}

SourceGuardReport AssessShareSource(Rsyncer& rsyncer, const std::string& shareName,
                                    const std::list<std::string>& excludes,
                                    const SourceGuardOptions& options, bool (*cancel)()) {
    SourceGuardReport report;
    SourceState source;
    if (Examine(rsyncer, shareName, source, report)) {
        ReceiverCopy receiver;
        int result = 0;
        if (NeedsReceiverCopy(source, options) &&
            (DryRunShareSync(rsyncer, shareName, excludes, cancel, receiver, result) < 0 ||
             !receiver.known)) {
            report = DryRunFailed(shareName, result);
            report.source = source;
        } else {
            report = JudgeShareSource(shareName, source, options, receiver);
        }
    }
    return report;
}

SourceGuardReport CheckChangedPaths(Rsyncer& rsyncer, const std::string& shareName,
                                    const std::vector<std::string>& paths,
                                    const std::list<std::string>& excludes,
                                    const SourceGuardOptions& options, bool (*cancel)(),
                                    bool& whole) {
    whole = false;
    SourceGuardReport report;
    SourceState source;
    if (!Examine(rsyncer, shareName, source, report)) {
        // the report refuses the run
    } else if (!source.folderExists || !source.volumeMounted) {
        report = JudgeShareSource(shareName, source, options, ReceiverCopy());
    } else if (source.folderEmpty) {
        // Whether the receiver's copy is empty too only the whole share's dry run tells.
        whole = true;
        return report;
    } else if (options.maxDelete.set) {
        ReceiverCopy receiver;
        int result = 0;
        if (DryRunSharePaths(rsyncer, shareName, paths, excludes, cancel, receiver, result) < 0 ||
            !receiver.known) {
            report = DryRunFailed(shareName, result);
        } else if (receiver.deletions > 0 && options.maxDelete.percent) {
            whole = true;  // a share of the whole copy: only the whole share's dry run counts it
            return report;
        } else if (receiver.deletions > options.maxDelete.value) {
            report = Refuse(SourceGuardResult::kTooManyDeletions,
                            "share '" + shareName + "': the run would delete " +
                                Entries(receiver.deletions) + ", more than the limit of " +
                                options.maxDelete.ToString() + "; nothing was copied or deleted");
        } else {
            report.allowedDeletions =
                static_cast<long long>(options.maxDelete.percent ? 0 : options.maxDelete.value);
        }
        report.receiver = receiver;
    } else {
        long long gone = 0;
        for (const std::string& path : paths) {
            struct stat st;
            if (lstat((source.folder + "/" + path).c_str(), &st) != 0) {
                ++gone;
            }
        }
        report.allowedDeletions = gone;
    }
    report.source = source;
    return EnforceShareSource(rsyncer, report);
}

}  // namespace S2S
