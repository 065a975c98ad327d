// Mac metadata companions: "__MACOSX/._name" AppleDouble files, resource
// forks under "XtraStuf.mac" / "Re$0urce.Fk", and "…r" / "…d" pairs, attached
// to the entries they describe and gone from the listing.

#include <gtest/gtest.h>

#include "support/TestSupport.h"
#include "support/ZipBuilder.h"
#include "support/ZipExtraFields.h"
#include "zip/GWZipArchive.h"

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

    // A JLEE block marks the fork it belongs to; the loader reads the local one.
    static void markFork(ZipEntry& entry, bool isDataFork) {
        entry.localExtra = zipExtraBlock(0x07C8, jleePayload("TEXT", "ttxt", 0, 0, 0, isDataFork));
        entry.centralExtra = entry.localExtra;
    }

    TemporaryDirectory directory;
};

std::vector<std::string> rootNames(const GWZipArchivePtr& archive) {
    std::vector<std::string> names;
    for (const auto& file : archive->files()) {
        names.push_back(file->name());
    }
    return names;
}

TEST_F(GWZipMetadataPairing, AppleDoubleCompanionsAttachAndLeaveTheListing) {
    ZipBuilder zip;
    zip.addFile("a.txt", bytesOf("hello"));
    zip.addFile("dir/name", bytesOf("nested"));
    zip.addDirectory("__MACOSX/");
    zip.addFile("__MACOSX/._a.txt", GWData(82, 1));
    zip.addDirectory("__MACOSX/dir/");
    zip.addFile("__MACOSX/dir/._name", GWData(120, 2));
    zip.addFile("__MACOSX/notes.txt", bytesOf("no prefix"));
    auto archive = open(zip);
    ASSERT_TRUE(archive);
    EXPECT_EQ(rootNames(archive), (std::vector<std::string>{"a.txt", "dir"}));

    auto a = archive->fileWithPath("a.txt");
    ASSERT_TRUE(a->appleDoubleFile());
    EXPECT_EQ(a->appleDoubleFile()->name(), "._a.txt");
    EXPECT_EQ(a->appleDoubleFile()->storedUncompressedSize(), 82u);
    EXPECT_EQ(a->uncompressedSize(), 5u + 82u);
    EXPECT_FALSE(a->resourceFork());

    auto nested = archive->fileWithPath("dir/name");
    ASSERT_TRUE(nested->appleDoubleFile());
    EXPECT_EQ(nested->appleDoubleFile()->storedUncompressedSize(), 120u);
    EXPECT_FALSE(archive->fileWithPath("__MACOSX"));
}

TEST_F(GWZipMetadataPairing, ACompanionWithoutItsEntryGetsAnEmptyPlaceholder) {
    ZipBuilder zip;
    zip.addFile("__MACOSX/._b", GWData(82, 1));
    zip.addFile("__MACOSX/new/deep/._c", GWData(82, 1));
    auto archive = open(zip);
    ASSERT_TRUE(archive);
    EXPECT_EQ(rootNames(archive), (std::vector<std::string>{"b", "new"}));
    auto b = archive->fileWithPath("b");
    EXPECT_EQ(b->storedUncompressedSize(), 0u);
    EXPECT_EQ(b->permissionsMode(), 0100644);
    EXPECT_TRUE(b->appleDoubleFile());
    EXPECT_FALSE(b->parent());
    auto c = archive->fileWithPath("new/deep/c");
    ASSERT_TRUE(c);
    EXPECT_TRUE(c->appleDoubleFile());
    EXPECT_EQ(c->parent()->permissionsMode(), 040755);
}

TEST_F(GWZipMetadataPairing, OnlyTheFirstRootFolderOfThatNameHoldsCompanions) {
    ZipBuilder zip;
    zip.addFile("x", bytesOf("x"));
    zip.addFile("__MACOSX/._x", GWData(82, 1));
    // An explicit root directory after its contents makes a second root.
    zip.addDirectory("__MACOSX/");
    auto archive = open(zip);
    ASSERT_TRUE(archive);
    EXPECT_EQ(rootNames(archive), (std::vector<std::string>{"x", "__MACOSX"}));
    EXPECT_TRUE(archive->fileWithPath("x")->appleDoubleFile());
    EXPECT_TRUE(archive->files()[1]->isDirectory());
}

TEST_F(GWZipMetadataPairing, ResourceForkFoldersAttachForksByPath) {
    for (const char* folder : {"XtraStuf.mac", "Re$0urce.Fk"}) {
        SCOPED_TRACE(folder);
        ZipBuilder zip;
        zip.addFile("dir/name", bytesOf("data fork"));
        zip.addFile(std::string(folder) + "/dir/name", GWData(300, 3));
        zip.addFile(std::string(folder) + "/lonely", GWData(10, 3));
        zip.addFile("__MACOSX/dir/._name", GWData(82, 2));  // both kinds of companion
        auto archive = open(zip);
        ASSERT_TRUE(archive);
        EXPECT_EQ(rootNames(archive), (std::vector<std::string>{"dir", "lonely"}));
        auto name = archive->fileWithPath("dir/name");
        ASSERT_TRUE(name->resourceFork());
        ASSERT_TRUE(name->appleDoubleFile());
        EXPECT_EQ(name->resourceFork()->storedUncompressedSize(), 300u);
        EXPECT_EQ(name->uncompressedSize(), 9u + 300u + 82u);
        EXPECT_TRUE(archive->fileWithPath("lonely")->resourceFork());
    }
}

TEST_F(GWZipMetadataPairing, ResourceAndDataPairsJoinAtTheRootOnly) {
    ZipBuilder zip;
    markFork(zip.addFile("Iconr", GWData(50, 1)), false);
    markFork(zip.addFile("Icond", GWData(20, 2)), true);
    markFork(zip.addFile("Plainr", GWData(40, 3)), false);
    zip.addFile("Plain", bytesOf("data"));
    markFork(zip.addFile("Lostr", GWData(40, 3)), false);
    markFork(zip.addFile("folder/Iconr", GWData(50, 1)), false);
    markFork(zip.addFile("folder/Icond", GWData(20, 2)), true);
    auto archive = open(zip);
    ASSERT_TRUE(archive);
    EXPECT_EQ(rootNames(archive), (std::vector<std::string>{"Icon", "Plain", "Lostr", "folder"}));
    auto icon = archive->fileWithPath("Icon");
    ASSERT_TRUE(icon->resourceFork());
    EXPECT_EQ(icon->resourceFork()->name(), "Iconr");
    EXPECT_EQ(icon->uncompressedSize(), 70u);
    ASSERT_TRUE(archive->fileWithPath("Plain")->resourceFork());
    EXPECT_FALSE(archive->fileWithPath("Lostr")->resourceFork());
    EXPECT_TRUE(archive->fileWithPath("folder/Iconr"));
    EXPECT_TRUE(archive->fileWithPath("folder/Icond"));
}

TEST_F(GWZipMetadataPairing, MacStyleNamesDecodeBeforeTheyPair) {
    ZipBuilder zip;
    auto add = [&](const GWData& name, std::size_t size) {
        ZipEntry entry;
        entry.name = name;
        entry.host = kZipHostOSX;
        entry.content = GWData(size, 'x');
        zip.add(entry);
    };
    add(GWData{'M', 0x8A, 'r', 'z'}, 3);
    add(concat({bytesOf("__MACOSX/._"), GWData{'M', 0x8A, 'r', 'z'}}), 82);
    auto archive = open(zip);
    ASSERT_TRUE(archive);
    EXPECT_EQ(rootNames(archive), std::vector<std::string>{"M\xC3\xA4rz"});
    EXPECT_TRUE(archive->files()[0]->appleDoubleFile());
}

TEST_F(GWZipMetadataPairing, AHugeMacOSXFolderPairsEveryEntry) {
    ZipBuilder zip;
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
    ASSERT_EQ(files.size(), std::size_t(kCount));
    for (const auto& file : files) {
        ASSERT_TRUE(file->appleDoubleFile()) << file->name();
        EXPECT_EQ(file->appleDoubleFile()->name(), "._" + file->name());
    }
}

TEST_F(GWZipMetadataPairing, DeeplyNestedCompanionsPairWithoutRecursion) {
    std::string path;
    for (int level = 0; level < 30000; ++level) {
        path += "d/";
    }
    ZipBuilder zip;
    zip.addFile(path + "x", bytesOf("deep"));
    zip.addFile("__MACOSX/" + path + "._x", GWData(82, 1));
    auto archive = open(zip);
    ASSERT_TRUE(archive);
    EXPECT_EQ(rootNames(archive), std::vector<std::string>{"d"});
    auto x = archive->fileWithPath(path + "x");
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
