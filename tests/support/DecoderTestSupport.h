#pragma once

#include <optional>
#include <span>

#include "foundation/GWDecompressor.h"

namespace gwtest {

// Feeds `stream` to the decompressor in pieces of `pieceSize` (0: whole),
// calling again with empty input while it asks to, and ends with an empty
// final piece; the concatenated output, or none with the decoder's error.
std::optional<GWData> decodeInPieces(GWDecompressor& decompressor,
                                     std::span<const std::uint8_t> stream, std::size_t pieceSize,
                                     GWErrorPtr* error);

// ZIP method 14's stream (with its end marker) and a zstd frame of `input`.
GWData zipLzmaBytes(const GWData& input);
GWData zstdBytes(const GWData& input);

}  // namespace gwtest
