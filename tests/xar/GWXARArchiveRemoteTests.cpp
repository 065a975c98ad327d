// A XAR archive read from an HTTP server: the header and table of contents
// take few requests. Listing, streaming and extracting over HTTP as from the
// local file is checked through the tool (GWArchiveToolRemoteTests).

#include <gtest/gtest.h>

#include "XarExtractTestSupport.h"
#include "XarTestSupport.h"
#include "support/ServedFolderTest.h"

using namespace gwtest;

class GWXARArchiveRemote : public ServedFolderTest {};

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
    GWErrorPtr error;
    auto remote = GWXARArchive::initWithURL(server_->url("many.xar"), false, &error);
    ASSERT_TRUE(remote) << error->localizedDescription();
    EXPECT_TRUE(remote->checksumIsValid());
    EXPECT_EQ(remote->files().size(), 3000u);
    // The opening request, the rest of the TOC, and the checksum at the
    // heap's start, each at most a read-ahead block longer than needed.
    EXPECT_LE(server_->requests().size(), 3u);
    EXPECT_LE(server_->bodyBytesSent(), tocEnd + 64 * 1024);
}
