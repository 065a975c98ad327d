// Local file headers and the decompressor chosen for an entry.

#include <gtest/gtest.h>

#include <cerrno>

#include "GWArchiveSupport/GWArchiveConstants.h"
#include "support/TestSupport.h"
#include "support/ZipBuilder.h"
#include "support/ZipLegacyEncoders.h"
#include "zip/ZipTestSupport.h"

namespace {

using namespace gwtest;

class GWZipLocalHeader : public ::testing::Test {
protected:
    std::shared_ptr<GWZipWorkOperation> operation = std::make_shared<GWZipWorkOperation>();
    GWErrorPtr error;
};

TEST_F(GWZipLocalHeader, ReadsEveryFieldOfABuiltHeader) {
    ZipBuilder zip;
    zip.prefix = GWData(100, 'x');
    ZipEntry& entry = zip.addFile("name.txt", textBytes(5000, 3), 8);
    entry.versionNeeded = 45;
    entry.flags = 0x0802;
    entry.dosTime = zipDOSTime(13, 14, 58);
    entry.dosDate = zipDOSDate(2023, 7, 9);
    entry.localExtra = GWData(12, 0);
    const GWData bytes = zip.bytes();
    const std::uint64_t at = zip.localHeaderOffsets()[0];
    ASSERT_EQ(at, 100u);

    GWZipLocalFileHeader record;
    ASSERT_TRUE(operation->readLocalHeaderRecord(
        &record, std::span(bytes).subspan(at, GWZipLocalFileHeader::kLength), &error));
    EXPECT_EQ(record.signature, 0x04034B50u);
    EXPECT_EQ(record.versionNeeded, 45);
    EXPECT_EQ(record.generalPurposeFlags, 0x0802);
    EXPECT_EQ(record.compressionMethod, 8);
    EXPECT_EQ(record.modificationTime, zipDOSTime(13, 14, 58));
    EXPECT_EQ(record.modificationDate, zipDOSDate(2023, 7, 9));
    EXPECT_EQ(record.crc32, entry.effectiveCRC32());
    EXPECT_EQ(record.compressedSize, entry.storedBytes().size());
    EXPECT_EQ(record.uncompressedSize, 5000u);
    EXPECT_EQ(record.filenameLength, 8);
    EXPECT_EQ(record.extraFieldLength, 12);
}

TEST_F(GWZipLocalHeader, ShortOrForeignHeadersAreCorrupt) {
    ZipBuilder zip;
    zip.addFile("a", bytesOf("x"));
    const GWData bytes = zip.bytes();
    const GWData exact(bytes.begin(), bytes.begin() + 30);
    GWZipLocalFileHeader record;
    EXPECT_TRUE(operation->readLocalHeaderRecord(&record, exact, &error));

    const GWData short29(bytes.begin(), bytes.begin() + 29);
    record.versionNeeded = 77;
    EXPECT_FALSE(operation->readLocalHeaderRecord(&record, short29, &error));
    EXPECT_TRUE(error->is(kGWCocoaErrorDomain, GWFileReadCorruptFileError));
    EXPECT_FALSE(operation->readLocalHeaderRecord(&record, {}, &error));
    EXPECT_TRUE(error->is(kGWCocoaErrorDomain, GWFileReadCorruptFileError));

    for (std::size_t i = 0; i < 4; ++i) {
        GWData foreign = exact;
        foreign[i] ^= 0x20;
        error = nullptr;
        EXPECT_FALSE(operation->readLocalHeaderRecord(&record, foreign, &error));
        ASSERT_NE(error, nullptr);
        EXPECT_TRUE(error->is(kGWCocoaErrorDomain, GWFileReadCorruptFileError));
    }
    // A central directory record is not a local header.
    const GWData central(bytes.begin() + 32, bytes.end());  // after header, "a" and "x"
    EXPECT_FALSE(operation->readLocalHeaderRecord(&record, central, nullptr));
}

// --- Decompressor choice ---------------------------------------------------------------

GWData decodeAll(GWDecompressor& decompressor, const GWData& input, GWErrorPtr* error) {
    GWData output;
    bool again = false;
    auto piece = decompressor.decompressedDataFromStreamWithInputData(input, true, &again, error);
    while (piece) {
        output.insert(output.end(), piece->begin(), piece->end());
        if (!again) {
            break;
        }
        piece = decompressor.decompressedDataFromStreamWithInputData({}, true, &again, error);
    }
    return output;
}

GWZipFilePtr entryFor(std::uint64_t size, std::uint16_t flags) {
    return GWZipFile::initWithName("e", nullptr, 0, size, std::nullopt, 0, 0, 0, 0100644,
                                   std::nullopt, std::nullopt, 0, flags, 0, {});
}

TEST_F(GWZipLocalHeader, StoredDeflatedAndBzip2NeedNoEntry) {
    const GWData original = textBytes(20000, 7);
    for (std::uint16_t method : {0, 8, 12}) {
        auto decompressor = operation->decompressorForFile(nullptr, method, &error);
        ASSERT_NE(decompressor, nullptr) << method;
        EXPECT_EQ(decodeAll(*decompressor, zipCompress(original, method), &error), original)
            << method;
    }
}

TEST_F(GWZipLocalHeader, ShrunkAndImplodedUseTheEntrysSizeAndFlags) {
    const GWData original = textBytes(6000, 11);
    auto shrunkEntry = entryFor(original.size(), 0);
    auto unshrink = operation->decompressorForFile(shrunkEntry, 1, &error);
    ASSERT_NE(unshrink, nullptr);
    EXPECT_EQ(decodeAll(*unshrink, shrinkBytes(original), &error), original);

    for (std::uint16_t flags : {0, 2, 4, 6}) {
        ImplodeSettings settings;
        settings.largeDictionary = flags & 2;
        settings.literalTree = flags & 4;
        auto explode = operation->decompressorForFile(entryFor(original.size(), flags), 6, &error);
        ASSERT_NE(explode, nullptr);
        EXPECT_EQ(decodeAll(*explode, implodeBytes(original, settings), &error), original)
            << "flags " << flags;
    }
}

TEST_F(GWZipLocalHeader, ShrunkAndImplodedWithoutAnEntryAreInvalid) {
    for (std::uint16_t method : {1, 6}) {
        error = nullptr;
        EXPECT_EQ(operation->decompressorForFile(nullptr, method, &error), nullptr);
        ASSERT_NE(error, nullptr);
        EXPECT_TRUE(error->is(kGWPOSIXErrorDomain, EINVAL));
    }
}

TEST_F(GWZipLocalHeader, OtherMethodsAreRefusedWithTheirNumber) {
    ZipLogCapture log;
    for (std::uint16_t method : {2, 3, 4, 5, 7, 98, 99, 0xFFFF}) {
        error = nullptr;
        EXPECT_EQ(operation->decompressorForFile(entryFor(10, 0), method, &error), nullptr)
            << method;
        ASSERT_NE(error, nullptr);
        EXPECT_TRUE(
            error->is(kGWZipArchiveErrorDomain, GWZipArchiveUnsupportedCompressionMethodError));
        const GWValue* entity =
            GWDictionaryValue(error->userInfo(), kGWZipArchiveUnknownEntityErrorKey);
        ASSERT_NE(entity, nullptr);
        EXPECT_EQ(entity->unsignedValue(), method);
        EXPECT_TRUE(log.contains("unsupported compression method: " + std::to_string(method)));
    }
}

}  // namespace
