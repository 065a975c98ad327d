#include <algorithm>
#include <array>
#include <string>

#include "GWStreamDecoder.h"

namespace {

constexpr unsigned kControlCode = 256;
constexpr unsigned kFirstTableCode = 257;
constexpr unsigned kCodeCount = 1u << 13;  // codes grow from 9 to at most 13 bits
constexpr unsigned kInitialCodeSize = 9;
constexpr unsigned kLargestCodeSize = 13;
constexpr std::uint16_t kFreeSlot = 0xFFFF;

std::string codeError(unsigned code, const char* problem) {
    return "shrink code " + std::to_string(code) + " " + problem;
}

// ZIP method 1: LZW whose code size and partial clearing are both signalled by
// the compressor (code 256 followed by 1 or 2). The stream has no end code, so
// it ends when the expected number of bytes has come out.
class GWUnshrinkDecoder final : public GWStreamDecoder {
public:
    explicit GWUnshrinkDecoder(std::uint64_t uncompressedSize) : remaining_(uncompressedSize) {
        for (unsigned code = 0; code < kCodeCount; ++code) {
            prefix_[code] = kFreeSlot;
            suffix_[code] = std::uint8_t(code);
        }
    }

    Step decode(std::span<const std::uint8_t> input, std::span<std::uint8_t> output,
                bool isFinal) override {
        Step step;
        for (;;) {
            // Bytes of the last code first: they may not have fitted last time.
            const std::size_t pending = std::size_t(kCodeCount) - stringStart_;
            if (pending > 0 && remaining_ > 0 && step.produced < output.size()) {
                const std::size_t n =
                    std::min<std::uint64_t>({pending, output.size() - step.produced, remaining_});
                std::copy_n(string_.begin() + stringStart_, n, output.begin() + step.produced);
                stringStart_ += n;
                step.produced += n;
                remaining_ -= n;
            }
            if (remaining_ == 0) {
                step.finished = true;
                return step;
            }
            if (stringStart_ < kCodeCount) {
                return step;  // the output span is full
            }
            while (bitCount_ < codeSize_ && step.consumed < input.size()) {
                bits_ |= std::uint32_t(input[step.consumed++]) << bitCount_;
                bitCount_ += 8;
            }
            if (bitCount_ < codeSize_) {
                if (isFinal) {
                    fail(step, "the shrunk stream ends early");
                }
                return step;
            }
            const unsigned code = bits_ & ((1u << codeSize_) - 1);
            bits_ >>= codeSize_;
            bitCount_ -= codeSize_;
            if (!takeCode(code, step)) {
                return step;
            }
        }
    }

private:
    static void fail(Step& step, std::string reason) {
        step.failed = true;
        step.error = std::move(reason);
    }

    bool takeCode(unsigned code, Step& step) {
        if (afterControl_) {
            afterControl_ = false;
            if (code == 1) {
                if (codeSize_ == kLargestCodeSize) {
                    fail(step, "the shrink code size grows beyond 13 bits");
                    return false;
                }
                ++codeSize_;
                return true;
            }
            if (code == 2) {
                clearLeaves();
                return true;
            }
            fail(step, "unknown shrink control code 256, " + std::to_string(code));
            return false;
        }
        if (code == kControlCode) {
            afterControl_ = true;
            return true;
        }
        if (previous_ < 0) {
            if (code >= kControlCode) {
                fail(step, "the shrunk stream begins with code " + std::to_string(code));
                return false;
            }
        } else {
            // This code's first byte completes the entry the previous code
            // left pending, which this code may itself already build on.
            const int firstByte = firstByteOf(code, step);
            if (firstByte < 0) {
                return false;
            }
            addEntry(std::uint8_t(firstByte));
        }
        if (!expand(code, step)) {
            return false;
        }
        previous_ = int(code);
        previousFirstByte_ = string_[stringStart_];
        return true;
    }

    bool isFree(unsigned code) const { return code >= kControlCode && prefix_[code] == kFreeSlot; }

    // The first byte of `code`'s string, or -1 after failing the step. The
    // slot about to be filled counts as the pending entry: the previous string
    // and a byte, so its first byte is the previous string's. That covers the
    // code the compressor defined just before sending it, and (after a
    // partial clear freed the previous code) codes built on that slot.
    int firstByteOf(unsigned code, Step& step) const {
        unsigned at = code;
        for (unsigned links = 0; links < kCodeCount; ++links) {
            if (at < kControlCode) {
                return int(at);
            }
            if (isFree(at)) {
                if (at == nextFree_) {
                    return previousFirstByte_;
                }
                fail(step, at == code ? codeError(code, "refers to a free slot")
                                      : codeError(code, "is built on a free slot"));
                return -1;
            }
            at = prefix_[at];
        }
        fail(step, codeError(code, "loops back on itself"));
        return -1;
    }

    // Spells `code` into the tail of string_, walking prefixes back to a byte.
    bool expand(unsigned code, Step& step) {
        std::size_t at = kCodeCount;
        for (unsigned link = code;; link = prefix_[link]) {
            if (isFree(link)) {
                fail(step, codeError(code, "is built on a free slot"));
                return false;
            }
            if (at == 0) {
                fail(step, codeError(code, "loops back on itself"));
                return false;
            }
            string_[--at] = suffix_[link];
            if (link < kControlCode) {
                break;
            }
        }
        stringStart_ = at;
        return true;
    }

    // The previous code followed by `firstByte` takes the lowest free slot.
    void addEntry(std::uint8_t firstByte) {
        if (nextFree_ >= kCodeCount) {
            return;  // the table is full until the compressor clears it
        }
        prefix_[nextFree_] = std::uint16_t(previous_);
        suffix_[nextFree_] = firstByte;
        findNextFree(nextFree_ + 1);
    }

    void findNextFree(unsigned from) {
        nextFree_ = from;
        while (nextFree_ < kCodeCount && prefix_[nextFree_] != kFreeSlot) {
            ++nextFree_;
        }
    }

    // Frees every entry that no other entry extends.
    void clearLeaves() {
        std::array<bool, kCodeCount> extended{};
        for (unsigned code = kFirstTableCode; code < kCodeCount; ++code) {
            if (prefix_[code] != kFreeSlot) {
                extended[prefix_[code]] = true;
            }
        }
        for (unsigned code = kFirstTableCode; code < kCodeCount; ++code) {
            if (!extended[code]) {
                prefix_[code] = kFreeSlot;
            }
        }
        findNextFree(kFirstTableCode);
    }

    std::uint64_t remaining_;
    std::uint32_t bits_ = 0;
    unsigned bitCount_ = 0;
    unsigned codeSize_ = kInitialCodeSize;
    bool afterControl_ = false;
    int previous_ = -1;  // the last data code, none before the first
    std::uint8_t previousFirstByte_ = 0;
    unsigned nextFree_ = kFirstTableCode;
    std::array<std::uint16_t, kCodeCount> prefix_;
    std::array<std::uint8_t, kCodeCount> suffix_;
    // The bytes of the last code, at string_[stringStart_, kCodeCount).
    std::array<std::uint8_t, kCodeCount> string_;
    std::size_t stringStart_ = kCodeCount;
};

}  // namespace

std::unique_ptr<GWStreamDecoder> GWMakeUnshrinkDecoder(std::uint64_t uncompressedSize) {
    return std::make_unique<GWUnshrinkDecoder>(uncompressedSize);
}
