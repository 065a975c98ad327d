// Mac metadata companions: "__MACOSX/._name" AppleDouble files, resource
// forks under "XtraStuf.mac" / "Re$0urce.Fk", and "…r" / "…d" pairs, attached
// to the entries they describe and gone from the listing.

#include <gtest/gtest.h>

#include "support/TestSupport.h"
#include "support/ZipBuilder.h"
#include "support/ZipExtraFields.h"
#include "zip/GWZipArchive.h"
#include "zip/ZipTestSupport.h"

namespace {

using namespace gwtest;

class GWZipMetadataPairing : public ::testing::Test {
protected:
    GWZipArchivePtr open(const ZipBuilder& zip) {
        zip.write(directory.file("mac.zip"));
        GWErrorPtr error;
        auto archive = GWZipArchive::initWithURL(directory.url("mac.zip"), &error);
        EXPECT_TRUE(archive) << (error ? error->localizedDescription() : "");
        return archive;
    }

    TemporaryDirectory directory;
};

// A JLEE block marks the fork an entry holds; the loader reads the local one.
ZipEntry& markFork(ZipEntry& entry, bool isDataFork) {
    entry.localExtra = zipExtraBlock(0x07C8, jleePayload("TEXT", "ttxt", 0, 0, 0, isDataFork));
    entry.centralExtra = entry.localExtra;
    return entry;
}

// Companions leave the listing, "__MACOSX" files without "._" included; one
// without its entry gets an empty placeholder (and implicit folders). Only
// the first root folder of that name holds companions. "…r" / "…d" pairs
// join at the root only, and Mac names decode before they pair.
TEST_F(GWZipMetadataPairing, CompanionsAttachToTheEntriesTheyDescribe) {
    const std::pair<ZipBuilder, std::string> rows[] = {
        {zipOfNames({"a.txt", "dir/name", "__MACOSX/", "__MACOSX/._a.txt", "__MACOSX/dir/",
                     "__MACOSX/dir/._name", "__MACOSX/notes.txt"}),
         "a.txt[._a.txt] dir/755(name[._name])"},
        {zipOfNames({"__MACOSX/._b", "__MACOSX/new/deep/._c"}), "b[._b] new/755(deep/755(c[._c]))"},
        {zipOfNames({"x", "__MACOSX/._x", "__MACOSX/"}), "x[._x] __MACOSX/700"},
        {zipOfNames(
             {"dir/name", "XtraStuf.mac/dir/name", "XtraStuf.mac/lonely", "__MACOSX/dir/._name"}),
         "dir/755(name[._name]{name}) lonely{lonely}"},
        {zipOfNames({"Re$0urce.Fk/dir/name", "dir/name"}), "dir/755(name{name})"},
        {[] {
             ZipBuilder zip;
             markFork(zip.addFile("Iconr", GWData(50, 1)), false);
             markFork(zip.addFile("Icond", GWData(20, 2)), true);
             markFork(zip.addFile("Plainr", GWData(40, 3)), false);
             zip.addFile("Plain", bytesOf("data"));
             markFork(zip.addFile("Lostr", GWData(40, 3)), false);
             markFork(zip.addFile("folder/Iconr", GWData(50, 1)), false);
             markFork(zip.addFile("folder/Icond", GWData(20, 2)), true);
             return zip;
         }(),
         "Icon{Iconr} Plain{Plainr} Lostr folder/755(Iconr Icond)"},
        {[] {
             ZipBuilder zip;
             for (const GWData& name : {GWData{'M', 0x8A, 'r', 'z'},
                                        concat({bytesOf("__MACOSX/._"), {'M', 0x8A, 'r', 'z'}})}) {
                 ZipEntry entry;
                 entry.name = name;
                 entry.host = kZipHostOSX;
                 zip.add(entry);
             }
             return zip;
         }(),
         "M\xC3\xA4rz[._M\xC3\xA4rz]"},
    };
    for (const auto& [zip, expected] : rows) {
        auto archive = open(zip);
        ASSERT_TRUE(archive);
        EXPECT_EQ(zipTreeShape(archive->files()), expected);
    }
    // The companions' sizes count in the entry's.
    auto archive = open(rows[3].first);
    EXPECT_EQ(archive->fileWithPath("dir/name")->uncompressedSize(), 3u * bytesOf("x").size());
}

// Pairing is a pass over an index, not a scan per entry nor a recursion per level.
TEST_F(GWZipMetadataPairing, ManyAndDeeplyNestedCompanionsAllPair) {
    std::string deep;
    for (int level = 0; level < 30000; ++level) {
        deep += "d/";
    }
    ZipBuilder zip;
    zip.addFile(deep + "x", bytesOf("deep"));
    zip.addFile("__MACOSX/" + deep + "._x", GWData(82, 1));
    constexpr int kCount = 20000;
    for (int i = 0; i < kCount; ++i) {
        zip.addFile("f" + std::to_string(i), bytesOf("x"));
    }
    for (int i = 0; i < kCount; ++i) {
        zip.addFile("__MACOSX/._f" + std::to_string(i), GWData(2, 0));
    }
    auto archive = open(zip);
    ASSERT_TRUE(archive);
    const auto files = archive->files();
    ASSERT_EQ(files.size(), std::size_t(kCount) + 1);
    for (std::size_t i = 1; i < files.size(); ++i) {
        ASSERT_TRUE(files[i]->appleDoubleFile()) << files[i]->name();
        EXPECT_EQ(files[i]->appleDoubleFile()->name(), "._" + files[i]->name());
    }
    auto x = archive->fileWithPath(deep + "x");
    ASSERT_TRUE(x);
    EXPECT_TRUE(x->appleDoubleFile());
}

TEST_F(GWZipMetadataPairing, CancellationStopsThePairing) {
    auto operation = GWZipLoadOperation::initWithURL(directory.url("unused.zip"));
    auto folder = GWZipFile::initWithName("__MACOSX", nullptr, 0, 0, std::nullopt, 0, 0, 0, 040755,
                                          std::nullopt, std::nullopt, 0, 0, 0, {});
    auto companion = GWZipFile::initWithName("._a", folder, 0, 0, std::nullopt, 0, 0, 0, 0100644,
                                             std::nullopt, std::nullopt, 0, 0, 0, {});
    folder->addChild(companion);
    GWZipFileArray roots{folder};
    operation->cancel();
    GWErrorPtr error;
    EXPECT_FALSE(operation->setUpMetadataItemsForFiles(roots, &error));
    ASSERT_TRUE(error);
    EXPECT_TRUE(error->is(kGWCocoaErrorDomain, GWUserCancelledError));
}

}  // namespace
