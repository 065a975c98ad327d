// gwarchive on http URLs: large archives cost little more than the bytes
// asked for, and a connection that drops mid-entry fails that entry.

#include <gtest/gtest.h>

#include <algorithm>
#include <chrono>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <tuple>

#include "ToolTestSupport.h"
#include "support/ScriptedHTTPServer.h"
#include "support/ServedFolderTest.h"
#include "support/XarBuilder.h"
#include "support/ZipBuilder.h"
#include "xar/XarTestSupport.h"

using namespace gwtest;
namespace fs = std::filesystem;

namespace {

constexpr std::uint64_t kAllowance = 256 * 1024;

class GWArchiveToolRemote : public ServedFolderTest {};

}  // namespace

TEST_F(GWArchiveToolRemote, ListingTwoHundredThousandEntriesCostsTheDirectoryAndLittleMore) {
    StreamingZipWriter writer(directory_.file("many.zip"));
    for (int index = 0; index < 200000; ++index) {
        writer.add("d" + std::to_string(index / 1000) + "/f" + std::to_string(index), {});
    }
    ASSERT_TRUE(writer.finish());

    server_->forgetRequests();
    const std::string listing = directory_.file("listing.txt");
    ToolRun list =
        runTool("list " + shellQuote(server_->address("many.zip")) + " > " + shellQuote(listing));
    ASSERT_EQ(list.status, 0) << list.err;
    const GWData lines = readFile(listing);
    EXPECT_EQ(std::count(lines.begin(), lines.end(), '\n'), 200000 + 200);
    const std::uint64_t sent = server_->bodyBytesSent();
    RecordProperty("centralDirectoryBytes", std::to_string(writer.centralDirectorySize()));
    RecordProperty("bytesSent", std::to_string(sent));
    RecordProperty("requests", std::to_string(server_->requests().size()));
    EXPECT_GE(sent, writer.centralDirectorySize());
    EXPECT_LE(sent, writer.centralDirectorySize() + kAllowance);
    EXPECT_LE(server_->requests().size(), 4u);
}

TEST_F(GWArchiveToolRemote, AHugeResourceThatIsNoArchiveIsNotReadToItsEnd) {
    const std::string path = directory_.file("huge.bin");
    fs::resize_file((std::ofstream(path), path), 2ull << 30);
    server_->forgetRequests();
    EXPECT_EQ(runTool("list " + shellQuote(server_->address("huge.bin"))).status, 1);
    // The longest self-extractor stub searched, and the end record's window.
    EXPECT_LE(server_->bodyBytesSent(), (4u << 20) + kAllowance);
    EXPECT_LE(server_->requests().size(), 16u);
    fs::remove(path);
}

TEST_F(GWArchiveToolRemote, CatOfOneEntryOfAHugeArchiveCostsThatEntryAndLittleMore) {
    // 300 MiB of stored zeros between two small members, as a sparse file.
    const std::string path = directory_.file("huge.zip");
    StreamingZipWriter writer(path);
    const GWData first = textBytes(20000, 6), last = textBytes(50000, 7);
    writer.add("first.txt", first, 8);
    writer.addZeros("huge.bin", 300ull << 20);
    writer.add("last.txt", last, 8);
    ASSERT_TRUE(writer.finish());

    for (const auto& [name, index, content] :
         {std::tuple("first.txt", 0, &first), std::tuple("last.txt", 2, &last)}) {
        server_->forgetRequests();
        ToolRun cat = runTool("cat " + shellQuote(server_->address("huge.zip")) + " " + name);
        ASSERT_EQ(cat.status, 0) << cat.err;
        EXPECT_EQ(cat.out, std::string(content->begin(), content->end()));
        const std::uint64_t sent = server_->bodyBytesSent();
        EXPECT_LE(sent, writer.storedSize(index) + kAllowance) << name;
        RecordProperty(std::string(name) + ".storedBytes",
                       std::to_string(writer.storedSize(index)));
        RecordProperty(std::string(name) + ".bytesSent", std::to_string(sent));
    }
    fs::remove(path);
}

namespace {

// Three members, the middle one 400,000 random bytes stored as they are;
// `cut` lies halfway through it.
struct ArchiveWithCut {
    GWData bytes;
    std::uint64_t cut = 0;
};

ArchiveWithCut zipWithCut() {
    ZipBuilder zip;
    zip.addFile("before.txt", textBytes(3000, 8), 8);
    zip.addFile("cut.bin", randomBytes(400000, 9));
    zip.addFile("after.txt", textBytes(3000, 10), 8);
    GWData bytes = zip.bytes();
    return {std::move(bytes), zip.localHeaderOffsets()[1] + 200000};
}

ArchiveWithCut xarWithCut() {
    XarBuilder xar;
    std::string files;
    std::uint64_t cutInHeap = 0;
    int id = 0;
    for (const auto& [name, content] :
         {std::pair("before.txt", textBytes(3000, 8)), std::pair("cut.bin", randomBytes(400000, 9)),
          std::pair("after.txt", textBytes(3000, 10))}) {
        if (std::string(name) == "cut.bin") {
            cutInHeap = xar.nextHeapOffset() + 200000;
        }
        files += "<file id=\"" + std::to_string(++id) + "\"><name>" + name +
                 "</name><type>file</type><mode>0644</mode>" +
                 xar.dataElement("data", content, XarEncoding::none) + "</file>";
    }
    xar.setFiles(files);
    GWData bytes = xar.bytes();
    const std::uint64_t heapStart = readXarTOC(bytes)->heapStart;
    return {std::move(bytes), heapStart + cutInHeap};
}

}  // namespace

class GWArchiveToolDroppedConnection : public ::testing::TestWithParam<const char*> {};

TEST_P(GWArchiveToolDroppedConnection, AnEntryCutShortIsAnErrorNotAShortFile) {
    const std::string format = GetParam();
    const ArchiveWithCut archive = format == "zip" ? zipWithCut() : xarWithCut();
    ScriptedHTTPServer server(archive.bytes, ScriptedHTTPServer::Behaviour::dropAt, archive.cut);
    ASSERT_TRUE(server.running());
    const std::string address = shellQuote(server.address("cut." + format));
    // Each retry of the cut read meets the same cut.
    setenv("GWARCHIVE_HTTP_TIMEOUTS", "retry=1", 1);

    ToolRun cat = runTool("cat -v " + address + " cut.bin");
    EXPECT_EQ(cat.status, 1);
    EXPECT_NE(cat.err.find("(NSPOSIXErrorDomain 104)"), std::string::npos) << cat.err;
    EXPECT_LT(cat.out.size(), 400000u);

    ToolRun test = runTool("test " + address);
    EXPECT_EQ(test.status, 1);
    EXPECT_NE(test.out.find("cut.bin"), std::string::npos) << test.out;
    EXPECT_EQ(test.out.find("before.txt"), std::string::npos) << test.out;

    TemporaryDirectory directory;
    ToolRun extract = runTool("extract -C " + shellQuote(directory.path()) + " " + address);
    EXPECT_EQ(extract.status, 1);
    EXPECT_NE(extract.err.find("cut.bin"), std::string::npos) << extract.err;
    EXPECT_FALSE(fs::exists(directory.file("cut.bin")));
    EXPECT_EQ(readFile(directory.file("after.txt")), textBytes(3000, 10));
    // Nothing written aside is left behind either.
    std::size_t items = 0;
    for (const auto& entry : fs::directory_iterator(directory.path())) {
        (void)entry;
        ++items;
    }
    EXPECT_EQ(items, 2u);
    unsetenv("GWARCHIVE_HTTP_TIMEOUTS");
}

INSTANTIATE_TEST_SUITE_P(Formats, GWArchiveToolDroppedConnection, ::testing::Values("zip", "xar"));

// Rows name only what differs from a well-behaved server.
#pragma GCC diagnostic ignored "-Wmissing-field-initializers"

namespace {

using Script = ScriptedHTTPServer::Script;
using Behaviour = ScriptedHTTPServer::Behaviour;
using Validators = ScriptedHTTPServer::Validators;

// Four stored members of 60,000 random bytes; another seed gives another
// archive of the same size and layout.
std::vector<GWData> members(int seed) {
    std::vector<GWData> contents;
    for (int index = 0; index < 4; ++index) {
        contents.push_back(randomBytes(60000, seed * 10 + index));
    }
    return contents;
}

GWData storedZip(const std::vector<GWData>& contents) {
    ZipBuilder zip;
    for (std::size_t index = 0; index < contents.size(); ++index) {
        zip.addFile("m" + std::to_string(index) + ".bin", contents[index]);
    }
    return zip.bytes();
}

struct ServerFailure {
    const char* label;
    Script script;
    const char* command;
    int expected;
    int requestLimit = 100;
};

}  // namespace

TEST(GWArchiveToolMisbehavingServer, EachEndsInItsErrorWithoutWrongBytesOrSecrets) {
    const ServerFailure cases[] = {
        {"silent after accept", {Behaviour::silent}, "list", ETIMEDOUT, 1},
        {"stall after headers", {Behaviour::stallAt, 0}, "info", ETIMEDOUT, 1},
        {"one byte a second", {Behaviour::trickle}, "list", ETIMEDOUT, 1},
        // test gives up on the remaining members after the second one's time-out.
        {"declares more than it sends", {Behaviour::stallAt, 90000}, "test", ETIMEDOUT, 5},
        {"replaced, no validator", {.replaceAt = 3}, "extract", ESTALE},
        {"replaced, weak tag",
         {.validators = Validators::weakTagAndDate, .replaceAt = 3},
         "extract",
         ESTALE},
        {"replaced, strong tag",
         {.validators = Validators::strongTag, .replaceAt = 3},
         "extract",
         ESTALE},
        {"redirected to another file on the second request",
         {.location = "/other", .redirectAt = 2},
         "extract",
         ESTALE},
        {"credentials and a 404", {Behaviour::notFound}, "info", ENOENT, 1},
    };
    setenv("GWARCHIVE_HTTP_TIMEOUTS", "connect=1,stall=1,deadline=3,retry=10", 1);
    const std::vector<GWData> original = members(1);
    for (const ServerFailure& row : cases) {
        SCOPED_TRACE(row.label);
        Script script = row.script;
        // Without a validator only the size can tell.
        script.replacement = storedZip(members(script.validators == Validators::none ? 3 : 2));
        if (script.validators == Validators::none && script.replaceAt > 0) {
            script.replacement.push_back(0);
        }
        ScriptedHTTPServer server(storedZip(original), script);
        std::string address = server.address("a.zip");
        address.insert(address.find("://") + 3, "user:secret@");
        TemporaryDirectory directory;
        const std::string destination =
            row.command == std::string("extract") ? " -C " + shellQuote(directory.path()) : "";

        const auto started = std::chrono::steady_clock::now();
        ToolRun run =
            runTool(std::string(row.command) + " -v" + destination + " " + shellQuote(address));
        EXPECT_LT(std::chrono::steady_clock::now() - started, std::chrono::seconds(10));
        EXPECT_EQ(run.status, 1) << run.out;
        const std::string code = "NSPOSIXErrorDomain " + std::to_string(row.expected) + ")";
        EXPECT_NE((run.out + run.err).find(code), std::string::npos) << run.out << run.err;
        EXPECT_EQ((run.out + run.err).find("secret"), std::string::npos) << run.out << run.err;
        EXPECT_LE(server.requestCount(), row.requestLimit) << run.out << run.err;
        for (std::size_t index = 0; index < original.size(); ++index) {
            const std::string member = directory.file("m" + std::to_string(index) + ".bin");
            if (fs::exists(member)) {
                EXPECT_EQ(readFile(member), original[index]) << member;
            }
        }
    }
    unsetenv("GWARCHIVE_HTTP_TIMEOUTS");
}
