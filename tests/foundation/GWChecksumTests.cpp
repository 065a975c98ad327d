#include <gtest/gtest.h>
#include <zlib.h>

#include "foundation/GWChecksum.h"
#include "support/TestSupport.h"

using gwtest::bytesOf;
using gwtest::hex;

namespace {

std::string digest(const std::string& text, int algorithm) {
    return hex(GWChecksum::checksumForData(bytesOf(text), algorithm));
}

}  // namespace

TEST(GWChecksum, DigestsMatchThePublishedVectors) {
    const std::tuple<int, std::string, const char*> vectors[] = {
        // The CRC-32 of "1234" is 0x9BE3E0A3, laid out least significant byte first.
        {GWChecksumAlgorithmCRC32, "1234", "a3e0e39b"},
        {GWChecksumAlgorithmCRC32, "", "00000000"},
        {GWChecksumAlgorithmMD2, "", "8350e5a3e24c153df2275c9f80692773"},
        {GWChecksumAlgorithmMD2, "abc", "da853b0d3f88d99b30283a69e6ded6bb"},
        {GWChecksumAlgorithmMD2,
         "12345678901234567890123456789012345678901234567890123456789012345678901234567890",
         "d5976f79d83d3a0dc9806c3c66f3efd8"},
        {GWChecksumAlgorithmMD5, "abc", "900150983cd24fb0d6963f7d28e17f72"},
        {GWChecksumAlgorithmSHA1, "abc", "a9993e364706816aba3e25717850c26c9cd0d89d"},
        {GWChecksumAlgorithmSHA224, "abc",
         "23097d223405d8228642a477bda255b32aadbce4bda0b3f7e36c9da7"},
        {GWChecksumAlgorithmSHA256, "abc",
         "ba7816bf8f01cfea414140de5dae2223b00361a396177a9cb410ff61f20015ad"},
        {GWChecksumAlgorithmSHA384, "abc",
         "cb00753f45a35e8bb5a03d699ac65007272c32ab0eded1631a8b605a43ff5bed8086072ba1e7cc2358"
         "baeca134c825a7"},
        {GWChecksumAlgorithmSHA512, "abc",
         "ddaf35a193617abacc417349ae20413112e6fa4e89a97ea20a9eeee64b55d39a2192992a274fc1a83"
         "6ba3c23a3feebbd454d4423643ce80e2a9ac94fa54ca49f"},
    };
    for (const auto& [algorithm, text, expected] : vectors) {
        EXPECT_EQ(digest(text, algorithm), expected) << algorithm << " of \"" << text << "\"";
    }
}

TEST(GWChecksum, StreamingInAnySplitEqualsOneShotAndZlibsCRC) {
    const GWData data = gwtest::randomBytes(100000, 7);
    for (int algorithm : {1, 3, 4, 5, 6, 7, 8, 9}) {
        auto checksum = GWChecksum::checksumWithAlgorithm(algorithm);
        ASSERT_TRUE(checksum);
        for (std::size_t at = 0; at < data.size(); at += 997) {
            checksum->update(
                std::span(data).subspan(at, std::min<std::size_t>(997, data.size() - at)));
        }
        const GWData streamed = checksum->finish();
        EXPECT_EQ(streamed, GWChecksum::checksumForData(data, algorithm)) << algorithm;
        EXPECT_EQ(streamed.size(), GWChecksum::digestLength(algorithm));
    }
    for (std::size_t length : {std::size_t(0), std::size_t(1), std::size_t(15), std::size_t(64),
                               std::size_t(1000), data.size()}) {
        const auto span = std::span(data).first(length);
        for (std::size_t split : {std::size_t(0), length / 3, length}) {
            auto checksum = GWChecksum::checksumWithAlgorithm(GWChecksumAlgorithmCRC32);
            checksum->update(span.first(split));
            checksum->update(span.subspan(split));
            const GWData digest = checksum->finish();
            ASSERT_EQ(digest.size(), 4u);
            EXPECT_EQ(digest[0] | digest[1] << 8 | digest[2] << 16 | std::uint32_t(digest[3]) << 24,
                      crc32_z(0, span.data(), span.size()))
                << "length " << length << " split " << split;
        }
    }
    // Algorithms without a digest give nothing.
    for (int algorithm : {int(GWChecksumAlgorithmNone), int(GWChecksumAlgorithmUnknown), 2}) {
        EXPECT_TRUE(GWChecksum::checksumForData(bytesOf("abc"), algorithm).empty());
    }
    EXPECT_EQ(GWChecksum::checksumWithAlgorithm(GWChecksumAlgorithmNone), nullptr);
}

// A file is read in blocks; its digest is that of its bytes.
TEST(GWChecksum, FileDigestsEqualTheDigestsOfTheirBytes) {
    gwtest::TemporaryDirectory directory;
    const GWData bytes = gwtest::randomBytes(5 * 1024 * 1024 + 17, 42);
    gwtest::writeFile(directory.file("big.bin"), bytes);
    for (int algorithm : {GWChecksumAlgorithmMD5, GWChecksumAlgorithmSHA1,
                          GWChecksumAlgorithmSHA256, GWChecksumAlgorithmSHA512}) {
        GWErrorPtr error;
        auto ours = GWChecksum::checksumAtURL(directory.url("big.bin"), algorithm, &error);
        ASSERT_TRUE(ours) << error->localizedDescription();
        EXPECT_EQ(*ours, GWChecksum::checksumForData(bytes, algorithm)) << algorithm;
    }
    GWErrorPtr error;
    EXPECT_FALSE(
        GWChecksum::checksumAtURL(directory.url("missing"), GWChecksumAlgorithmMD5, &error));
    ASSERT_TRUE(error);
    EXPECT_TRUE(error->is(kGWPOSIXErrorDomain, ENOENT));
}
