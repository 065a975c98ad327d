#include "foundation/GWContainment.h"

#include <gtest/gtest.h>
#include <unistd.h>

#include <filesystem>

#include "support/TestSupport.h"

namespace {

using gwtest::TemporaryDirectory;

GWURL fileURL(const std::string& path) {
    return GWURL::fileURLWithPath(path);
}

TEST(GWContainment, RelativePathsBelowARoot) {
    const GWURL root = fileURL("/data/out");
    EXPECT_EQ(GWRelativePathBelow(root, fileURL("/data/out/a/b")), "a/b");
    EXPECT_EQ(GWRelativePathBelow(fileURL("/"), fileURL("/x")), "x");
    // The root itself, a sibling sharing its prefix, and climbing names.
    EXPECT_FALSE(GWRelativePathBelow(root, root));
    EXPECT_FALSE(GWRelativePathBelow(root, fileURL("/data/outside/a")));
    EXPECT_FALSE(GWRelativePathBelow(root, root.URLByAppendingPathComponent("../x")));
    EXPECT_FALSE(GWRelativePathBelow(root, root.URLByAppendingPathComponent("a/../../x")));
    EXPECT_FALSE(GWRelativePathBelow(root, root.URLByAppendingPathComponent("./x")));
    EXPECT_FALSE(GWRelativePathBelow(root, root.URLByAppendingPathComponent("/etc/x")));
    EXPECT_FALSE(GWRelativePathBelow(root, *GWURL::URLWithString("https://host/data/out/x")));
}

TEST(GWContainment, PlainComponents) {
    EXPECT_TRUE(GWIsPlainPathComponent("name"));
    EXPECT_TRUE(GWIsPlainPathComponent("..."));
    for (const std::string& bad : {std::string(), std::string("."), std::string(".."),
                                   std::string("a/b"), std::string("a\0b", 3)}) {
        EXPECT_FALSE(GWIsPlainPathComponent(bad)) << bad;
    }
}

TEST(GWContainment, LinksAndFilesOnTheWayAreRefused) {
    TemporaryDirectory directory;
    const GWURL root = directory.url("out");
    std::filesystem::create_directories(directory.file("out/real/deeper"));
    std::filesystem::create_directory_symlink(directory.path(), directory.file("out/up"));
    gwtest::writeFile(directory.file("out/file"), gwtest::bytesOf("x"));

    EXPECT_TRUE(GWIsContainedDestination(root, directory.url("out/real/deeper/new")));
    EXPECT_TRUE(GWIsContainedDestination(root, directory.url("out/missing/still/new")));
    // The destination itself may be a link: it is replaced, never followed.
    EXPECT_TRUE(GWIsContainedDestination(root, directory.url("out/up")));
    EXPECT_FALSE(GWIsContainedDestination(root, directory.url("out/up/x")));
    EXPECT_FALSE(GWIsContainedDestination(root, directory.url("out/up/real/x")));
    EXPECT_FALSE(GWIsContainedDestination(root, directory.url("out/file/x")));
}

TEST(GWContainment, DeviceNodesNeedPrivileges) {
    EXPECT_EQ(GWMayCreateDeviceNodes(), geteuid() == 0);
    GWOverrideMayCreateDeviceNodes(false);
    EXPECT_FALSE(GWMayCreateDeviceNodes());
    GWOverrideMayCreateDeviceNodes(true);
    EXPECT_TRUE(GWMayCreateDeviceNodes());
    GWOverrideMayCreateDeviceNodes(std::nullopt);
    EXPECT_EQ(GWMayCreateDeviceNodes(), geteuid() == 0);
}

}  // namespace
