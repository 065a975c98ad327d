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

enum class Wrapping { Raw, Zlib };

GWData deflateBytes(const GWData& input, Wrapping wrapping, int level = 6) {
    z_stream stream{};
    deflateInit2(&stream, level, Z_DEFLATED, wrapping == Wrapping::Raw ? -15 : 15, 8,
                 Z_DEFAULT_STRATEGY);
    GWData output(deflateBound(&stream, input.size()));
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
     [](const GWData& d) { return deflateBytes(d, Wrapping::Raw); }},
    {"zlib", GWDecompressorAlgorithmDeflate,
     [](const GWData& d) { return deflateBytes(d, Wrapping::Zlib); }},
    {"bzip2", GWDecompressorAlgorithmBzip2, bzip2Bytes},
    {"deflate on the deflate64 engine", GWDecompressorAlgorithmDeflate64,
     [](const GWData& d) { return deflateBytes(d, Wrapping::Raw, 9); },
     [] { return GWMakeDeflate64Decoder(false); }},
    {"deflate64", GWDecompressorAlgorithmDeflate64, deflate64Bytes},
    {"lzma", GWDecompressorAlgorithmLZMA, gwtest::zipLzmaBytes},
    {"xz", GWDecompressorAlgorithmXZ,
     [](const GWData& d) { return gwtest::xarEncode(d, gwtest::XarEncoding::xz); }},
    {"zstd", GWDecompressorAlgorithmZstd, gwtest::zstdBytes},
};

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

TEST(GWDecompressor, BufferedOutputAsksToRunAgainUntilDelivered) {
    const GWData input = gwtest::textBytes(2 * 1024 * 1024, 5);
    auto decompressor =
        GWDecompressor::initForStreamingWithAlgorithm(GWDecompressorAlgorithmDeflate, nullptr);
    bool again = false;
    auto first = decompressor->decompressedDataFromStreamWithInputData(
        deflateBytes(input, Wrapping::Raw), false, &again, nullptr);
    ASSERT_TRUE(first);
    EXPECT_TRUE(again);
    EXPECT_LT(first->size(), input.size());
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
    ASSERT_TRUE(last);
    EXPECT_TRUE(last->empty());
    EXPECT_FALSE(again);
}

TEST(GWDecompressor, SinkStepsHandOutEveryPieceAndStopWhenTold) {
    GWData input = gwtest::textBytes(700000, 21);
    const GWData noise = gwtest::randomBytes(200000, 22);
    input.insert(input.begin() + 300000, noise.begin(), noise.end());
    const GWData stream = deflateBytes(input, Wrapping::Zlib);
    auto decompressor =
        GWDecompressor::initForStreamingWithAlgorithm(GWDecompressorAlgorithmDeflate, nullptr);
    GWData output;
    int pieces = 0;
    for (std::size_t at = 0; at < stream.size(); at += 50000) {
        const std::size_t length = std::min<std::size_t>(50000, stream.size() - at);
        const bool last = at + length == stream.size();
        GWErrorPtr error;
        ASSERT_TRUE(decompressor->decompressStreamWithInputData(
            std::span(stream).subspan(at, length), last,
            [&](std::span<const std::uint8_t> piece) {
                EXPECT_FALSE(piece.empty());
                output.insert(output.end(), piece.begin(), piece.end());
                ++pieces;
                return true;
            },
            &error));
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
    GWErrorPtr again;
    EXPECT_FALSE(cut->decompressStreamWithInputData({}, true, ignore, &again));
    EXPECT_TRUE(again);
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
    GWErrorPtr error;
    EXPECT_FALSE(decodeInPieces(kCodecs[1], gwtest::randomBytes(5000, 11), 100, &error));
}

TEST(GWDecompressor, UnknownAlgorithmsAreRefusedAndAnErrorIsFinal) {
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

TEST(GWDecompressor, RecognisesAndDecodesWholeBuffers) {
    const GWData input = gwtest::textBytes(50000, 4);
    int algorithm = -1;
    EXPECT_TRUE(GWDecompressor::isDataCompressed(deflateBytes(input, Wrapping::Zlib), &algorithm));
    EXPECT_EQ(algorithm, GWDecompressorAlgorithmDeflate);
    EXPECT_TRUE(GWDecompressor::isDataCompressed(bzip2Bytes(input), &algorithm));
    EXPECT_EQ(algorithm, GWDecompressorAlgorithmBzip2);
    EXPECT_FALSE(GWDecompressor::isDataCompressed(gwtest::bytesOf("<?xml version"), nullptr));
    EXPECT_FALSE(GWDecompressor::isDataCompressed({}, nullptr));

    auto decoded =
        GWDecompressor::decompressedDataFromData(deflateBytes(input, Wrapping::Zlib), nullptr);
    ASSERT_TRUE(decoded);
    EXPECT_TRUE(*decoded == input);
    GWErrorPtr error;
    EXPECT_FALSE(GWDecompressor::decompressedDataFromData(deflateBytes(input, Wrapping::Zlib),
                                                          &error, input.size() - 1));
    EXPECT_TRUE(error->is(kGWCocoaErrorDomain, GWFileReadCorruptFileError));
    EXPECT_FALSE(GWDecompressor::decompressedDataFromData(gwtest::bytesOf("plain"), &error));
}

TEST(GWDecompressor, FileRangesStreamWithBothDigestsOnTheLastCall) {
    gwtest::TemporaryDirectory directory;
    const GWData input = gwtest::textBytes(1500000, 8);
    const GWData stream = deflateBytes(input, Wrapping::Zlib);
    GWData file = gwtest::bytesOf("prefix");
    file.insert(file.end(), stream.begin(), stream.end());
    file.insert(file.end(), {'t', 'a', 'i', 'l'});
    gwtest::writeFile(directory.file("heap"), file);
    auto handle = GWRemoteFileHandle::initForReadingFromURL(directory.url("heap"), nullptr);

    GWData output;
    int doneCalls = 0;
    std::optional<GWData> storedDigest, decodedDigest;
    GWDecompressor::decompressRemoteFileHandle(
        handle, 6, stream.size(), GWDecompressorAlgorithmDeflate, GWChecksumAlgorithmSHA1,
        GWChecksumAlgorithmMD5,
        [&](std::span<const std::uint8_t> piece, std::uint64_t, std::uint64_t, bool done,
            const std::optional<GWData>& stored, const std::optional<GWData>& decoded,
            const GWErrorPtr& error) {
            EXPECT_FALSE(error);
            EXPECT_EQ(doneCalls, 0) << "no call after the last";
            output.insert(output.end(), piece.begin(), piece.end());
            if (done) {
                ++doneCalls;
                storedDigest = stored;
                decodedDigest = decoded;
            } else {
                EXPECT_FALSE(stored || decoded);
            }
            return true;
        });
    EXPECT_EQ(doneCalls, 1);
    EXPECT_TRUE(output == input);
    EXPECT_EQ(storedDigest, GWChecksum::checksumForData(stream, GWChecksumAlgorithmSHA1));
    EXPECT_EQ(decodedDigest, GWChecksum::checksumForData(input, GWChecksumAlgorithmMD5));
}

TEST(GWDecompressor, FileRangeStreamsStopOnRefusalAndReportErrorsOnce) {
    gwtest::TemporaryDirectory directory;
    gwtest::writeFile(directory.file("f"), gwtest::randomBytes(3000000, 1));
    auto handle = GWRemoteFileHandle::initForReadingFromURL(directory.url("f"), nullptr);
    int calls = 0;
    GWDecompressor::decompressRemoteFileHandle(
        handle, 0, 3000000, GWDecompressorAlgorithmCopy, 0, 0,
        [&](auto, auto, auto, bool, const auto&, const auto&, const GWErrorPtr&) {
            ++calls;
            return false;
        });
    EXPECT_EQ(calls, 1);

    // Past the end of the file, and a damaged stream: one call, with the error.
    for (int algorithm : {GWDecompressorAlgorithmCopy, GWDecompressorAlgorithmDeflate}) {
        std::vector<GWErrorPtr> errors;
        GWDecompressor::decompressRemoteFileHandle(
            handle, algorithm == 0 ? 2999000 : 0, algorithm == 0 ? 5000 : 3000000, algorithm, 1, 1,
            [&](auto, auto, auto, bool done, const auto& stored, const auto&,
                const GWErrorPtr& error) {
                if (error) {
                    EXPECT_TRUE(done);
                    EXPECT_FALSE(stored);
                    errors.push_back(error);
                }
                return true;
            });
        EXPECT_EQ(errors.size(), 1u) << algorithm;
    }
}

TEST(GWDecompressor, AnEmptyRangeIsOneDoneCallWithDigestsOfNothing) {
    gwtest::TemporaryDirectory directory;
    gwtest::writeFile(directory.file("f"), gwtest::bytesOf("x"));
    auto handle = GWRemoteFileHandle::initForReadingFromURL(directory.url("f"), nullptr);
    int calls = 0;
    GWDecompressor::decompressRemoteFileHandle(
        handle, 0, 0, GWDecompressorAlgorithmDeflate, GWChecksumAlgorithmSHA1, 0,
        [&](std::span<const std::uint8_t> piece, auto, auto, bool done, const auto& stored,
            const auto& decoded, const GWErrorPtr& error) {
            ++calls;
            EXPECT_TRUE(piece.empty() && done && !error && !decoded);
            EXPECT_EQ(stored, GWChecksum::checksumForData({}, GWChecksumAlgorithmSHA1));
            return true;
        });
    EXPECT_EQ(calls, 1);
}
