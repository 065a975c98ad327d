#include "ZipLegacyEncoders.h"

#include <algorithm>
#include <numeric>
#include <queue>
#include <stdexcept>
#include <unordered_map>

namespace gwtest {

namespace {

// Both methods pack codes from the least significant bit of each byte up.
class BitWriter {
public:
    void put(std::uint32_t value, unsigned count) {
        buffer_ |= std::uint64_t(value & ((1u << count) - 1)) << count_;
        count_ += count;
        while (count_ >= 8) {
            bytes_.push_back(std::uint8_t(buffer_));
            buffer_ >>= 8;
            count_ -= 8;
        }
    }

    GWData finish() {
        if (count_ > 0) {
            bytes_.push_back(std::uint8_t(buffer_));
        }
        buffer_ = 0;
        count_ = 0;
        return std::move(bytes_);
    }

private:
    GWData bytes_;
    std::uint64_t buffer_ = 0;
    unsigned count_ = 0;
};

// ---- shrink ----------------------------------------------------------------

constexpr unsigned kShrinkCodes = 8192;
constexpr unsigned kShrinkControl = 256;
constexpr unsigned kShrinkFirstEntry = 257;
constexpr unsigned kShrinkLargestCodeSize = 13;

class Shrinker {
public:
    Shrinker(const ShrinkOptions& options, ShrinkStats& stats)
        : options_(options),
          stats_(stats),
          parent_(kShrinkCodes, -1),
          byte_(kShrinkCodes),
          childCount_(kShrinkCodes) {}

    GWData run(const GWData& input) {
        if (input.empty()) {
            return {};
        }
        unsigned current = input[0];
        for (std::size_t i = 1; i < input.size(); ++i) {
            const std::uint8_t next = input[i];
            const auto found = children_.find(key(current, next));
            if (found != children_.end()) {
                current = found->second;
                continue;
            }
            emit(current);
            if (nextFree_ == (1u << codeSize_)) {
                growOrClear(current);
            }
            if (nextFree_ < kShrinkCodes) {
                parent_[nextFree_] = int(current);
                byte_[nextFree_] = next;
                ++childCount_[current];
                children_[key(current, next)] = std::uint16_t(nextFree_);
                findNextFree(nextFree_ + 1);
            }
            current = next;
        }
        emit(current);
        return bits_.finish();
    }

private:
    static std::uint32_t key(unsigned parent, std::uint8_t byte) { return parent << 8 | byte; }

    void emit(unsigned code) { bits_.put(code, codeSize_); }

    // Every slot below 1 << codeSize is taken: the one state in which PKZIP
    // clears, and peers disagree about clearing tables with free holes. The
    // table grows instead until the chosen size, and also while the code just
    // sent would not survive a clear (the entry added next extends it).
    void growOrClear(unsigned current) {
        const bool survives = current < kShrinkControl || childCount_[current] > 0;
        if (codeSize_ < kShrinkLargestCodeSize &&
            (codeSize_ < options_.clearingCodeSize || !survives)) {
            bits_.put(kShrinkControl, codeSize_);
            bits_.put(1, codeSize_);
            ++codeSize_;
            stats_.largestCodeSize = std::max(stats_.largestCodeSize, codeSize_);
            return;
        }
        bits_.put(kShrinkControl, codeSize_);
        bits_.put(2, codeSize_);
        clearLeaves();
        ++stats_.partialClears;
    }

    void findNextFree(unsigned from) {
        nextFree_ = from;
        while (nextFree_ < kShrinkCodes && parent_[nextFree_] >= 0) {
            ++nextFree_;
        }
    }

    void clearLeaves() {
        std::vector<bool> extended(kShrinkCodes);
        for (unsigned code = kShrinkFirstEntry; code < kShrinkCodes; ++code) {
            if (parent_[code] >= 0) {
                extended[parent_[code]] = true;
            }
        }
        for (unsigned code = kShrinkFirstEntry; code < kShrinkCodes; ++code) {
            if (parent_[code] >= 0 && !extended[code]) {
                children_.erase(key(unsigned(parent_[code]), byte_[code]));
                --childCount_[parent_[code]];
                parent_[code] = -1;
            }
        }
        findNextFree(kShrinkFirstEntry);
    }

    const ShrinkOptions& options_;
    ShrinkStats& stats_;
    BitWriter bits_;
    unsigned codeSize_ = 9;
    unsigned nextFree_ = kShrinkFirstEntry;
    std::vector<int> parent_;  // -1: free
    std::vector<std::uint8_t> byte_;
    std::vector<unsigned> childCount_;
    std::unordered_map<std::uint32_t, std::uint16_t> children_;
};

// ---- implode ---------------------------------------------------------------

constexpr unsigned kLongestCode = 16;

// Huffman code lengths of at most 16 bits for every symbol, used or not
// (the format gives each symbol a length).
std::vector<unsigned> codeLengths(std::vector<std::size_t> weights) {
    for (auto& weight : weights) {
        ++weight;
    }
    for (;;) {
        struct Node {
            std::size_t weight;
            int parent;
        };
        std::vector<Node> nodes;
        using Entry = std::pair<std::size_t, int>;  // weight, node
        std::priority_queue<Entry, std::vector<Entry>, std::greater<>> queue;
        for (std::size_t weight : weights) {
            queue.emplace(weight, int(nodes.size()));
            nodes.push_back({weight, -1});
        }
        while (queue.size() > 1) {
            const auto [weightA, a] = queue.top();
            queue.pop();
            const auto [weightB, b] = queue.top();
            queue.pop();
            const int parent = int(nodes.size());
            nodes.push_back({weightA + weightB, -1});
            nodes[a].parent = nodes[b].parent = parent;
            queue.emplace(weightA + weightB, parent);
        }
        std::vector<unsigned> lengths(weights.size());
        unsigned longest = 0;
        for (std::size_t symbol = 0; symbol < weights.size(); ++symbol) {
            for (int node = nodes[symbol].parent; node >= 0; node = nodes[node].parent) {
                ++lengths[symbol];
            }
            longest = std::max(longest, lengths[symbol]);
        }
        if (longest <= kLongestCode) {
            return lengths;
        }
        for (auto& weight : weights) {
            weight = weight / 2 + 1;  // flatter weights, shallower tree
        }
    }
}

std::uint16_t reverse16(std::uint32_t value) {
    std::uint16_t reversed = 0;
    for (unsigned bit = 0; bit < 16; ++bit) {
        reversed = std::uint16_t(reversed << 1 | ((value >> bit) & 1));
    }
    return reversed;
}

// The format's construction: lengths sorted stably from short to long, codes
// counted up from zero beginning with the last (longest), then bit-reversed so
// that they can be written least significant bit first.
std::vector<std::uint16_t> shannonFanoCodes(const std::vector<unsigned>& lengths) {
    std::vector<std::size_t> order(lengths.size());
    std::iota(order.begin(), order.end(), 0);
    std::stable_sort(order.begin(), order.end(),
                     [&](std::size_t a, std::size_t b) { return lengths[a] < lengths[b]; });
    std::vector<std::uint16_t> codes(lengths.size());
    std::uint32_t code = 0, increment = 0;
    unsigned lastLength = 0;
    for (std::size_t i = order.size(); i-- > 0;) {
        code += increment;
        if (lengths[order[i]] != lastLength) {
            lastLength = lengths[order[i]];
            increment = 1u << (kLongestCode - lastLength);
        }
        codes[order[i]] = reverse16(code);
    }
    return codes;
}

// A byte count less one, then one byte per run of equal lengths: the run
// less one in the high nibble, the length less one in the low.
void appendTree(GWData& out, const std::vector<unsigned>& lengths) {
    GWData runs;
    for (std::size_t at = 0; at < lengths.size();) {
        std::size_t run = 1;
        while (run < 16 && at + run < lengths.size() && lengths[at + run] == lengths[at]) {
            ++run;
        }
        runs.push_back(std::uint8_t((run - 1) << 4 | (lengths[at] - 1)));
        at += run;
    }
    out.push_back(std::uint8_t(runs.size() - 1));
    out.insert(out.end(), runs.begin(), runs.end());
}

struct Code {
    std::vector<unsigned> lengths;
    std::vector<std::uint16_t> codes;

    explicit Code(const std::vector<std::size_t>& weights)
        : lengths(codeLengths(weights)), codes(shannonFanoCodes(lengths)) {}
    void put(BitWriter& bits, std::size_t symbol) const {
        bits.put(codes[symbol], lengths[symbol]);
    }
};

}  // namespace

GWData shrinkBytes(const GWData& input, const ShrinkOptions& options, ShrinkStats* stats) {
    ShrinkStats local;
    ShrinkStats& counts = stats ? *stats : local;
    counts = {};
    return Shrinker(options, counts).run(input);
}

std::vector<ImplodeToken> implodeTokens(const GWData& input, const ImplodeSettings& settings) {
    const std::size_t minimum = settings.minimumMatch(), longest = settings.longestMatch();
    const std::size_t dictionary = settings.dictionarySize();
    constexpr unsigned kHashBits = 16;
    constexpr int kChainLimit = 64;
    auto hash = [&](std::size_t at) {
        std::uint32_t h = 0;
        for (std::size_t i = 0; i < minimum; ++i) {
            h = h * 0x01000193u ^ input[at + i];
        }
        return (h * 0x9E3779B1u) >> (32 - kHashBits);
    };
    std::vector<std::int64_t> head(std::size_t(1) << kHashBits, -1);
    std::vector<std::int64_t> previous(input.size(), -1);
    auto insert = [&](std::size_t at) {
        if (at + minimum <= input.size()) {
            const auto h = hash(at);
            previous[at] = head[h];
            head[h] = std::int64_t(at);
        }
    };

    std::vector<ImplodeToken> tokens;
    for (std::size_t at = 0; at < input.size();) {
        std::size_t bestLength = 0, bestDistance = 0;
        if (at + minimum <= input.size()) {
            const std::size_t limit = std::min(longest, input.size() - at);
            int chain = 0;
            for (std::int64_t candidate = head[hash(at)];
                 candidate >= 0 && at - std::size_t(candidate) <= dictionary && chain < kChainLimit;
                 candidate = previous[std::size_t(candidate)], ++chain) {
                std::size_t length = 0;
                while (length < limit &&
                       input[std::size_t(candidate) + length] == input[at + length]) {
                    ++length;
                }
                if (length > bestLength) {
                    bestLength = length;
                    bestDistance = at - std::size_t(candidate);
                }
            }
        }
        if (bestLength >= minimum) {
            tokens.push_back({0, bestLength, bestDistance});
            for (std::size_t i = 0; i < bestLength; ++i) {
                insert(at + i);
            }
            at += bestLength;
        } else {
            tokens.push_back({input[at], 0, 0});
            insert(at);
            ++at;
        }
    }
    return tokens;
}

GWData implodeTokenStream(const std::vector<ImplodeToken>& tokens,
                          const ImplodeSettings& settings) {
    const unsigned lowBits = settings.largeDictionary ? 7 : 6;
    const std::size_t minimum = settings.minimumMatch();
    std::vector<std::size_t> literalWeights(256), lengthWeights(64), distanceWeights(64);
    for (const ImplodeToken& token : tokens) {
        if (token.length == 0) {
            ++literalWeights[token.literal];
            continue;
        }
        if (token.length < minimum || token.length > settings.longestMatch() ||
            token.distance < 1 || token.distance > settings.dictionarySize()) {
            throw std::invalid_argument("implode token out of range");
        }
        ++lengthWeights[std::min<std::size_t>(token.length - minimum, 63)];
        ++distanceWeights[(token.distance - 1) >> lowBits];
    }
    const Code literals(literalWeights), lengths(lengthWeights), distances(distanceWeights);

    GWData out;
    if (settings.literalTree) {
        appendTree(out, literals.lengths);
    }
    appendTree(out, lengths.lengths);
    appendTree(out, distances.lengths);

    BitWriter bits;
    for (const ImplodeToken& token : tokens) {
        if (token.length == 0) {
            bits.put(1, 1);
            if (settings.literalTree) {
                literals.put(bits, token.literal);
            } else {
                bits.put(token.literal, 8);
            }
            continue;
        }
        bits.put(0, 1);
        const std::size_t distance = token.distance - 1;
        bits.put(std::uint32_t(distance & ((1u << lowBits) - 1)), lowBits);
        distances.put(bits, distance >> lowBits);
        const std::size_t length = token.length - minimum;
        lengths.put(bits, std::min<std::size_t>(length, 63));
        if (length >= 63) {
            bits.put(std::uint32_t(length - 63), 8);
        }
    }
    const GWData coded = bits.finish();
    out.insert(out.end(), coded.begin(), coded.end());
    return out;
}

GWData implodeBytes(const GWData& input, const ImplodeSettings& settings) {
    return implodeTokenStream(implodeTokens(input, settings), settings);
}

}  // namespace gwtest
