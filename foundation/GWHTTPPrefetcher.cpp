#include "GWHTTPPrefetcher.h"

#include <algorithm>
#include <cerrno>
#include <cmath>
#include <cstring>

namespace {

constexpr std::size_t kSmallestSpan = 256 * 1024;
constexpr std::size_t kLargestSpan = 8 << 20;
constexpr std::size_t kMostWorkers = 8;
constexpr std::size_t kMostCursors = 16;
// A stream that has not read for this long has ended.
constexpr std::chrono::seconds kCursorLife{2};
// Reads that went through a span from its start, leaving no hole larger than
// this, have finished it: what they skipped is a gap, a data descriptor, or
// room left for a local header longer than its entry's.
constexpr std::uint64_t kSpanTail = 4096;

}  // namespace

namespace {
constexpr std::uint64_t kStragglers = 256 * 1024;
}  // namespace

bool GWHTTPPrefetcher::startsAfter(std::uint64_t offset, const SpanPtr& span) {
    return offset < span->offset;
}

GWHTTPPrefetcher::GWHTTPPrefetcher(std::uint64_t sourceSize, Opener opener)
    : sourceSize_(sourceSize), opener_(std::move(opener)) {}

GWHTTPPrefetcher::~GWHTTPPrefetcher() {
    {
        std::lock_guard lock(mutex_);
        stopping_ = true;
    }
    changed_.notify_all();
    for (auto& worker : workers_) {
        worker.join();
    }
}

void GWHTTPPrefetcher::observe(const GWHTTPTiming& timing) {
    std::lock_guard lock(mutex_);
    if (timing.firstByteSeconds > 0 && (roundTrip_ == 0 || timing.firstByteSeconds < roundTrip_)) {
        roundTrip_ = timing.firstByteSeconds;
    }
    // Only a body long enough to leave slow start says what a request carries.
    const double streaming = timing.totalSeconds - timing.firstByteSeconds;
    if (timing.bytes >= kSmallestSpan && streaming > 0) {
        const double rate = double(timing.bytes) / streaming;
        bytesPerSecond_ = bytesPerSecond_ == 0 ? rate : (bytesPerSecond_ + rate) / 2;
    }
}

// A span long enough that the round trip before its first byte is a small
// part of it: four round trips' worth of one request's bytes.
std::size_t GWHTTPPrefetcher::spanSizeLocked() const {
    if (bytesPerSecond_ == 0 || roundTrip_ == 0) {
        // Before any span came back: as if a request carried 64 MB/s.
        return std::clamp<std::size_t>(std::size_t(4 * 64e6 * roundTrip_), 1 << 20, kLargestSpan);
    }
    return std::clamp<std::size_t>(std::size_t(4 * bytesPerSecond_ * roundTrip_), kSmallestSpan,
                                   kLargestSpan);
}

// Over a long round trip one request is held back by its connection's
// window, not by the link: more of them in flight make up for it.
std::size_t GWHTTPPrefetcher::concurrencyLocked() const {
    return std::clamp<std::size_t>(2 + std::size_t(roundTrip_ / 0.005), 2, 6);
}

std::uint64_t GWHTTPPrefetcher::windowLocked() const {
    constexpr std::uint64_t kLargestWindow = 32 << 20;
    return std::min<std::uint64_t>(std::uint64_t(spanSizeLocked()) * concurrencyLocked() * 2,
                                   kLargestWindow);
}

std::uint64_t GWHTTPPrefetcher::window() const {
    std::lock_guard lock(mutex_);
    return windowLocked();
}

void GWHTTPPrefetcher::willRead(std::span<const GWByteRange> ranges) {
    std::vector<GWByteRange> wanted;
    for (const GWByteRange& range : ranges) {
        if (range.offset < sourceSize_ && range.length > 0) {
            wanted.push_back({range.offset, std::min(range.length, sourceSize_ - range.offset)});
        }
    }
    std::sort(wanted.begin(), wanted.end(),
              [](const auto& a, const auto& b) { return a.offset < b.offset; });
    std::lock_guard lock(mutex_);
    if (stopping_ || failed_) {
        return;
    }
    const std::uint64_t spanSize = spanSizeLocked();
    // Bytes that come sooner read through than in a request of their own.
    const std::uint64_t gap =
        bytesPerSecond_ == 0 || roundTrip_ == 0
            ? 64 * 1024
            : std::clamp<std::uint64_t>(std::uint64_t(bytesPerSecond_ * roundTrip_), 8 * 1024,
                                        1 << 20);
    std::vector<SpanPtr> planned;
    auto add = [&](std::uint64_t from, std::uint64_t to) {
        if (!planned.empty()) {
            Span& last = *planned.back();
            const std::uint64_t lastEnd = last.offset + last.length;
            if (from <= lastEnd + gap && std::max(to, lastEnd) - last.offset <= spanSize) {
                last.length = std::max(to, lastEnd) - last.offset;
                return;
            }
        }
        for (; from < to; from += spanSize) {
            auto span = std::make_shared<Span>();
            span->offset = span->readUpTo = from;
            span->length = std::min(spanSize, to - from);
            planned.push_back(std::move(span));
        }
    };
    for (const GWByteRange& range : wanted) {
        // Only what no span planned already holds.
        std::uint64_t from = range.offset;
        const std::uint64_t to = range.offset + range.length;
        // From the span that may hold `from`: a hostile archive announces
        // many entries over the same bytes.
        auto at = std::upper_bound(spans_.begin(), spans_.end(), from, startsAfter);
        if (at != spans_.begin()) {
            --at;
        }
        for (; at != spans_.end(); ++at) {
            const SpanPtr& span = *at;
            if (span->offset >= to) {
                break;
            }
            if (span->offset + span->length > from) {
                if (span->offset > from) {
                    add(from, span->offset);
                }
                from = span->offset + span->length;
            }
        }
        if (from < to) {
            add(from, to);
        }
    }
    for (SpanPtr& span : planned) {
        spans_.insert(std::upper_bound(spans_.begin(), spans_.end(), span->offset, startsAfter),
                      std::move(span));
    }
    if (cursors_.empty() && !spans_.empty()) {
        cursors_.push_back({spans_.front()->offset, std::chrono::steady_clock::now()});
    }
    startWorkersLocked();
    changed_.notify_all();
}

bool GWHTTPPrefetcher::take(std::uint64_t offset, std::span<std::uint8_t> into,
                            GWErrorPtr* failure) {
    if (into.empty() || offset > UINT64_MAX - into.size()) {
        return false;
    }
    const std::uint64_t end = offset + into.size();
    std::unique_lock lock(mutex_);
    auto at = std::upper_bound(spans_.begin(), spans_.end(), offset, startsAfter);
    // Merged spans may overlap a little: the holder may be a few back.
    for (int look = 0; look < 3 && at != spans_.begin(); ++look) {
        --at;
        if ((*at)->offset + (*at)->length > offset) {
            break;
        }
    }
    // The spans that hold the range, one after another.
    std::vector<SpanPtr> holders;
    for (std::uint64_t covered = offset; covered < end; ++at) {
        if (at == spans_.end() || (*at)->offset > covered) {
            return false;
        }
        if ((*at)->offset + (*at)->length > covered) {
            holders.push_back(*at);
            covered = (*at)->offset + (*at)->length;
        }
    }
    moveCursorLocked(offset, end);
    for (const SpanPtr& span : holders) {
        span->wanted = true;
    }
    dropBehindLocked();
    startWorkersLocked();
    changed_.notify_all();
    // Once fetching ahead failed, a span not under way never will be.
    const auto settled = [this](const SpanPtr& span) {
        return span->state == Span::ready || span->dropped ||
               (failed_ && span->state == Span::queued);
    };
    changed_.wait(lock, [&] { return std::all_of(holders.begin(), holders.end(), settled); });
    for (const SpanPtr& span : holders) {
        if (span->state != Span::ready) {
            // A connection cut somewhere in a long merged range says nothing
            // of this reader's own bytes: it asks for them itself. Any other
            // failure (a changed file, a refused redirect, a stall) it would
            // meet as well.
            if (span->error && !span->error->is(kGWPOSIXErrorDomain, ECONNRESET)) {
                GWFail(failure, span->error);
            }
            return false;
        }
    }
    for (const SpanPtr& span : holders) {
        const std::uint64_t from = std::max(offset, span->offset);
        const std::uint64_t to = std::min(end, span->offset + span->length);
        std::memcpy(into.data() + (from - offset), span->bytes.data() + (from - span->offset),
                    std::size_t(to - from));
        if (from <= span->readUpTo + kSpanTail) {
            span->readUpTo = std::max(span->readUpTo, to);
        }
        span->finished = span->readUpTo + kSpanTail >= span->offset + span->length;
    }
    // A finished span stays while reads of entries beside each other may
    // still be a little behind.
    std::erase_if(spans_, [&](const SpanPtr& span) {
        if (!span->finished || span->offset + span->length + kStragglers > end) {
            return false;
        }
        span->dropped = true;
        held_ -= span->length;
        return true;
    });
    return true;
}

void GWHTTPPrefetcher::moveCursorLocked(std::uint64_t offset, std::uint64_t end) {
    const auto now = std::chrono::steady_clock::now();
    std::erase_if(cursors_, [&](const Cursor& cursor) { return now - cursor.moved > kCursorLife; });
    // Reads of one stream follow each other closely; several entries read
    // side by side land within a span of each other.
    const std::uint64_t near = spanSizeLocked();
    for (Cursor& cursor : cursors_) {
        if (offset + near >= cursor.at && offset <= cursor.at + near) {
            cursor.at = std::max(cursor.at, end);
            cursor.moved = now;
            return;
        }
    }
    if (cursors_.size() >= kMostCursors) {
        cursors_.erase(
            std::min_element(cursors_.begin(), cursors_.end(),
                             [](const Cursor& a, const Cursor& b) { return a.moved < b.moved; }));
    }
    cursors_.push_back({end, now});
}

void GWHTTPPrefetcher::dropBehindLocked() {
    std::uint64_t behind = UINT64_MAX;
    for (const Cursor& cursor : cursors_) {
        behind = std::min(behind, cursor.at);
    }
    if (cursors_.empty()) {
        return;
    }
    while (!spans_.empty() && spans_.front()->state != Span::fetching &&
           spans_.front()->offset + spans_.front()->length <= behind) {
        // A reader holding the span keeps its bytes until it has copied them.
        Span& span = *spans_.front();
        if (span.state == Span::ready) {
            held_ -= span.length;
        }
        span.dropped = true;
        spans_.pop_front();
    }
}

GWHTTPPrefetcher::SpanPtr GWHTTPPrefetcher::nextLocked() {
    if (failed_ || running_ >= concurrencyLocked()) {
        return nullptr;
    }
    for (const SpanPtr& span : spans_) {
        if (span->state == Span::queued && span->wanted) {
            return span;
        }
    }
    const std::uint64_t window = windowLocked();
    if (held_ >= 2 * window) {
        return nullptr;
    }
    for (const SpanPtr& span : spans_) {
        if (span->state != Span::queued) {
            continue;
        }
        for (const Cursor& cursor : cursors_) {
            if (cursor.at < span->offset + span->length && span->offset < cursor.at + window) {
                return span;
            }
        }
    }
    return nullptr;
}

void GWHTTPPrefetcher::startWorkersLocked() {
    const std::size_t wanted = std::min(concurrencyLocked(), kMostWorkers);
    while (workers_.size() < wanted && !stopping_) {
        workers_.emplace_back([this] { work(); });
    }
}

void GWHTTPPrefetcher::work() {
    std::unique_ptr<GWHTTPRangeReader> reader;
    std::unique_lock lock(mutex_);
    for (;;) {
        SpanPtr span;
        changed_.wait(lock, [&] { return stopping_ || (span = nextLocked()) != nullptr; });
        if (stopping_) {
            return;
        }
        span->state = Span::fetching;
        ++running_;
        held_ += span->length;
        lock.unlock();
        if (!reader) {
            reader = opener_();
        }
        GWData bytes(std::size_t(span->length));
        GWErrorPtr error;
        const bool fetched = reader && reader->fetch(span->offset, bytes, &error);
        const GWHTTPTiming timing = reader ? reader->lastTiming() : GWHTTPTiming{};
        if (fetched) {
            observe(timing);
        }
        lock.lock();
        --running_;
        if (fetched) {
            span->bytes = std::move(bytes);
            span->state = Span::ready;
        } else {
            held_ -= span->length;
            span->error = error;
            failed_ = true;
            for (const SpanPtr& other : spans_) {
                if (other->state != Span::ready && other != span) {
                    other->dropped = other->state == Span::queued || other->dropped;
                }
            }
            span->dropped = true;
            std::erase_if(spans_, [](const SpanPtr& other) { return other->dropped; });
        }
        changed_.notify_all();
    }
}
