// Keyed persistence and copying of opened ZIP archives.

#include <gtest/gtest.h>

#include "support/CoderTestSupport.h"
#include "support/TestSupport.h"
#include "support/ZipBuilder.h"
#include "zip/GWZipArchive.h"

namespace {

using namespace gwtest;

class GWZipArchiveCoding : public ::testing::Test {
protected:
    void SetUp() override {
        ZipBuilder zip;
        zip.prefix = GWData(300, 'S');
        zip.addFile("a.txt", bytesOf("alpha"));
        zip.addFile("dir/b.txt", bytesOf("beta"));
        zip.addFile("__MACOSX/dir/._b.txt", GWData(82, 1));
        zip.write(directory.file("coded.zip"));
        GWErrorPtr error;
        archive = GWZipArchive::initWithURL(directory.url("coded.zip"), &error);
        ASSERT_TRUE(archive);
        archive->setCompressedSize(77);
    }

    static void expectSameTree(const GWZipArchivePtr& restored, const GWZipArchivePtr& original) {
        EXPECT_EQ(restored->startOffset(), 300u);
        ASSERT_TRUE(restored->ref());
        EXPECT_EQ(*restored->ref(), *original->ref());
        EXPECT_EQ(restored->URL(), original->URL());
        EXPECT_EQ(restored->compressedSize(), 0u);
        ASSERT_EQ(restored->files().size(), 2u);
        auto b = restored->fileWithPath("dir/b.txt");
        ASSERT_TRUE(b);
        EXPECT_NE(b, original->fileWithPath("dir/b.txt"));
        EXPECT_EQ(b->parent(), restored->fileWithPath("dir"));
        EXPECT_FALSE(restored->fileWithPath("dir")->parent());
        ASSERT_TRUE(b->appleDoubleFile());
        EXPECT_EQ(b->appleDoubleFile()->storedUncompressedSize(), 82u);
        EXPECT_EQ(b->localHeaderOffset(), original->fileWithPath("dir/b.txt")->localHeaderOffset());
    }

    TemporaryDirectory directory;
    GWZipArchivePtr archive;
};

TEST_F(GWZipArchiveCoding, WritesItsThreeKeys) {
    RecordingCoder coder(true);
    archive->encodeWithCoder(coder);
    EXPECT_EQ(coder.keys, (std::vector<std::string>{"GWRef", "Files", "StartOffset"}));
    EXPECT_EQ(coder.values["StartOffset"].unsignedValue(), 300u);
}

TEST_F(GWZipArchiveCoding, NonKeyedCodersGetNothing) {
    WriteCountingCoder coder;
    archive->encodeWithCoder(coder);
    EXPECT_EQ(coder.writes, 0);
}

TEST_F(GWZipArchiveCoding, KeyedRoundTripRestoresTheTree) {
    GWErrorPtr error;
    const GWData data = GWKeyedArchiver::archivedDataWithRootObject(*archive, &error);
    ASSERT_FALSE(data.empty()) << error->localizedDescription();
    auto restored = GWKeyedUnarchiver::unarchiveObjectWithData<GWZipArchive>(data, &error);
    ASSERT_TRUE(restored) << error->localizedDescription();
    expectSameTree(restored, archive);
}

TEST_F(GWZipArchiveCoding, CopiesAreDeep) {
    auto copy = archive->copy();
    ASSERT_TRUE(copy);
    expectSameTree(copy, archive);
    EXPECT_NE(copy->ref(), archive->ref());
    copy->files()[0]->setName("renamed");
    EXPECT_EQ(archive->files()[0]->name(), "a.txt");
}

}  // namespace
