// `gwarchive extract` of hostile archives: the folder given with -C is the
// only place anything is written, and each refused entry is reported while
// the rest of the batch goes on.

#include <gtest/gtest.h>

#include "ToolTestSupport.h"
#include "support/ContainmentSupport.h"
#include "support/HostileArchives.h"

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

}  // namespace
