// XAR extraction stays inside the destination it was given, whatever names
// and links the table of contents holds.

#include <gtest/gtest.h>

#include "GWArchiveSupport/GWArchiveConstants.h"
#include "support/ContainmentSupport.h"
#include "support/HostileArchives.h"
#include "xar/GWXARArchive.h"

namespace {

using namespace gwtest;

bool endsWith(const std::string& text, const std::string& end) {
    return text.size() >= end.size() &&
           text.compare(text.size() - end.size(), end.size(), end) == 0;
}

class GWXARContainment : public ::testing::TestWithParam<HostileArchive> {};

TEST_P(GWXARContainment, NothingOutsideTheDestinationChanges) {
    ContainmentSandbox sandbox;
    TemporaryDirectory archives;
    writeFile(archives.file("hostile.xar"), GetParam().build(sandbox.parent()));
    const auto before = sandbox.outside();
    GWErrorPtr error;
    auto archive = GWXARArchive::initWithURL(archives.url("hostile.xar"), false, &error);
    ASSERT_TRUE(archive) << error->localizedDescription();
    std::vector<GWErrorPtr> refusals;
    int item = 0;
    for (const auto& file : archive->files()) {
        bool checksumIsInvalid = false;
        GWErrorPtr failure;
        const GWURL destination =
            sandbox.outURL().URLByAppendingPathComponent("item" + std::to_string(item++));
        if (!archive->extractFile(file, destination, &checksumIsInvalid, &failure)) {
            refusals.push_back(failure);
        }
    }
    EXPECT_EQ(sandbox.outside(), before);
    EXPECT_EQ(readFile(sandbox.canary()), bytesOf(ContainmentSandbox::kCanaryText));
    if (GetParam().refusedPath.empty()) {
        EXPECT_TRUE(refusals.empty());
        return;
    }
    ASSERT_EQ(refusals.size(), 1u);
    ASSERT_TRUE(refusals.front());
    EXPECT_TRUE(
        refusals.front()->is(kGWXARArchiveErrorDomain, GWXARArchiveEntryOutsideDestinationError))
        << refusals.front()->localizedDescription();
    EXPECT_TRUE(endsWith(refusals.front()->detailString(kGWXARArchiveUnknownEntityErrorKey),
                         GetParam().refusedPath));
}

INSTANTIATE_TEST_SUITE_P(Hostile, GWXARContainment, ::testing::ValuesIn(hostileXARArchives()),
                         [](const auto& info) { return info.param.name; });

}  // namespace
