// The asynchronous initialiser: returns at once, loads on the loading queue,
// reports there, and can be cancelled through the operation it hands back.

#include <gtest/gtest.h>

#include <atomic>
#include <chrono>
#include <future>
#include <thread>

#include "foundation/GWOperationQueue.h"
#include "support/TestSupport.h"
#include "support/ZipBuilder.h"
#include "zip/GWZipArchive.h"

namespace {

using namespace gwtest;

class GWZipArchiveAsync : public ::testing::Test {
protected:
    void SetUp() override {
        ZipBuilder zip;
        zip.addFile("a.txt", bytesOf("alpha"));
        zip.addFile("b/c.txt", bytesOf("gamma"));
        zip.write(directory.file("async.zip"));
        queue->setMaxConcurrentOperationCount(1);
    }

    struct Outcome {
        GWErrorPtr error;
        std::size_t filesSeen = 0;
        bool ranOnQueue = false;
    };

    GWZipArchive::CompletionHandler handler(const GWZipArchivePtr* archive) {
        return [this, archive](const GWErrorPtr& error) {
            Outcome outcome;
            outcome.error = error;
            outcome.filesSeen = *archive ? (*archive)->files().size() : 0;
            // The handler is itself one of the loading queue's operations.
            outcome.ranOnQueue = queue->operationCount() > 0;
            done.set_value(outcome);
        };
    }

    Outcome wait() {
        auto future = done.get_future();
        EXPECT_EQ(future.wait_for(std::chrono::seconds(20)), std::future_status::ready);
        return future.get();
    }

    TemporaryDirectory directory;
    GWOperationQueuePtr queue = std::make_shared<GWOperationQueue>();
    std::promise<Outcome> done;
};

TEST_F(GWZipArchiveAsync, ReturnsAtOnceAndSetsFilesBeforeTheHandlerRuns) {
    queue->setSuspended(true);
    GWZipArchivePtr archive;
    GWZipLoadOperationPtr operation;
    archive =
        GWZipArchive::initWithURL(directory.url("async.zip"), queue, &operation, handler(&archive));
    ASSERT_TRUE(archive);
    ASSERT_TRUE(operation);
    EXPECT_TRUE(archive->files().empty());
    EXPECT_FALSE(operation->isFinished());
    queue->setSuspended(false);
    const Outcome outcome = wait();
    EXPECT_FALSE(outcome.error);
    EXPECT_EQ(outcome.filesSeen, 2u);
    EXPECT_TRUE(outcome.ranOnQueue);
    EXPECT_EQ(archive->fileWithPath("b/c.txt")->storedUncompressedSize(), 5u);

    // Without a handler or a queue the archive still loads.
    auto plain =
        GWZipArchive::initWithURL(directory.url("async.zip"), nullptr, &operation, nullptr);
    ASSERT_TRUE(plain);
    ASSERT_TRUE(operation);
    operation->waitUntilFinished();
    EXPECT_EQ(plain->files().size(), 2u);
}

TEST_F(GWZipArchiveAsync, CancellingTheOperationReportsCancellation) {
    queue->setSuspended(true);
    GWZipArchivePtr archive;
    GWZipLoadOperationPtr operation;
    archive =
        GWZipArchive::initWithURL(directory.url("async.zip"), queue, &operation, handler(&archive));
    ASSERT_TRUE(operation);
    operation->cancel();
    queue->setSuspended(false);
    const Outcome outcome = wait();
    ASSERT_TRUE(outcome.error);
    EXPECT_TRUE(outcome.error->is(kGWCocoaErrorDomain, GWUserCancelledError));
    EXPECT_EQ(outcome.filesSeen, 0u);
    EXPECT_TRUE(outcome.ranOnQueue);
}

TEST_F(GWZipArchiveAsync, LoadFailuresAndRefusedURLsReachTheHandler) {
    queue->setSuspended(true);
    GWZipArchivePtr archive;
    archive =
        GWZipArchive::initWithURL(directory.url("absent.zip"), queue, nullptr, handler(&archive));
    EXPECT_TRUE(archive);
    queue->setSuspended(false);
    const Outcome outcome = wait();
    ASSERT_TRUE(outcome.error);
    EXPECT_EQ(outcome.error->code(), ENOENT);

    std::promise<GWErrorPtr> refused;
    GWZipLoadOperationPtr operation;
    EXPECT_FALSE(GWZipArchive::initWithURL(
        GWURL(), queue, &operation, [&](const GWErrorPtr& error) { refused.set_value(error); }));
    EXPECT_FALSE(operation);
    auto future = refused.get_future();
    ASSERT_EQ(future.wait_for(std::chrono::seconds(20)), std::future_status::ready);
    const GWErrorPtr refusal = future.get();
    EXPECT_TRUE(refusal && refusal->is(kGWCocoaErrorDomain, GWFileReadUnsupportedSchemeError));
}

// A large directory is walked on a second thread; cancelling at any moment
// ends the load either way, with no thread left waiting.
TEST(GWZipLoadOperationCancel, CancellingALargeLoadAtAnyMomentEndsIt) {
    TemporaryDirectory directory;
    ZipBuilder zip;
    for (int i = 0; i < 30000; ++i) {
        zip.addFile("d" + std::to_string(i % 7) + "/f" + std::to_string(i), {});
    }
    zip.write(directory.file("large.zip"));
    // Delay -1: cancelled before it starts, it stops in the search.
    for (int delay = -1; delay < 12; ++delay) {
        auto operation = GWZipLoadOperation::initWithURL(directory.url("large.zip"));
        if (delay < 0) {
            operation->cancel();
        }
        std::thread loader([&] { operation->main(); });
        std::this_thread::sleep_for(std::chrono::milliseconds(std::max(delay, 0) * 3));
        operation->cancel();
        loader.join();
        if (operation->error() || delay < 0) {
            ASSERT_TRUE(operation->error());
            EXPECT_TRUE(operation->error()->is(kGWCocoaErrorDomain, GWUserCancelledError));
            EXPECT_FALSE(operation->files());
        } else {
            ASSERT_TRUE(operation->files());
            EXPECT_EQ(operation->files()->size(), 7u);
        }
    }
}

TEST(GWZipLoadOperationCancel, SearchFindsPatternsAcrossChunksAndHonoursItsRange) {
    TemporaryDirectory directory;
    GWData bytes(40000, 'x');
    const std::size_t at = 16384 - 2;  // split between the first two reads
    bytes[at] = 'P';
    bytes[at + 1] = 'K';
    bytes[at + 2] = 3;
    bytes[at + 3] = 4;
    writeFile(directory.file("data"), bytes);
    auto file = GWRemoteFileHandle::initForReadingFromURL(directory.url("data"), nullptr);
    ASSERT_TRUE(file);
    const std::uint8_t pattern[] = {'P', 'K', 3, 4};
    std::uint64_t found = 0;
    GWErrorPtr error;
    ASSERT_TRUE(
        GWZipLoadOperation::searchForData(pattern, *file, 0, UINT64_MAX, &found, nullptr, &error));
    EXPECT_EQ(found, at);
    ASSERT_TRUE(
        GWZipLoadOperation::searchForData(pattern, *file, at + 1, 1000, &found, nullptr, &error));
    EXPECT_EQ(found, GWZipLoadOperation::kNotFound);
    ASSERT_TRUE(
        GWZipLoadOperation::searchForData(pattern, *file, 0, at + 3, &found, nullptr, &error));
    EXPECT_EQ(found, GWZipLoadOperation::kNotFound);
    EXPECT_FALSE(GWZipLoadOperation::searchForData(
        pattern, *file, 0, UINT64_MAX, &found, [] { return true; }, &error));
    EXPECT_TRUE(error->is(kGWCocoaErrorDomain, GWUserCancelledError));
}

}  // namespace
