// The default deflate decoder (ISA-L) held to zlib's verdict: the same
// streams, made by zlib at several levels and in both wrappings, whole,
// cut short and damaged, must decode to the same bytes or fail alike.
#include <gtest/gtest.h>
#include <zlib.h>

#include "foundation/GWChecksum.h"
#include "foundation/GWDecompressor.h"
#include "foundation/decoders/GWStreamDecoder.h"
#include "support/DecoderTestSupport.h"
#include "support/TestSupport.h"

namespace {

GWData zlibDeflate(const GWData& input, bool wrapped, int level,
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

struct Verdict {
    std::optional<GWData> output;
    GWErrorPtr error;
};

Verdict decodeWith(std::unique_ptr<GWStreamDecoder> engine, const GWData& stream,
                   std::size_t pieceSize) {
    GWDecompressor decompressor(std::move(engine));
    Verdict verdict;
    verdict.output = gwtest::decodeInPieces(decompressor, stream, pieceSize, &verdict.error);
    return verdict;
}

// Both engines on one stream: the same bytes, or the same kind of failure.
void expectSameVerdict(const GWData& stream, std::size_t pieceSize, const std::string& label) {
    const Verdict fast = decodeWith(GWMakeInflateDecoder(), stream, pieceSize);
    const Verdict reference = decodeWith(GWMakeZlibInflateDecoder(), stream, pieceSize);
    ASSERT_EQ(bool(fast.output), bool(reference.output))
        << label << ": zlib says "
        << (reference.error ? reference.error->localizedDescription() : "fine") << ", ISA-L says "
        << (fast.error ? fast.error->localizedDescription() : "fine");
    if (reference.output) {
        EXPECT_TRUE(*fast.output == *reference.output) << label;
    } else {
        ASSERT_TRUE(fast.error && reference.error) << label;
        EXPECT_EQ(fast.error->domain(), reference.error->domain()) << label;
        EXPECT_EQ(fast.error->code(), reference.error->code()) << label;
    }
}

const GWData& mixedInput() {
    static const GWData input = [] {
        GWData data = gwtest::textBytes(700000, 21);
        const GWData noise = gwtest::randomBytes(200000, 22);
        data.insert(data.begin() + 300000, noise.begin(), noise.end());
        return data;
    }();
    return input;
}

}  // namespace

TEST(GWInflateReference, WholeStreamsDecodeAlikeAtEveryLevelAndWrapping) {
    const GWData inputs[] = {mixedInput(), gwtest::randomBytes(70000, 23), GWData{'a'}, GWData{}};
    for (const GWData& input : inputs) {
        for (bool wrapped : {false, true}) {
            // Level 0 writes stored blocks only; 1, 6 and 9 fixed and dynamic Huffman blocks.
            for (int level : {0, 1, 6, 9}) {
                const GWData stream = zlibDeflate(input, wrapped, level);
                for (std::size_t piece : {std::size_t(0), std::size_t(4093), std::size_t(3)}) {
                    if (piece == 3 && stream.size() > 100000) {
                        continue;
                    }
                    const std::string label = std::string(wrapped ? "zlib" : "raw") + " level " +
                                              std::to_string(level) + " size " +
                                              std::to_string(input.size()) + " pieces " +
                                              std::to_string(piece);
                    expectSameVerdict(stream, piece, label);
                    const Verdict fast = decodeWith(GWMakeInflateDecoder(), stream, piece);
                    ASSERT_TRUE(fast.output) << label;
                    EXPECT_TRUE(*fast.output == input) << label;
                }
            }
        }
    }
    // Fixed Huffman codes only, and run-length matches at distance one.
    for (int strategy : {Z_FIXED, Z_RLE, Z_HUFFMAN_ONLY}) {
        expectSameVerdict(zlibDeflate(mixedInput(), false, 6, strategy), 0, "strategy");
    }
}

TEST(GWInflateReference, TruncatedStreamsFailAlikeAtEveryCut) {
    const GWData input = gwtest::textBytes(40000, 24);
    for (bool wrapped : {false, true}) {
        for (int level : {0, 6}) {
            const GWData stream = zlibDeflate(input, wrapped, level);
            for (std::size_t cut = 0; cut < stream.size(); cut += 1 + cut / 8) {
                const GWData truncated(stream.begin(), stream.begin() + std::ptrdiff_t(cut));
                const std::string label = std::string(wrapped ? "zlib" : "raw") + " level " +
                                          std::to_string(level) + " cut at " + std::to_string(cut);
                expectSameVerdict(truncated, 1000, label);
                EXPECT_FALSE(decodeWith(GWMakeInflateDecoder(), truncated, 1000).output) << label;
            }
        }
    }
}

TEST(GWInflateReference, DamagedStreamsFailAlike) {
    const GWData input = mixedInput();
    for (bool wrapped : {false, true}) {
        const GWData stream = zlibDeflate(input, wrapped, 6);
        int failures = 0;
        for (std::size_t at = 0; at < stream.size(); at += stream.size() / 97 + 1) {
            for (std::uint8_t flip : {std::uint8_t(0x01), std::uint8_t(0xA5)}) {
                GWData damaged = stream;
                damaged[at] ^= flip;
                expectSameVerdict(
                    damaged, 65536,
                    std::string(wrapped ? "zlib" : "raw") + " flipped at " + std::to_string(at));
                failures += !decodeWith(GWMakeInflateDecoder(), damaged, 65536).output;
            }
        }
        EXPECT_GT(failures, 0);
    }
    // Not deflate at all, and a zlib header naming another method.
    expectSameVerdict(gwtest::randomBytes(5000, 25), 100, "noise");
    expectSameVerdict(GWData{0x78, 0x9C, 0xFF, 0xFF, 0xFF, 0xFF}, 0, "reserved block type");
}

TEST(GWInflateReference, CRC32MatchesZlibInAnySplit) {
    const GWData data = gwtest::randomBytes(1 << 20, 26);
    for (std::size_t length : {std::size_t(0), std::size_t(1), std::size_t(15), std::size_t(64),
                               std::size_t(1000), data.size()}) {
        const auto span = std::span(data).first(length);
        const uLong expected = crc32_z(0, span.data(), span.size());
        for (std::size_t split : {std::size_t(0), length / 3, length}) {
            auto checksum = GWChecksum::checksumWithAlgorithm(GWChecksumAlgorithmCRC32);
            checksum->update(span.first(split));
            checksum->update(span.subspan(split));
            const GWData digest = checksum->finish();
            ASSERT_EQ(digest.size(), 4u);
            const std::uint32_t value =
                digest[0] | digest[1] << 8 | digest[2] << 16 | std::uint32_t(digest[3]) << 24;
            EXPECT_EQ(value, expected) << "length " << length << " split " << split;
        }
    }
}
