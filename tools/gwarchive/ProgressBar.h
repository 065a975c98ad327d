#pragma once

#include <atomic>
#include <chrono>
#include <cstdint>
#include <cstdio>
#include <mutex>
#include <string>

namespace gwarchive {

// A one-line progress bar (bytes done and total, rate, time left) redrawn in
// place on a terminal. `advance` may be called from many threads at once;
// drawing is throttled so that small entries do not flood the terminal.
class ProgressBar {
public:
    ProgressBar(std::FILE* stream, std::uint64_t totalBytes);
    ~ProgressBar();

    void advance(std::uint64_t bytes);
    // Draws the final state and ends the line.
    void finish();

    // The text of one frame; public so that it can be checked without a terminal.
    static std::string frame(std::uint64_t done, std::uint64_t total, double seconds,
                             std::size_t width);

private:
    void draw(bool force);

    std::FILE* stream_;
    std::uint64_t total_;
    std::atomic<std::uint64_t> done_{0};
    std::chrono::steady_clock::time_point start_;
    std::mutex drawMutex_;
    std::chrono::steady_clock::time_point lastDraw_;
    bool finished_ = false;
};

}  // namespace gwarchive
