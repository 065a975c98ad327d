// Streaming stored data out of a XAR heap to a data handler: the pieces, the
// single last call, the checksum verdict, refusals and unreadable streams.

#include <gtest/gtest.h>

#include <cerrno>

#include "GWArchiveSupport/GWArchiveConstants.h"
#include "XarExtractTestSupport.h"
#include "foundation/GWChecksum.h"

namespace {

using gwtest::XarBuilder;
using gwtest::XarEncoding;
using gwtest::xarFileElement;

// Everything a data handler was told, call by call.
struct StreamCalls {
    struct Call {
        std::optional<GWData> data;
        bool isDone = false;
        bool checksumFailed = false;
        GWErrorPtr error;
    };
    std::vector<Call> calls;

    GWData bytes() const {
        GWData joined;
        for (const auto& call : calls) {
            if (call.data) {
                joined.insert(joined.end(), call.data->begin(), call.data->end());
            }
        }
        return joined;
    }
    const Call& last() const { return calls.back(); }
};

// A handler that records each call into `calls` and refuses the call with
// index `refuseAt` (never when negative).
GWXARDataHandler recordingHandler(StreamCalls& calls, int refuseAt = -1) {
    return [&calls, refuseAt](std::optional<std::span<const std::uint8_t>> data, bool isDone,
                              bool checksumFailed, const GWErrorPtr& error) {
        StreamCalls::Call call;
        if (data) {
            call.data = GWData(data->begin(), data->end());
        }
        call.isDone = isDone;
        call.checksumFailed = checksumFailed;
        call.error = error;
        calls.calls.push_back(std::move(call));
        return int(calls.calls.size()) - 1 != refuseAt;
    };
}

// More than one decoder piece, so that the stream really comes in parts.
const GWData kLargeContent = gwtest::randomBytes(3 * 1024 * 1024 + 17, 7);

class DataStream : public ::testing::TestWithParam<XarEncoding> {
protected:
    GWXARArchivePtr open(XarBuilder& xar, const std::string& body) {
        xar.setFiles(body);
        return gwtest::openBuiltXar(xar, directory);
    }

    gwtest::TemporaryDirectory directory;
};

TEST_P(DataStream, PiecesJoinToTheContentAndOnlyTheLastIsDone) {
    XarBuilder xar;
    std::string inner = xar.dataElement("data", kLargeContent, GetParam());
    for (const char* name : {"user.one", "user.two"}) {
        inner += xar.dataElement("ea", gwtest::bytesOf(name), GetParam(), "md5",
                                 "<name>" + std::string(name) + "</name>");
    }
    auto archive = open(xar, xarFileElement(1, "big", "file", "0644", inner));
    ASSERT_TRUE(archive);

    StreamCalls calls;
    archive->extractDataForkOfFile(archive->fileWithPath("big"), nullptr, recordingHandler(calls));
    ASSERT_GE(calls.calls.size(), 2u);
    for (std::size_t i = 0; i + 1 < calls.calls.size(); ++i) {
        EXPECT_FALSE(calls.calls[i].isDone) << i;
        EXPECT_FALSE(calls.calls[i].error) << i;
    }
    EXPECT_TRUE(calls.last().isDone);
    EXPECT_FALSE(calls.last().checksumFailed);
    EXPECT_FALSE(calls.last().error);
    EXPECT_EQ(calls.bytes(), kLargeContent);

    // Attributes are found by name.
    StreamCalls attribute;
    archive->extractExtendedAttribute("user.two", archive->fileWithPath("big"), nullptr,
                                      recordingHandler(attribute));
    EXPECT_EQ(attribute.bytes(), gwtest::bytesOf("user.two"));
    EXPECT_TRUE(attribute.last().isDone);
    EXPECT_FALSE(attribute.last().checksumFailed);
}

INSTANTIATE_TEST_SUITE_P(Encodings, DataStream,
                         ::testing::Values(XarEncoding::none, XarEncoding::gzip,
                                           XarEncoding::bzip2));

class DataStreamContract : public ::testing::Test {
protected:
    // One regular file "f" holding `content`, plus whatever `more` adds.
    GWXARArchivePtr openWithFile(const GWData& content, const std::string& more = "",
                                 const std::string& data = "") {
        const std::string element =
            data.empty() ? xar.dataElement("data", content, XarEncoding::gzip) : data;
        xar.setFiles(xarFileElement(1, "f", "file", "0644", element) + more);
        return gwtest::openBuiltXar(xar, directory);
    }

    StreamCalls dataFork(const GWXARArchivePtr& archive, const std::string& path,
                         int refuseAt = -1) {
        StreamCalls calls;
        archive->extractDataForkOfFile(archive->fileWithPath(path), nullptr,
                                       recordingHandler(calls, refuseAt));
        return calls;
    }

    gwtest::TemporaryDirectory directory;
    XarBuilder xar;
};

TEST_F(DataStreamContract, MismatchedDigestDeliversAllDataThenTheVerdict) {
    const GWData content = gwtest::textBytes(100000, 3);
    const std::string bad = gwtest::hex(GWChecksum::checksumForData(gwtest::bytesOf("x"), 5));
    // The digest of the decoded bytes, then that of the stored ones, replaced by another.
    for (const GWData& digested : {content, gwtest::xarEncode(content, XarEncoding::gzip)}) {
        std::string element = xar.dataElement("data", content, XarEncoding::gzip);
        const std::string good = gwtest::hex(GWChecksum::checksumForData(digested, 5));
        ASSERT_NE(element.find(good), std::string::npos);
        element.replace(element.find(good), good.size(), bad);
        auto archive = openWithFile(content, "", element);
        ASSERT_TRUE(archive);

        const auto calls = dataFork(archive, "f");
        ASSERT_FALSE(calls.calls.empty());
        EXPECT_EQ(calls.bytes(), content);
        EXPECT_TRUE(calls.last().isDone);
        EXPECT_TRUE(calls.last().checksumFailed);
        EXPECT_FALSE(calls.last().error);
        for (std::size_t i = 0; i + 1 < calls.calls.size(); ++i) {
            EXPECT_FALSE(calls.calls[i].checksumFailed) << "verdict before the end, call " << i;
        }
    }

    // No digest stored at all counts as a mismatch.
    auto bare = openWithFile(content, "", xar.dataElement("data", content, XarEncoding::none, ""));
    ASSERT_TRUE(bare);
    const auto bareCalls = dataFork(bare, "f");
    EXPECT_EQ(bareCalls.bytes(), content);
    EXPECT_TRUE(bareCalls.last().checksumFailed);
}

TEST_F(DataStreamContract, RefusingHandlerGetsExactlyOneCancelledCall) {
    auto archive = openWithFile(kLargeContent);
    ASSERT_TRUE(archive);
    const auto calls = dataFork(archive, "f", 0);
    ASSERT_EQ(calls.calls.size(), 2u);
    const auto& last = calls.calls[1];
    EXPECT_FALSE(last.data);
    EXPECT_TRUE(last.isDone);
    ASSERT_TRUE(last.error);
    EXPECT_TRUE(last.error->is(kGWCocoaErrorDomain, GWUserCancelledError));
    EXPECT_TRUE(archive->isCancelled());

    // The next extraction starts afresh.
    const auto again = dataFork(archive, "f");
    EXPECT_EQ(again.bytes(), kLargeContent);
    EXPECT_FALSE(archive->isCancelled());
}

TEST_F(DataStreamContract, XzDecodesUnderEitherStyle) {
    const GWData content = gwtest::textBytes(300000, 3);
    for (const char* style : {"application/x-xz", "application/x-lzma"}) {
        std::string element = xar.dataElement("data", content, XarEncoding::xz);
        element.replace(element.find("application/x-xz"), 16, style);
        auto archive = openWithFile(content, "", element);
        ASSERT_TRUE(archive);
        const auto calls = dataFork(archive, "f");
        EXPECT_EQ(calls.bytes(), content) << style;
        EXPECT_FALSE(calls.last().error) << style;
        EXPECT_FALSE(calls.last().checksumFailed) << style;
    }
}

// A fuzzed archive: 155 bytes of bzip2 stated to hold 300 bytes decoded to
// 12 MB, digested with MD2 for half a minute. A stream short of its stated
// size is as wrong.
TEST_F(DataStreamContract, StreamsEndAtTheirStatedSizeOrFail) {
    const GWData zeros(8 * 1024 * 1024, 0);
    for (const std::string stated : {"300", "8388609"}) {
        std::string element = xar.dataElement("data", zeros, XarEncoding::bzip2, "md2");
        const std::string real = "<size>" + std::to_string(zeros.size()) + "</size>";
        element.replace(element.find(real), real.size(), "<size>" + stated + "</size>");
        auto archive = openWithFile({}, "", element);
        ASSERT_TRUE(archive);

        const auto calls = dataFork(archive, "f");
        ASSERT_FALSE(calls.calls.empty());
        EXPECT_LE(calls.bytes().size(), std::stoull(stated));
        EXPECT_TRUE(calls.last().isDone);
        ASSERT_TRUE(calls.last().error);
        EXPECT_TRUE(calls.last().error->is(kGWXARArchiveErrorDomain, 23)) << stated;
        EXPECT_EQ(calls.last().error->detailString(kGWXARArchiveUnknownEntityErrorKey), stated);
    }
}

TEST_F(DataStreamContract, LinksResolveBeforeReading) {
    const GWData content = gwtest::bytesOf("target bytes");
    const std::string more =
        xarFileElement(3, "s", "symlink", "0777", "<link type=\"file\">f</link>") +
        xarFileElement(4, "empty-link", "symlink", "0777") +
        "<file id=\"5\"><name>h1</name><type link=\"1\">hardlink</type><mode>0644</mode></file>" +
        "<file id=\"6\"><name>h2</name><type link=\"5\">hardlink</type><mode>0644</mode></file>" +
        xarFileElement(8, "empty", "file", "0644");
    auto archive = openWithFile(content, more);
    ASSERT_TRUE(archive);

    auto linkCalls = dataFork(archive, "s");
    ASSERT_EQ(linkCalls.calls.size(), 1u);
    EXPECT_EQ(linkCalls.bytes(), gwtest::bytesOf("f"));
    EXPECT_TRUE(linkCalls.last().isDone);
    EXPECT_FALSE(linkCalls.last().error);

    auto emptyLinkCalls = dataFork(archive, "empty-link");
    ASSERT_EQ(emptyLinkCalls.calls.size(), 1u);
    ASSERT_TRUE(emptyLinkCalls.last().data);
    EXPECT_TRUE(emptyLinkCalls.last().data->empty());
    EXPECT_FALSE(emptyLinkCalls.last().error);

    // An attribute of a link is its link text too; that is how items resolve.
    StreamCalls attributeOfLink;
    auto link = archive->fileWithPath("s");
    auto reference = GWXARDataReference::init();
    archive->extractDataReference(reference, link, nullptr, recordingHandler(attributeOfLink));
    EXPECT_EQ(attributeOfLink.bytes(), gwtest::bytesOf("f"));

    auto chainCalls = dataFork(archive, "h2");
    EXPECT_EQ(chainCalls.bytes(), content);
    EXPECT_TRUE(chainCalls.last().isDone);
    EXPECT_FALSE(chainCalls.last().error);

    // Writers leave the data element out of empty files.
    auto emptyCalls = dataFork(archive, "empty");
    ASSERT_EQ(emptyCalls.calls.size(), 1u);
    EXPECT_TRUE(emptyCalls.last().isDone);
    EXPECT_FALSE(emptyCalls.last().error);
    EXPECT_TRUE(emptyCalls.bytes().empty());
}

// Streams that cannot be read: one last call, done and with the error, after
// pieces that carried none. A zero code accepts any error.
TEST_F(DataStreamContract, UnreadableStreamsEndWithOneError) {
    using Damage = std::function<void(GWXARArchive&, const std::string& path)>;
    const struct {
        const char* what;
        const char* path;
        Damage damage;
        std::string domain;
        long code;
        std::string entity = {};
    } cases[] = {
        {"unknown compression", "f",
         [](GWXARArchive& a, auto&) { a.fileWithPath("f")->dataFork()->setCompressionType(5); },
         kGWXARArchiveErrorDomain, 13, "5"},
        // Pointed at the table-of-contents digest: not a zlib stream.
        {"damaged stream", "f",
         [this](GWXARArchive& a, auto&) {
             auto fork = a.fileWithPath("f")->dataFork();
             fork->setOffset(fork->offset() - xar.digestLength());
         },
         "", 0},
        {"past the end of the file", "f",
         [](GWXARArchive& a, auto&) {
             a.fileWithPath("f")->dataFork()->setCompressedSize(1u << 30);
         },
         "", 0},
        {"archive file gone", "f", [](GWXARArchive& a, auto&) { unlink(a.URL().path().c_str()); },
         "", 0},
        {"directory", "d", nullptr, kGWPOSIXErrorDomain, EISDIR},
        {"fifo", "p", nullptr, kGWPOSIXErrorDomain, EINVAL},
        {"entry of another archive", "other", nullptr, kGWXARArchiveErrorDomain, 3},
        {"missing attribute", "user.none", nullptr, kGWXARArchiveErrorDomain, 4, "user.none"},
    };
    for (const auto& c : cases) {
        SCOPED_TRACE(c.what);
        auto archive =
            openWithFile(gwtest::textBytes(5000, 9), xarFileElement(2, "d", "directory", "0755") +
                                                         xarFileElement(7, "p", "fifo", "0644"));
        ASSERT_TRUE(archive);
        auto other = gwtest::openBuiltXar(xar, directory, "other.xar");
        if (c.damage) {
            c.damage(*archive, c.path);
        }
        StreamCalls calls;
        const std::string path = c.path;
        if (path == "other") {
            archive->extractDataForkOfFile(other->fileWithPath("f"), nullptr,
                                           recordingHandler(calls));
        } else if (path.starts_with("user.")) {
            archive->extractExtendedAttribute(path, archive->fileWithPath("f"), nullptr,
                                              recordingHandler(calls));
        } else {
            calls = dataFork(archive, path);
        }
        ASSERT_FALSE(calls.calls.empty());
        EXPECT_TRUE(calls.last().isDone);
        ASSERT_TRUE(calls.last().error);
        for (std::size_t i = 0; i + 1 < calls.calls.size(); ++i) {
            EXPECT_FALSE(calls.calls[i].error) << i;
        }
        if (c.code) {
            EXPECT_TRUE(calls.last().error->is(c.domain, c.code))
                << calls.last().error->localizedDescription();
            EXPECT_EQ(calls.last().error->detailString(kGWXARArchiveUnknownEntityErrorKey),
                      c.entity);
        }
        if (c.domain == kGWXARArchiveErrorDomain) {
            EXPECT_EQ(calls.last().error->URL(), archive->URL());
        }
    }
}

}  // namespace
