#include <algorithm>
#include <array>
#include <cstring>
#include <string>

#include "GWStreamDecoder.h"

// Deflate64 is deflate with a 64 KiB window, length code 285 meaning 3 plus
// 16 extra bits and two more distance codes. No packaged library decodes it,
// so it is decoded here; the same engine reads plain deflate, which is how it
// is checked against zlib.

namespace {

constexpr unsigned kLongestCode = 15;
constexpr unsigned kFastBits = 10;  // codes this short are found in one lookup
constexpr std::size_t kHistory = 64 * 1024;
constexpr std::size_t kBufferSize = kHistory + 256 * 1024;

constexpr std::uint16_t kLengthBase[29] = {3,  4,  5,  6,   7,   8,   9,   10,  11, 13,
                                           15, 17, 19, 23,  27,  31,  35,  43,  51, 59,
                                           67, 83, 99, 115, 131, 163, 195, 227, 258};
constexpr std::uint8_t kLengthExtra[29] = {0, 0, 0, 0, 0, 0, 0, 0, 1, 1, 1, 1, 2, 2, 2,
                                           2, 3, 3, 3, 3, 4, 4, 4, 4, 5, 5, 5, 5, 0};
constexpr std::uint32_t kDistanceBase[32] = {1,    2,    3,    4,     5,     7,     9,     13,
                                             17,   25,   33,   49,    65,    97,    129,   193,
                                             257,  385,  513,  769,   1025,  1537,  2049,  3073,
                                             4097, 6145, 8193, 12289, 16385, 24577, 32769, 49153};
constexpr std::uint8_t kDistanceExtra[32] = {0,  0,  0,  0,  1,  1,  2,  2,  3,  3, 4,
                                             4,  5,  5,  6,  6,  7,  7,  8,  8,  9, 9,
                                             10, 10, 11, 11, 12, 12, 13, 13, 14, 14};
constexpr std::uint8_t kCodeLengthOrder[19] = {16, 17, 18, 0, 8,  7, 9,  6, 10, 5,
                                               11, 4,  12, 3, 13, 2, 14, 1, 15};

// A canonical Huffman code. Short codes come from a table indexed by the next
// bits; longer ones are counted out bit by bit, which is rare enough not to show.
class HuffmanCode {
public:
    static constexpr int kNeedMoreBits = -1;
    static constexpr int kInvalidCode = -2;

    // False for an over-subscribed code. An incomplete one is accepted; its
    // missing codes fail when met.
    bool build(const std::uint8_t* lengths, unsigned count) {
        counts_.fill(0);
        for (unsigned i = 0; i < count; ++i) {
            ++counts_[lengths[i]];
        }
        counts_[0] = 0;
        int left = 1;
        std::array<std::uint16_t, kLongestCode + 2> offsets{};
        for (unsigned length = 1; length <= kLongestCode; ++length) {
            left = left * 2 - counts_[length];
            if (left < 0) {
                return false;
            }
            offsets[length + 1] = std::uint16_t(offsets[length] + counts_[length]);
        }
        for (unsigned symbol = 0; symbol < count; ++symbol) {
            if (lengths[symbol] != 0) {
                symbols_[offsets[lengths[symbol]]++] = std::uint16_t(symbol);
            }
        }
        fast_.fill(0);
        unsigned code = 0, index = 0;
        for (unsigned length = 1; length <= kFastBits; ++length) {
            for (unsigned n = 0; n < counts_[length]; ++n, ++code) {
                unsigned reversed = 0;
                for (unsigned bit = 0; bit < length; ++bit) {
                    reversed |= ((code >> bit) & 1) << (length - 1 - bit);
                }
                const auto entry = std::uint16_t(symbols_[index++] << 4 | length);
                for (unsigned at = reversed; at < (1u << kFastBits); at += 1u << length) {
                    fast_[at] = entry;
                }
            }
            code <<= 1;
        }
        return true;
    }

    // Decodes from `bits` (the next stream bit in bit 0), of which `available`
    // are valid; sets `used` to the code's length.
    int decode(std::uint64_t bits, unsigned available, unsigned& used) const {
        const std::uint16_t entry = fast_[bits & ((1u << kFastBits) - 1)];
        if (entry != 0) {
            used = entry & 15;
            return used <= available ? entry >> 4 : kNeedMoreBits;
        }
        int code = 0, first = 0, index = 0;
        for (unsigned length = 1; length <= kLongestCode; ++length) {
            if (length > available) {
                return kNeedMoreBits;
            }
            code |= int((bits >> (length - 1)) & 1);
            const int count = counts_[length];
            if (code - first < count) {
                used = length;
                return symbols_[std::size_t(index + code - first)];
            }
            index += count;
            first = (first + count) << 1;
            code <<= 1;
        }
        return kInvalidCode;
    }

private:
    std::array<std::uint16_t, kLongestCode + 1> counts_{};
    std::array<std::uint16_t, 320> symbols_{};  // by length, then by value
    std::array<std::uint16_t, 1u << kFastBits> fast_{};
};

class GWDeflate64Decoder final : public GWStreamDecoder {
public:
    explicit GWDeflate64Decoder(bool deflate64) : deflate64_(deflate64) {}

    Step decode(std::span<const std::uint8_t> input, std::span<std::uint8_t> output,
                bool isFinal) override {
        Step step;
        if (!buffer_) {
            buffer_.reset(new std::uint8_t[kBufferSize]);
        }
        in_ = input.data();
        inEnd_ = input.data() + input.size();
        for (;;) {
            const std::size_t n = std::min(pos_ - flushed_, output.size() - step.produced);
            std::memcpy(output.data() + step.produced, buffer_.get() + flushed_, n);
            flushed_ += n;
            step.produced += n;
            if (flushed_ < pos_) {
                break;  // the caller's room is full
            }
            if (state_ == State::done) {
                step.finished = true;
                break;
            }
            if (pos_ == kBufferSize) {
                std::memmove(buffer_.get(), buffer_.get() + kBufferSize - kHistory, kHistory);
                pos_ = flushed_ = kHistory;
            }
            const Outcome outcome = run();
            if (outcome == Outcome::failed) {
                step.failed = true;
                step.error =
                    (deflate64_ ? "damaged deflate64 stream: " : "damaged deflate stream: ") +
                    std::string(error_);
                break;
            }
            if (outcome == Outcome::starved) {
                const std::size_t rest = std::min(pos_ - flushed_, output.size() - step.produced);
                std::memcpy(output.data() + step.produced, buffer_.get() + flushed_, rest);
                flushed_ += rest;
                step.produced += rest;
                if (isFinal && flushed_ == pos_) {
                    step.failed = true;
                    step.error = deflate64_ ? "the deflate64 stream ends early"
                                            : "the deflate stream ends early";
                }
                break;
            }
        }
        step.consumed = std::size_t(in_ - input.data());
        // Bits past the count may belong to bytes offered again; keep none.
        bitBuffer_ &= bitCount_ >= 64 ? ~std::uint64_t(0) : (std::uint64_t(1) << bitCount_) - 1;
        return step;
    }

private:
    enum class State {
        header,
        storedHeader,
        stored,
        table,
        codeLengths,
        lengths,
        codes,
        distance,
        copy,
        done
    };
    enum class Outcome { full, starved, failed };

    void refill() {
        if (bitCount_ > 56) {
            return;
        }
        if (inEnd_ - in_ >= 8) {
            std::uint64_t word;
            std::memcpy(&word, in_, 8);  // little-endian hosts only, as is Linux on x86 and ARM
            bitBuffer_ |= word << bitCount_;
            const unsigned taken = (63 - bitCount_) >> 3;
            in_ += taken;
            bitCount_ += taken * 8;
            return;
        }
        while (bitCount_ <= 56 && in_ < inEnd_) {
            bitBuffer_ |= std::uint64_t(*in_++) << bitCount_;
            bitCount_ += 8;
        }
    }
    std::uint32_t bits(unsigned count) const {
        return std::uint32_t(bitBuffer_ & ((std::uint64_t(1) << count) - 1));
    }
    void drop(unsigned count) {
        bitBuffer_ >>= count;
        bitCount_ -= count;
    }
    Outcome fail(const char* reason) {
        error_ = reason;
        return Outcome::failed;
    }

    bool buildFixedCodes() {
        std::uint8_t lengths[288 + 32];
        std::fill(lengths, lengths + 144, 8);
        std::fill(lengths + 144, lengths + 256, 9);
        std::fill(lengths + 256, lengths + 280, 7);
        std::fill(lengths + 280, lengths + 288, 8);
        std::fill(lengths + 288, lengths + 320, 5);
        return literals_.build(lengths, 288) && distances_.build(lengths + 288, 32);
    }

    // Decodes until the buffer is full, the stream ends, input runs out or
    // the stream proves damaged. Every step is whole: it waits for all the
    // bits it needs before taking any.
    Outcome run() {
        for (;;) {
            refill();
            switch (state_) {
                case State::header: {
                    if (bitCount_ < 3) {
                        return Outcome::starved;
                    }
                    lastBlock_ = bits(1) != 0;
                    const unsigned type = (bits(3) >> 1);
                    drop(3);
                    if (type == 0) {
                        state_ = State::storedHeader;
                    } else if (type == 1) {
                        buildFixedCodes();
                        state_ = State::codes;
                    } else if (type == 2) {
                        state_ = State::table;
                    } else {
                        return fail("invalid block type");
                    }
                    break;
                }
                case State::storedHeader: {
                    drop(bitCount_ % 8);
                    if (bitCount_ < 32) {
                        return Outcome::starved;
                    }
                    const std::uint32_t lengths = bits(32);
                    drop(32);
                    if ((lengths & 0xFFFF) != (~lengths >> 16)) {
                        return fail("invalid stored block lengths");
                    }
                    remaining_ = lengths & 0xFFFF;
                    state_ = State::stored;
                    break;
                }
                case State::stored: {
                    while (remaining_ > 0 && bitCount_ >= 8 && pos_ < kBufferSize) {
                        buffer_[pos_++] = std::uint8_t(bits(8));
                        drop(8);
                        --remaining_;
                        ++total_;
                    }
                    if (bitCount_ == 0) {
                        bitBuffer_ = 0;  // what refill read ahead is copied directly below
                        const std::size_t n = std::min({std::size_t(remaining_), kBufferSize - pos_,
                                                        std::size_t(inEnd_ - in_)});
                        std::memcpy(buffer_.get() + pos_, in_, n);
                        in_ += n;
                        pos_ += n;
                        remaining_ -= std::uint32_t(n);
                        total_ += n;
                    }
                    if (remaining_ == 0) {
                        state_ = lastBlock_ ? State::done : State::header;
                        if (state_ == State::done) {
                            return Outcome::full;
                        }
                    } else if (pos_ == kBufferSize) {
                        return Outcome::full;
                    } else if (in_ == inEnd_ && bitCount_ == 0) {
                        return Outcome::starved;
                    }
                    break;
                }
                case State::table: {
                    if (bitCount_ < 14) {
                        return Outcome::starved;
                    }
                    literalCount_ = 257 + bits(5);
                    distanceCount_ = 1 + (bits(10) >> 5);
                    codeLengthCount_ = 4 + (bits(14) >> 10);
                    drop(14);
                    // 7-Zip's Deflate64 writes lengths for all 288 literal/length symbols.
                    if (literalCount_ > (deflate64_ ? 288u : 286u) ||
                        distanceCount_ > (deflate64_ ? 32u : 30u)) {
                        return fail("too many length or distance symbols");
                    }
                    index_ = 0;
                    lengths_.fill(0);
                    state_ = State::codeLengths;
                    break;
                }
                case State::codeLengths: {
                    while (index_ < codeLengthCount_) {
                        if (bitCount_ < 3 && (refill(), bitCount_ < 3)) {
                            return Outcome::starved;
                        }
                        lengths_[kCodeLengthOrder[index_++]] = std::uint8_t(bits(3));
                        drop(3);
                    }
                    if (!codeLengths_.build(lengths_.data(), 19)) {
                        return fail("invalid code lengths set");
                    }
                    index_ = 0;
                    lengths_.fill(0);
                    state_ = State::lengths;
                    break;
                }
                case State::lengths: {
                    const Outcome outcome = readLengths();
                    if (outcome != Outcome::full) {
                        return outcome;
                    }
                    break;
                }
                case State::codes:
                case State::distance:
                case State::copy: {
                    const Outcome outcome = readCodes();
                    if (outcome != Outcome::full || pos_ == kBufferSize || state_ == State::done) {
                        return outcome;
                    }
                    break;
                }
                case State::done: return Outcome::full;
            }
        }
    }

    // The literal/length and distance code lengths, then the two codes.
    Outcome readLengths() {
        const unsigned total = literalCount_ + distanceCount_;
        while (index_ < total) {
            refill();
            unsigned used = 0;
            const int symbol = codeLengths_.decode(bitBuffer_, bitCount_, used);
            if (symbol == HuffmanCode::kNeedMoreBits) {
                return Outcome::starved;
            }
            if (symbol < 0) {
                return fail("invalid code lengths set");
            }
            if (symbol < 16) {
                drop(used);
                lengths_[index_++] = std::uint8_t(symbol);
                continue;
            }
            static constexpr unsigned kExtra[3] = {2, 3, 7}, kBase[3] = {3, 3, 11};
            const unsigned extra = kExtra[symbol - 16];
            if (used + extra > bitCount_) {
                return Outcome::starved;
            }
            const unsigned repeat =
                kBase[symbol - 16] + ((bitBuffer_ >> used) & ((1u << extra) - 1));
            if (symbol == 16 && index_ == 0) {
                return fail("invalid bit length repeat");
            }
            if (index_ + repeat > total) {
                return fail("invalid bit length repeat");
            }
            const std::uint8_t value = symbol == 16 ? lengths_[index_ - 1] : 0;
            std::fill_n(lengths_.begin() + index_, repeat, value);
            index_ += repeat;
            drop(used + extra);
        }
        if (lengths_[256] == 0) {
            return fail("missing end-of-block code");
        }
        if (!literals_.build(lengths_.data(), literalCount_) ||
            !distances_.build(lengths_.data() + literalCount_, distanceCount_)) {
            return fail("invalid literal/lengths or distances set");
        }
        state_ = State::codes;
        return Outcome::full;
    }

    // Literals and matches until the block ends, the buffer fills or input
    // runs out; a match cut by a full buffer goes on in the next call.
    Outcome readCodes() {
        for (;;) {
            if (state_ == State::copy) {
                const std::size_t n = std::min<std::size_t>(copyLength_, kBufferSize - pos_);
                std::uint8_t* to = buffer_.get() + pos_;
                const std::uint8_t* from = to - copyDistance_;
                if (copyDistance_ >= n) {
                    std::memcpy(to, from, n);
                } else {
                    for (std::size_t i = 0; i < n; ++i) {
                        to[i] = from[i];
                    }
                }
                pos_ += n;
                total_ += n;
                copyLength_ -= std::uint32_t(n);
                if (copyLength_ > 0) {
                    return Outcome::full;
                }
                state_ = State::codes;
            }
            if (pos_ == kBufferSize) {
                return Outcome::full;
            }
            refill();
            unsigned used = 0;
            if (state_ == State::codes) {
                const int symbol = literals_.decode(bitBuffer_, bitCount_, used);
                if (symbol < 0) {
                    return symbol == HuffmanCode::kNeedMoreBits
                               ? Outcome::starved
                               : fail("invalid literal/length code");
                }
                if (symbol < 256) {
                    drop(used);
                    buffer_[pos_++] = std::uint8_t(symbol);
                    ++total_;
                    continue;
                }
                if (symbol == 256) {
                    drop(used);
                    state_ = lastBlock_ ? State::done : State::header;
                    return Outcome::full;
                }
                const unsigned code = unsigned(symbol) - 257;
                if (code >= 29) {
                    return fail("invalid literal/length code");
                }
                const bool long64 = deflate64_ && code == 28;
                const unsigned extra = long64 ? 16 : kLengthExtra[code];
                if (used + extra > bitCount_) {
                    return Outcome::starved;
                }
                copyLength_ = (long64 ? 3 : kLengthBase[code]) +
                              std::uint32_t((bitBuffer_ >> used) & ((1u << extra) - 1));
                drop(used + extra);
                state_ = State::distance;
                refill();
            }
            const int symbol = distances_.decode(bitBuffer_, bitCount_, used);
            if (symbol < 0) {
                return symbol == HuffmanCode::kNeedMoreBits ? Outcome::starved
                                                            : fail("invalid distance code");
            }
            if (symbol >= (deflate64_ ? 32 : 30)) {
                return fail("invalid distance code");
            }
            const unsigned extra = kDistanceExtra[symbol];
            if (used + extra > bitCount_) {
                return Outcome::starved;
            }
            copyDistance_ =
                kDistanceBase[symbol] + std::uint32_t((bitBuffer_ >> used) & ((1u << extra) - 1));
            if (copyDistance_ > total_) {
                return fail("invalid distance too far back");
            }
            drop(used + extra);
            state_ = State::copy;
        }
    }

    const bool deflate64_;
    State state_ = State::header;
    bool lastBlock_ = false;
    const char* error_ = "";

    const std::uint8_t* in_ = nullptr;
    const std::uint8_t* inEnd_ = nullptr;
    std::uint64_t bitBuffer_ = 0;  // the next stream bit in bit 0
    unsigned bitCount_ = 0;

    // Decoded bytes: at least the window before `pos_`, then what is not yet
    // handed out from `flushed_` on.
    std::unique_ptr<std::uint8_t[]> buffer_;
    std::size_t pos_ = 0;
    std::size_t flushed_ = 0;
    std::uint64_t total_ = 0;

    std::uint32_t remaining_ = 0;  // of a stored block
    unsigned literalCount_ = 0, distanceCount_ = 0, codeLengthCount_ = 0, index_ = 0;
    std::array<std::uint8_t, 288 + 32> lengths_{};
    std::uint32_t copyLength_ = 0;
    std::uint32_t copyDistance_ = 0;
    HuffmanCode codeLengths_, literals_, distances_;
};

}  // namespace

std::unique_ptr<GWStreamDecoder> GWMakeDeflate64Decoder(bool deflate64) {
    return std::make_unique<GWDeflate64Decoder>(deflate64);
}
