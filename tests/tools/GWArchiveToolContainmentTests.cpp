// `gwarchive extract` of hostile archives: the folder given with -C is the
// only place anything is written, and each refused entry is reported while
// the rest of the batch goes on.

#include <gtest/gtest.h>

#include <filesystem>

#include "ToolTestSupport.h"
#include "support/ContainmentSupport.h"
#include "support/HostileArchives.h"
#include "support/XarBuilder.h"
#include "support/ZipBuilder.h"

namespace {

using namespace gwtest;

struct ToolCase {
    HostileArchive archive;
    std::string extension;
    std::string refusal;  // "domain code" as the tool prints it
};

std::vector<ToolCase> toolCases() {
    std::vector<ToolCase> cases;
    for (const auto& archive : hostileZipArchives()) {
        cases.push_back({archive, "zip", "GWZipArchiveErrorDomain 4"});
    }
    for (const auto& archive : hostileXARArchives()) {
        cases.push_back({archive, "xar", "GWXARArchiveErrorDomain 21"});
    }
    return cases;
}

void PrintTo(const ToolCase& test, std::ostream* out) {
    *out << test.extension << " " << test.archive.name;
}

class GWArchiveToolContainment : public ::testing::TestWithParam<ToolCase> {};

TEST_P(GWArchiveToolContainment, ExtractStaysInsideTheFolder) {
    const ToolCase& test = GetParam();
    for (const bool overwrite : {false, true}) {
        ContainmentSandbox sandbox;
        TemporaryDirectory archives;
        const std::string path = archives.file("hostile." + test.extension);
        writeFile(path, test.archive.build(sandbox.parent()));
        const auto before = sandbox.outside();
        ToolRun run = runTool(std::string("extract ") + (overwrite ? "--overwrite " : "") + "-C " +
                              shellQuote(sandbox.out()) + " " + shellQuote(path));
        EXPECT_EQ(sandbox.outside(), before) << run.err;
        EXPECT_EQ(readFile(sandbox.canary()), bytesOf(ContainmentSandbox::kCanaryText));
        if (!test.archive.refusedPath.empty()) {
            EXPECT_EQ(run.status, 1);
            EXPECT_NE(run.err.find(test.refusal), std::string::npos) << run.err;
            EXPECT_NE(run.err.find(test.archive.refusedPath), std::string::npos) << run.err;
        }
    }
}

INSTANTIATE_TEST_SUITE_P(Hostile, GWArchiveToolContainment, ::testing::ValuesIn(toolCases()),
                         [](const auto& info) {
                             return info.param.extension + info.param.archive.name;
                         });

// A link already in the folder (left by anyone) is not written through when
// a PATH below it is extracted on its own.
TEST(GWArchiveToolContainment, PathBelowALinkInTheFolderIsRefused) {
    ZipBuilder zip;
    zip.addFile("d/canary", bytesOf("replaced"));
    XarBuilder xar;
    xar.setFiles(
        "<file id=\"1\"><name>d</name><type>directory</type><file id=\"2\"><name>canary"
        "</name><type>file</type>" +
        xar.dataElement("data", bytesOf("replaced"), XarEncoding::none) + "</file></file>");
    const std::pair<std::string, GWData> archives[] = {{"zip", zip.bytes()}, {"xar", xar.bytes()}};
    for (const auto& [extension, bytes] : archives) {
        ContainmentSandbox sandbox;
        std::filesystem::create_directory_symlink(sandbox.parent(), sandbox.out() + "/d");
        TemporaryDirectory directory;
        const std::string path = directory.file("a." + extension);
        writeFile(path, bytes);
        const auto before = sandbox.outside();
        ToolRun run = runTool("extract --overwrite -C " + shellQuote(sandbox.out()) + " " +
                              shellQuote(path) + " d/canary");
        EXPECT_EQ(run.status, 1) << extension;
        EXPECT_NE(run.err.find(extension == "zip" ? "GWZipArchiveErrorDomain 4"
                                                  : "GWXARArchiveErrorDomain 21"),
                  std::string::npos)
            << run.err;
        EXPECT_EQ(sandbox.outside(), before) << extension;
    }
}

}  // namespace
