#include <gtest/gtest.h>

#include <arpa/inet.h>
#include <netinet/in.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <unistd.h>

#include <chrono>

#include <cerrno>

#include "foundation/GWHTTPRangeReader.h"
#include "foundation/GWRemoteFileHandle.h"
#include "support/NginxServer.h"
#include "support/ScriptedHTTPServer.h"
#include "support/ServedFolderTest.h"
#include "support/TestSupport.h"
#include "support/XarSigning.h"

namespace {

using gwtest::ScriptedHTTPServer;

// Every piece of a range read joined, and the error that ended it, if any.
struct RangeRead {
    GWData bytes;
    GWErrorPtr error;
    bool sawLast = false;
};

RangeRead readRange(GWRemoteFileHandle& handle, std::uint64_t offset, std::uint64_t length) {
    RangeRead result;
    handle.readDataAtOffset(offset, length, UINT64_MAX,
                            [&](GWRemoteFileHandle&, std::span<const std::uint8_t> piece,
                                bool isLast, const GWErrorPtr& error) {
                                result.bytes.insert(result.bytes.end(), piece.begin(), piece.end());
                                result.error = error;
                                result.sawLast = isLast;
                                return true;
                            });
    return result;
}

void expectPOSIXError(const GWErrorPtr& error, int number) {
    ASSERT_TRUE(error);
    EXPECT_EQ(error->domain(), kGWPOSIXErrorDomain) << error->localizedDescription();
    EXPECT_EQ(error->code(), number) << error->localizedDescription();
}

class GWRemoteFileHandleHTTPTest : public gwtest::ServedFolderTest {
protected:
    void SetUp() override {
        contents_ = gwtest::randomBytes(3 * 1000 * 1000 + 17, 5);
        gwtest::writeFile(directory_.file("data.bin"), contents_);
        gwtest::writeFile(directory_.file("empty"), {});
        ServedFolderTest::SetUp();
    }

    std::shared_ptr<GWRemoteFileHandle> open(const std::string& name, GWErrorPtr* error = nullptr) {
        return GWRemoteFileHandle::initForReadingFromURL(server_->url(name), error);
    }

    GWData slice(std::uint64_t offset, std::size_t length) const {
        return GWData(contents_.begin() + std::ptrdiff_t(offset),
                      contents_.begin() + std::ptrdiff_t(offset + length));
    }

    GWData contents_;
};

}  // namespace

TEST_F(GWRemoteFileHandleHTTPTest, ReadsAtPositionsAsALocalFileDoes) {
    GWErrorPtr error;
    auto handle = open("data.bin", &error);
    ASSERT_TRUE(handle) << error->localizedDescription();
    EXPECT_EQ(handle->fileSize(), contents_.size());
    EXPECT_TRUE(handle->isSeekable());

    for (std::uint64_t offset : {std::uint64_t(0), std::uint64_t(40000), std::uint64_t(2999990)}) {
        ASSERT_TRUE(handle->seekToFileOffset(offset, nullptr));
        auto bytes = handle->readDataOfLength(100000, &error);
        ASSERT_TRUE(bytes);
        EXPECT_EQ(*bytes, slice(offset, std::min<std::size_t>(100000, contents_.size() - offset)));
        EXPECT_EQ(handle->offsetInFile(), offset + bytes->size());
    }
    auto empty = handle->readDataOfLength(10, &error);
    ASSERT_TRUE(empty);
    EXPECT_TRUE(empty->empty());

    const RangeRead range = readRange(*handle, 12345, 1500000);
    EXPECT_FALSE(range.error);
    EXPECT_TRUE(range.sawLast);
    EXPECT_EQ(range.bytes, slice(12345, 1500000));
}

TEST_F(GWRemoteFileHandleHTTPTest, NearbySmallReadsCostOneRequestAndLargeOnesNoMoreThanAsked) {
    auto handle = open("data.bin");
    ASSERT_TRUE(handle);
    // 40 small records close together near the end, as central directory
    // records or local headers lie.
    const std::uint64_t base = contents_.size() - 20000;
    server_->forgetRequests();
    for (std::uint64_t record = 0; record < 40; ++record) {
        ASSERT_TRUE(handle->seekToFileOffset(base + record * 400, nullptr));
        auto bytes = handle->readDataOfLength(46, nullptr);
        ASSERT_TRUE(bytes);
        EXPECT_EQ(*bytes, slice(base + record * 400, 46));
    }
    EXPECT_LE(server_->requests().size(), 2u);

    server_->forgetRequests();
    ASSERT_TRUE(handle->seekToFileOffset(100000, nullptr));
    ASSERT_TRUE(handle->readDataOfLength(700000, nullptr));
    ASSERT_TRUE(handle->seekToFileOffset(900000, nullptr));
    ASSERT_TRUE(handle->readDataOfLength(10, nullptr));
    const auto requests = server_->requests();
    ASSERT_EQ(requests.size(), 2u);
    EXPECT_EQ(requests[0].bodyBytes, 700000u);
    EXPECT_EQ(requests[0].range, "bytes=100000-799999");
    // One kept-alive connection carries the handle's requests.
    EXPECT_EQ(requests[0].connection, requests[1].connection);

    // Announced ranges, as an extraction's entries with their headers: those
    // a small gap apart share requests, which every entry's own handle reads.
    server_->forgetRequests();
    std::vector<GWByteRange> entries;
    for (std::uint64_t entry = 0; entry < 60; ++entry) {
        entries.push_back({1000 + entry * 40000, 39000});
    }
    handle->willRead(entries);
    for (const GWByteRange& entry : entries) {
        auto reader = open("data.bin");
        ASSERT_TRUE(reader && reader->seekToFileOffset(entry.offset, nullptr));
        EXPECT_EQ(reader->readDataOfLength(entry.length, nullptr),
                  slice(entry.offset, entry.length));
    }
    EXPECT_LE(server_->requests().size(), 6u);
}

TEST_F(GWRemoteFileHandleHTTPTest, HandlesOfOneResourceShareItsSizeAndBlocks) {
    auto first = open("data.bin");
    ASSERT_TRUE(first);
    ASSERT_TRUE(first->seekToFileOffset(500000, nullptr));
    ASSERT_TRUE(first->readDataOfLength(10, nullptr));
    server_->forgetRequests();

    // As an extraction opens one handle per entry.
    auto second = open("data.bin");
    ASSERT_TRUE(second);
    EXPECT_EQ(second->fileSize(), contents_.size());
    ASSERT_TRUE(second->seekToFileOffset(500010, nullptr));
    EXPECT_EQ(second->readDataOfLength(100, nullptr), slice(500010, 100));
    EXPECT_TRUE(server_->requests().empty());
    ASSERT_TRUE(second->seekToFileOffset(2000000, nullptr));
    EXPECT_EQ(second->readDataOfLength(100, nullptr), slice(2000000, 100));
    EXPECT_EQ(server_->requests().size(), 1u);
}

TEST_F(GWRemoteFileHandleHTTPTest, AResourceReplacedUnderneathIsNoticedAndThenReread) {
    auto first = open("data.bin");
    ASSERT_TRUE(first);
    // Another size, then the same size: nginx's entity tag is made of the size and the time.
    gwtest::writeFile(directory_.file("data.bin"), gwtest::randomBytes(2000000, 6));
    ASSERT_TRUE(first->seekToFileOffset(1000000, nullptr));
    GWErrorPtr error;
    EXPECT_FALSE(first->readDataOfLength(10, &error));
    expectPOSIXError(error, ESTALE);

    auto second = open("data.bin");
    ASSERT_TRUE(second);
    const GWData replacement = gwtest::randomBytes(2000000, 8);
    gwtest::writeFile(directory_.file("data.bin"), replacement);
    ASSERT_EQ(gwtest::runCommand("touch -d '2001-02-03 04:05:06' " +
                                 gwtest::shellQuote(directory_.file("data.bin")))
                  .status,
              0);
    auto third = open("data.bin");
    ASSERT_TRUE(third);
    ASSERT_TRUE(third->seekToFileOffset(1000000, nullptr));
    EXPECT_FALSE(third->readDataOfLength(10, &error));
    expectPOSIXError(error, ESTALE);

    auto fourth = open("data.bin");
    ASSERT_TRUE(fourth);
    ASSERT_TRUE(fourth->seekToFileOffset(1000000, nullptr));
    EXPECT_EQ(fourth->readDataOfLength(10, nullptr),
              GWData(replacement.begin() + 1000000, replacement.begin() + 1000010));
}

TEST_F(GWRemoteFileHandleHTTPTest, EmptyMissingAndUnwritableResources) {
    GWErrorPtr error;
    auto handle = open("empty", &error);
    ASSERT_TRUE(handle) << error->localizedDescription();
    EXPECT_EQ(handle->fileSize(), 0u);
    auto bytes = handle->readDataOfLength(10, &error);
    ASSERT_TRUE(bytes);
    EXPECT_TRUE(bytes->empty());

    EXPECT_FALSE(open("nothing-here.zip", &error));
    expectPOSIXError(error, ENOENT);
    EXPECT_NE(error->localizedDescription().find("404"), std::string::npos);

    EXPECT_FALSE(GWRemoteFileHandle::initForWritingToURL(server_->url("new.bin"), &error));
    ASSERT_TRUE(error);
    EXPECT_TRUE(error->is(kGWCocoaErrorDomain, GWFileWriteUnsupportedSchemeError));
}

TEST(GWRemoteFileHandleMisbehavingServerTest, ADroppedConnectionFailsTheRangeWithoutShortData) {
    const GWData content = gwtest::randomBytes(600000, 3);
    ScriptedHTTPServer server(content, ScriptedHTTPServer::Behaviour::dropAt, 400000);
    const GWHTTPTimeouts saved = GWCurrentHTTPTimeouts();
    GWHTTPTimeouts quick = saved;
    quick.retryMilliseconds = 1;
    GWSetHTTPTimeouts(quick);
    GWErrorPtr error;
    auto handle = GWRemoteFileHandle::initForReadingFromURL(server.url(), &error);
    ASSERT_TRUE(handle) << error->localizedDescription();

    const RangeRead range = readRange(*handle, 100000, 500000);
    expectPOSIXError(range.error, ECONNRESET);
    EXPECT_TRUE(range.bytes.empty());

    ASSERT_TRUE(handle->seekToFileOffset(399990, nullptr));
    EXPECT_FALSE(handle->readDataOfLength(20, &error));
    expectPOSIXError(error, ECONNRESET);
    // The bytes before the cut are still there, over a new connection.
    ASSERT_TRUE(handle->seekToFileOffset(300000, nullptr));
    auto before = handle->readDataOfLength(50000, &error);
    ASSERT_TRUE(before);
    EXPECT_EQ(*before, GWData(content.begin() + 300000, content.begin() + 350000));
    GWSetHTTPTimeouts(saved);
}

// Rows name only what differs from a well-behaved server.
#pragma GCC diagnostic ignored "-Wmissing-field-initializers"

namespace {

// A port on 127.0.0.1 that never completes a connection: its listener takes
// no connection off a queue that is already full.
struct UnansweredPort {
    int listener = ::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0);
    std::vector<int> fillers;
    int port = 0;

    UnansweredPort() {
        sockaddr_in address{};
        address.sin_family = AF_INET;
        address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
        socklen_t length = sizeof address;
        if (::bind(listener, reinterpret_cast<sockaddr*>(&address), sizeof address) != 0 ||
            ::listen(listener, 0) != 0 ||
            ::getsockname(listener, reinterpret_cast<sockaddr*>(&address), &length) != 0) {
            return;
        }
        port = ntohs(address.sin_port);
        for (int index = 0; index < 3; ++index) {
            fillers.push_back(::socket(AF_INET, SOCK_STREAM | SOCK_NONBLOCK | SOCK_CLOEXEC, 0));
            ::connect(fillers.back(), reinterpret_cast<sockaddr*>(&address), sizeof address);
        }
        ::usleep(100000);
    }
    ~UnansweredPort() {
        for (int socket : fillers) {
            ::close(socket);
        }
        ::close(listener);
    }
};

using Script = ScriptedHTTPServer::Script;
using Behaviour = ScriptedHTTPServer::Behaviour;
using Validators = ScriptedHTTPServer::Validators;

struct ServerCase {
    const char* label;
    Script script;
    int expected;  // 0: the bytes of the file (the replacement, when redirected to it)
    bool failsAtOpen = false;
    const char* target = "archive";  // "refused": nobody listens; "unanswered": connect never ends
    bool announced = false;          // the range is fetched ahead before it is read
};

}  // namespace

// Time-outs, replaced resources and a 404 are rows of the tool's own table,
// which also checks that no wrong bytes are written; these are the rest.
TEST(GWRemoteFileHandleMisbehavingServerTest, EachEndsInItsErrorWithinTheTimeLimits) {
    const ServerCase cases[] = {
        {"no range support", {Behaviour::ignoreRanges}, ENOTSUP, true},
        {"another range", {Behaviour::wrongRange}, EPROTO, true},
        {"nobody listens", {}, ECONNREFUSED, true, "refused"},
        {"connect never answered", {}, ETIMEDOUT, true, "unanswered"},
        {"replaced while fetched ahead",
         {.validators = Validators::strongTag, .replaceAt = 2},
         ESTALE,
         false,
         "archive",
         true},
        {"stalls while fetched ahead",
         {Behaviour::stallAt, 150000},
         ETIMEDOUT,
         false,
         "archive",
         true},
        {"strong tag dropped",
         {.validators = Validators::strongTagDroppedLater, .replaceAt = 2},
         ESTALE},
        {"first request redirected to another host",
         {.location = "http://localhost:{port}/other", .redirectAt = 1},
         0},
        {"redirect loop", {.location = "/archive", .redirectAt = 0}, ELOOP, true},
        {"redirect to file:",
         {.location = "file:///etc/passwd", .redirectAt = 0},
         EPROTONOSUPPORT,
         true},
        {"redirect to link-local",
         {.location = "http://169.254.169.254/x", .redirectAt = 0},
         EPERM,
         true},
        {"redirect to private", {.location = "http://10.1.2.3/x", .redirectAt = 0}, EPERM, true},
        {"busy twice, then served", {.busyRequests = 2}, 0},
        {"range in a chunked trailer", {Behaviour::chunkedTrailer}, 0},
    };
    const GWHTTPTimeouts saved = GWCurrentHTTPTimeouts();
    GWHTTPTimeouts quick;
    quick.connectSeconds = quick.stallSeconds = 1;
    quick.deadlineSeconds = 3;
    quick.retryMilliseconds = 20;
    quick.retryAfterLimitSeconds = 0;
    GWSetHTTPTimeouts(quick);
    for (const ServerCase& row : cases) {
        SCOPED_TRACE(row.label);
        const GWData content = gwtest::randomBytes(200000, 4);
        Script script = row.script;
        script.replacement = gwtest::randomBytes(200000, 5);
        ScriptedHTTPServer server(content, script);
        UnansweredPort unanswered;
        std::string address = "http://user:secret@" + server.address().substr(7);
        if (row.target == std::string("refused")) {
            address = "http://127.0.0.1:" + std::to_string(gwtest::freeLocalPort()) + "/x";
        } else if (row.target == std::string("unanswered")) {
            address = "http://127.0.0.1:" + std::to_string(unanswered.port) + "/x";
        }
        const auto started = std::chrono::steady_clock::now();
        GWErrorPtr error;
        auto handle = GWRemoteFileHandle::initForReadingFromURL(
            GWURL::URLWithString(address).value_or(GWURL()), &error);
        std::optional<GWData> bytes;
        if (handle && row.announced) {
            const GWByteRange whole{0, content.size()};
            handle->willRead(std::span(&whole, 1));
        }
        if (handle && handle->seekToFileOffset(100000, nullptr)) {
            bytes = handle->readDataOfLength(100000, &error);
        }
        EXPECT_LT(std::chrono::steady_clock::now() - started, std::chrono::seconds(8));
        if (row.expected == 0) {
            ASSERT_TRUE(bytes) << error->localizedDescription();
            const GWData& served = script.redirectAt == 1 ? script.replacement : content;
            EXPECT_EQ(*bytes, GWData(served.begin() + 100000, served.end()));
            // Credentials stay with the host they were given for.
            EXPECT_EQ(server.requestsWithCredentials(),
                      script.redirectAt == 1 ? 1 : server.requestCount());
            continue;
        }
        EXPECT_EQ(!handle, row.failsAtOpen);
        EXPECT_FALSE(bytes);
        expectPOSIXError(error, row.expected);
        EXPECT_EQ(error->localizedDescription().find("secret"), std::string::npos);
        if (row.expected == ESTALE) {
            EXPECT_NE(
                error->localizedDescription().find("the remote file changed while it was read"),
                std::string::npos);
        }
    }
    GWSetHTTPTimeouts(saved);
}

TEST(GWRemoteFileHandleHTTPSTest, TheServerMustBeTrustedAndThenReadsAsOverHTTP) {
    if (!gwtest::NginxServer::available() || !gwtest::toolAvailable("openssl")) {
        GTEST_SKIP() << "nginx or openssl is not installed";
    }
    gwtest::TemporaryDirectory directory;
    const std::string certificate = directory.file("server.pem"), key = directory.file("key.pem");
    const auto made = gwtest::runCommand(
        "openssl req -x509 -newkey ec -pkeyopt ec_paramgen_curve:prime256v1 -nodes -days 2"
        " -subj /CN=127.0.0.1 -addext subjectAltName=IP:127.0.0.1 -keyout " +
        gwtest::shellQuote(key) + " -out " + gwtest::shellQuote(certificate) + " 2>&1");
    ASSERT_EQ(made.status, 0) << made.output;
    ASSERT_EQ(mkdir(directory.file("www").c_str(), 0755), 0);
    const GWData contents = gwtest::randomBytes(100000, 9);
    gwtest::writeFile(directory.file("www/data.bin"), contents);
    gwtest::NginxServer server(directory.file("www"), {{certificate, key}},
                               "    location = /down { return 302 http://127.0.0.1:9/x; }\n");
    ASSERT_TRUE(server.running()) << server.failure();

    GWErrorPtr error;
    EXPECT_FALSE(GWRemoteFileHandle::initForReadingFromURL(server.url("data.bin"), &error));
    expectPOSIXError(error, EPROTO);

    gwtest::TrustedRootScope trust(certificate);
    auto handle = GWRemoteFileHandle::initForReadingFromURL(server.url("data.bin"), &error);
    ASSERT_TRUE(handle) << error->localizedDescription();
    ASSERT_TRUE(handle->seekToFileOffset(60000, nullptr));
    EXPECT_EQ(handle->readDataOfLength(40000, nullptr),
              GWData(contents.begin() + 60000, contents.end()));
    // Never from https down to http.
    EXPECT_FALSE(GWRemoteFileHandle::initForReadingFromURL(server.url("down"), &error));
    expectPOSIXError(error, EPERM);
}
