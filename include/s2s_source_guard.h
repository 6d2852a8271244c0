// The guard in front of a share's data run. Every data run carries --delete, so the receiver's copy
// follows the sender's folder exactly; when that folder is missing, empty, or lies on a volume that
// is not mounted (the mount point is there, empty), the run would delete the whole copy. Before the
// run the share's source is checked, and a deletion limit can be put on it:
//   - the share's folder (what rsync reads) must exist;
//   - its volume must be mounted (host.conf's [volumes] and the mount table decide, see
//     VURNVolumeIsMounted in s2s_platform.h);
//   - a folder the copy would send no file from (it holds only empty folders, or only files the
//     exclude rules leave out) is refused when the receiver's copy is not empty, unless an empty
//     source is explicitly allowed;
//   - with a deletion limit (a count, or a percentage of what the receiver's copy holds), a run
//     that would delete more is refused before it deletes anything.
// What the copy would send and what the receiver holds are learnt from a dry run of the very data
// run (same source, destination and exclude rules), made for every share unless an empty source is
// allowed and no limit is set. The data run then carries a deletion limit of its own even when
// none was asked for: the deletions that listing found, so a folder emptied between the check and
// the copy cannot empty the receiver's copy (rsync stops deleting and the run ends with 25).
// A refused share is not copied and must not be marked complete; the other shares are unaffected.
//
// A copy limited to the paths that changed (a real-time run) is checked by CheckChangedPaths:
// the folder and volume as above, and the emptiness locally (a folder that still holds a file
// cannot be emptying the receiver's copy); when the folder holds no file, or a percentage limit
// would need the size of the receiver's whole copy, the caller checks and copies the whole share
// instead. A deletion limit is judged on a dry run of the limited copy.
#ifndef S2S_SOURCE_GUARD_H
#define S2S_SOURCE_GUARD_H

#include <list>
#include <string>
#include <vector>

#include "s2s_export.h"
#include "s2s_host.h"
#include "s2s_rsyncer.h"

namespace S2S {

enum class SourceGuardResult : int {
    kSafe = 0,          // the data run may go ahead
    kFolderMissing,     // the share's folder does not exist
    kVolumeNotMounted,  // the share's volume is not mounted
    kEmptySource,       // the folder is empty while the receiver's copy is not
    kTooManyDeletions,  // the run would delete more than the deletion limit allows
    kCheckFailed,       // the check could not be made (local facts, or the dry run failed)
};

// "safe", "folder-missing", "volume-not-mounted", "empty-source", "max-delete", "check-failed".
S2S_EXPORT const char* SourceGuardResultName(SourceGuardResult result);

// A limit on the entries (files, folders, links) one data run may delete on the receiver.
struct S2S_EXPORT DeleteLimit {
    bool set = false;      // false: no limit
    bool percent = false;  // `value` is a percentage of the entries the receiver's copy holds
    unsigned long long value = 0;

    // "N" or "N%" (decimal digits only; a count at most INT_MAX, what rsync's --max-delete
    // takes; a percentage at most 100). False with `error` set.
    static bool Parse(const std::string& text, DeleteLimit& limit, std::string& error);
    // The deletions allowed against a copy of `entries` entries (a percentage rounds down).
    unsigned long long Allowed(unsigned long long entries) const;
    // The limit as Parse takes it ("150", "20%"); "" when not set.
    std::string ToString() const;
};

struct SourceGuardOptions {
    bool allowEmptySource = false;  // an empty folder may empty the receiver's copy
    DeleteLimit maxDelete;
};

// The local state of a share's source.
struct SourceState {
    std::string folder;  // what rsync reads (an encrypted share's encrypted directory)
    std::string volume;  // the volume's mount path; "" when the folder is missing
    bool folderExists = false;
    bool folderEmpty = false;  // no regular file or link anywhere below the folder
    bool volumeMounted = false;
};

// What a dry run of the data run found on the receiver.
struct ReceiverCopy {
    bool known = false;                  // a dry run was made
    unsigned long long entries = 0;      // entries of the receiver's copy the run looks at
    unsigned long long deletions = 0;    // entries the run would delete
    unsigned long long sourceFiles = 0;  // regular files and links the run's file list holds
};

struct SourceGuardReport {
    SourceGuardResult result = SourceGuardResult::kSafe;
    std::string message;  // one line for people; "" when safe
    SourceState source;
    ReceiverCopy receiver;
    long long allowedDeletions = -1;  // the deletion limit the data run gets; -1: none
    int dryRunResult = 0;             // the dry run's rsync or server code when it failed
};

// Fills `state` for a share whose facts are `info`. 0, or -1 (with an ERROR line) when the volume
// or the folder cannot be examined.
S2S_EXPORT int InspectShareSource(const std::string& shareName, const ShareInfo& info,
                                  SourceState& state);

// True when judging `source` under `options` needs to know what the receiver holds.
S2S_EXPORT bool NeedsReceiverCopy(const SourceState& source, const SourceGuardOptions& options);

// The decision on the facts alone; `receiver` is consulted only when NeedsReceiverCopy says so
// (then an unknown copy gives kCheckFailed; a known one decides whether the copy sends nothing).
// On kSafe, `allowedDeletions` holds the limit's count, or without a limit the deletions the
// receiver's copy was found to need.
S2S_EXPORT SourceGuardReport JudgeShareSource(const std::string& shareName,
                                              const SourceState& source,
                                              const SourceGuardOptions& options,
                                              const ReceiverCopy& receiver);

// A dry run of RunSync(id, shareName, "/", excludes) that counts the receiver's entries and the
// deletions. 0 with the run's code in `result` (0 or 24 count as done; `copy` is then known),
// -1 when the share's facts cannot be read.
S2S_EXPORT int DryRunShareSync(Rsyncer& rsyncer, const std::string& shareName,
                               const std::list<std::string>& excludes, bool (*cancel)(),
                               ReceiverCopy& copy, int& result);

// The same dry run limited to `paths` of the share (Rsyncer::RunSyncPaths); `copy.entries` then
// counts only what those paths reach.
S2S_EXPORT int DryRunSharePaths(Rsyncer& rsyncer, const std::string& shareName,
                                const std::vector<std::string>& paths,
                                const std::list<std::string>& excludes, bool (*cancel)(),
                                ReceiverCopy& copy, int& result);

// The whole check before RunSync of a whole share: inspects the source, makes the dry run when it
// is needed and judges. It also sets the Rsyncer's deletion limit for the data run that follows
// (Rsyncer::SetMaxDelete): the allowed count when the share is safe, 0 when it is refused, so that
// even a caller that runs a refused share deletes nothing. Refusals are logged as WARNING lines.
S2S_EXPORT SourceGuardReport CheckShareSource(Rsyncer& rsyncer, const std::string& shareName,
                                              const std::list<std::string>& excludes,
                                              const SourceGuardOptions& options, bool (*cancel)());

// CheckShareSource in two halves, for a caller that makes the check on another thread (with an
// Rsyncer of its own) while its own Rsyncer sends commands: AssessShareSource inspects, makes the
// dry run and judges, and touches no deletion limit; EnforceShareSource then puts the verdict on
// the data run of `rsyncer` as CheckShareSource does, logs a refusal, and returns the report.
S2S_EXPORT SourceGuardReport AssessShareSource(Rsyncer& rsyncer, const std::string& shareName,
                                               const std::list<std::string>& excludes,
                                               const SourceGuardOptions& options, bool (*cancel)());
S2S_EXPORT SourceGuardReport EnforceShareSource(Rsyncer& rsyncer, const SourceGuardReport& report);

// The check before RunSyncPaths of `paths` (see above). Sets `whole` when the share must be
// checked with CheckShareSource and copied whole instead (the report is then kSafe and says
// nothing). Otherwise it sets the Rsyncer's deletion limit like CheckShareSource: the task's limit
// when one is set, else the number of listed paths gone from the folder, so that a folder
// emptied after the check deletes no more than the changes asked for (rsync then ends with 25
// and the caller syncs the share whole).
S2S_EXPORT SourceGuardReport CheckChangedPaths(Rsyncer& rsyncer, const std::string& shareName,
                                               const std::vector<std::string>& paths,
                                               const std::list<std::string>& excludes,
                                               const SourceGuardOptions& options, bool (*cancel)(),
                                               bool& whole);

}  // namespace S2S

#endif  // S2S_SOURCE_GUARD_H
