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
        GWZipFileArray roots;
        EXPECT_EQ(GWZipFile::fileWithPath(empty, roots, true), nullptr) << empty;
        EXPECT_TRUE(roots.empty());
    }
}

TEST(GWZipFileTree, CreatesImplicitDirectoriesAlongThePath) {
    GWZipFileArray roots;
    const GWDate before = GWDate::now();
    auto c = GWZipFile::fileWithPath("a/b/c", roots, true);
    ASSERT_NE(c, nullptr);
    EXPECT_EQ(c->path(), "a/b/c");
    auto b = c->parent();
    auto a = b->parent();
    EXPECT_EQ(roots, GWZipFileArray{a});
    for (const auto& made : {a, b, c}) {
        EXPECT_EQ(made->permissionsMode(), 040755);
        EXPECT_TRUE(made->isDirectory());
        EXPECT_EQ(made->owner(), getuid());
        EXPECT_EQ(made->groupOwner(), getgid());
        ASSERT_TRUE(made->storedModificationDate());
        EXPECT_GE(*made->storedModificationDate(), before);
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

// The first of equal names wins, case matters, and the index follows renames
// (of children that do not know their directory too), snapshots and removals.
TEST(GWZipFileChildren, LookupsFollowDuplicatesRenamesAndRemovals) {
    auto dir = makeDirectory("dir");
    EXPECT_EQ(dir->children(), nullptr);
    auto x = addFile(dir, "x");
    auto snapshot = dir->children();
    auto y = addFile(dir, "y");
    addFile(dir, "X");
    y->setName("x");
    EXPECT_EQ(dir->childNamed("x"), x);
    EXPECT_EQ(GWZipFile::fileNamed("x", GWZipFileArray{y, x}), y);
    x->setName("z");
    EXPECT_EQ(dir->childNamed("x"), y);
    EXPECT_EQ(dir->childNamed("z"), x);
    EXPECT_EQ(dir->childNamed("y"), nullptr);
    auto stranger = makeFile("s");
    dir->addChild(stranger);
    stranger->setName("t");
    EXPECT_EQ(dir->childNamed("t"), stranger);
    EXPECT_EQ(dir->childNamed("s"), nullptr);
    x->setExtraInfo({{kGWZipFilenameKey, "renamed"}});
    EXPECT_EQ(dir->childNamed("renamed"), x);
    EXPECT_EQ(snapshot->size(), 1u);
    // Removal takes every occurrence of that object and no other.
    dir->addChild(x);
    dir->removeChild(x);
    EXPECT_EQ(childNames(dir), (std::vector<std::string>{"x", "X", "t"}));
    EXPECT_EQ(dir->childNamed("renamed"), nullptr);
    for (const auto& child : GWZipFileArray(*dir->children())) {
        dir->removeChild(child);
    }
    ASSERT_NE(dir->children(), nullptr);  // an empty array, no longer a leaf
    EXPECT_TRUE(dir->children()->empty());
}

TEST(GWZipFileTree, VeryDeepTreesAreBuiltCopiedAndReleased) {
    // A 64 KiB name can hold some 30000 components; nothing may recurse per level.
    std::string path = "d";
    for (int i = 1; i < 30000; ++i) {
        path += "/d";
    }
    GWZipFileArray roots;
    auto deepest = GWZipFile::fileWithPath(path, roots, true);
    ASSERT_NE(deepest, nullptr);
    EXPECT_EQ(deepest->path(), path);
    auto copy = roots[0]->copy();
    auto node = copy;
    while (node->children() && !node->children()->empty()) {
        node = node->children()->front();
    }
    EXPECT_EQ(node->path(), path);
    roots.clear();
    deepest.reset();
    node.reset();
    copy.reset();  // both trees go away here
}

// --- Derived properties ---------------------------------------------------------------

TEST(GWZipFileDerived, FolderCodesUTCDatesAndNarrowedFinderNumbers) {
    GWDictionary info{{kGWZipTypeCodeKey, "TEXT"}, {kGWZipCreatorCodeKey, "ttxt"}};
    auto dir = makeFile("d", nullptr, 040755, info);
    EXPECT_EQ(dir->typeCode(), 0x666F6C64u);  // "fold", whatever the extra info says
    EXPECT_EQ(dir->creatorCode(), 0x4D414353u);
    EXPECT_EQ(makeFile("f", nullptr, 0100644, info)->creatorCode(), 0x74747874u);
    EXPECT_EQ(makeFile("p")->typeCode(), 0u);

    const GWDate utc(1700000000), local(1700003600);
    auto both = makeFile("f", nullptr, 0100644,
                         {{kGWZipUTCModificationDateKey, utc},
                          {kGWZipModificationDateKey, local},
                          {kGWZipCreationDateKey, local},
                          {kGWZipUTCBackupDateKey, utc}});
    EXPECT_EQ(both->modificationDate(), utc);
    EXPECT_EQ(both->creationDate(), local);
    EXPECT_EQ(both->backupDate(), utc);
    auto localOnly = makeFile("f", nullptr, 0100644, {{kGWZipModificationDateKey, local}});
    EXPECT_EQ(localOnly->modificationDate(), local);
    EXPECT_EQ(makeFile("f")->modificationDate(), kCentralDate);
    EXPECT_FALSE(makeFile("f")->creationDate());
    // A value of the wrong kind is no date.
    auto wrongKind = makeFile("f", nullptr, 0100644, {{kGWZipUTCModificationDateKey, "today"}});
    EXPECT_EQ(wrongKind->modificationDate(), kCentralDate);

    auto finder = makeFile("f", nullptr, 0100644,
                           {{kGWZipVerticalIconLocationKey, std::uint64_t(0xFFF6)},
                            {kGWZipPutAwayFolderKey, std::int64_t(0x12345)}});
    EXPECT_EQ(finder->iconLocationV(), -10);
    EXPECT_EQ(finder->putAwayFolderID(), 0x2345);
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
    // A directory is never MacBinary.
    auto dir = makeFile("d", nullptr, 040755, {{kGWZipIsMacBinaryEncodedKey, true}});
    EXPECT_FALSE(dir->isMacBinaryEncoded());
    EXPECT_EQ(dir->uncompressedChecksum(), (GWData{1, 2, 3, 4}));
    EXPECT_EQ(dir->uncompressedChecksumAlgorithm(), 1u);
}

// The entry's name after setExtraInfo; names that are not one component
// are refused, and Mac names keep their slashes as colons.
TEST(GWZipFileRenaming, NameKeysInOrderAndOnlyOneComponent) {
    struct Case {
        GWDictionary info;
        std::uint16_t mode;
        std::string name;
    };
    const Case cases[] = {
        {{{kGWZipFilenameKey, "Given"}, {kGWZipPOSIXPathKey, "d/p"}, {kGWZipHFSPathKey, "D:h"}},
         0100644,
         "Given"},
        {{{kGWZipPOSIXPathKey, "dir/sub/posix.txt/"}, {kGWZipHFSPathKey, "D:h"}},
         0100644,
         "posix.txt"},
        {{{kGWZipHFSPathKey, "Macintosh HD:Folder:Read/Me"}}, 0100644, "Read:Me"},
        {{{kGWZipHFSPathKey, "Disk:Folder:"}}, 040755, "Folder"},
        {{{kGWZipCommentKey, "no name here"}}, 0100644, "safe"},
        {{{kGWZipFilenameKey, "other"}, {kGWZipDontChangeFilenameKey, true}}, 0100644, "safe"},
        {{{kGWZipFilenameKey, "other"}, {kGWZipDontChangeFilenameKey, false}}, 0100644, "other"},
        {{{kGWZipFilenameKey, ""}}, 0100644, "safe"},
        {{{kGWZipFilenameKey, "."}}, 0100644, "safe"},
        {{{kGWZipFilenameKey, ".."}}, 0100644, "safe"},
        {{{kGWZipPOSIXPathKey, "a/.."}}, 0100644, "safe"},
        {{{kGWZipPOSIXPathKey, "/"}}, 0100644, "safe"},
        {{{kGWZipHFSPathKey, ":::"}}, 0100644, "safe"},
        {{{kGWZipFilenameKey, "../../etc/passwd"}}, 0100644, "..:..:etc:passwd"},
    };
    for (const Case& c : cases) {
        auto file = makeFile("safe", nullptr, c.mode);
        file->setExtraInfo(c.info);
        EXPECT_EQ(file->name(), c.name) << GWValue(c.info).description();
        EXPECT_EQ(file->extraInfo(), c.info);
    }
    // The initialiser stores extra info without renaming.
    auto file = makeFile("stored", nullptr, 0100644, {{kGWZipFilenameKey, "ignored"}});
    EXPECT_EQ(file->name(), "stored");
}

}  // namespace
