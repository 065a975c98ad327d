// Batches of entries extracted through GWZipArchive: destinations, directory
// ordering, the shared first error, queues and the data-fork stream.

#include <gtest/gtest.h>
#include <sys/stat.h>

#include <algorithm>
#include <atomic>
#include <cerrno>

#include "GWArchiveSupport/GWArchiveConstants.h"
#include "foundation/GWDispatch.h"
#include "foundation/GWMetadataStore.h"
#include "support/AppleDoubleBuilder.h"
#include "support/MetadataTestSupport.h"
#include "support/TestSupport.h"
#include "support/ZipBuilder.h"
#include "tools/ToolTestSupport.h"
#include "zip/GWZipArchive.h"
#include "zip/ZipExtractTestSupport.h"

namespace {

using namespace gwtest;

class GWZipArchiveExtraction : public ::testing::Test {
protected:
    GWZipArchivePtr open(const ZipBuilder& zip) {
        zip.write(directory.file("archive.zip"));
        GWErrorPtr error;
        auto archive = GWZipArchive::initWithURL(directory.url("archive.zip"), &error);
        EXPECT_TRUE(archive) << (error ? error->localizedDescription() : "");
        return archive;
    }

    TemporaryDirectory directory;
    GWErrorPtr error;
};

// An entry goes to its full path below the folder, a directory with its
// whole subtree and nothing else.
TEST_F(GWZipArchiveExtraction, EntriesGoToTheirFullPathsAndDirectoriesBringTheirSubtrees) {
    ZipBuilder zip;
    zip.addDirectory("top/");
    zip.addFile("top/one.txt", bytesOf("1"));
    zip.addDirectory("top/sub/");
    zip.addFile("top/sub/two.txt", bytesOf("22"), 8);
    zip.addSymlink("top/sub/link", "two.txt");
    zip.addFile("elsewhere.txt", bytesOf("not asked for"));
    auto archive = open(zip);
    for (bool atomically : {true, false}) {
        const std::string out = atomically ? "atomic" : "in-place";
        ASSERT_TRUE(archive->extractFile(archive->fileWithPath("top/sub/two.txt"),
                                         directory.url(out), atomically, nullptr, &error))
            << error->localizedDescription();
        EXPECT_EQ(readFile(directory.file(out + "/top/sub/two.txt")), bytesOf("22"));
    }
    ASSERT_TRUE(archive->extractFile(archive->fileWithPath("top"), directory.url("out"), true,
                                     nullptr, &error))
        << error->localizedDescription();
    EXPECT_EQ(readFile(directory.file("out/top/one.txt")), bytesOf("1"));
    EXPECT_EQ(readFile(directory.file("out/top/sub/two.txt")), bytesOf("22"));
    EXPECT_EQ(readFile(directory.file("out/top/sub/link")), bytesOf("22"));
    EXPECT_FALSE(fileExists(directory.file("out/elsewhere.txt")));
}

TEST_F(GWZipArchiveExtraction, DirectoryOperationsComeFirstAndAreDependedOn) {
    ZipBuilder zip;
    zip.addDirectory("d/");
    zip.addDirectory("d/e/");
    zip.addFile("d/e/f", bytesOf("x"));
    zip.addFile("d/g", bytesOf("y"));
    auto archive = open(zip);
    auto operations = archive->operationsToExtractFile(
        archive->fileWithPath("d"), directory.url("dest"), true, nullptr, &error);
    ASSERT_TRUE(operations);
    ASSERT_EQ(operations->size(), 4u);
    std::vector<std::string> paths;
    for (const auto& operation : *operations) {
        paths.push_back(operation->destURL()->path());
    }
    const std::string base = directory.file("dest");
    EXPECT_EQ(paths, (std::vector<std::string>{base, base + "/e", base + "/e/f", base + "/g"}));
    auto dependsOn = [](const GWZipExtractOperationPtr& operation,
                        const GWZipExtractOperationPtr& on) {
        const auto& all = operation->dependencies();
        return std::find(all.begin(), all.end(), on) != all.end();
    };
    const auto& ops = *operations;
    EXPECT_TRUE(ops[0]->dependencies().empty());
    EXPECT_TRUE(dependsOn(ops[1], ops[0]));
    EXPECT_TRUE(dependsOn(ops[2], ops[1]));
    EXPECT_TRUE(dependsOn(ops[3], ops[0]));
}

TEST_F(GWZipArchiveExtraction, AnEmptyListCompletesAndAnUnbuildableOneFails) {
    ZipBuilder zip;
    zip.addFile("a", bytesOf("x"));
    auto archive = open(zip);
    EXPECT_TRUE(archive->extractFiles({}, directory.url("out"), true, nullptr, &error));
    // Once a wait for ever: the batch's operations cannot be built.
    EXPECT_FALSE(archive->extractFiles({nullptr}, directory.url("out"), true, nullptr, &error));
    EXPECT_TRUE(error);

    GWSemaphore done(0);
    GWErrorPtr reported = GWCocoaError(GWFileReadUnknownError);
    archive->extractFiles({}, directory.url("out"), true, nullptr, nullptr,
                          [&](const GWErrorPtr& batchError) {
                              reported = batchError;
                              done.signal();
                          });
    done.wait();
    EXPECT_FALSE(reported);
}

TEST_F(GWZipArchiveExtraction, AProgressHandlerAnsweringFalseCancelsTheBatch) {
    ZipBuilder zip;
    for (int i = 0; i < 30; ++i) {
        zip.addFile("f" + std::to_string(i), textBytes(50000, i), 8);
    }
    auto archive = open(zip);
    std::atomic<int> calls{0};
    EXPECT_FALSE(archive->extractFiles(
        archive->files(), directory.url("out"), true,
        [&](std::uint64_t) {
            ++calls;
            return false;
        },
        &error));
    ASSERT_TRUE(error);
    EXPECT_TRUE(error->is(kGWCocoaErrorDomain, GWUserCancelledError));
    EXPECT_GE(calls.load(), 1);
    // Stopped or cancelled, no entry reached its destination.
    for (int i = 0; i < 30; ++i) {
        EXPECT_FALSE(fileExists(directory.file("out/f" + std::to_string(i)))) << i;
    }
}

TEST_F(GWZipArchiveExtraction, TheFirstErrorIsTheBatchsResultAndTheRestMayGoOn) {
    ZipBuilder zip;
    zip.addFile("bad", bytesOf("data"), 98);
    for (int i = 0; i < 20; ++i) {
        zip.addFile("good" + std::to_string(i), textBytes(30000, i), 8);
    }
    auto archive = open(zip);
    auto queue = std::make_shared<GWOperationQueue>();
    GWSemaphore done(0);
    GWErrorPtr reported;
    archive->extractFiles(archive->files(), directory.url("out"), false, queue, nullptr,
                          [&](const GWErrorPtr& batchError) {
                              reported = batchError;
                              done.signal();
                          });
    done.wait();
    ASSERT_TRUE(reported);
    EXPECT_TRUE(reported->is(kGWZipArchiveErrorDomain, 1));

    std::vector<std::string> failed;
    GWExtractOptions options;
    options.continueAfterFailure = true;
    options.entryFailed = [&](const std::string& path, const GWErrorPtr&) {
        failed.push_back(path);
    };
    EXPECT_FALSE(archive->extractFiles(archive->files(), directory.url("again"), true, nullptr,
                                       &error, options));
    EXPECT_TRUE(error->is(kGWZipArchiveErrorDomain, 1));
    EXPECT_EQ(failed, std::vector<std::string>{"bad"});
    for (int i = 0; i < 20; ++i) {
        EXPECT_EQ(readFile(directory.file("again/good" + std::to_string(i))), textBytes(30000, i));
    }
}

TEST_F(GWZipArchiveExtraction, ABatchThatCannotFitIsRefusedBeforeAnythingIsWritten) {
    SmallFileSystem small(1 << 20);
    if (!small.mounted()) {
        GTEST_SKIP() << "cannot mount a small file system here";
    }
    ZipBuilder zip;
    zip.addFile("first", bytesOf("fits"));
    zip.addFile("zeros", GWData(4 << 20, 0), 8);  // 4 MiB declared, a few KiB stored
    auto archive = open(zip);
    const GWURL out = GWURL::fileURLWithPath(small.path() + "/out");
    EXPECT_FALSE(archive->extractFiles(archive->files(), out, true, nullptr, &error));
    ASSERT_TRUE(error);
    EXPECT_TRUE(error->is(kGWPOSIXErrorDomain, ENOSPC)) << error->localizedDescription();
    EXPECT_NE(error->localizedDescription().find("4194308 bytes are needed"), std::string::npos)
        << error->localizedDescription();
    EXPECT_FALSE(fileExists(small.path() + "/out"));

    ToolRun run = runTool("extract -v -C " + shellQuote(out.path()) + " " +
                          shellQuote(directory.file("archive.zip")));
    EXPECT_EQ(run.status, 1);
    EXPECT_NE(run.err.find("(NSPOSIXErrorDomain 28)"), std::string::npos) << run.err;
    EXPECT_FALSE(fileExists(small.path() + "/out/first"));
}

// Data forks stream whole in GWZipArchiveRemote's tests; without an entry
// the handler hears one error and no data.
TEST_F(GWZipArchiveExtraction, ADataForkWithoutAnEntryIsAnError) {
    ZipBuilder zip;
    zip.addFile("blob", bytesOf("x"));
    auto archive = open(zip);
    DataHandlerLog log;
    GWSemaphore done(0);
    auto handler = log.handler();
    archive->extractDataForkOfFile(nullptr, nullptr,
                                   [&](auto data, bool isDone, const GWErrorPtr& failure) {
                                       handler(data, isDone, failure);
                                       done.signal();
                                       return true;
                                   });
    done.wait();
    ASSERT_EQ(log.doneFlags.size(), 1u);
    EXPECT_TRUE(log.doneFlags[0] && !log.hadData[0]);
    EXPECT_TRUE(log.errors[0] && log.errors[0]->is(kGWCocoaErrorDomain, GWFileWriteUnknownError));
}

TEST_F(GWZipArchiveExtraction, MacCompanionsListedByTheLoaderBecomeMetadata) {
    if (!userAttributesSupported(directory.path())) {
        GTEST_SKIP() << "no user extended attributes here";
    }
    AppleDoubleFile companion;
    companion.finderInfo = finderInfoBytes("TEXT", "ttxt", 0x0400);
    companion.attributes = {{"com.example.tag", bytesOf("red")}};
    ZipBuilder zip;
    zip.addFile("docs/a.txt", bytesOf("a"), 8);
    zip.addFile("__MACOSX/docs/._a.txt", buildAppleDouble(companion), 8);
    // Outside __MACOSX an "._" name is an entry like any other.
    zip.addFile("docs/._a.txt", bytesOf("a member of its own"));
    zip.addFile("docs/Icon", bytesOf("i"));
    zip.addFile("XtraStuf.mac/docs/Icon", bytesOf("resource bytes"), 8);
    auto archive = open(zip);
    ASSERT_EQ(archive->files().size(), 1u);
    // The member first, so that moving "a.txt" into place finds it there.
    ASSERT_TRUE(archive->extractFile(archive->fileWithPath("docs/._a.txt"), directory.url("out"),
                                     true, nullptr, &error));
    ASSERT_TRUE(archive->extractFiles(
        {archive->fileWithPath("docs/a.txt"), archive->fileWithPath("docs/Icon")},
        directory.url("out"), true, nullptr, &error))
        << error->localizedDescription();
    const std::string a = directory.file("out/docs/a.txt");
    EXPECT_EQ(readFile(a), bytesOf("a"));
    EXPECT_EQ(readFile(directory.file("out/docs/._a.txt")), bytesOf("a member of its own"));
    EXPECT_EQ(GWMetadataStore(a).attribute("com.example.tag", nullptr), bytesOf("red"));
    EXPECT_EQ(GWMetadataStore(a).attribute("com.apple.FinderInfo", nullptr), companion.finderInfo);
    EXPECT_EQ(GWMetadataStore(directory.file("out/docs/Icon"))
                  .attribute("com.apple.ResourceFork", nullptr),
              bytesOf("resource bytes"));
    EXPECT_FALSE(fileExists(directory.file("out/__MACOSX")));
    EXPECT_FALSE(fileExists(directory.file("out/XtraStuf.mac")));
}

}  // namespace
