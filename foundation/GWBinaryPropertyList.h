#pragma once

#include <cstddef>
#include <cstdint>
#include <optional>
#include <span>

#include "GWDate.h"
#include "GWError.h"
#include "GWValue.h"

// Code of kGWCocoaErrorDomain for a value the writer cannot represent.
inline constexpr long GWPropertyListWriteInvalidError = 3852;

// Arrays and dictionaries nested deeper than this are refused in both
// directions, which keeps the recursive reader and writer well inside a
// thread's stack.
inline constexpr std::size_t kGWPropertyListMaxDepth = 512;

// The binary property-list format "bplist00" for GWValue trees.
//
// Integers keep their value exactly: negative ones read back signed, those
// above INT64_MAX unsigned (stored in the format's 16-byte form), all others
// signed. Dates are stored as seconds since 2001-01-01 UTC. Text is ASCII or
// UTF-16; bytes that are not UTF-8 are written as U+FFFD.
class GWBinaryPropertyList {
public:
    static bool isBinaryPropertyList(std::span<const std::uint8_t> bytes);

    // Empty, with GWPropertyListWriteInvalidError, when `root` nests deeper
    // than kGWPropertyListMaxDepth.
    static GWData dataWithValue(const GWValue& root, GWErrorPtr* error = nullptr);

    // Reads untrusted bytes. Malformed input gives none and
    // GWFileReadCorruptFileError whose description names the offset.
    static std::optional<GWValue> valueWithData(std::span<const std::uint8_t> bytes,
                                                GWErrorPtr* error = nullptr);

    // The format's clock. Whole seconds convert exactly in both directions,
    // and so does any fraction after about 1985. Before that a double counted
    // from 2001 has coarser steps than one counted from 1970, so a fraction
    // finer than those steps (2^-21 s in 1904) is rounded to the nearest one.
    static double timeIntervalSince2001(const GWDate& date);
    static GWDate dateWithTimeIntervalSince2001(double seconds);
};
