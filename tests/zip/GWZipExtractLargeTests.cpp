// Extraction of an entry of several hundred MiB streams: memory stays
// bounded. Slow, so it runs only with GW_LARGE_TESTS=1.

#include <gtest/gtest.h>

#include <cstdlib>
#include <fstream>
#include <string>

#include "support/TestSupport.h"
#include "zip/GWZipArchive.h"
#include "zip/ZipExtractTestSupport.h"

namespace {

using namespace gwtest;

// The process's peak or current resident size in KiB ("VmHWM", "VmRSS").
long statusKiB(const std::string& field) {
    std::ifstream status("/proc/self/status");
    std::string line;
    while (std::getline(status, line)) {
        if (line.rfind(field + ":", 0) == 0) {
            return std::strtol(line.c_str() + field.size() + 1, nullptr, 10);
        }
    }
    return -1;
}

TEST(GWZipExtractLarge, AHugeEntryExtractsInBoundedMemory) {
    const char* enabled = std::getenv("GW_LARGE_TESTS");
    if (!enabled || std::string(enabled) != "1") {
        GTEST_SKIP() << "set GW_LARGE_TESTS=1 to run";
    }
    if (!toolAvailable("zip") || !toolAvailable("cmp")) {
        GTEST_SKIP() << "zip or cmp not installed";
    }
    TemporaryDirectory directory;
    const std::string source = directory.file("huge.bin");
    const std::string archive = directory.file("huge.zip");
    // Zeros deflate a thousandfold, the hardest case for bounded output;
    // a random tail checks that the bytes really are the right ones.
    ASSERT_EQ(runCommand("truncate -s 400M " + shellQuote(source) +
                         " && head -c 1048576 /dev/urandom >> " + shellQuote(source))
                  .status,
              0);
    ASSERT_EQ(
        runCommand("cd " + shellQuote(directory.path()) + " && zip -q -1 huge.zip huge.bin").status,
        0);
    auto opened = GWZipArchive::initWithURL(GWURL::fileURLWithPath(archive), nullptr);
    ASSERT_TRUE(opened);
    auto file = opened->fileWithPath("huge.bin");
    ASSERT_TRUE(file);

    const long before = statusKiB("VmRSS");
    ProgressLog progress;
    GWErrorPtr error;
    auto operation = GWZipExtractOperation::initForExtractingFile(
        file, GWURL::fileURLWithPath(archive), 0, directory.url("out/huge.bin"), true,
        progress.handler(), &error);
    runToEnd(operation);
    ASSERT_FALSE(operation->error()) << operation->error()->localizedDescription();
    EXPECT_EQ(progress.total, (400u << 20) + (1u << 20));
    EXPECT_EQ(runCommand("cmp -s " + shellQuote(source) + " " +
                         shellQuote(directory.file("out/huge.bin")))
                  .status,
              0);
    const long peak = statusKiB("VmHWM");
    RecordProperty("PeakRSSKiB", std::to_string(peak));
    std::printf("resident before: %ld KiB, peak: %ld KiB\n", before, peak);
    EXPECT_LT(peak - before, 32 * 1024) << "extraction should not hold the entry in memory";
}

}  // namespace
