// Measures how far a running rsync has got without its cooperation: the bytes its processes have
// read so far (the rchar counter of /proc/<pid>/io), summed over the descendants of the calling
// thread (so runs on other threads of the same process are not counted). The
// sending rsync reads each file it sends once, so the sum follows the data sent; unchanged files
// are skipped by rsync and never counted, so an incremental run ends well below the share's size.
#ifndef S2S_RSYNC_TRANSFER_METER_H
#define S2S_RSYNC_TRANSFER_METER_H

#include <sys/types.h>

#include <cstdint>
#include <map>
#include <string>

namespace S2S {

// The regular files of a tree and their total size (symbolic links are not followed).
struct TreeSize {
    uint64_t files = 0;
    uint64_t bytes = 0;
};
TreeSize MeasureTree(const std::string& root);

class TransferMeter {
  public:
    // Forgets the processes of an earlier run.
    void Reset();
    // Re-reads the counters of the calling thread's descendants; cheap enough to call several
    // times a second. Call it from the thread that starts the processes.
    void Poll();
    // Bytes read by the descendants seen since Reset (an exited process keeps its last count).
    uint64_t Bytes() const;

  private:
    void Visit(pid_t pid, pid_t tid, int depth);

    std::map<pid_t, uint64_t> read_by_pid_;
};

}  // namespace S2S

#endif  // S2S_RSYNC_TRANSFER_METER_H
