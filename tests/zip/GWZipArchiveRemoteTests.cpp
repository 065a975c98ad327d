// ZIP archives read from an HTTP server list, stream and extract as the same
// file does locally, and cost about one pass over the central directory.

#include <gtest/gtest.h>

#include <cstring>
#include <fstream>

#include "support/ServedFolderTest.h"
#include "support/TestSupport.h"
#include "support/ZipBuilder.h"
#include "support/ZipExtraFields.h"
#include "tools/ToolTestSupport.h"
#include "zip/GWZipArchive.h"

namespace {

using namespace gwtest;

// Members of every kind the loader and the extractor treat differently.
ZipBuilder mixedArchive() {
    ZipBuilder zip;
    zip.addDirectory("docs/");
    zip.addFile("docs/readme.txt", textBytes(30000, 1), 8);
    zip.addFile("docs/notes.txt", textBytes(5000, 2), 12);
    zip.addFile("data/random.bin", randomBytes(900000, 3));
    zip.addFile("data/empty", {});
    zip.addFile("caf\xC3\xA9.txt", bytesOf("unicode name"), 8);
    zip.addSymlink("docs/link", "readme.txt");
    // Only the compressed size escaped: over HTTP no local header is read, so
    // the central record's Zip64 field alone says where the data ends.
    GWData escaped = textBytes(3000, 4);
    ZipEntry& zip64 = zip.addFile("docs/zip64.txt", escaped, 8);
    zip64.centralExtra = zipExtraBlock(0x0001, zip64Payload({zip64.storedBytes().size()}));
    zip64.localExtra =
        zipExtraBlock(0x0001, zip64Payload({escaped.size(), zip64.storedBytes().size()}));
    zip64.compressedSize = 0xFFFFFFFFu;
    // Stored entries each larger than a read-ahead block, side by side.
    for (int index = 0; index < 40; ++index) {
        zip.addFile("many/" + std::to_string(index), randomBytes(40000, 10 + index), 0);
    }
    return zip;
}

// Entries in the order a depth-first walk meets them.
void collect(const GWZipFileArray& files, std::vector<GWZipFilePtr>& into) {
    for (const GWZipFilePtr& file : files) {
        into.push_back(file);
        if (auto children = file->children()) {
            collect(*children, into);
        }
    }
}

GWData streamed(const GWZipArchivePtr& archive, const GWZipFilePtr& file, GWErrorPtr* failure) {
    GWData bytes;
    auto queue = std::make_shared<GWOperationQueue>();
    archive->extractDataForkOfFile(
        file, queue,
        [&](std::optional<std::span<const std::uint8_t>> data, bool, const GWErrorPtr& error) {
            if (data) {
                bytes.insert(bytes.end(), data->begin(), data->end());
            }
            if (error) {
                *failure = error;
            }
            return true;
        });
    queue->waitUntilAllOperationsAreFinished();
    return bytes;
}

class GWZipArchiveRemote : public ServedFolderTest {
protected:
    GWZipArchivePtr open(const GWURL& url) {
        GWErrorPtr error;
        auto archive = GWZipArchive::initWithURL(url, &error);
        EXPECT_TRUE(archive) << (error ? error->localizedDescription() : "no error");
        return archive;
    }
};

}  // namespace

TEST_F(GWZipArchiveRemote, ListsStreamsAndExtractsAsTheLocalFile) {
    mixedArchive().write(directory_.file("mixed.zip"));
    auto local = open(directory_.url("mixed.zip"));
    auto remote = open(server_->url("mixed.zip"));
    ASSERT_TRUE(local && remote);
    std::vector<GWZipFilePtr> localFiles, remoteFiles;
    collect(local->files(), localFiles);
    collect(remote->files(), remoteFiles);
    ASSERT_EQ(remoteFiles.size(), localFiles.size());
    for (std::size_t index = 0; index < localFiles.size(); ++index) {
        EXPECT_EQ(remoteFiles[index]->path(), localFiles[index]->path());
        EXPECT_EQ(remoteFiles[index]->permissionsMode(), localFiles[index]->permissionsMode());
        if (localFiles[index]->isDirectory()) {
            continue;  // implicit ones are dated when listed
        }
        EXPECT_EQ(remoteFiles[index]->modificationDate(), localFiles[index]->modificationDate());
        GWErrorPtr localError, remoteError;
        const GWData expected = streamed(local, localFiles[index], &localError);
        EXPECT_EQ(streamed(remote, remoteFiles[index], &remoteError), expected)
            << localFiles[index]->path();
        EXPECT_FALSE(localError || remoteError) << localFiles[index]->path();
    }

    GWErrorPtr error;
    ASSERT_TRUE(
        local->extractFiles(local->files(), directory_.url("by-local"), false, nullptr, &error));
    server_->forgetRequests();
    ASSERT_TRUE(
        remote->extractFiles(remote->files(), directory_.url("by-remote"), false, nullptr, &error))
        << error->localizedDescription();
    // Adjacent entries are fetched together, not in a request each (46).
    // Spans are sized from measured timings, so a loaded machine needs a few
    // more requests than an idle one (3).
    EXPECT_LE(server_->requests().size(), 12u);
    EXPECT_EQ(describeTree(directory_.file("by-remote")),
              describeTree(directory_.file("by-local")));
    EXPECT_NE(describeTree(directory_.file("by-remote")).find("random.bin"), std::string::npos);
}

TEST_F(GWZipArchiveRemote, AnArchiveBehindAStubOpensAndTheEndRecordFallbackStaysLocal) {
    // An executable without marker sections: only the end record near the
    // end says it carries a ZIP, which is looked for in local files alone.
    GWData image(0x400, 0);
    image[0] = 'M';
    image[1] = 'Z';
    image[8] = 4;
    image[0x3C] = 0x80;
    std::memcpy(image.data() + 0x80, "PE\0\0", 4);
    ZipBuilder zip;
    zip.addFile("inside.txt", bytesOf("packed"), 8);
    const GWData archive = zip.bytes();
    image.insert(image.end(), archive.begin(), archive.end());
    writeFile(directory_.file("setup.exe"), image);

    EXPECT_TRUE(GWZipArchive::isSelfExtractingZipArchiveAtURL(directory_.url("setup.exe")));
    EXPECT_FALSE(GWZipArchive::isSelfExtractingZipArchiveAtURL(server_->url("setup.exe")));
    EXPECT_FALSE(GWZipArchive::isZipArchiveAtURL(server_->url("setup.exe")));

    auto remote = open(server_->url("setup.exe"));
    ASSERT_TRUE(remote);
    EXPECT_EQ(remote->startOffset(), 0x400u);
    ASSERT_EQ(remote->files().size(), 1u);
    GWErrorPtr error;
    EXPECT_EQ(streamed(remote, remote->files()[0], &error), bytesOf("packed"));
    EXPECT_FALSE(error);
}

TEST_F(GWZipArchiveRemote, AMissingArchiveFailsToOpenWithFileNotFound) {
    GWErrorPtr error;
    EXPECT_FALSE(GWZipArchive::initWithURL(server_->url("absent.zip"), &error));
    ASSERT_TRUE(error);
    EXPECT_TRUE(error->is(kGWPOSIXErrorDomain, ENOENT)) << error->localizedDescription();
}
