#pragma once

#include <cstddef>
#include <cstdint>
#include <vector>

#include "foundation/GWValue.h"

// Encoders for the two legacy ZIP methods that no installed tool writes:
// shrink (method 1) and implode (method 6). They aim at valid streams that
// exercise every path of a decoder, not at good compression.
namespace gwtest {

struct ShrinkOptions {
    // Code size (9 to 13) at which a full table is partially cleared rather
    // than grown; small sizes give short inputs partial clears too.
    unsigned clearingCodeSize = 13;
};

struct ShrinkStats {
    int partialClears = 0;
    unsigned largestCodeSize = 9;
};

GWData shrinkBytes(const GWData& input, const ShrinkOptions& options = {},
                   ShrinkStats* stats = nullptr);

struct ImplodeSettings {
    bool largeDictionary = false;  // 8 KiB instead of 4 KiB; general-purpose flag bit 1
    bool literalTree = false;      // literals Shannon-Fano coded; flag bit 2
    std::uint16_t flags() const { return (largeDictionary ? 2 : 0) | (literalTree ? 4 : 0); }
    std::size_t dictionarySize() const { return largeDictionary ? 8192 : 4096; }
    std::size_t minimumMatch() const { return literalTree ? 3 : 2; }
    std::size_t longestMatch() const { return minimumMatch() + 63 + 255; }
};

// A literal (length 0) or a copy of `length` bytes from `distance` back.
struct ImplodeToken {
    std::uint8_t literal = 0;
    std::size_t length = 0;
    std::size_t distance = 0;
};

// Greedy longest matches within the dictionary.
std::vector<ImplodeToken> implodeTokens(const GWData& input, const ImplodeSettings& settings);
// The code tables and the coded tokens. Tokens may reach before the start.
GWData implodeTokenStream(const std::vector<ImplodeToken>& tokens, const ImplodeSettings& settings);
GWData implodeBytes(const GWData& input, const ImplodeSettings& settings);

}  // namespace gwtest
