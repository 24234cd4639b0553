#include "kytoupdate_progress.h"

#include <algorithm>
#include <cmath>

namespace kytoupdate {

ProgressView::ProgressView(FILE* out, bool terminal, int width, const std::string& unit)
    : out_(out), terminal_(terminal), width_(width > 20 ? width : 80), unit_(unit) {}

std::string ProgressView::FormatRate(double bytesPerSecond) {
    static const char* const units[] = {"B/s", "KiB/s", "MiB/s", "GiB/s"};
    int u = 0;
    while (bytesPerSecond >= 1024 && u < 3) {
        bytesPerSecond /= 1024;
        ++u;
    }
    char buf[32];
    snprintf(buf, sizeof buf, u == 0 ? "%.0f %s" : "%.1f %s", bytesPerSecond, units[u]);
    return buf;
}

std::string ProgressView::FormatDuration(double seconds) {
    long s = std::lround(std::max(0.0, seconds));
    char buf[32];
    if (s >= 3600)
        snprintf(buf, sizeof buf, "%ld:%02ld:%02ld", s / 3600, (s / 60) % 60, s % 60);
    else
        snprintf(buf, sizeof buf, "%ld:%02ld", s / 60, s % 60);
    return buf;
}

std::string ProgressView::Details(const ProgressSample& s) const {
    std::string text = std::to_string(s.percentage) + "%";
    if (s.items > 0)
        text += "  " + unit_ + " " + std::to_string(s.item) + " of " + std::to_string(s.items);
    if (rate_ >= 0)
        text += "  " + FormatRate(rate_);
    if (s.percentage > 0 && s.percentage < 100 && s.seconds > 0)
        text += "  " + FormatDuration(s.seconds * (100 - s.percentage) / s.percentage) + " left";
    return text;
}

void ProgressView::Update(const ProgressSample& s) {
    if (s.item != lastItem_ || s.bytes < lastBytes_) {
        lastItem_ = s.item;
        lastBytes_ = s.bytes;
        lastSeconds_ = s.seconds;
    } else if (s.seconds - lastSeconds_ >= 0.5) {
        const double now = (s.bytes - lastBytes_) / (s.seconds - lastSeconds_);
        rate_ = rate_ < 0 ? now : 0.7 * rate_ + 0.3 * now;
        lastBytes_ = s.bytes;
        lastSeconds_ = s.seconds;
    }

    const std::string details = Details(s);
    if (!terminal_) {
        // One line per change of what matters; rate and time left ride along.
        const std::string key = std::to_string(s.percentage) + "/" + std::to_string(s.item);
        if (key == lastPlain_)
            return;
        lastPlain_ = key;
        fprintf(out_, "%s\n", details.c_str());
        fflush(out_);
        return;
    }
    const int barWidth = std::max(10, width_ - static_cast<int>(details.size()) - 4);
    const int filled = barWidth * std::min(100, std::max(0, s.percentage)) / 100;
    std::string bar(static_cast<size_t>(filled), '#');
    bar.append(static_cast<size_t>(barWidth - filled), '-');
    fprintf(out_, "\r[%s] %s\033[K", bar.c_str(), details.c_str());
    fflush(out_);
    drawn_ = true;
}

void ProgressView::Finish() {
    if (terminal_ && drawn_) {
        fputc('\n', out_);
        fflush(out_);
    }
    drawn_ = false;
}

}  // namespace kytoupdate
