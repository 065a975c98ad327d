// The streaming decoders behind ZIP and XAR entries, fed a stream in pieces.
// The first byte picks the decoder (and the explode flags), the next two the
// expanded size of the methods that need one, the fourth the piece length.

#include <algorithm>
#include <cstddef>
#include <cstdint>

#include "FuzzSupport.h"
#include "foundation/GWDecompressor.h"
#include "foundation/decoders/GWStreamDecoder.h"

namespace {

constexpr std::size_t kHeaderLength = 4;
// Past this a bomb only costs time.
constexpr std::uint64_t kMaxOutput = 8 * 1024 * 1024;

std::shared_ptr<GWDecompressor> decompressor(std::uint8_t kind, std::uint64_t size) {
    GWErrorPtr error;
    switch ((kind & 0x0F) % 10) {
        case 0:
            return GWDecompressor::initForStreamingWithAlgorithm(GWDecompressorAlgorithmDeflate,
                                                                 &error);
        case 1:
            return GWDecompressor::initForStreamingWithAlgorithm(GWDecompressorAlgorithmBzip2,
                                                                 &error);
        case 2: return GWDecompressor::initForUnshrinkStreamingWithUncompressedSize(size, &error);
        case 3:
            return GWDecompressor::initForExplodeStreamingWithUncompressedSize(
                size, (kind & 0x10) != 0, (kind & 0x20) != 0, &error);
        case 4:
            return GWDecompressor::initForStreamingWithAlgorithm(GWDecompressorAlgorithmDeflate64,
                                                                 &error);
        case 5: return std::make_shared<GWDecompressor>(GWMakeDeflate64Decoder(false));
        case 6:
            return GWDecompressor::initForStreamingWithAlgorithm(GWDecompressorAlgorithmLZMA,
                                                                 &error);
        case 7:
            return GWDecompressor::initForLZMAStreamingWithUncompressedSize(size, false, &error);
        case 8:
            return GWDecompressor::initForStreamingWithAlgorithm(GWDecompressorAlgorithmZstd,
                                                                 &error);
        default:
            return GWDecompressor::initForStreamingWithAlgorithm(GWDecompressorAlgorithmXZ, &error);
    }
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    static const bool ready = (gwfuzz::silenceLog(), true);
    (void)ready;
    if (size < kHeaderLength) {
        return 0;
    }
    const std::uint64_t expanded = (std::uint64_t(data[1]) << 8 | data[2]) * 64;
    const std::size_t pieceLength = std::size_t(data[3]) + 1;
    auto engine = decompressor(data[0], expanded);
    if (!engine) {
        return 0;
    }
    std::span<const std::uint8_t> rest(data + kHeaderLength, size - kHeaderLength);
    std::uint64_t produced = 0;
    do {
        const auto piece = rest.first(std::min(pieceLength, rest.size()));
        rest = rest.subspan(piece.size());
        const bool isFinal = rest.empty();
        bool again = false;
        GWErrorPtr error;
        auto out = engine->decompressedDataFromStreamWithInputData(piece, isFinal, &again, &error);
        while (out && again && produced < kMaxOutput) {
            produced += out->size();
            out = engine->decompressedDataFromStreamWithInputData({}, isFinal, &again, &error);
        }
        if (!out || produced >= kMaxOutput) {
            break;
        }
        produced += out->size();
    } while (!rest.empty());
    return 0;
}
