#pragma once

#include <chrono>
#include <condition_variable>
#include <cstdint>
#include <deque>
#include <functional>
#include <memory>
#include <mutex>
#include <span>
#include <thread>
#include <vector>

#include "GWHTTPRangeReader.h"
#include "GWValue.h"

struct GWByteRange {
    std::uint64_t offset = 0;
    std::uint64_t length = 0;
};

// Fetches the ranges a caller will read (the entries of an extraction, the
// rest of a long stream) before it asks, in file order, several requests at
// a time: over a link with latency, one request per read would cost a round
// trip each. Ranges closer than a round trip's worth of bytes share a
// request. Requests run on their own readers of the resource, so each one is
// checked against its identity as any other; its failure is its readers'
// (the resource changed, the server stalled), and ends fetching ahead.
//
// Memory stays bounded: spans are fetched only within a window ahead of
// where reads go on (a few streams at once, as when entries are extracted
// side by side), up to two windows' worth in all, and are dropped once every
// stream has passed them. A span a reader waits for is fetched regardless.
class GWHTTPPrefetcher {
public:
    using Opener = std::function<std::unique_ptr<GWHTTPRangeReader>()>;
    GWHTTPPrefetcher(std::uint64_t sourceSize, Opener opener);
    ~GWHTTPPrefetcher();
    GWHTTPPrefetcher(const GWHTTPPrefetcher&) = delete;
    GWHTTPPrefetcher& operator=(const GWHTTPPrefetcher&) = delete;

    // Plans the ranges not already planned; they are fetched as reads approach.
    void willRead(std::span<const GWByteRange> ranges);
    // Copies the bytes at `offset` when a planned span holds them all,
    // waiting for one under way; false when the caller must fetch them, or
    // with `failure` set when fetching the span that holds them failed.
    bool take(std::uint64_t offset, std::span<std::uint8_t> into, GWErrorPtr* failure);
    // What a request of `bytes` took, to size the next spans and the window.
    void observe(const GWHTTPTiming& timing);

    // How far ahead of the furthest read spans are fetched.
    std::uint64_t window() const;

private:
    struct Span {
        std::uint64_t offset = 0;
        std::uint64_t length = 0;
        enum State { queued, fetching, ready } state = queued;
        bool dropped = false;        // no longer planned; a queued one is never fetched
        bool wanted = false;         // a reader waits for it
        std::uint64_t readUpTo = 0;  // how far reads have gone through it in order
        GWErrorPtr error;            // why fetching it failed
        bool finished = false;       // reads went through it
        GWData bytes;
    };
    using SpanPtr = std::shared_ptr<Span>;
    static bool startsAfter(std::uint64_t offset, const SpanPtr& span);
    void work();
    void startWorkersLocked();
    void dropBehindLocked();
    void moveCursorLocked(std::uint64_t offset, std::uint64_t end);
    SpanPtr nextLocked();
    std::uint64_t windowLocked() const;
    std::size_t concurrencyLocked() const;
    std::size_t spanSizeLocked() const;

    const std::uint64_t sourceSize_;
    const Opener opener_;
    mutable std::mutex mutex_;
    std::condition_variable changed_;
    std::deque<SpanPtr> spans_;  // in the order planned
    // Where the streams of reads have got to, and when each last moved.
    struct Cursor {
        std::uint64_t at = 0;
        std::chrono::steady_clock::time_point moved;
    };
    std::vector<Cursor> cursors_;
    std::uint64_t held_ = 0;     // bytes of spans fetched or under way
    double roundTrip_ = 0;       // seconds, the shortest seen
    double bytesPerSecond_ = 0;  // of one request once under way
    std::size_t running_ = 0;
    bool failed_ = false;
    bool stopping_ = false;
    std::vector<std::thread> workers_;
};
