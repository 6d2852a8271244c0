// ProgressBar: the rate and time-left arithmetic, the human-readable sizes and durations, and the
// drawing (redrawn in place on a terminal, plain periodic lines elsewhere).
#include "tools/s2s/progress.h"

#include <algorithm>

namespace s2s_cli {

namespace {

constexpr auto kTerminalInterval = std::chrono::milliseconds(100);
constexpr auto kPlainInterval = std::chrono::seconds(5);
// The rate is measured over this window, so it follows changes without jumping at every sample.
constexpr auto kRateWindow = std::chrono::seconds(5);
constexpr int kBarWidth = 24;

}  // namespace

std::string FormatBytes(uint64_t bytes) {
    static const char* const kUnits[] = {"B", "KiB", "MiB", "GiB", "TiB", "PiB"};
    if (bytes < 1024) {
        return std::to_string(bytes) + " B";
    }
    double value = static_cast<double>(bytes);
    int unit = 0;
    while (value >= 1024.0 && unit < 5) {
        value /= 1024.0;
        ++unit;
    }
    char text[32];
    std::snprintf(text, sizeof(text), value < 10.0 ? "%.2f %s" : "%.1f %s", value, kUnits[unit]);
    return text;
}

std::string FormatDuration(double seconds) {
    if (seconds < 0) {
        seconds = 0;
    }
    const unsigned long long total = static_cast<unsigned long long>(seconds + 0.5);
    char text[48];
    if (total < 60) {
        std::snprintf(text, sizeof(text), "%llus", total);
    } else if (total < 3600) {
        std::snprintf(text, sizeof(text), "%llum%02llus", total / 60, total % 60);
    } else if (total < 86400) {
        std::snprintf(text, sizeof(text), "%lluh%02llum", total / 3600, (total / 60) % 60);
    } else {
        std::snprintf(text, sizeof(text), "%llud%02lluh", total / 86400, (total / 3600) % 24);
    }
    return text;
}

ProgressBar::ProgressBar(FILE* out, bool terminal, bool enabled)
    : out_(out), terminal_(terminal), enabled_(enabled && out != nullptr) {}

ProgressBar::~ProgressBar() {
    Clear();
}

void ProgressBar::Start(const std::string& label, uint64_t total_bytes) {
    if (!enabled_) {
        return;
    }
    Clear();
    active_ = true;
    label_ = label;
    total_ = total_bytes;
    done_ = 0;
    started_ = Clock::now();
    last_draw_ = started_;
    samples_.clear();
    samples_.emplace_back(started_, 0);
    if (terminal_) {
        Draw(true);
    }
}

void ProgressBar::Update(uint64_t done_bytes) {
    if (!enabled_ || !active_) {
        return;
    }
    done_ = std::max(done_, done_bytes);
    const Clock::time_point now = Clock::now();
    samples_.emplace_back(now, done_);
    while (samples_.size() > 2 && now - samples_.front().first > kRateWindow) {
        samples_.pop_front();
    }
    Draw(false);
}

void ProgressBar::Finish() {
    if (!enabled_ || !active_) {
        return;
    }
    Clear();
    active_ = false;
}

void ProgressBar::Clear() {
    if (enabled_ && terminal_ && drawn_) {
        std::fputs("\r\033[K", out_);
        std::fflush(out_);
    }
    drawn_ = false;
}

double ProgressBar::Rate() const {
    if (samples_.size() < 2) {
        return 0.0;
    }
    const auto& first = samples_.front();
    const auto& last = samples_.back();
    const double seconds = std::chrono::duration<double>(last.first - first.first).count();
    if (seconds <= 0.0) {
        return 0.0;
    }
    return static_cast<double>(last.second - first.second) / seconds;
}

std::string ProgressBar::Line() const {
    std::string line = label_ + " ";
    const uint64_t shown = total_ != 0 ? std::min(done_, total_) : done_;
    if (total_ != 0) {
        const double fraction = static_cast<double>(shown) / static_cast<double>(total_);
        const int filled = static_cast<int>(fraction * kBarWidth);
        line += "[" + std::string(filled, '#') + std::string(kBarWidth - filled, '.') + "] ";
        char percent[16];
        std::snprintf(percent, sizeof(percent), "%3d%% ", static_cast<int>(fraction * 100.0));
        line += percent;
        line += FormatBytes(shown) + " of " + FormatBytes(total_);
    } else {
        line += FormatBytes(shown);
    }
    const double rate = Rate();
    line += "  " + FormatBytes(static_cast<uint64_t>(rate)) + "/s";
    if (total_ != 0 && rate > 0.0) {
        line += "  " + FormatDuration(static_cast<double>(total_ - shown) / rate) + " left";
    }
    return line;
}

void ProgressBar::Draw(bool force) {
    const Clock::time_point now = Clock::now();
    const auto interval =
        terminal_ ? Clock::duration(kTerminalInterval) : Clock::duration(kPlainInterval);
    if (!force && now - last_draw_ < interval) {
        return;
    }
    last_draw_ = now;
    if (terminal_) {
        std::fprintf(out_, "\r\033[K%s", Line().c_str());
        drawn_ = true;
    } else {
        std::fprintf(out_, "  %s\n", Line().c_str());
    }
    std::fflush(out_);
}

}  // namespace s2s_cli
