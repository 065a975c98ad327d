#include <gtest/gtest.h>
#include <unistd.h>

#include "zip/GWZipFile.h"

namespace {

const GWDate kCentralDate(1600000000);

GWZipFilePtr makeFile(const std::string& name, const GWZipFilePtr& parent = nullptr,
                      std::uint16_t mode = 0100644, GWDictionary extraInfo = {},
                      std::uint64_t size = 10) {
    return GWZipFile::initWithName(name, parent, size / 2, size, GWData{1, 2, 3, 4}, 1, 501, 20,
                                   mode, kCentralDate, std::nullopt, 0, 0, 8, std::move(extraInfo));
}

GWZipFilePtr makeDirectory(const std::string& name, const GWZipFilePtr& parent = nullptr) {
    return makeFile(name, parent, 040755, {}, 0);
}

// A child added the way the loader adds one: parent link, then addChild.
GWZipFilePtr addFile(const GWZipFilePtr& parent, const std::string& name,
                     std::uint16_t mode = 0100644) {
    auto file = makeFile(name, parent, mode);
    parent->addChild(file);
    return file;
}

std::vector<std::string> childNames(const GWZipFilePtr& directory) {
    std::vector<std::string> names;
    if (auto children = directory->children()) {
        for (const auto& child : *children) {
            names.push_back(child->name());
        }
    }
    return names;
}

using Components = std::vector<std::string>;

// --- Paths and lookup -------------------------------------------------------------

TEST(GWZipFileTree, StandardizesPathComponents) {
    EXPECT_EQ(GWZipFile::standardizedComponentsForPath("a//b/./c/"), (Components{"a", "b", "c"}));
    EXPECT_EQ(GWZipFile::standardizedComponentsForPath("/abs/x"), (Components{"abs", "x"}));
    EXPECT_EQ(GWZipFile::standardizedComponentsForPath("a/../b"), (Components{"b"}));
    EXPECT_EQ(GWZipFile::standardizedComponentsForPath("../a"), (Components{"a"}));
    EXPECT_EQ(GWZipFile::standardizedComponentsForPath("a/b/../../../c"), (Components{"c"}));
    EXPECT_EQ(GWZipFile::standardizedComponentsForPath("..."), (Components{"..."}));
    for (const char* empty : {"", "/", ".", "..", "/./../", "//"}) {
        EXPECT_TRUE(GWZipFile::standardizedComponentsForPath(empty).empty()) << empty;
    }
}

TEST(GWZipFileTree, PathOfOnlySeparatorsFindsAndCreatesNothing) {
    GWZipFileArray roots;
    for (const char* path : {"/", ".", "..", "./..//"}) {
        EXPECT_EQ(GWZipFile::fileWithPath(path, roots, true), nullptr) << path;
    }
    EXPECT_TRUE(roots.empty());
}

TEST(GWZipFileTree, CreatesImplicitDirectoriesAlongThePath) {
    GWZipFileArray roots;
    const GWDate before = GWDate::now();
    auto c = GWZipFile::fileWithPath("a/b/c", roots, true);
    ASSERT_NE(c, nullptr);
    ASSERT_EQ(roots.size(), 1u);
    auto a = roots[0];
    auto b = a->childNamed("b");
    ASSERT_NE(b, nullptr);
    EXPECT_EQ(b->childNamed("c"), c);
    EXPECT_EQ(c->parent(), b);
    EXPECT_EQ(b->parent(), a);
    EXPECT_EQ(a->parent(), nullptr);
    EXPECT_EQ(c->path(), "a/b/c");
    for (const auto& made : {a, b, c}) {
        EXPECT_EQ(made->permissionsMode(), 040755);
        EXPECT_TRUE(made->isDirectory());
        EXPECT_EQ(made->owner(), getuid());
        EXPECT_EQ(made->groupOwner(), getgid());
        ASSERT_TRUE(made->storedModificationDate());
        EXPECT_GE(*made->storedModificationDate(), before);
        EXPECT_LE(*made->storedModificationDate(), GWDate::now());
        EXPECT_FALSE(made->privateUncompressedChecksum());
        EXPECT_EQ(made->privateUncompressedChecksumAlgorithm(), 0u);
        EXPECT_EQ(made->compressedSize(), 0u);
        EXPECT_EQ(made->uncompressedSize(), 0u);
        EXPECT_EQ(made->localHeaderOffset(), 0u);
        EXPECT_TRUE(made->extraInfo().empty());
    }
    // The same path again finds the same nodes and adds nothing.
    EXPECT_EQ(GWZipFile::fileWithPath("a/./b/c/", roots, true), c);
    EXPECT_EQ(roots.size(), 1u);
    EXPECT_EQ(childNames(a), (std::vector<std::string>{"b"}));
    // Without creation a missing path stays missing.
    EXPECT_EQ(GWZipFile::fileWithPath("a/b/x/y", roots, false), nullptr);
    EXPECT_EQ(b->children()->size(), 1u);
}

TEST(GWZipFileTree, CreationBelowAGivenParentGoesIntoThatParent) {
    GWZipFileArray roots{makeDirectory("top")};
    GWZipFileArray lookIn;  // empty: nothing is found, so "d" is made in "top"
    auto made = GWZipFile::fileWithPathComponents({"d", "e"}, roots[0], lookIn, true);
    ASSERT_NE(made, nullptr);
    EXPECT_TRUE(lookIn.empty());
    EXPECT_EQ(made->path(), "top/d/e");
    EXPECT_EQ(GWZipFile::fileWithPathComponents({}, roots[0], lookIn, true), nullptr);
}

TEST(GWZipFileTree, LookupsReturnTheFirstOfEqualNames) {
    auto dir = makeDirectory("dir");
    auto first = addFile(dir, "same");
    auto second = addFile(dir, "same");
    addFile(dir, "Same");
    EXPECT_EQ(dir->childNamed("same"), first);
    EXPECT_NE(dir->childNamed("Same"), first);  // case matters
    EXPECT_EQ(dir->childNamed("sam"), nullptr);
    GWZipFileArray roots{second, first};
    EXPECT_EQ(GWZipFile::fileNamed("same", roots), second);
}

TEST(GWZipFileTree, NameLookupFollowsRenames) {
    auto dir = makeDirectory("dir");
    auto x = addFile(dir, "x");
    auto y = addFile(dir, "y");
    y->setName("x");
    EXPECT_EQ(dir->childNamed("x"), x);
    x->setName("z");
    EXPECT_EQ(dir->childNamed("x"), y);
    EXPECT_EQ(dir->childNamed("z"), x);
    EXPECT_EQ(dir->childNamed("y"), nullptr);
    // A child that does not know its directory is found under its new name too.
    auto stranger = makeFile("s");
    dir->addChild(stranger);
    EXPECT_EQ(dir->childNamed("s"), stranger);
    stranger->setName("t");
    EXPECT_EQ(dir->childNamed("t"), stranger);
    EXPECT_EQ(dir->childNamed("s"), nullptr);
    // Renaming through the extra info moves the entry in the index as well.
    x->setExtraInfo({{kGWZipFilenameKey, "renamed"}});
    EXPECT_EQ(dir->childNamed("renamed"), x);
}

TEST(GWZipFileTree, ManyEntriesInOneDirectoryAreAllFound) {
    GWZipFileArray roots;
    auto dir = GWZipFile::fileWithPath("big", roots, true);
    constexpr int kCount = 20000;
    for (int i = 0; i < kCount; ++i) {
        auto made = GWZipFile::fileWithPath("big/d" + std::to_string(i) + "/f", roots, true);
        ASSERT_NE(made, nullptr);
    }
    ASSERT_EQ(dir->children()->size(), std::size_t(kCount));
    for (int i = 0; i < kCount; i += 997) {
        const std::string name = "d" + std::to_string(i);
        auto found = dir->childNamed(name);
        ASSERT_NE(found, nullptr);
        EXPECT_EQ(found->name(), name);
        EXPECT_EQ((*dir->children())[std::size_t(i)], found);
    }
}

TEST(GWZipFileTree, VeryDeepTreesAreBuiltCopiedAndReleased) {
    // A 64 KiB name can hold some 30000 components; nothing may recurse per level.
    std::string path;
    constexpr int kDepth = 30000;
    for (int i = 0; i < kDepth; ++i) {
        path += i ? "/d" : "d";
    }
    GWZipFileArray roots;
    auto deepest = GWZipFile::fileWithPath(path, roots, true);
    ASSERT_NE(deepest, nullptr);
    EXPECT_EQ(deepest->path(), path);
    auto copy = roots[0]->copy();
    auto node = copy;
    int depth = 1;
    while (node->children() && !node->children()->empty()) {
        node = node->children()->front();
        ++depth;
    }
    EXPECT_EQ(depth, kDepth);
    EXPECT_EQ(node->path(), path);
    roots.clear();
    deepest.reset();
    node.reset();
    copy.reset();  // both trees go away here
}

// --- Children -----------------------------------------------------------------------

TEST(GWZipFileChildren, SnapshotsDoNotChangeWhenTheDirectoryDoes) {
    auto dir = makeDirectory("dir");
    EXPECT_EQ(dir->children(), nullptr);
    addFile(dir, "a");
    auto snapshot = dir->children();
    ASSERT_NE(snapshot, nullptr);
    auto b = addFile(dir, "b");
    EXPECT_EQ(snapshot->size(), 1u);
    EXPECT_EQ(dir->children()->size(), 2u);
    dir->removeChild(b);
    EXPECT_EQ(dir->children()->size(), 1u);
    EXPECT_EQ(dir->childNamed("b"), nullptr);
    // Adding does not set the parent link: callers do that at construction.
    auto orphan = makeFile("orphan");
    dir->addChild(orphan);
    EXPECT_EQ(orphan->parent(), nullptr);
}

TEST(GWZipFileChildren, RemoveChildRemovesEveryOccurrenceOfThatObjectOnly) {
    auto dir = makeDirectory("dir");
    auto twice = addFile(dir, "n");
    auto sameName = addFile(dir, "n");
    dir->addChild(twice);
    dir->removeChild(twice);
    ASSERT_EQ(dir->children()->size(), 1u);
    EXPECT_EQ(dir->children()->front(), sameName);
    EXPECT_EQ(dir->childNamed("n"), sameName);
    dir->removeChild(sameName);
    ASSERT_NE(dir->children(), nullptr);  // an empty array, no longer a leaf
    EXPECT_TRUE(dir->children()->empty());
    dir->setChildren(std::nullopt);
    EXPECT_EQ(dir->children(), nullptr);
}

// --- Derived properties ---------------------------------------------------------------

TEST(GWZipFileDerived, DirectoriesAreFoldersWhateverTheExtraInfoSays) {
    GWDictionary info{{kGWZipTypeCodeKey, "TEXT"}, {kGWZipCreatorCodeKey, "ttxt"}};
    auto dir = makeFile("d", nullptr, 040755, info);
    EXPECT_EQ(dir->type(), "fold");
    EXPECT_EQ(dir->creator(), "MACS");
    EXPECT_EQ(dir->typeCode(), 0x666F6C64u);
    EXPECT_EQ(dir->creatorCode(), 0x4D414353u);
    auto file = makeFile("f", nullptr, 0100644, info);
    EXPECT_EQ(file->type(), "TEXT");
    EXPECT_EQ(file->creatorCode(), 0x74747874u);
    auto plain = makeFile("p");
    EXPECT_FALSE(plain->type());
    EXPECT_EQ(plain->typeCode(), 0u);
    EXPECT_EQ(plain->creatorCode(), 0u);
}

TEST(GWZipFileDerived, UTCDatesWinOverLocalOnesAndTheCentralDate) {
    const GWDate utc(1700000000), local(1700003600);
    auto both = makeFile("f", nullptr, 0100644,
                         {{kGWZipUTCModificationDateKey, utc},
                          {kGWZipModificationDateKey, local},
                          {kGWZipCreationDateKey, local},
                          {kGWZipUTCBackupDateKey, utc},
                          {kGWZipAccessDateKey, local}});
    EXPECT_EQ(both->modificationDate(), utc);
    EXPECT_EQ(both->creationDate(), local);
    EXPECT_EQ(both->backupDate(), utc);
    EXPECT_EQ(both->accessDate(), local);
    auto localOnly = makeFile("f", nullptr, 0100644, {{kGWZipModificationDateKey, local}});
    EXPECT_EQ(localOnly->modificationDate(), local);
    auto neither = makeFile("f");
    EXPECT_EQ(neither->modificationDate(), kCentralDate);
    EXPECT_FALSE(neither->creationDate());
    EXPECT_FALSE(neither->backupDate());
    EXPECT_FALSE(neither->accessDate());
    // A value of the wrong kind is no date.
    auto wrongKind = makeFile("f", nullptr, 0100644, {{kGWZipUTCModificationDateKey, "today"}});
    EXPECT_EQ(wrongKind->modificationDate(), kCentralDate);
}

TEST(GWZipFileDerived, FinderNumbersAreNarrowedAsDocumented) {
    auto file = makeFile("f", nullptr, 0100644,
                         {{kGWZipVerticalIconLocationKey, std::uint64_t(0xFFF6)},
                          {kGWZipHorizontalIconLocationKey, std::uint64_t(40)},
                          {kGWZipFinderFlagsKey, std::uint64_t(0x4100)},
                          {kGWZipExtendedFinderFlagsKey, std::uint64_t(0x8000)},
                          {kGWZipVersionNumberKey, std::uint64_t(3)},
                          {kGWZipAccessRightsKey, std::uint64_t(0x81)},
                          {kGWZipPutAwayFolderKey, std::int64_t(0x12345)},
                          {kGWZipCommentKey, "note"}});
    EXPECT_EQ(file->iconLocationV(), -10);
    EXPECT_EQ(file->iconLocationH(), 40);
    EXPECT_EQ(file->finderFlags(), 0x4100);
    EXPECT_EQ(file->extendedFinderFlags(), 0x8000);
    EXPECT_EQ(file->versionNumber(), 3);
    EXPECT_EQ(file->accessRights(), 0x81);
    EXPECT_EQ(file->putAwayFolderID(), 0x2345);
    EXPECT_EQ(file->comment(), "note");
    auto plain = makeFile("p");
    EXPECT_EQ(plain->iconLocationV(), 0);
    EXPECT_EQ(plain->finderFlags(), 0);
    EXPECT_EQ(plain->putAwayFolderID(), 0);
    EXPECT_FALSE(plain->comment());
    EXPECT_FALSE(plain->moreInfoAvailableInLocalHeader());
    EXPECT_TRUE(makeFile("m", nullptr, 0100644, {{kGWZipMoreInfoAvailableInLocalHeaderKey, true}})
                    ->moreInfoAvailableInLocalHeader());
}

TEST(GWZipFileDerived, UncompressedSizeCountsCompanionsRecursively) {
    auto file = makeFile("f", nullptr, 0100644, {}, 1000);
    file->setResourceFork(makeFile("rsrc", nullptr, 0100644, {}, 100));
    file->setAppleDoubleFile(makeFile("._f", nullptr, 0100644, {}, 82));
    EXPECT_EQ(file->uncompressedSize(), 1182u);
    EXPECT_EQ(file->storedUncompressedSize(), 1000u);
    file->resourceFork()->setAppleDoubleFile(makeFile("._rsrc", nullptr, 0100644, {}, 7));
    EXPECT_EQ(file->uncompressedSize(), 1189u);
    EXPECT_EQ(file->resourceFork()->uncompressedSize(), 107u);
}

TEST(GWZipFileDerived, MacBinaryEntriesReportNoChecksum) {
    auto file = makeFile("f", nullptr, 0100644, {{kGWZipIsMacBinaryEncodedKey, true}});
    EXPECT_TRUE(file->isMacBinaryEncoded());
    EXPECT_FALSE(file->uncompressedChecksum());
    EXPECT_EQ(file->uncompressedChecksumAlgorithm(), 0u);
    EXPECT_EQ(file->privateUncompressedChecksum(), (GWData{1, 2, 3, 4}));
    EXPECT_EQ(file->privateUncompressedChecksumAlgorithm(), 1u);
    // Setting the checksum writes the private fields all the same.
    file->setUncompressedChecksum(GWData{9});
    file->setUncompressedChecksumAlgorithm(4);
    EXPECT_EQ(file->privateUncompressedChecksum(), GWData{9});
    EXPECT_EQ(file->privateUncompressedChecksumAlgorithm(), 4u);
    // A directory is never MacBinary.
    auto dir = makeFile("d", nullptr, 040755, {{kGWZipIsMacBinaryEncodedKey, true}});
    EXPECT_FALSE(dir->isMacBinaryEncoded());
    EXPECT_EQ(dir->uncompressedChecksum(), (GWData{1, 2, 3, 4}));
    EXPECT_EQ(dir->uncompressedChecksumAlgorithm(), 1u);
}

TEST(GWZipFileStorage, OptionalFieldsKeepNoneApartFromEmpty) {
    const GWData sha1(20, 0xAB);
    for (const std::optional<GWData>& checksum :
         {std::optional<GWData>(), std::optional<GWData>(GWData{}),
          std::optional<GWData>(GWData{1, 2, 3, 4}), std::optional<GWData>(GWData(8, 7)),
          std::optional<GWData>(sha1)}) {
        auto file = makeFile("f");
        file->setUncompressedChecksum(checksum);
        file->setSymlinkDestination(checksum ? std::optional<std::string>("") : std::nullopt);
        file->setExtraInfo(checksum ? GWDictionary{{kGWZipCommentKey, "c"}} : GWDictionary{});
        for (const auto& seen : {file, file->copy()}) {
            EXPECT_EQ(seen->privateUncompressedChecksum(), checksum);
            EXPECT_EQ(seen->symlinkDestination().has_value(), checksum.has_value());
            EXPECT_EQ(seen->comment().has_value(), checksum.has_value());
        }
    }
    auto file = makeFile("f");
    file->setResourceFork(nullptr);
    EXPECT_EQ(file->resourceFork(), nullptr);
    EXPECT_EQ(file->appleDoubleFile(), nullptr);
}

// --- Renaming through the extra info ------------------------------------------------

TEST(GWZipFileRenaming, NameKeysArePreferredInOrder) {
    auto file = makeFile("archive-name");
    file->setExtraInfo({{kGWZipFilenameKey, "Given"},
                        {kGWZipPOSIXPathKey, "dir/posix"},
                        {kGWZipHFSPathKey, "Disk:hfs"}});
    EXPECT_EQ(file->name(), "Given");
    EXPECT_EQ(file->extraInfo().size(), 3u);
    file->setExtraInfo({{kGWZipPOSIXPathKey, "dir/sub/posix.txt/"}, {kGWZipHFSPathKey, "D:h"}});
    EXPECT_EQ(file->name(), "posix.txt");
    file->setExtraInfo({{kGWZipHFSPathKey, "Macintosh HD:Folder:Read/Me"}});
    EXPECT_EQ(file->name(), "Read:Me");  // the POSIX form of a Mac name with a slash
    auto dir = makeFile("x", nullptr, 040755);
    dir->setExtraInfo({{kGWZipHFSPathKey, "Disk:Folder:"}});
    EXPECT_EQ(dir->name(), "Folder");
    file->setExtraInfo({{kGWZipCommentKey, "no name here"}});
    EXPECT_EQ(file->name(), "Read:Me");
}

TEST(GWZipFileRenaming, DontChangeFilenameKeepsTheName) {
    auto file = makeFile("kept");
    file->setExtraInfo({{kGWZipFilenameKey, "other"}, {kGWZipDontChangeFilenameKey, true}});
    EXPECT_EQ(file->name(), "kept");
    file->setExtraInfo({{kGWZipFilenameKey, "other"}, {kGWZipDontChangeFilenameKey, false}});
    EXPECT_EQ(file->name(), "other");
}

TEST(GWZipFileRenaming, NamesThatAreNotOneComponentAreRefused) {
    auto file = makeFile("safe");
    for (const char* filename : {"", ".", ".."}) {
        file->setExtraInfo({{kGWZipFilenameKey, filename}});
        EXPECT_EQ(file->name(), "safe") << filename;
    }
    file->setExtraInfo({{kGWZipPOSIXPathKey, "a/.."}});
    EXPECT_EQ(file->name(), "safe");
    file->setExtraInfo({{kGWZipPOSIXPathKey, "/"}});
    EXPECT_EQ(file->name(), "safe");
    file->setExtraInfo({{kGWZipHFSPathKey, ":::"}});
    EXPECT_EQ(file->name(), "safe");
    file->setExtraInfo({{kGWZipFilenameKey, "../../etc/passwd"}});
    EXPECT_EQ(file->name(), "..:..:etc:passwd");  // a Mac name: its slashes are not separators
}

TEST(GWZipFileRenaming, TheInitialiserStoresExtraInfoWithoutRenaming) {
    auto file = makeFile("stored", nullptr, 0100644, {{kGWZipFilenameKey, "ignored"}});
    EXPECT_EQ(file->name(), "stored");
    EXPECT_EQ(file->filenameFromExtraInfo(file->extraInfo()), "ignored");
}

}  // namespace
