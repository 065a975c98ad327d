// Path lookup in an opened archive: exact names, first match, and the
// deliberate passing over of components that match nothing.

#include <gtest/gtest.h>

#include "support/TestSupport.h"
#include "support/ZipBuilder.h"
#include "zip/GWZipArchive.h"

namespace {

using namespace gwtest;

class GWZipArchiveLookup : public ::testing::Test {
protected:
    void SetUp() override {
        ZipBuilder zip;
        zip.addFile("a/b", bytesOf("1"));
        zip.addFile("a/c/d", bytesOf("2"));
        zip.addFile("leaf", bytesOf("3"));
        zip.addFile("dup/x", bytesOf("first"));
        zip.addFile("dup/x", bytesOf("second"));
        zip.addFile("./dot", bytesOf("4"));
        zip.write(directory.file("lookup.zip"));
        GWErrorPtr error;
        archive = GWZipArchive::initWithURL(directory.url("lookup.zip"), &error);
        ASSERT_TRUE(archive);
    }

    std::string pathOf(const std::string& lookup) const {
        auto file = archive->fileWithPath(lookup);
        return file ? file->path() : "(none)";
    }

    TemporaryDirectory directory;
    GWZipArchivePtr archive;
};

// Components that match nothing are passed over, "." and ".." included
// (lookups are not standardised); once a directory matched, the search
// stays below it.
TEST_F(GWZipArchiveLookup, FindsNodesByTheirPathPassingOverUnmatchedComponents) {
    const std::pair<const char*, const char*> cases[] = {
        {"a", "a"},        {"a/c/d", "a/c/d"},      {"a/b/", "a/b"},      {"dot", "dot"},
        {"/a", "a"},       {"x/a/b", "a/b"},        {"a/x/c/d", "a/c/d"}, {"./../leaf", "leaf"},
        {"a/../b", "a/b"}, {"a/../leaf", "(none)"}, {"a/zz", "(none)"},   {"leaf/more", "(none)"},
        {"", "(none)"},    {"/", "(none)"},         {"A", "(none)"},
    };
    for (const auto& [lookup, path] : cases) {
        EXPECT_EQ(pathOf(lookup), path) << lookup;
    }
    // The first of two same-named entries wins; lists keep their order and
    // drop misses; a renamed root is found by its new name only.
    EXPECT_EQ(archive->fileWithPath("dup/x")->storedUncompressedSize(), 5u);
    std::string found;
    for (const auto& file : archive->filesWithPaths({"a/c", "a/missing", "leaf", "", "a/b"})) {
        found += file->path() + " ";
    }
    EXPECT_EQ(found, "a/c leaf a/b ");
    auto leaf = archive->fileWithPath("leaf");
    leaf->setName("renamed");
    EXPECT_EQ(archive->fileWithPath("renamed"), leaf);
    EXPECT_FALSE(archive->fileWithPath("leaf"));
}

}  // namespace
