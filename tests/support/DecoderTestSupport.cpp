#include "DecoderTestSupport.h"

#include <algorithm>

namespace gwtest {

std::optional<GWData> decodeInPieces(GWDecompressor& decompressor,
                                     std::span<const std::uint8_t> stream, std::size_t pieceSize,
                                     GWErrorPtr* error) {
    if (pieceSize == 0) {
        pieceSize = std::max<std::size_t>(stream.size(), 1);
    }
    GWData output;
    auto step = [&](std::span<const std::uint8_t> input, bool isFinal) {
        bool again = false;
        do {
            auto piece =
                decompressor.decompressedDataFromStreamWithInputData(input, isFinal, &again, error);
            if (!piece) {
                return false;
            }
            output.insert(output.end(), piece->begin(), piece->end());
            input = {};
        } while (again);
        return true;
    };
    for (std::size_t at = 0; at < stream.size(); at += pieceSize) {
        if (!step(stream.subspan(at, std::min(pieceSize, stream.size() - at)), false)) {
            return std::nullopt;
        }
    }
    if (!step({}, true)) {
        return std::nullopt;
    }
    return output;
}

}  // namespace gwtest
