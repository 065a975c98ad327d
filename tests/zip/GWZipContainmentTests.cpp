// Extraction stays inside the folder it was given, whatever names and links
// the archive holds.

#include <gtest/gtest.h>

#include <filesystem>

#include "GWArchiveSupport/GWArchiveConstants.h"
#include "support/ContainmentSupport.h"
#include "support/HostileArchives.h"
#include "support/ZipBuilder.h"
#include "zip/GWZipArchive.h"

namespace {

using namespace gwtest;

// Every entry of the tree, parents first, as a tool extracting "everything"
// asks for them.
void collect(const GWZipFileArray& files, GWZipFileArray& all) {
    for (const auto& file : files) {
        all.push_back(file);
        if (auto children = file->children()) {
            collect(*children, all);
        }
    }
}

class GWZipContainment : public ::testing::TestWithParam<HostileArchive> {};

// One entry at a time (so that links extracted earlier are on disk when later
// entries are written), in place or atomically, then all in one batch.
TEST_P(GWZipContainment, NothingOutsideTheFolderChanges) {
    for (const int mode : {0, 1, 2}) {
        ContainmentSandbox sandbox;
        TemporaryDirectory archives;
        writeFile(archives.file("hostile.zip"), GetParam().build(sandbox.parent()));
        const auto before = sandbox.outside();
        GWErrorPtr error;
        auto archive = GWZipArchive::initWithURL(archives.url("hostile.zip"), &error);
        ASSERT_TRUE(archive) << error->localizedDescription();
        GWZipFileArray all;
        collect(archive->files(), all);
        std::vector<GWErrorPtr> refusals;
        if (mode == 2) {
            archive->extractFiles(all, sandbox.outURL(), false, nullptr, nullptr);
        }
        for (const auto& file : mode == 2 ? GWZipFileArray() : all) {
            GWErrorPtr failure;
            if (!archive->extractFile(file, sandbox.outURL(), mode == 1, nullptr, &failure) &&
                failure->domain() == kGWZipArchiveErrorDomain) {
                refusals.push_back(failure);
            }
        }
        EXPECT_EQ(sandbox.outside(), before);
        EXPECT_EQ(readFile(sandbox.canary()), bytesOf(ContainmentSandbox::kCanaryText));
        if (mode == 2 || GetParam().refusedPath.empty()) {
            EXPECT_TRUE(refusals.empty());
            continue;
        }
        ASSERT_FALSE(refusals.empty());
        EXPECT_EQ(refusals.front()->code(), GWZipArchiveEntryOutsideDestinationError);
        EXPECT_EQ(refusals.front()->detailString(kGWZipArchiveUnknownEntityErrorKey),
                  GetParam().refusedPath);
    }
}

INSTANTIATE_TEST_SUITE_P(Hostile, GWZipContainment, ::testing::ValuesIn(hostileZipArchives()),
                         [](const auto& info) { return info.param.name; });

TEST(GWZipContainment, ExistingLinkInTheFolderIsNotWrittenThrough) {
    // Left by an earlier extraction or by anyone else: the folder's own
    // links are refused all the same.
    ContainmentSandbox sandbox;
    std::filesystem::create_directory_symlink(sandbox.parent() + "/sub", sandbox.out() + "/dir");
    ZipBuilder zip;
    zip.addFile("dir/kept", bytesOf("replaced"));
    TemporaryDirectory archives;
    writeFile(archives.file("plain.zip"), zip.bytes());
    const auto before = sandbox.outside();
    auto archive = GWZipArchive::initWithURL(archives.url("plain.zip"), nullptr);
    ASSERT_TRUE(archive);
    GWErrorPtr error;
    EXPECT_FALSE(archive->extractFile(archive->fileWithPath("dir/kept"), sandbox.outURL(), false,
                                      nullptr, &error));
    ASSERT_TRUE(error);
    EXPECT_EQ(error->domain(), kGWZipArchiveErrorDomain);
    EXPECT_EQ(error->code(), GWZipArchiveEntryOutsideDestinationError);
    EXPECT_EQ(sandbox.outside(), before);
    // The refusal released what preparation holds: the next extraction runs.
    ZipBuilder other;
    other.addFile("fine", bytesOf("fine"));
    writeFile(archives.file("fine.zip"), other.bytes());
    auto fine = GWZipArchive::initWithURL(archives.url("fine.zip"), nullptr);
    ASSERT_TRUE(fine);
    EXPECT_TRUE(fine->extractFiles(fine->files(), sandbox.outURL(), false, nullptr, nullptr));
    EXPECT_EQ(readFile(sandbox.out() + "/fine"), bytesOf("fine"));
}

TEST(GWZipContainment, LinksThemselvesAreStillExtracted) {
    // Refusal is for what would go through a link, not for links pointing out.
    ContainmentSandbox sandbox;
    ZipBuilder zip;
    zip.addSymlink("up", "..");
    zip.addFile("in/file", bytesOf("inside"));
    TemporaryDirectory archives;
    writeFile(archives.file("links.zip"), zip.bytes());
    auto archive = GWZipArchive::initWithURL(archives.url("links.zip"), nullptr);
    ASSERT_TRUE(archive);
    GWErrorPtr error;
    ASSERT_TRUE(archive->extractFiles(archive->files(), sandbox.outURL(), false, nullptr, &error))
        << error->localizedDescription();
    EXPECT_EQ(std::filesystem::read_symlink(sandbox.out() + "/up"), "..");
    EXPECT_EQ(readFile(sandbox.out() + "/in/file"), bytesOf("inside"));
}

}  // namespace
