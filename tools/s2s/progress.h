// The progress display of a share's copy: bytes done of the total, the transfer rate and the time
// left. On a terminal one line is redrawn in place (at most ten times a second); otherwise a plain
// line is written every few seconds, so logs of scripted runs stay readable.
#ifndef S2S_TOOLS_S2S_PROGRESS_H
#define S2S_TOOLS_S2S_PROGRESS_H

#include <chrono>
#include <cstdint>
#include <cstdio>
#include <deque>
#include <string>

namespace s2s_cli {

// "0 B", "512 B", "1.5 KiB", "12.3 MiB", "2.00 GiB".
std::string FormatBytes(uint64_t bytes);
// "7s", "1m05s", "2h03m", "3d04h".
std::string FormatDuration(double seconds);

class ProgressBar {
  public:
    using Clock = std::chrono::steady_clock;

    // `out` stays owned by the caller. `terminal` chooses the redrawn line over plain lines;
    // `enabled` false makes every call a no-op.
    ProgressBar(FILE* out, bool terminal, bool enabled);
    ~ProgressBar();
    ProgressBar(const ProgressBar&) = delete;
    ProgressBar& operator=(const ProgressBar&) = delete;

    // A new copy begins: `label` (the share name) and the bytes expected (0 when unknown).
    void Start(const std::string& label, uint64_t total_bytes);
    // Bytes done so far (monotonic within one copy); redraws when it is time to.
    void Update(uint64_t done_bytes);
    // The copy ended: the terminal line is cleared so the caller's own line takes its place.
    void Finish();
    // Clears the terminal line before somebody else writes to the same terminal.
    void Clear();

    // The rate over the last few seconds, in bytes per second (0 until two samples exist).
    double Rate() const;
    // The line as it would be drawn now (without carriage return or escape codes).
    std::string Line() const;

  private:
    void Draw(bool force);

    FILE* out_;
    bool terminal_;
    bool enabled_;
    bool active_ = false;
    bool drawn_ = false;
    std::string label_;
    uint64_t total_ = 0;
    uint64_t done_ = 0;
    Clock::time_point started_;
    Clock::time_point last_draw_;
    std::deque<std::pair<Clock::time_point, uint64_t>> samples_;
};

}  // namespace s2s_cli

#endif  // S2S_TOOLS_S2S_PROGRESS_H
