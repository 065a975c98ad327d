#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <span>

#include "GWError.h"
#include "GWValue.h"

class GWRemoteFileHandle;
class GWStreamDecoder;

// Decompressor algorithm numbers.
enum GWDecompressorAlgorithm : int {
    GWDecompressorAlgorithmCopy = 0,
    GWDecompressorAlgorithmDeflate = 1,  // raw or zlib-wrapped
    GWDecompressorAlgorithmBzip2 = 5,
    // Numbered after their ZIP methods.
    GWDecompressorAlgorithmDeflate64 = 9,
    GWDecompressorAlgorithmLZMA = 14,  // ZIP's form, ended by its end marker
    GWDecompressorAlgorithmZstd = 93,
    GWDecompressorAlgorithmXZ = 95,  // or the older .lzma form
};

// A streaming decoder: feed it pieces of a compressed stream, take the bytes
// it gives back, and call again with empty input while it asks to run again.
class GWDecompressor {
public:
    static std::shared_ptr<GWDecompressor> initForStreamingWithAlgorithm(int algorithm,
                                                                         GWErrorPtr* error);
    // ZIP methods 1 and 6, which need the size the entry expands to; the
    // explode flags are bits 1 and 2 of the entry's general-purpose flags.
    static std::shared_ptr<GWDecompressor> initForUnshrinkStreamingWithUncompressedSize(
        std::uint64_t size, GWErrorPtr* error);
    static std::shared_ptr<GWDecompressor> initForExplodeStreamingWithUncompressedSize(
        std::uint64_t size, bool useLargeDictionary, bool useLiteralTree, GWErrorPtr* error);
    // ZIP method 14; without an end marker (flag bit 1) the stream stops at `size`.
    static std::shared_ptr<GWDecompressor> initForLZMAStreamingWithUncompressedSize(
        std::uint64_t size, bool hasEndMarker, GWErrorPtr* error);
    ~GWDecompressor();

    // One step. Returns none with an error for a damaged stream. Sets
    // `shouldRunAgain` while it holds more output; the caller then repeats
    // the call with empty input and the same `isFinal`.
    std::optional<GWData> decompressedDataFromStreamWithInputData(
        std::span<const std::uint8_t> input, bool isFinal, bool* shouldRunAgain, GWErrorPtr* error);

    // The same step without copies: decodes all of `input` (and with
    // `isFinal` the stream's end), handing each decoded piece to `sink` as it
    // comes. A piece lives until the sink returns. False for a damaged stream
    // (with the error) and when the sink stops (without one).
    using PieceSink = std::function<bool(std::span<const std::uint8_t> piece)>;
    bool decompressStreamWithInputData(std::span<const std::uint8_t> input, bool isFinal,
                                       const PieceSink& sink, GWErrorPtr* error);

    // True when the bytes begin a zlib (algorithm 1) or bzip2 (5) stream.
    static bool isDataCompressed(std::span<const std::uint8_t> data, int* algorithm = nullptr);
    // Decodes a whole buffer that isDataCompressed recognised. Output beyond
    // `maxLength` bytes fails, so a hostile stream cannot exhaust memory.
    static std::optional<GWData> decompressedDataFromData(std::span<const std::uint8_t> data,
                                                          GWErrorPtr* error,
                                                          std::uint64_t maxLength = UINT64_MAX);

    // (decoded piece, stored bytes read so far, decoded bytes so far, done,
    // digest of the stored bytes, digest of the decoded bytes, error) -> go on?
    // The digests come with the call that has `done` set.
    using StreamHandler = std::function<bool(
        std::span<const std::uint8_t> piece, std::uint64_t storedBytesRead,
        std::uint64_t decodedBytes, bool done, const std::optional<GWData>& storedDigest,
        const std::optional<GWData>& decodedDigest, const GWErrorPtr& error)>;

    // Reads [offset, offset + length) through the handle, decodes it and
    // digests both sides in one pass. Returns after the handler's last call.
    static void decompressRemoteFileHandle(const std::shared_ptr<GWRemoteFileHandle>& handle,
                                           std::uint64_t offset, std::uint64_t length,
                                           int algorithm, int compressedChecksumAlgorithm,
                                           int decompressedChecksumAlgorithm,
                                           const StreamHandler& handler);

    explicit GWDecompressor(std::unique_ptr<GWStreamDecoder> engine);

private:
    // Input held over from an earlier step followed by `input`.
    std::span<const std::uint8_t> takeInput(std::span<const std::uint8_t> input);
    // Keeps what the engine left of the input for the next step.
    void keepInput(std::span<const std::uint8_t> rest);
    bool fail(const std::string& reason, GWErrorPtr* error);
    // Room for one step's output, at least `size` bytes.
    std::span<std::uint8_t> outputRoom(std::size_t size);

    std::unique_ptr<GWStreamDecoder> engine_;
    GWData pending_;                // input the engine has not consumed yet,
    std::size_t pendingStart_ = 0;  // from this offset on
    // Output of one step before it is handed back; left uninitialised, as
    // the engine writes it before anyone reads it.
    std::unique_ptr<std::uint8_t[]> scratch_;
    std::size_t scratchSize_ = 0;
    bool finished_ = false;
    GWErrorPtr failure_;
};
