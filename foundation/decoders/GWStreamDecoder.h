#pragma once

#include <cstddef>
#include <cstdint>
#include <memory>
#include <span>
#include <string>

// One decoding engine behind GWDecompressor. The decompressor owns the
// buffering and the run-again protocol; an engine only turns input into output.
class GWStreamDecoder {
public:
    struct Step {
        std::size_t consumed = 0;  // input bytes used
        std::size_t produced = 0;  // output bytes written
        bool finished = false;     // the stream ended and all its output was written
        bool failed = false;       // damaged input; `error` says how
        std::string error;
    };

    virtual ~GWStreamDecoder() = default;

    // Decodes as much of `input` as fits into `output`. It must make progress
    // when it has input (or output it holds back) and room to write. With
    // `isFinal` no more input follows, so an engine that cannot end its stream
    // with what it has may fail. Input it did not consume is offered again.
    virtual Step decode(std::span<const std::uint8_t> input, std::span<std::uint8_t> output,
                        bool isFinal) = 0;
};

// True when the first two bytes form a zlib header (deflate method, a window
// of at most 32 KiB, no preset dictionary, valid check bits). A raw deflate
// stream can begin like this only with a stored block whose padding bits are
// set, which no encoder writes.
inline bool GWLooksLikeZlibHeader(std::uint8_t cmf, std::uint8_t flg) {
    return (cmf & 0x0F) == 8 && (cmf >> 4) <= 7 && (flg & 0x20) == 0 &&
           ((unsigned(cmf) << 8) | flg) % 31 == 0;
}

std::unique_ptr<GWStreamDecoder> GWMakeCopyDecoder();
// Raw deflate, or the zlib-wrapped form when the stream begins with a zlib
// header. The default runs on ISA-L; the zlib one is the reference it is
// tested against.
std::unique_ptr<GWStreamDecoder> GWMakeInflateDecoder();
std::unique_ptr<GWStreamDecoder> GWMakeZlibInflateDecoder();
std::unique_ptr<GWStreamDecoder> GWMakeBzip2Decoder();
// ZIP method 1 (shrink) and method 6 (implode). Neither stream marks its end,
// so both stop after `uncompressedSize` bytes.
std::unique_ptr<GWStreamDecoder> GWMakeUnshrinkDecoder(std::uint64_t uncompressedSize);
std::unique_ptr<GWStreamDecoder> GWMakeExplodeDecoder(std::uint64_t uncompressedSize,
                                                      bool useLargeDictionary, bool useLiteralTree);
// Deflate64 (ZIP method 9); with `deflate64` false the same engine reads
// plain raw deflate, which lets it be checked against zlib.
std::unique_ptr<GWStreamDecoder> GWMakeDeflate64Decoder(bool deflate64 = true);
// xz, or the older .lzma form (ZIP method 95; XAR's x-xz and x-lzma).
std::unique_ptr<GWStreamDecoder> GWMakeXzDecoder();
// ZIP method 14: raw LZMA behind a 9-byte header. Without an end marker
// (general-purpose bit 1) the stream ends after `uncompressedSize` bytes.
std::unique_ptr<GWStreamDecoder> GWMakeZipLzmaDecoder(std::uint64_t uncompressedSize,
                                                      bool hasEndMarker);
std::unique_ptr<GWStreamDecoder> GWMakeZstdDecoder();
