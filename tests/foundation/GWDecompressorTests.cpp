#include <bzlib.h>
#include <gtest/gtest.h>
#include <zlib.h>

#include "foundation/GWChecksum.h"
#include "foundation/GWDecompressor.h"
#include "foundation/GWRemoteFileHandle.h"
#include "foundation/decoders/GWStreamDecoder.h"
#include "support/DecoderTestSupport.h"
#include "support/TestSupport.h"
#include "support/XarBuilder.h"

namespace {

GWData zlibDeflate(const GWData& input, bool wrapped, int level = 6,
                   int strategy = Z_DEFAULT_STRATEGY) {
    z_stream stream{};
    deflateInit2(&stream, level, Z_DEFLATED, wrapped ? 15 : -15, 8, strategy);
    GWData output(deflateBound(&stream, input.size()) + 16);
    stream.next_in = const_cast<Bytef*>(input.data());
    stream.avail_in = uInt(input.size());
    stream.next_out = output.data();
    stream.avail_out = uInt(output.size());
    deflate(&stream, Z_FINISH);
    output.resize(stream.total_out);
    deflateEnd(&stream);
    return output;
}

GWData bzip2Bytes(const GWData& input) {
    GWData output(input.size() + input.size() / 100 + 600);
    unsigned int length = unsigned(output.size());
    BZ2_bzBuffToBuffCompress(reinterpret_cast<char*>(output.data()), &length,
                             reinterpret_cast<char*>(const_cast<std::uint8_t*>(input.data())),
                             unsigned(input.size()), 9, 0, 0);
    output.resize(length);
    return output;
}

// No library writes Deflate64; the stream is taken from a ZIP that 7zz makes.
// Empty (the row is skipped) without 7zz.
GWData deflate64Bytes(const GWData& input) {
    gwtest::TemporaryDirectory directory;
    gwtest::writeFile(directory.file("in"), input);
    if (!gwtest::toolAvailable("7zz") ||
        gwtest::runCommand("cd " + gwtest::shellQuote(directory.path()) +
                           " && 7zz a -tzip -mm=Deflate64 out.zip in >/dev/null")
                .status != 0) {
        return {};
    }
    const GWData zip = gwtest::readFile(directory.file("out.zip"));
    if (zip[8] != 9) {
        return {};  // 7zz stores what does not shrink
    }
    auto u32 = [&](std::size_t at) {
        return GWData::size_type(zip[at] | zip[at + 1] << 8 | zip[at + 2] << 16 |
                                 std::uint32_t(zip[at + 3]) << 24);
    };
    const std::size_t start = 30 + (u32(26) & 0xFFFF) + (u32(26) >> 16);
    return GWData(zip.begin() + std::ptrdiff_t(start),
                  zip.begin() + std::ptrdiff_t(start + u32(18)));
}

struct Codec {
    const char* name;
    int algorithm;
    GWData (*encode)(const GWData&);
    std::unique_ptr<GWStreamDecoder> (*engine)() = nullptr;  // instead of the algorithm's
};

std::optional<GWData> decodeInPieces(const Codec& codec, const GWData& stream,
                                     std::size_t pieceSize, GWErrorPtr* error) {
    auto decompressor = codec.engine
                            ? std::make_shared<GWDecompressor>(codec.engine())
                            : GWDecompressor::initForStreamingWithAlgorithm(codec.algorithm, error);
    if (!decompressor) {
        return std::nullopt;
    }
    return gwtest::decodeInPieces(*decompressor, stream, pieceSize, error);
}

const Codec kCodecs[] = {
    {"copy", GWDecompressorAlgorithmCopy, [](const GWData& d) { return d; }},
    {"raw deflate", GWDecompressorAlgorithmDeflate,
     [](const GWData& d) { return zlibDeflate(d, false); }},
    {"zlib", GWDecompressorAlgorithmDeflate, [](const GWData& d) { return zlibDeflate(d, true); }},
    {"bzip2", GWDecompressorAlgorithmBzip2, bzip2Bytes},
    {"deflate on the deflate64 engine", GWDecompressorAlgorithmDeflate64,
     [](const GWData& d) { return zlibDeflate(d, false, 9); },
     [] { return GWMakeDeflate64Decoder(false); }},
    {"deflate64", GWDecompressorAlgorithmDeflate64, deflate64Bytes},
    {"lzma", GWDecompressorAlgorithmLZMA, gwtest::zipLzmaBytes},
    {"xz", GWDecompressorAlgorithmXZ,
     [](const GWData& d) { return gwtest::xarEncode(d, gwtest::XarEncoding::xz); }},
    {"zstd", GWDecompressorAlgorithmZstd, gwtest::zstdBytes},
};

// Text with a stretch of noise: stored, fixed and dynamic blocks alike.
GWData mixedInput() {
    GWData data = gwtest::textBytes(700000, 21);
    const GWData noise = gwtest::randomBytes(200000, 22);
    data.insert(data.begin() + 300000, noise.begin(), noise.end());
    return data;
}

}  // namespace

TEST(GWDecompressor, EveryCodecDecodesPiecesOfAnySize) {
    // Long runs of a 40000-byte block reach Deflate64's far distances and long lengths.
    GWData repeats;
    for (int copies = 0; copies < 6; ++copies) {
        const GWData block = gwtest::randomBytes(40000, 3);
        repeats.insert(repeats.end(), block.begin(), block.end());
    }
    const GWData inputs[] = {gwtest::textBytes(3 * 1024 * 1024 + 5, 1),
                             gwtest::randomBytes(300000, 2), repeats, GWData{'x'}};
    for (const Codec& codec : kCodecs) {
        for (const GWData& input : inputs) {
            const GWData stream = codec.encode(input);
            if (stream.empty()) {
                continue;  // no encoder at hand
            }
            for (std::size_t pieceSize : {std::size_t(1), std::size_t(7), std::size_t(0)}) {
                if (pieceSize == 1 && stream.size() > 400000) {
                    continue;  // byte-at-a-time over megabytes proves nothing more
                }
                GWErrorPtr error;
                auto output = decodeInPieces(codec, stream, pieceSize, &error);
                ASSERT_TRUE(output) << codec.name << ": " << error->localizedDescription();
                EXPECT_TRUE(*output == input) << codec.name << " in pieces of " << pieceSize;
            }
        }
    }
}

TEST(GWDecompressor, DamagedAndTruncatedStreamsAreErrors) {
    const GWData input = gwtest::textBytes(100000, 9);
    for (const Codec& codec : kCodecs) {
        if (codec.algorithm == GWDecompressorAlgorithmCopy) {
            continue;
        }
        const GWData stream = codec.encode(input);
        if (stream.empty()) {
            continue;
        }
        GWErrorPtr error;
        GWData truncated(stream.begin(), stream.begin() + stream.size() / 2);
        EXPECT_FALSE(decodeInPieces(codec, truncated, 0, &error)) << codec.name;
        ASSERT_TRUE(error);
        EXPECT_TRUE(error->is(kGWCocoaErrorDomain, GWFileReadCorruptFileError));

        int failures = 0;
        for (std::size_t at = 0; at < stream.size(); at += stream.size() / 40 + 1) {
            GWData damaged = stream;
            damaged[at] ^= 0x5A;
            GWErrorPtr damageError;
            auto output = decodeInPieces(codec, damaged, 4096, &damageError);
            // A flip may survive decoding; it must never crash or claim more.
            failures += !output;
            EXPECT_TRUE(!output || output->size() < 2 * input.size());
        }
        EXPECT_GT(failures, 0) << codec.name;
    }
    // Unknown algorithms are refused, and an error is final.
    GWErrorPtr error;
    EXPECT_FALSE(GWDecompressor::initForStreamingWithAlgorithm(3, &error));
    EXPECT_TRUE(error->is(kGWPOSIXErrorDomain, EINVAL));
    auto decompressor =
        GWDecompressor::initForStreamingWithAlgorithm(GWDecompressorAlgorithmBzip2, nullptr);
    EXPECT_FALSE(decompressor->decompressedDataFromStreamWithInputData(
        gwtest::bytesOf("BZh9 not really bzip2 data at all"), true, nullptr, &error));
    GWErrorPtr again;
    EXPECT_FALSE(decompressor->decompressedDataFromStreamWithInputData(
        bzip2Bytes(gwtest::bytesOf("fine")), true, nullptr, &again));
    EXPECT_TRUE(again);
}

// The default inflate engine held to zlib's verdict: the same bytes, or the
// same kind of failure, for whole, cut and damaged streams.
TEST(GWDecompressor, InflateAgreesWithZlibOnWholeCutAndDamagedStreams) {
    auto decode = [](std::unique_ptr<GWStreamDecoder> engine, const GWData& stream,
                     std::size_t piece, GWErrorPtr* error) {
        GWDecompressor decompressor(std::move(engine));
        return gwtest::decodeInPieces(decompressor, stream, piece, error);
    };
    // Returns whether the stream decoded.
    auto expectSame = [&](const GWData& stream, std::size_t piece, const std::string& label) {
        GWErrorPtr fastError, zlibError;
        const auto fast = decode(GWMakeInflateDecoder(), stream, piece, &fastError);
        const auto reference = decode(GWMakeZlibInflateDecoder(), stream, piece, &zlibError);
        EXPECT_EQ(bool(fast), bool(reference)) << label;
        if (fast && reference) {
            EXPECT_TRUE(*fast == *reference) << label;
        } else if (!fast && !reference) {
            EXPECT_TRUE(fastError->is(zlibError->domain(), zlibError->code())) << label;
        }
        return bool(fast);
    };
    const GWData mixed = mixedInput();
    for (const GWData& input : {mixed, gwtest::randomBytes(70000, 23), GWData{'a'}, GWData{}}) {
        for (bool wrapped : {false, true}) {
            // Level 0 writes stored blocks only; 1, 6 and 9 fixed and dynamic Huffman blocks.
            for (int level : {0, 1, 6, 9}) {
                const GWData stream = zlibDeflate(input, wrapped, level);
                for (std::size_t piece : {std::size_t(0), std::size_t(4093), std::size_t(3)}) {
                    if (piece != 3 || stream.size() < 100000) {
                        EXPECT_TRUE(expectSame(stream, piece, "whole"));
                    }
                }
            }
        }
    }
    // Fixed Huffman codes only, and run-length matches at distance one.
    for (int strategy : {Z_FIXED, Z_RLE, Z_HUFFMAN_ONLY}) {
        expectSame(zlibDeflate(mixed, false, 6, strategy), 0, "strategy");
    }
    const GWData text = gwtest::textBytes(40000, 24);
    for (bool wrapped : {false, true}) {
        for (int level : {0, 6}) {
            const GWData stream = zlibDeflate(text, wrapped, level);
            for (std::size_t cut = 0; cut < stream.size(); cut += 1 + cut / 8) {
                const GWData truncated(stream.begin(), stream.begin() + std::ptrdiff_t(cut));
                EXPECT_FALSE(expectSame(truncated, 1000, "cut at " + std::to_string(cut)));
            }
        }
        const GWData stream = zlibDeflate(mixed, wrapped, 6);
        int failures = 0;
        for (std::size_t at = 0; at < stream.size(); at += stream.size() / 97 + 1) {
            for (std::uint8_t flip : {std::uint8_t(0x01), std::uint8_t(0xA5)}) {
                GWData damaged = stream;
                damaged[at] ^= flip;
                failures += !expectSame(damaged, 65536, "flipped at " + std::to_string(at));
            }
        }
        EXPECT_GT(failures, 0);
    }
    expectSame(gwtest::randomBytes(5000, 25), 100, "noise");
    expectSame(GWData{0x78, 0x9C, 0xFF, 0xFF, 0xFF, 0xFF}, 0, "reserved block type");
}

TEST(GWDecompressor, BufferedOutputAndSinkStepsDeliverEverythingOnce) {
    const GWData input = mixedInput();
    const GWData stream = zlibDeflate(input, true);
    auto decompressor =
        GWDecompressor::initForStreamingWithAlgorithm(GWDecompressorAlgorithmDeflate, nullptr);
    bool again = false;
    auto first =
        decompressor->decompressedDataFromStreamWithInputData(stream, false, &again, nullptr);
    ASSERT_TRUE(first);
    EXPECT_TRUE(again);
    GWData output = *first;
    int calls = 0;
    while (again) {
        auto more =
            decompressor->decompressedDataFromStreamWithInputData({}, false, &again, nullptr);
        ASSERT_TRUE(more);
        output.insert(output.end(), more->begin(), more->end());
        ++calls;
    }
    EXPECT_GT(calls, 1);
    EXPECT_TRUE(output == input);
    // The stream has ended, so an empty last piece ends it quietly.
    auto last = decompressor->decompressedDataFromStreamWithInputData({}, true, &again, nullptr);
    ASSERT_TRUE(last && last->empty());
    EXPECT_FALSE(again);

    auto sinking =
        GWDecompressor::initForStreamingWithAlgorithm(GWDecompressorAlgorithmDeflate, nullptr);
    output.clear();
    int pieces = 0;
    for (std::size_t at = 0; at < stream.size(); at += 50000) {
        const std::size_t length = std::min<std::size_t>(50000, stream.size() - at);
        ASSERT_TRUE(sinking->decompressStreamWithInputData(
            std::span(stream).subspan(at, length), at + length == stream.size(),
            [&](std::span<const std::uint8_t> piece) {
                EXPECT_FALSE(piece.empty());
                output.insert(output.end(), piece.begin(), piece.end());
                ++pieces;
                return true;
            },
            nullptr));
    }
    EXPECT_TRUE(output == input);
    EXPECT_GT(pieces, 3);

    // A sink that stops ends the step without an error.
    auto stopped =
        GWDecompressor::initForStreamingWithAlgorithm(GWDecompressorAlgorithmDeflate, nullptr);
    GWErrorPtr error;
    EXPECT_FALSE(stopped->decompressStreamWithInputData(
        stream, true, [](std::span<const std::uint8_t>) { return false; }, &error));
    EXPECT_FALSE(error);

    // A cut stream is damaged, and stays so.
    auto cut =
        GWDecompressor::initForStreamingWithAlgorithm(GWDecompressorAlgorithmDeflate, nullptr);
    const GWData half(stream.begin(), stream.begin() + std::ptrdiff_t(stream.size() / 2));
    auto ignore = [](std::span<const std::uint8_t>) { return true; };
    EXPECT_FALSE(cut->decompressStreamWithInputData(half, true, ignore, &error));
    ASSERT_TRUE(error);
    EXPECT_TRUE(error->is(kGWCocoaErrorDomain, GWFileReadCorruptFileError));
    GWErrorPtr after;
    EXPECT_FALSE(cut->decompressStreamWithInputData({}, true, ignore, &after));
    EXPECT_TRUE(after);
}

TEST(GWDecompressor, RecognisesAndDecodesWholeBuffers) {
    const GWData input = gwtest::textBytes(50000, 4);
    const GWData zlib = zlibDeflate(input, true);
    int algorithm = -1;
    EXPECT_TRUE(GWDecompressor::isDataCompressed(zlib, &algorithm));
    EXPECT_EQ(algorithm, GWDecompressorAlgorithmDeflate);
    EXPECT_TRUE(GWDecompressor::isDataCompressed(bzip2Bytes(input), &algorithm));
    EXPECT_EQ(algorithm, GWDecompressorAlgorithmBzip2);
    EXPECT_FALSE(GWDecompressor::isDataCompressed(gwtest::bytesOf("<?xml version"), nullptr));
    EXPECT_FALSE(GWDecompressor::isDataCompressed({}, nullptr));

    auto decoded = GWDecompressor::decompressedDataFromData(zlib, nullptr);
    ASSERT_TRUE(decoded);
    EXPECT_TRUE(*decoded == input);
    GWErrorPtr error;
    EXPECT_FALSE(GWDecompressor::decompressedDataFromData(zlib, &error, input.size() - 1));
    EXPECT_TRUE(error->is(kGWCocoaErrorDomain, GWFileReadCorruptFileError));
    EXPECT_FALSE(GWDecompressor::decompressedDataFromData(gwtest::bytesOf("plain"), &error));
}

TEST(GWDecompressor, FileRangesStreamWithBothDigestsOnOneLastCall) {
    gwtest::TemporaryDirectory directory;
    const GWData input = gwtest::textBytes(1500000, 8);
    const GWData stream = zlibDeflate(input, true);
    GWData file = gwtest::bytesOf("prefix");
    file.insert(file.end(), stream.begin(), stream.end());
    file.insert(file.end(), {'t', 'a', 'i', 'l'});
    gwtest::writeFile(directory.file("heap"), file);
    auto handle = GWRemoteFileHandle::initForReadingFromURL(directory.url("heap"), nullptr);
    struct Row {
        std::uint64_t offset, length;
        int algorithm;
        const GWData& expected;
        std::size_t errors;
        bool refuse = false;
    };
    const GWData empty;
    const Row rows[] = {
        {6, stream.size(), GWDecompressorAlgorithmDeflate, input, 0},
        {0, 0, GWDecompressorAlgorithmDeflate, empty, 0},
        {0, file.size(), GWDecompressorAlgorithmCopy, empty, 0, true},  // the handler stops it
        {file.size() - 100, 5000, GWDecompressorAlgorithmCopy, empty, 1},
        {0, file.size(), GWDecompressorAlgorithmDeflate, empty, 1},
    };
    for (const Row& row : rows) {
        SCOPED_TRACE(row.offset + row.length);
        GWData output;
        int calls = 0, doneCalls = 0;
        std::vector<GWErrorPtr> errors;
        std::optional<GWData> storedDigest, decodedDigest;
        GWDecompressor::decompressRemoteFileHandle(
            handle, row.offset, row.length, row.algorithm, GWChecksumAlgorithmSHA1,
            GWChecksumAlgorithmMD5,
            [&](std::span<const std::uint8_t> piece, std::uint64_t, std::uint64_t, bool done,
                const std::optional<GWData>& stored, const std::optional<GWData>& decoded,
                const GWErrorPtr& error) {
                ++calls;
                EXPECT_EQ(doneCalls, 0) << "no call after the last";
                output.insert(output.end(), piece.begin(), piece.end());
                if (error) {
                    EXPECT_TRUE(done && !stored);
                    errors.push_back(error);
                }
                if (done) {
                    ++doneCalls;
                    storedDigest = stored;
                    decodedDigest = decoded;
                } else {
                    EXPECT_FALSE(stored || decoded);
                }
                return !row.refuse;
            });
        EXPECT_EQ(errors.size(), row.errors);
        if (row.refuse) {
            EXPECT_EQ(calls, 1);
        } else if (row.errors == 0) {
            EXPECT_EQ(doneCalls, 1);
            EXPECT_TRUE(output == row.expected);
            const GWData storedRange(file.begin() + std::ptrdiff_t(row.offset),
                                     file.begin() + std::ptrdiff_t(row.offset + row.length));
            EXPECT_EQ(storedDigest,
                      GWChecksum::checksumForData(storedRange, GWChecksumAlgorithmSHA1));
            EXPECT_EQ(decodedDigest,
                      GWChecksum::checksumForData(row.expected, GWChecksumAlgorithmMD5));
        }
    }
}
