#include <algorithm>
#include <array>

#include "GWStreamDecoder.h"

namespace {

constexpr unsigned kLongestCode = 16;
constexpr std::size_t kWindowSize = 8192;  // the larger of the two dictionaries
constexpr unsigned kLengthEscape = 63;     // a length symbol followed by an extra byte

// A Shannon-Fano code rebuilt from its bit lengths the way the format assigns
// codes: lengths sorted (stably) from short to long, codes counted upwards from
// zero starting at the longest. Codes of one length are thus consecutive, so a
// code is found by its length and its offset from the first of that length.
class ShannonFanoCode {
public:
    static constexpr int kNeedMoreBits = -1;
    static constexpr int kInvalidCode = -2;

    // False when the lengths do not form a prefix code.
    bool build(std::span<const std::uint8_t> lengths) {
        std::array<unsigned, kLongestCode + 1> count{};
        for (std::uint8_t length : lengths) {
            ++count[length];
        }
        unsigned start = 0;
        for (unsigned length = 1; length <= kLongestCode; ++length) {
            offset_[length] = start;
            count_[length] = count[length];
            start += count[length];
        }
        std::array<unsigned, kLongestCode + 1> next = offset_;
        for (std::size_t symbol = 0; symbol < lengths.size(); ++symbol) {
            symbols_[next[lengths[symbol]]++] = std::uint8_t(symbol);
        }
        // Longest first; every code must sit on a boundary of its own length
        // and all must fit in 16 bits, or two codes would share a prefix.
        std::uint32_t code = 0;
        for (unsigned length = kLongestCode; length >= 1; --length) {
            if (count_[length] == 0) {
                continue;
            }
            const std::uint32_t step = 1u << (kLongestCode - length);
            if (code % step != 0) {
                return false;
            }
            first_[length] = code >> (kLongestCode - length);
            code += count_[length] * step;
            if (code > (1u << kLongestCode)) {
                return false;
            }
        }
        return true;
    }

    // Decodes from `bits` (the next stream bit in bit 0), of which `available`
    // are valid. Sets `used` to the code's length.
    int decode(std::uint64_t bits, unsigned available, unsigned& used) const {
        std::uint32_t value = 0;
        for (unsigned length = 1; length <= kLongestCode; ++length) {
            if (length > available) {
                return kNeedMoreBits;
            }
            value = (value << 1) | unsigned((bits >> (length - 1)) & 1);
            const std::uint32_t index = value - first_[length];
            if (value >= first_[length] && index < count_[length]) {
                used = length;
                // The last symbol of a length holds the lowest code.
                return symbols_[offset_[length] + count_[length] - 1 - index];
            }
        }
        return kInvalidCode;
    }

private:
    std::array<unsigned, kLongestCode + 1> offset_{};  // into symbols_, per length
    std::array<unsigned, kLongestCode + 1> count_{};
    std::array<std::uint32_t, kLongestCode + 1> first_{};
    std::array<std::uint8_t, 256> symbols_{};  // by length, then by value
};

// ZIP method 6: a 4 KiB or 8 KiB sliding dictionary whose output is coded with
// two or three Shannon-Fano codes, sent as run lengths at the start. The stream
// has no end marker; it ends when the expected number of bytes has come out.
class GWExplodeDecoder final : public GWStreamDecoder {
public:
    GWExplodeDecoder(std::uint64_t uncompressedSize, bool largeDictionary, bool literalTree)
        : remaining_(uncompressedSize),
          lowDistanceBits_(largeDictionary ? 7 : 6),
          minimumMatch_(literalTree ? 3 : 2),
          treeCount_(literalTree ? 3 : 2) {}

    Step decode(std::span<const std::uint8_t> input, std::span<std::uint8_t> output,
                bool isFinal) override {
        Step step;
        while (remaining_ > 0 && treesRead_ < treeCount_ && step.consumed < input.size()) {
            if (!readTreeByte(input[step.consumed++], step)) {
                return step;
            }
        }
        for (;;) {
            if (copyLength_ > 0) {
                copyMatch(output, step);
            }
            if (remaining_ == 0) {
                step.finished = true;
                return step;
            }
            if (copyLength_ > 0 || step.produced == output.size()) {
                return step;  // the output span is full
            }
            if (treesRead_ < treeCount_) {
                if (isFinal) {
                    fail(step, "the imploded stream ends inside its code tables");
                }
                return step;
            }
            while (bitCount_ <= 56 && step.consumed < input.size()) {
                bits_ |= std::uint64_t(input[step.consumed++]) << bitCount_;
                bitCount_ += 8;
            }
            const Token token = readToken(step);
            if (step.failed) {
                return step;
            }
            if (token.bits == 0) {
                if (isFinal) {
                    fail(step, "the imploded stream ends early");
                }
                return step;
            }
            bits_ = token.bits >= 64 ? 0 : bits_ >> token.bits;
            bitCount_ -= token.bits;
            if (token.length == 0) {
                put(token.literal, output, step);
            } else {
                copyLength_ = token.length;
                copyDistance_ = token.distance;
            }
        }
    }

private:
    // One literal or match; `bits` is 0 while its bits have not all arrived.
    struct Token {
        unsigned bits = 0;
        std::uint8_t literal = 0;
        unsigned length = 0;  // 0 for a literal
        unsigned distance = 0;
    };

    static void fail(Step& step, std::string reason) {
        step.failed = true;
        step.error = std::move(reason);
    }

    // Trees come first: a byte count less one, then bytes that each give a
    // run of equal lengths (high nibble: run less one, low: length less one).
    bool readTreeByte(std::uint8_t byte, Step& step) {
        if (treeBytesLeft_ < 0) {
            treeBytesLeft_ = int(byte) + 1;
            lengthsRead_ = 0;
            return true;
        }
        const std::size_t size = treeSize(treesRead_);
        const std::size_t run = (byte >> 4) + 1;
        if (lengthsRead_ + run > size) {
            return invalidTree(step);
        }
        std::fill_n(lengths_.begin() + lengthsRead_, run, std::uint8_t((byte & 0x0F) + 1));
        lengthsRead_ += run;
        if (--treeBytesLeft_ > 0) {
            return true;
        }
        if (lengthsRead_ != size ||
            !codes_[codeIndex(treesRead_)].build(std::span(lengths_).first(size))) {
            return invalidTree(step);
        }
        treeBytesLeft_ = -1;
        ++treesRead_;
        return true;
    }

    bool invalidTree(Step& step) {
        static const char* const kNames[] = {"literal", "length", "distance"};
        fail(step, std::string("invalid Shannon-Fano tree for ") + kNames[codeIndex(treesRead_)] +
                       " codes");
        return false;
    }

    // Trees in stream order map to literal (only with three), length, distance.
    unsigned codeIndex(unsigned tree) const { return tree + (treeCount_ == 2 ? 1 : 0); }
    std::size_t treeSize(unsigned tree) const { return codeIndex(tree) == 0 ? 256 : 64; }

    // Reads a whole token from the bit buffer without taking it, so that a
    // token cut by the end of an input piece is simply read again later.
    Token readToken(Step& step) const {
        Token token;
        unsigned at = 0;
        auto take = [&](unsigned count, unsigned& value) {
            if (at + count > bitCount_) {
                return false;
            }
            value = unsigned((bits_ >> at) & ((1u << count) - 1));
            at += count;
            return true;
        };
        auto decode = [&](const ShannonFanoCode& code, unsigned& value, const char* what) {
            unsigned used = 0;
            const int symbol = code.decode(bits_ >> at, bitCount_ - at, used);
            if (symbol == ShannonFanoCode::kInvalidCode) {
                fail(step, std::string("invalid Shannon-Fano code for ") + what);
            }
            if (symbol < 0) {
                return false;
            }
            value = unsigned(symbol);
            at += used;
            return true;
        };
        unsigned isLiteral = 0;
        if (!take(1, isLiteral)) {
            return token;
        }
        if (isLiteral) {
            unsigned literal = 0;
            if (!(treeCount_ == 3 ? decode(codes_[0], literal, "a literal") : take(8, literal))) {
                return token;
            }
            token.literal = std::uint8_t(literal);
        } else {
            unsigned low = 0, high = 0, length = 0, extra = 0;
            if (!take(lowDistanceBits_, low) || !decode(codes_[2], high, "a distance") ||
                !decode(codes_[1], length, "a length") ||
                (length == kLengthEscape && !take(8, extra))) {
                return token;
            }
            token.length = length + extra + minimumMatch_;
            token.distance = ((high << lowDistanceBits_) | low) + 1;
        }
        token.bits = at;
        return token;
    }

    void put(std::uint8_t byte, std::span<std::uint8_t> output, Step& step) {
        window_[position_++ % kWindowSize] = byte;
        output[step.produced++] = byte;
        --remaining_;
    }

    // Distances may reach before the first byte; the window starts as zeros,
    // which is what the format says lies there.
    void copyMatch(std::span<std::uint8_t> output, Step& step) {
        while (copyLength_ > 0 && remaining_ > 0 && step.produced < output.size()) {
            put(window_[(position_ - copyDistance_) % kWindowSize], output, step);
            --copyLength_;
        }
    }

    std::uint64_t remaining_;
    const unsigned lowDistanceBits_;
    const unsigned minimumMatch_;
    const unsigned treeCount_;

    unsigned treesRead_ = 0;
    int treeBytesLeft_ = -1;  // -1: the next byte is a tree's byte count
    std::size_t lengthsRead_ = 0;
    std::array<std::uint8_t, 256> lengths_{};
    std::array<ShannonFanoCode, 3> codes_;  // literal, length, distance

    std::uint64_t bits_ = 0;
    unsigned bitCount_ = 0;

    std::array<std::uint8_t, kWindowSize> window_{};
    std::uint64_t position_ = kWindowSize;  // so that position_ - distance never wraps
    unsigned copyLength_ = 0;
    unsigned copyDistance_ = 0;
};

}  // namespace

std::unique_ptr<GWStreamDecoder> GWMakeExplodeDecoder(std::uint64_t uncompressedSize,
                                                      bool useLargeDictionary,
                                                      bool useLiteralTree) {
    return std::make_unique<GWExplodeDecoder>(uncompressedSize, useLargeDictionary, useLiteralTree);
}
