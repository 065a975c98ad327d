// Length fields are claims: archives that claim enormous tables, counts,
// forks or sizes fail with the documented error without the memory they
// claim and write no more than they declare; small tables of contents that
// describe enormous trees or repeat heap references stay bounded too.
// Measured in the tool's own process, so the test binary's footprint does
// not count.

#include <gtest/gtest.h>

#include <algorithm>
#include <chrono>
#include <filesystem>
#include <functional>

#include "ToolTestSupport.h"
#include "support/MacBinaryBuilder.h"
#include "support/XarBuilder.h"
#include "support/ZipBuilder.h"

namespace {

using namespace gwtest;

constexpr long kResidentLimitKiB = 100 * 1024;
#ifdef GW_SANITIZED
// Shadow memory, redzones and slower code: the sanitizers' cost, not the tool's.
// Redzones alone make 100,000 small signature objects 4.2 times larger
// (77 MiB without sanitizers, 321 MiB with them).
constexpr long kSanitizerFactor = 5;
#else
constexpr long kSanitizerFactor = 1;
#endif
constexpr std::uint64_t kTenGiB = 10ull << 30;

void putBE32(GWData& bytes, std::size_t at, std::uint32_t value) {
    for (int i = 0; i < 4; ++i)
        bytes[at + i] = std::uint8_t(value >> (24 - 8 * i));
}

void putLE64(GWData& bytes, std::size_t at, std::uint64_t value) {
    for (int i = 0; i < 8; ++i)
        bytes[at + i] = std::uint8_t(value >> (8 * i));
}

struct HugeCase {
    const char* name;
    const char* fileName;
    std::function<GWData()> build;
    std::vector<std::string> command;  // before the input path; "OUT" is a fresh folder
    bool withOutput;                   // an output path follows the input
    const char* error;                 // as the tool prints it; "" when it succeeds
    long residentLimitKiB = kResidentLimitKiB;
    std::uint64_t maxWritten = 0;  // bytes the run may leave in the folder
};

// A stream that decodes to 16 MiB while its headers claim 100 bytes.
GWData zipBomb(std::uint16_t method) {
    ZipBuilder zip;
    zip.addFile("bomb", GWData(16 << 20, 0), method).uncompressedSize = 100;
    return zip.bytes();
}

// Many files whose data references all point at one heap range, each
// claiming `size` bytes.
GWData xarSharingOneRange(std::size_t count, const std::string& size) {
    XarBuilder xar;
    std::string data = xar.dataElement("data", GWData(16 << 20, 0), XarEncoding::bzip2);
    const auto at = data.find("<size>");
    data.replace(at, data.find("</size>") - at, "<size>" + size);
    std::string files;
    for (std::size_t i = 1; i <= count; ++i)
        files += "<file id=\"" + std::to_string(i) + "\"><name>f" + std::to_string(i) +
                 "</name><type>file</type>" + data + "</file>";
    xar.setFiles(files);
    return xar.bytes();
}

std::uint64_t bytesBelow(const std::string& root) {
    std::uint64_t total = 0;
    std::error_code ignored;
    for (auto it = std::filesystem::recursive_directory_iterator(root, ignored);
         it != std::filesystem::recursive_directory_iterator(); it.increment(ignored))
        if (it->is_regular_file(ignored))
            total += it->file_size(ignored);
    return total;
}

// A XAR whose table of contents holds `body` and whose heap holds `heap`
// after the table's own digest.
GWData xarWith(const std::string& body, const GWData& heap = {}) {
    XarBuilder xar;
    xar.addHeapBytes(heap);
    xar.setFiles(body);
    return xar.bytes();
}

std::string repeated(const std::string& text, std::size_t count) {
    std::string all;
    all.reserve(text.size() * count);
    for (std::size_t i = 0; i < count; ++i)
        all += text;
    return all;
}

void PrintTo(const HugeCase& test, std::ostream* out) {
    *out << test.name;
}

const HugeCase kHugeCases[] = {
    {"XARTableOfContentsClaimingTenGiB",
     "huge.xar",
     [] {
         XarBuilder xar;
         xar.setFiles("<file id=\"1\"><name>a</name><type>file</type></file>");
         xar.compressedTOCLength = kTenGiB;
         xar.uncompressedTOCLength = kTenGiB;
         return xar.bytes();
     },
     {"list"},
     false,
     "NSCocoaErrorDomain 259"},
    {"XARTableOfContentsInflatingToTenGiB",
     "inflating.xar",
     [] {
         XarBuilder xar;
         xar.setFiles("<file id=\"1\"><name>a</name><type>file</type></file>");
         xar.uncompressedTOCLength = kTenGiB;
         return xar.bytes();
     },
     {"list"},
     false,
     "NSCocoaErrorDomain 259"},
    // Small when compressed, tens of millions of nodes when parsed.
    {"XARTableOfContentsOfTwelveMillionElements",
     "nodes.xar",
     [] { return xarWith(repeated("<x/>", 12'000'000)); },
     {"list"},
     false,
     "NSCocoaErrorDomain 259",
     512 * 1024},
    {"XARTableOfContentsOfHalfAMillionEntries",
     "entries.xar",
     [] { return xarWith(repeated("<file><name>f</name></file>", 500'000)); },
     {"list"},
     false,
     "NSCocoaErrorDomain 259",
     512 * 1024},
    // Every signature names the same 16 KiB of a 20 MiB heap.
    {"XARSignaturesSharingOneHeapRange",
     "signatures.xar",
     [] {
         return xarWith(
             repeated("<signature style=\"RSA\"><offset>20</offset><size>16384</size></signature>",
                      100'000),
             GWData(20u << 20, 0x5a));
     },
     {"info"},
     false,
     ""},
    {"XARChecksumPointingAtTwentyMiB",
     "checksum.xar",
     [] {
         return xarWith(
             "<file id=\"1\"><name>a</name><data><archived-checksum style=\"sha1\">"
             "<offset>20</offset><size>20971520</size></archived-checksum></data>"
             "</file>",
             GWData(20u << 20, 0x5a));
     },
     {"list"},
     false,
     "GWXARArchiveErrorDomain 20"},
    {"Zip64EndRecordClaimingTwoToTheSixtyEntries",
     "many.zip",
     [] {
         ZipBuilder zip;
         zip.zip64EndRecord = true;
         zip.addFile("a", bytesOf("one entry"));
         GWData bytes = zip.bytes();
         const GWData signature{'P', 'K', 6, 6};
         auto at = std::search(bytes.begin(), bytes.end(), signature.begin(), signature.end());
         const std::size_t record = std::size_t(at - bytes.begin());
         putLE64(bytes, record + 24, 1ull << 60);  // entries on this disk
         putLE64(bytes, record + 32, 1ull << 60);  // entries in all
         return bytes;
     },
     {"list"},
     false,
     "central directory missing: 1 entries recovered"},
    {"MacBinaryClaimingFourGiBForks",
     "huge.bin",
     [] {
         MacBinaryFile file;
         file.dataFork = bytesOf("a little data");
         file.resourceFork = bytesOf("a little resource");
         GWData bytes = buildMacBinary(file);
         putBE32(bytes, 83, 0xFFFFFFFF);
         putBE32(bytes, 87, 0xFFFFFFFF);
         resealMacBinaryHeader(bytes);
         return bytes;
     },
     // A fork piece that is not there cannot be read.
     {"macbinary"},
     true,
     "NSCocoaErrorDomain 256"},
    {"ZipDeflateBombLyingAboutItsSize",
     "deflate.zip",
     [] { return zipBomb(8); },
     {"extract", "-C", "OUT"},
     false,
     "GWZipArchiveErrorDomain 6"},
    {"ZipBzip2BombLyingAboutItsSize",
     "bzip2.zip",
     [] { return zipBomb(12); },
     {"extract", "-C", "OUT"},
     false,
     "GWZipArchiveErrorDomain 6"},
    {"XARFilesSharingOneHeapRangeClaimingATerabyte",
     "shared.xar",
     [] { return xarSharingOneRange(1000, std::to_string(1ull << 30)); },
     {"extract", "-C", "OUT"},
     false,
     "NSPOSIXErrorDomain 28"},
    {"XARFilesSharingOneHeapRangeEachStoppedAtItsSize",
     "stopped.xar",
     [] { return xarSharingOneRange(200, "1000"); },
     {"extract", "-C", "OUT"},
     false,
     "GWXARArchiveErrorDomain 23",
     kResidentLimitKiB,
     200 * 1000},
};

class GWArchiveToolHugeLength : public ::testing::TestWithParam<HugeCase> {};

TEST_P(GWArchiveToolHugeLength, FailsInBoundedMemory) {
    TemporaryDirectory directory;
    const std::string input = directory.file(GetParam().fileName);
    writeFile(input, GetParam().build());
    const std::string out = directory.file("out");
    std::vector<std::string> arguments = GetParam().command;
    std::replace(arguments.begin(), arguments.end(), std::string("OUT"), out);
    arguments.insert(arguments.begin() + 1, "-v");  // errors with domain and code
    arguments.push_back(input);
    if (GetParam().withOutput)
        arguments.push_back(directory.file("out"));
    const auto started = std::chrono::steady_clock::now();
    const MeasuredToolRun run = runToolMeasured(arguments);
    EXPECT_LT(std::chrono::steady_clock::now() - started,
              std::chrono::seconds(5 * kSanitizerFactor));
    EXPECT_EQ(run.status, *GetParam().error ? 1 : 0) << run.err;
    EXPECT_NE(run.err.find(GetParam().error), std::string::npos) << run.err;
    EXPECT_GT(run.maxResidentKiB, 0);
    EXPECT_LT(run.maxResidentKiB, GetParam().residentLimitKiB * kSanitizerFactor);
    EXPECT_LE(bytesBelow(out), GetParam().maxWritten);
    RecordProperty("maxResidentKiB", std::to_string(run.maxResidentKiB));
}

INSTANTIATE_TEST_SUITE_P(Claims, GWArchiveToolHugeLength, ::testing::ValuesIn(kHugeCases),
                         [](const auto& info) { return std::string(info.param.name); });

}  // namespace
