// `gwarchive extract` of hostile archives: the folder given with -C is the
// only place anything is written, each refused entry is reported while the
// rest of the batch goes on, and nothing that grants privilege comes out
// unless its switch is given.

#include <fcntl.h>
#include <gtest/gtest.h>
#include <linux/fs.h>
#include <sys/ioctl.h>
#include <sys/stat.h>
#include <sys/sysmacros.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <algorithm>
#include <filesystem>
#include <functional>
#include <tuple>

#include "ToolTestSupport.h"
#include "support/AppleDoubleBuilder.h"
#include "support/ContainmentSupport.h"
#include "support/HostileArchives.h"
#include "support/XarBuilder.h"
#include "support/ZipBuilder.h"
#include "support/ZipExtraFields.h"
#include "xar/XarExtractTestSupport.h"

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
        ToolRun run = runTool(std::string("extract -v ") + (overwrite ? "--overwrite " : "") +
                              "-C " + shellQuote(sandbox.out()) + " " + shellQuote(path));
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

// What an archive may grant, read back from the extracted item: "none" when
// the item or attribute is not there.
using Observation = std::function<std::string(const std::string& path)>;

std::string permissions(const std::string& path) {
    struct stat info;
    if (lstat(path.c_str(), &info) != 0)
        return "none";
    char text[8];
    std::snprintf(text, sizeof text, "%o", info.st_mode & 07777);
    return text;
}

std::string device(const std::string& path) {
    struct stat info;
    if (lstat(path.c_str(), &info) != 0)
        return "none";
    return std::string(S_ISCHR(info.st_mode)   ? "c "
                       : S_ISBLK(info.st_mode) ? "b "
                                               : "? ") +
           std::to_string(major(info.st_rdev)) + ":" + std::to_string(minor(info.st_rdev));
}

Observation attribute(const std::string& name) {
    return [name](const std::string& path) {
        return lgetxattr(path.c_str(), name.c_str(), nullptr, 0) < 0 ? "none" : "set";
    };
}

// Immutable, append-only and nodump as "iad"; the item is left removable.
std::string pinning(const std::string& path) {
    const int fd = open(path.c_str(), O_RDONLY | O_NONBLOCK | O_NOFOLLOW);
    int flags = 0;
    if (fd < 0 || ioctl(fd, FS_IOC_GETFLAGS, &flags) != 0) {
        if (fd >= 0)
            close(fd);
        return "unsupported";
    }
    std::string text;
    text += (flags & FS_IMMUTABLE_FL) ? "i" : "";
    text += (flags & FS_APPEND_FL) ? "a" : "";
    text += (flags & FS_NODUMP_FL) ? "d" : "";
    flags &= ~(FS_IMMUTABLE_FL | FS_APPEND_FL);
    ioctl(fd, FS_IOC_SETFLAGS, &flags);
    close(fd);
    return text.empty() ? "-" : text;
}

GWData zipWithMode(const std::string& name, std::uint32_t mode, GWData extra = {}) {
    ZipBuilder zip;
    ZipEntry& entry =
        name.ends_with("/") ? zip.addDirectory(name) : zip.addFile(name, bytesOf("x"));
    entry.externalAttributes = mode << 16;
    entry.centralExtra = std::move(extra);
    return zip.bytes();
}

GWData xarWith(const std::string& type, const std::string& mode, const std::string& inner = "",
               const std::string& extraAttribute = "") {
    XarBuilder xar;
    std::string body = inner;
    if (!extraAttribute.empty())
        body += xar.dataElement("ea", bytesOf("v"), XarEncoding::none, "sha1",
                                "<name>" + extraAttribute + "</name>");
    xar.setFiles(xarFileElement(1, "f", type, mode, body));
    return xar.bytes();
}

// An access ACL granting user 1234 read, as the kernel stores it.
std::string aclAttributeBlob() {
    GWData blob;
    auto put = [&blob](std::uint32_t value, int width) {
        for (int i = 0; i < width; ++i)
            blob.push_back(std::uint8_t(value >> (8 * i)));
    };
    put(2, 4);
    for (const auto& [tag, perm, id] :
         {std::tuple{1, 6, ~0u}, std::tuple{2, 4, 1234u}, std::tuple{4, 4, ~0u},
          std::tuple{0x10, 4, ~0u}, std::tuple{0x20, 4, ~0u}}) {
        put(std::uint32_t(tag), 2);
        put(std::uint32_t(perm), 2);
        put(id, 4);
    }
    return std::string(blob.begin(), blob.end());
}

struct GrantCase {
    std::string name;
    std::string extension;
    std::function<GWData()> archive;
    std::string option;
    Observation observe;
    std::string byDefault;
    std::string withOption;
    bool warns = false;  // one warning line when left out
};

std::vector<GrantCase> grantCases() {
    const GWData asi = zipExtraBlock(0x756E, asiUnixPayload(0, 0102755, 0, 0));
    const GWData pkware = zipExtraBlock(0x000D, unixPayload(1, 2, 0, 0));
    AppleDoubleFile companion;
    companion.attributes = {{"trusted.x", bytesOf("v")}};
    ZipBuilder appleDouble;
    appleDouble.addFile("f", bytesOf("x"));
    appleDouble.addFile("__MACOSX/._f", buildAppleDouble(companion));
    const GWData appleDoubleZip = appleDouble.bytes();
    const std::string acl = aclAttributeBlob();
    return {
        {"ZipSetuid", "zip", [] { return zipWithMode("f", 0104755); }, "--keep-setuid", permissions,
         "755", "4755"},
        {"ZipSetgidWithASiField", "zip", [=] { return zipWithMode("f", 0102755, asi); },
         "--keep-setuid", permissions, "755", "2755"},
        {"ZipStickyDirectoryWithPKWAREField", "zip",
         [=] { return zipWithMode("f/", 041777, pkware); }, "--keep-setuid", permissions, "777",
         "1777"},
        {"XarSetuidSetgid", "xar", [] { return xarWith("file", "06755"); }, "--keep-setuid",
         permissions, "755", "6755"},
        {"XarStickyDirectory", "xar", [] { return xarWith("directory", "01777"); }, "--keep-setuid",
         permissions, "777", "1777"},
        {"XarCharacterDevice", "xar",
         [] {
             return xarWith("character special", "0666",
                            "<device><major>1</major><minor>3</minor></device>");
         },
         "--devices", device, "none", "c 1:3", true},
        {"XarBlockDevice", "xar",
         [] {
             return xarWith("block special", "0600",
                            "<device><major>254</major><minor>0</minor></device>");
         },
         "--devices", device, "none", "b 254:0", true},
        {"XarTrustedAttribute", "xar", [] { return xarWith("file", "0644", "", "trusted.x"); },
         "--privileged-xattrs", attribute("trusted.x"), "none", "set", true},
        {"XarSecurityAttribute", "xar", [] { return xarWith("file", "0644", "", "security.ima"); },
         "--privileged-xattrs", attribute("security.ima"), "none", "set", true},
        {"XarPlainAclAttribute", "xar",
         [=] {
             XarBuilder xar;
             xar.setFiles(
                 xarFileElement(1, "f", "file", "0640",
                                xar.dataElement("ea", bytesOf(acl), XarEncoding::none, "sha1",
                                                "<name>system.posix_acl_access</name>")));
             return xar.bytes();
         },
         "--privileged-xattrs", attribute("system.posix_acl_access"), "none", "set", true},
        {"ZipAppleDoubleTrustedAttribute", "zip", [=] { return appleDoubleZip; },
         "--privileged-xattrs", attribute("trusted.x"), "none", "set", true},
        {"XarImmutable", "xar",
         [] { return xarWith("file", "0644", "<flags><UserImmutable/></flags>"); }, "--keep-flags",
         pinning, "-", "i"},
        {"XarAppendOnlyKeepsNoDump", "xar",
         [] { return xarWith("file", "0644", "<flags><UserAppend/><UserNoDump/></flags>"); },
         "--keep-flags", pinning, "d", "ad"},
    };
}

void PrintTo(const GrantCase& test, std::ostream* out) {
    *out << test.name;
}

class GWArchiveToolGrants : public ::testing::TestWithParam<GrantCase> {};

TEST_P(GWArchiveToolGrants, OnlyTheSwitchGrantsIt) {
    const GrantCase& test = GetParam();
    if (geteuid() != 0)
        GTEST_SKIP() << "only root can be granted these";
    TemporaryDirectory directory;
    const std::string path = directory.file("a." + test.extension);
    writeFile(path, test.archive());
    for (const bool granted : {false, true}) {
        const std::string out = directory.file(granted ? "granted" : "default");
        std::filesystem::create_directory(out);
        ToolRun run = runTool("extract --no-progress " + (granted ? test.option + " " : "") +
                              "-C " + shellQuote(out) + " " + shellQuote(path));
        EXPECT_EQ(run.status, 0) << run.err;
        const std::string seen = test.observe(out + "/f");
        if (seen == "unsupported")
            GTEST_SKIP() << "the file system under " << out << " keeps no inode flags";
        EXPECT_EQ(seen, granted ? test.withOption : test.byDefault) << granted;
        const bool warned = run.err.find("gwarchive: " + path + ": f: warning: ") == 0 &&
                            std::count(run.err.begin(), run.err.end(), '\n') == 1;
        EXPECT_EQ(warned, test.warns && !granted) << run.err;
    }
}

INSTANTIATE_TEST_SUITE_P(Hostile, GWArchiveToolGrants, ::testing::ValuesIn(grantCases()),
                         [](const auto& info) { return info.param.name; });

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
        ToolRun run = runTool("extract -v --overwrite -C " + shellQuote(sandbox.out()) + " " +
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
