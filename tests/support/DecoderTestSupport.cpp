#include "DecoderTestSupport.h"

#include <lzma.h>
#include <zstd.h>

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

// ZIP's LZMA form: version, properties size and properties, then raw LZMA
// ended by its marker.
GWData zipLzmaBytes(const GWData& input) {
    lzma_options_lzma options;
    lzma_lzma_preset(&options, 6);
    const lzma_filter filters[] = {{LZMA_FILTER_LZMA1, &options}, {LZMA_VLI_UNKNOWN, nullptr}};
    GWData output(9 + input.size() + input.size() / 2 + 1024);
    output[0] = 9, output[1] = 20, output[2] = 5;
    lzma_properties_encode(filters, output.data() + 4);
    std::size_t length = 9;
    lzma_raw_buffer_encode(filters, nullptr, input.data(), input.size(), output.data(), &length,
                           output.size());
    output.resize(length);
    return output;
}

GWData zstdBytes(const GWData& input) {
    GWData output(ZSTD_compressBound(input.size()));
    output.resize(ZSTD_compress(output.data(), output.size(), input.data(), input.size(), 3));
    return output;
}

}  // namespace gwtest
