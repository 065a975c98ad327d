// The ZIP builder writes archives that peer tools accept, so that the
// reader's tests can trust what it builds.

#include <gtest/gtest.h>

#include "support/TestSupport.h"
#include "support/ZipBuilder.h"
#include "support/ZipExtraFields.h"

namespace {

using namespace gwtest;

ZipBuilder varietyArchive() {
    ZipBuilder zip;
    zip.prefix = GWData(1000, 0x90);
    zip.offsetsIncludePrefix = true;  // as a self-extractor's tools write them
    zip.archiveComment = bytesOf("archive comment");
    zip.addDirectory("dir/");
    zip.addFile("dir/stored.txt", textBytes(3000, 1), 0).comment = bytesOf("entry comment");
    zip.addFile("dir/deflated.txt", textBytes(50000, 2), 8);
    zip.addFile("bzip2.bin", randomBytes(7000, 3), 12).host = kZipHostMSDOS;
    ZipEntry& described = zip.addFile("descriptor.txt", textBytes(4000, 4), 8);
    described.dataDescriptor = true;
    ZipEntry& wide = zip.addFile("zip64.txt", textBytes(2000, 5), 8);
    wide.zip64Sizes = true;
    wide.zip64Offset = true;
    zip.addSymlink("link", "dir/stored.txt");
    ZipEntry& extra = zip.addFile("extra.txt", bytesOf("x"));
    extra.centralExtra = zipExtraBlock(0x5455, extendedTimestampPayload(1, {1600000000}));
    extra.localExtra = zipExtraBlock(0x5455, extendedTimestampPayload(3, {1600000000, 1}));
    zip.zip64EndRecord = true;
    return zip;
}

TEST(ZipBuilder, PeerToolsAcceptWhatItWrites) {
    TemporaryDirectory dir;
    const std::string path = dir.file("variety.zip");
    varietyArchive().write(path);
    if (toolAvailable("unzip")) {
        const auto tested = runCommand("unzip -tq " + shellQuote(path) + " 2>&1");
        EXPECT_EQ(tested.status, 0) << tested.output;
    }
    if (toolAvailable("bsdtar")) {
        const auto listed = runCommand("bsdtar -tf " + shellQuote(path) + " 2>&1");
        EXPECT_EQ(listed.status, 0) << listed.output;
        EXPECT_NE(listed.output.find("dir/deflated.txt"), std::string::npos);
        EXPECT_NE(listed.output.find("zip64.txt"), std::string::npos);
    }
}

TEST(ZipBuilder, ItsReaderFindsRecordsAndExtraFields) {
    ZipBuilder zip;
    ZipEntry& entry = zip.addFile("a.txt", textBytes(100, 9), 8);
    entry.host = kZipHostMacintosh;
    entry.externalAttributes = 0x12345678;
    entry.centralExtra = zipExtraBlock(0x7855, {});
    entry.localExtra = zipExtraBlock(0x7855, infoZipUnixPayload(1, 2));
    zip.prefix = GWData(10, 0);
    const auto records = readZipRecords(zip.bytes());
    ASSERT_EQ(records.size(), 1u);
    EXPECT_EQ(records[0].name, "a.txt");
    EXPECT_EQ(records[0].versionMadeBy >> 8, kZipHostMacintosh);
    EXPECT_EQ(records[0].method, 8);
    EXPECT_EQ(records[0].externalAttributes, 0x12345678u);
    EXPECT_EQ(records[0].localHeaderOffset, 0u);  // relative to the archive, after the prefix
    EXPECT_EQ(records[0].centralExtra, entry.centralExtra);
    EXPECT_EQ(records[0].localExtra, entry.localExtra);
    EXPECT_EQ(zip.localHeaderOffsets()[0], 10u);
}

}  // namespace
