// XAR archives read from an HTTP server open, stream and extract as the same
// file does locally; the header and table of contents take few requests.

#include <gtest/gtest.h>

#include <sys/stat.h>

#include "GWArchiveSupport/GWArchiveConstants.h"
#include "XarExtractTestSupport.h"
#include "XarTestSupport.h"
#include "support/ServedFolderTest.h"
#include "support/TestSupport.h"
#include "support/XarBuilder.h"
#include "xar/GWXARArchive.h"

namespace {

using namespace gwtest;

// Every regular file below `files`, by path.
void regularFiles(const GWXARFileArray& files, std::vector<GWXARFilePtr>& into) {
    for (const GWXARFilePtr& file : files) {
        if (file->type() == GWXARFileTypeRegular) {
            into.push_back(file);
        }
        regularFiles(file->children(), into);
    }
}

StreamCalls streamed(const GWXARArchivePtr& archive, const GWXARFilePtr& file) {
    StreamCalls calls;
    GWSemaphore done(0);
    auto record = recordingHandler(calls);
    archive->extractDataForkOfFile(file, nullptr,
                                   [&](std::optional<std::span<const std::uint8_t>> data,
                                       bool isDone, bool checksumFailed, const GWErrorPtr& error) {
                                       const bool answer =
                                           record(data, isDone, checksumFailed, error);
                                       if (isDone) {
                                           done.signal();
                                       }
                                       return answer;
                                   });
    done.wait();
    return calls;
}

class GWXARArchiveRemote : public ServedFolderTest {
protected:
    GWXARArchivePtr open(const GWURL& url) {
        GWErrorPtr error;
        auto archive = GWXARArchive::initWithURL(url, false, &error);
        EXPECT_TRUE(archive) << (error ? error->localizedDescription() : "no error");
        return archive;
    }
};

}  // namespace

TEST_F(GWXARArchiveRemote, ABsdtarArchiveStreamsAndExtractsAsTheLocalFile) {
    if (!toolAvailable("bsdtar")) {
        GTEST_SKIP() << "bsdtar is not installed";
    }
    const std::string tree = directory_.file("tree");
    const auto made =
        runCommand("set -e; mkdir -p " + shellQuote(tree) + "/d; cd " + shellQuote(tree) +
                   "; printf 'hello\\n' > small; head -c 700000 /dev/urandom > d/random.bin;"
                   " seq 1 40000 > d/numbers.txt; ln -s ../small d/link; chmod 600 small;"
                   " cd ..; bsdtar -cf tree.xar --format xar tree 2>&1");
    ASSERT_EQ(made.status, 0) << made.output;

    auto local = open(directory_.url("tree.xar"));
    auto remote = open(server_->url("tree.xar"));
    ASSERT_TRUE(local && remote);
    EXPECT_TRUE(remote->checksumIsValid());
    std::vector<GWXARFilePtr> localFiles, remoteFiles;
    regularFiles(local->files(), localFiles);
    regularFiles(remote->files(), remoteFiles);
    ASSERT_EQ(remoteFiles.size(), localFiles.size());
    ASSERT_EQ(remoteFiles.size(), 3u);
    for (std::size_t index = 0; index < localFiles.size(); ++index) {
        const StreamCalls expected = streamed(local, localFiles[index]);
        const StreamCalls actual = streamed(remote, remoteFiles[index]);
        EXPECT_EQ(actual.bytes(), expected.bytes()) << remoteFiles[index]->name().value_or("");
        EXPECT_FALSE(actual.last().error);
        EXPECT_FALSE(actual.last().checksumFailed);
    }

    ASSERT_EQ(mkdir(directory_.file("by-local").c_str(), 0755), 0);
    ASSERT_EQ(mkdir(directory_.file("by-remote").c_str(), 0755), 0);
    GWErrorPtr error;
    ASSERT_TRUE(local->extractFile(local->fileWithPath("tree"), directory_.url("by-local/tree"),
                                   nullptr, &error));
    bool checksumIsInvalid = true;
    ASSERT_TRUE(remote->extractFile(remote->fileWithPath("tree"), directory_.url("by-remote/tree"),
                                    &checksumIsInvalid, &error))
        << error->localizedDescription();
    EXPECT_FALSE(checksumIsInvalid);
    const auto expected = snapshotTree(directory_.file("by-local/tree"));
    const auto actual = snapshotTree(directory_.file("by-remote/tree"));
    ASSERT_EQ(actual.size(), expected.size());
    for (const auto& [path, want] : expected) {
        ASSERT_TRUE(actual.count(path)) << path;
        const TreeItem& got = actual.at(path);
        EXPECT_EQ(got.mode, want.mode) << path;
        EXPECT_EQ(got.digest, want.digest) << path;
        EXPECT_EQ(got.linkText, want.linkText) << path;
        EXPECT_EQ(got.modificationSeconds, want.modificationSeconds) << path;
    }
}

TEST_F(GWXARArchiveRemote, HeaderAndTableOfContentsArriveInFewRequests) {
    XarBuilder xar;
    std::string files;
    for (int id = 1; id <= 3000; ++id) {
        files += xarFileElement(id, "file-" + std::to_string(id), "file", "0644",
                                xar.dataElement("data", textBytes(40, id), XarEncoding::none));
    }
    xar.setFiles(files);
    const GWData bytes = xar.bytes();
    writeFile(directory_.file("many.xar"), bytes);
    const std::uint64_t tocEnd = readXarTOC(bytes)->heapStart;

    server_->forgetRequests();
    auto remote = open(server_->url("many.xar"));
    ASSERT_TRUE(remote);
    EXPECT_TRUE(remote->checksumIsValid());
    EXPECT_EQ(remote->files().size(), 3000u);
    // The opening request, the rest of the TOC, and the checksum at the
    // heap's start, each at most a read-ahead block longer than needed.
    EXPECT_LE(server_->requests().size(), 3u);
    EXPECT_LE(server_->bodyBytesSent(), tocEnd + 64 * 1024);
}

TEST_F(GWXARArchiveRemote, AWrongStoredChecksumIsReportedAsLocally) {
    XarBuilder xar;
    xar.corruptStoredChecksum = true;
    xar.setFiles(xarFileElement(1, "a", "file", "0644",
                                xar.dataElement("data", bytesOf("abc"), XarEncoding::gzip)));
    xar.write(directory_.file("bad.xar"));
    auto remote = open(server_->url("bad.xar"));
    ASSERT_TRUE(remote);
    EXPECT_FALSE(remote->checksumIsValid());
    GWErrorPtr error;
    EXPECT_FALSE(GWXARArchive::initWithURL(server_->url("bad.xar"), true, &error));
    ASSERT_TRUE(error);
    EXPECT_TRUE(error->is(kGWXARArchiveErrorDomain, 5));
}
