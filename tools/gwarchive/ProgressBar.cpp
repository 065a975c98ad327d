#include "ProgressBar.h"

#include <sys/ioctl.h>
#include <unistd.h>

#include <algorithm>
#include <cmath>

namespace gwarchive {

namespace {

std::string formatBytes(double bytes) {
    static const char* const kUnits[] = {"B", "KiB", "MiB", "GiB", "TiB"};
    std::size_t unit = 0;
    while (bytes >= 1024 && unit + 1 < std::size(kUnits)) {
        bytes /= 1024;
        ++unit;
    }
    char text[32];
    std::snprintf(text, sizeof text, unit == 0 ? "%.0f %s" : "%.1f %s", bytes, kUnits[unit]);
    return text;
}

std::string formatDuration(double seconds) {
    if (!std::isfinite(seconds) || seconds < 0)
        return "--:--";
    auto whole = static_cast<unsigned long long>(seconds + 0.5);
    char text[32];
    if (whole >= 3600) {
        std::snprintf(text, sizeof text, "%llu:%02llu:%02llu", whole / 3600, whole / 60 % 60,
                      whole % 60);
    } else {
        std::snprintf(text, sizeof text, "%llu:%02llu", whole / 60, whole % 60);
    }
    return text;
}

std::size_t terminalWidth(std::FILE* stream) {
    winsize size{};
    if (ioctl(fileno(stream), TIOCGWINSZ, &size) == 0 && size.ws_col >= 40)
        return size.ws_col;
    return 80;
}

}  // namespace

ProgressBar::ProgressBar(std::FILE* stream, std::uint64_t totalBytes)
    : stream_(stream), total_(totalBytes), start_(std::chrono::steady_clock::now()) {}

ProgressBar::~ProgressBar() {
    finish();
}

std::string ProgressBar::frame(std::uint64_t done, std::uint64_t total, double seconds,
                               std::size_t width) {
    double fraction = total == 0 ? 1.0 : std::min(1.0, static_cast<double>(done) / total);
    double rate = seconds > 0 ? done / seconds : 0;
    double left = rate > 0 ? (static_cast<double>(total) - done) / rate : NAN;
    char percent[8];
    std::snprintf(percent, sizeof percent, "%3d%%", static_cast<int>(fraction * 100));
    std::string tail = " " + std::string(percent) + " " + formatBytes(done) + " / " +
                       formatBytes(total) + "  " + formatBytes(rate) + "/s  " +
                       formatDuration(left) + " left";
    std::size_t barWidth =
        width > tail.size() + 12 ? std::min<std::size_t>(40, width - tail.size() - 3) : 10;
    auto filled = static_cast<std::size_t>(fraction * barWidth);
    return "[" + std::string(filled, '#') + std::string(barWidth - filled, '-') + "]" + tail;
}

void ProgressBar::advance(std::uint64_t bytes) {
    done_.fetch_add(bytes, std::memory_order_relaxed);
    draw(false);
}

void ProgressBar::draw(bool force) {
    std::unique_lock lock(drawMutex_, std::defer_lock);
    if (force) {
        lock.lock();
    } else if (!lock.try_lock()) {
        return;  // another thread is drawing; its frame is as good as ours
    }
    auto now = std::chrono::steady_clock::now();
    if (!force && now - lastDraw_ < std::chrono::milliseconds(100))
        return;
    lastDraw_ = now;
    double seconds = std::chrono::duration<double>(now - start_).count();
    std::string line =
        frame(done_.load(std::memory_order_relaxed), total_, seconds, terminalWidth(stream_));
    std::fprintf(stream_, "\r%s\x1b[K", line.c_str());
    std::fflush(stream_);
}

void ProgressBar::finish() {
    if (finished_)
        return;
    finished_ = true;
    draw(true);
    std::fputc('\n', stream_);
    std::fflush(stream_);
}

}  // namespace gwarchive
