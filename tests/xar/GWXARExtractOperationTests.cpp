// Extracting XAR items to disk: each kind of item, its metadata, hard links,
// names that must not leave the destination, and what failures leave behind.

#include <gtest/gtest.h>

#include <linux/fs.h>
#include <sys/acl.h>
#include <sys/ioctl.h>
#include <sys/mount.h>
#include <sys/stat.h>
#include <sys/sysmacros.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <cstdlib>
#include <cstring>
#include <filesystem>
#include <functional>

#include "GWArchiveSupport/GWArchiveConstants.h"
#include "XarExtractTestSupport.h"
#include "XarTestSupport.h"
#include "foundation/GWChecksum.h"
#include "foundation/GWContainment.h"
#include "foundation/GWDispatch.h"
#include "foundation/GWFileDescriptor.h"
#include "foundation/GWMetadataStore.h"
#include "xar/GWXARExtractOperation.h"

namespace {

using gwtest::XarBuilder;
using gwtest::XarEncoding;
using gwtest::xarFileElement;

class XarExtraction : public ::testing::Test {
protected:
    GWXARArchivePtr open(const std::string& body) {
        xar.setFiles(body);
        return gwtest::openBuiltXar(xar, directory);
    }

    // Extracts `path` of the archive to "out/<name>" (out is created).
    bool extract(const GWXARArchivePtr& archive, const std::string& path, const std::string& name,
                 bool* checksumIsInvalid = nullptr, GWErrorPtr* error = nullptr,
                 const GWExtractOptions& options = {}) {
        mkdir(out.c_str(), 0755);
        return archive->extractFile(archive->fileWithPath(path), output(name), checksumIsInvalid,
                                    error, options);
    }
    GWURL output(const std::string& name) const { return GWURL::fileURLWithPath(out + "/" + name); }
    std::string outputPath(const std::string& name) const { return out + "/" + name; }
    // Paths below the private temporary folder ("" is the folder itself).
    std::vector<std::string> temporaryLeftovers() const {
        std::vector<std::string> paths;
        for (const auto& [path, item] : gwtest::snapshotTree(temporaryRoot_)) {
            if (!path.empty()) {
                paths.push_back(path);
            }
        }
        return paths;
    }

    gwtest::TemporaryDirectory directory;
    XarBuilder xar;
    std::string out = directory.file("out");

private:
    // A private temporary folder, so that leftovers are ours to count.
    std::string temporaryRoot_ = directory.file("tmp");
    int made_ = mkdir(temporaryRoot_.c_str(), 0700);
    gwtest::ScopedEnvironment temporaryFolder_{"TMPDIR", temporaryRoot_};
};

TEST_F(XarExtraction, RegularFileGetsBytesModeOwnerAndDates) {
    const GWData content = gwtest::textBytes(200000, 4);
    auto archive =
        open(xarFileElement(1, "f", "file", "0640",
                            "<uid>1234</uid><gid>567</gid><mtime>2001-02-03T04:05:06Z</mtime>"
                            "<atime>2002-03-04T05:06:07Z</atime><acl><access>user::rw-\n"
                            "user:1234:r--\ngroup::---\nmask::r-x\nother::---\n</access></acl>" +
                                xar.dataElement("data", content, XarEncoding::bzip2)));
    ASSERT_TRUE(archive);
    bool invalid = true;
    GWErrorPtr error;
    ASSERT_TRUE(extract(archive, "f", "copy", &invalid, &error)) << error->localizedDescription();
    EXPECT_FALSE(invalid);
    struct stat info;  // before reading, which moves the access date
    ASSERT_EQ(lstat(outputPath("copy").c_str(), &info), 0);
    EXPECT_EQ(gwtest::readFile(outputPath("copy")), content);
    EXPECT_TRUE(S_ISREG(info.st_mode));
    EXPECT_EQ(info.st_mode & 07777, 0640u) << "the ACL's mask may not change the mode";
    if (acl_t acl = acl_get_file(outputPath("copy").c_str(), ACL_TYPE_ACCESS)) {
        char* text = acl_to_text(acl, nullptr);
        EXPECT_NE(std::string(text).find("user:1234:r--"), std::string::npos) << text;
        acl_free(text);
        acl_free(acl);
    }
    EXPECT_EQ(info.st_mtim.tv_sec, 981173106);
    EXPECT_EQ(info.st_atim.tv_sec, 1015218367);
    if (geteuid() == 0) {
        EXPECT_EQ(info.st_uid, 1234u);
        EXPECT_EQ(info.st_gid, 567u);
    }
    EXPECT_TRUE(temporaryLeftovers().empty());
}

TEST_F(XarExtraction, DirectoryTreeKeepsNamesKindsAndLinkTexts) {
    auto archive = open(xarFileElement(
        1, "top", "directory", "0750",
        "<mtime>2010-01-01T00:00:00Z</mtime>" +
            xarFileElement(2, "a", "file", "0600",
                           xar.dataElement("data", gwtest::bytesOf("A"), XarEncoding::gzip)) +
            xarFileElement(3, "sub", "directory", "0710",
                           xarFileElement(4, "empty", "file", "0644") +
                               xar.dataElement("ea", gwtest::bytesOf("v"), XarEncoding::none,
                                               "sha1", "<name>user.folder</name>")) +
            xarFileElement(5, "rel", "symlink", "0777", "<link type=\"file\">a</link>") +
            xarFileElement(6, "abs", "symlink", "0777",
                           "<link type=\"broken\">/nonexistent/x</link>") +
            xarFileElement(7, "pipe", "fifo", "0620")));
    ASSERT_TRUE(archive);
    GWErrorPtr error;
    ASSERT_TRUE(extract(archive, "top", "top", nullptr, &error)) << error->localizedDescription();

    const auto tree = gwtest::snapshotTree(outputPath("top"));
    ASSERT_EQ(tree.size(), 7u);
    EXPECT_EQ(tree.at("").mode, S_IFDIR | 0750);
    EXPECT_EQ(tree.at("").modificationSeconds, 1262304000) << "set after the children";
    EXPECT_EQ(tree.at("a").mode, S_IFREG | 0600);
    EXPECT_EQ(tree.at("sub").mode, S_IFDIR | 0710);
    EXPECT_EQ(tree.at("sub").attributes.at("user.folder"), gwtest::bytesOf("v"));
    EXPECT_EQ(tree.at("sub/empty").digest, GWChecksum::checksumForData({}, 5));
    EXPECT_EQ(tree.at("rel").linkText, "a");
    EXPECT_EQ(tree.at("abs").linkText, "/nonexistent/x");
    EXPECT_EQ(tree.at("pipe").mode, S_IFIFO | 0620);
}

TEST_F(XarExtraction, ResourceForkRefusedByTheFileSystemGoesToTheSideFile) {
    GWMetadataStore::setAttributeSizeLimitForTesting(1000);
    const GWData fork = gwtest::randomBytes(5000, 6);
    auto archive = open(xarFileElement(1, "f", "file", "0644",
                                       xar.dataElement("ea", fork, XarEncoding::gzip, "sha1",
                                                       "<name>com.apple.ResourceFork</name>")));
    ASSERT_TRUE(archive);
    const bool extracted = extract(archive, "f", "f");
    GWMetadataStore::setAttributeSizeLimitForTesting(std::nullopt);
    ASSERT_TRUE(extracted);
    EXPECT_EQ(access(directory.file("out/._f").c_str(), F_OK), 0);
    EXPECT_EQ(GWMetadataStore(outputPath("f")).attribute("com.apple.ResourceFork", nullptr), fork);
    EXPECT_TRUE(temporaryLeftovers().empty());
}

TEST_F(XarExtraction, ResourceForkMayNotPassFourGiB) {
    auto archive = open(xarFileElement(1, "f", "file", "0644"));
    ASSERT_TRUE(archive);
    auto operation =
        GWXARExtractOperation::initWithFile(archive->fileWithPath("f"), output("f"), archive);
    gwtest::writeFile(directory.file("target"), {});
    std::uint32_t position = 0xFFFFFFF0u;
    GWErrorPtr error;
    const GWData piece(0x10, 1);
    EXPECT_TRUE(operation->appendDataToResourceFork({}, directory.url("target"), position, &error));
    EXPECT_FALSE(operation->appendDataToResourceFork(GWData(0x11, 1), directory.url("target"),
                                                     position, &error));
    ASSERT_TRUE(error);
    EXPECT_TRUE(error->is(kGWPOSIXErrorDomain, 27));
    EXPECT_EQ(error->URL(), archive->URL());
    EXPECT_EQ(error->detailString(kGWXARArchiveUnknownEntityErrorKey), "com.apple.ResourceFork");
    EXPECT_EQ(position, 0xFFFFFFF0u);

    position = 4;
    ASSERT_TRUE(
        operation->appendDataToResourceFork(piece, directory.url("target"), position, &error));
    EXPECT_EQ(position, 4u + 0x10);
}

TEST_F(XarExtraction, MetadataFailureKeepsTheItemAndFlagsTheChecksum) {
    // Linux keeps user attributes off symbolic links.
    auto archive =
        open(xarFileElement(1, "s", "symlink", "0777",
                            "<link type=\"broken\">x</link>" +
                                xar.dataElement("ea", gwtest::bytesOf("v"), XarEncoding::none,
                                                "sha1", "<name>user.on-a-link</name>")));
    ASSERT_TRUE(archive);
    bool invalid = false;
    GWErrorPtr error;
    ASSERT_TRUE(extract(archive, "s", "s", &invalid, &error));
    EXPECT_FALSE(error);
    EXPECT_TRUE(invalid);
    EXPECT_EQ(gwtest::snapshotTree(outputPath("s")).at("").linkText, "x");

    // So does data whose digest does not match: the bytes are still written.
    const GWData content = gwtest::bytesOf("content");
    archive = open(xarFileElement(1, "f", "file", "0644",
                                  xar.dataElement("data", content, XarEncoding::gzip)));
    ASSERT_TRUE(archive);
    archive->fileWithPath("f")->dataFork()->setUncompressedChecksum(GWData(20, 0));
    invalid = false;
    ASSERT_TRUE(extract(archive, "f", "f", &invalid));
    EXPECT_TRUE(invalid);
    EXPECT_EQ(gwtest::readFile(outputPath("f")), content);
}

// A directory "d" holding "f" and a hard link "h" to it. The link entry has
// its own data fork; `linkContent` is what its digest was made from.
std::string hardLinkTree(XarBuilder& xar, const GWData& content, const GWData& linkContent) {
    const std::string link =
        "<file id=\"3\"><name>h</name><type link=\"2\">hardlink</type>"
        "<mode>0644</mode>" +
        xar.dataElement("data", linkContent, XarEncoding::gzip) + "</file>";
    return xarFileElement(1, "d", "directory", "0755",
                          xarFileElement(2, "f", "file", "0644",
                                         xar.dataElement("data", content, XarEncoding::gzip)) +
                              link);
}

// Linked when the link's own digest proves the bytes are the target's and the
// target lies within the extracted item; a copy of the target's data otherwise.
TEST_F(XarExtraction, HardLinksAreLinkedOnlyWhenProvenAndWithinTheItem) {
    const GWData content = gwtest::bytesOf("shared");
    const struct {
        const char* item;
        GWData linkContent;
        bool linked;
    } cases[] = {{"d", content, true},
                 {"d", gwtest::bytesOf("other"), false},
                 // The target's archive path climbs to the top level, outside "top/d".
                 {"top/d", content, false}};
    for (const auto& c : cases) {
        SCOPED_TRACE(c.item + std::string(" ") + std::to_string(c.linked));
        XarBuilder builder;
        const std::string tree = hardLinkTree(builder, content, c.linkContent);
        const bool nested = c.item != std::string("d");
        builder.setFiles(nested ? xarFileElement(10, "top", "directory", "0755", tree) : tree);
        auto archive = gwtest::openBuiltXar(builder, directory);
        ASSERT_TRUE(archive);
        ASSERT_EQ(archive->fileWithPath(c.item + std::string("/h"))->type(), GWXARFileTypeHardLink);
        std::filesystem::remove_all(outputPath("d"));
        ASSERT_TRUE(extract(archive, c.item, "d"));
        const auto items = gwtest::snapshotTree(outputPath("d"));
        EXPECT_EQ(items.at("f").inode == items.at("h").inode, c.linked);
        EXPECT_EQ(gwtest::readFile(outputPath("d/h")), content);
    }
}

TEST_F(XarExtraction, HardLinkNeverReachesOutsideTheItem) {
    // A file outside with the very bytes the link claims to hold.
    const GWData content = gwtest::bytesOf("outside");
    const std::string outsidePath = directory.file("victim");
    gwtest::writeFile(outsidePath, content);
    const std::string body =
        xarFileElement(1, "d", "directory", "0755",
                       xarFileElement(2, "s", "symlink", "0777",
                                      "<link type=\"directory\">" + directory.path() + "</link>") +
                           "<file id=\"4\"><name>h</name><type link=\"3\">hardlink</type>"
                           "<mode>0644</mode>" +
                           xar.dataElement("data", content, XarEncoding::none) + "</file>") +
        xarFileElement(3, "victim", "file", "0644",
                       xar.dataElement("data", content, XarEncoding::none));
    auto archive = open(body);
    ASSERT_TRUE(archive);
    // Give the target the archive path d/s/victim, which runs through the
    // symbolic link d/s once extracted.
    auto d = archive->fileWithPath("d");
    auto s = GWXARFile::initWithArchive(nullptr);
    s->setName("s");
    s->setParent(d);
    archive->fileWithPath("victim")->setParent(s);
    ASSERT_EQ(archive->fileWithPath("d/h")->hardlinkPath(), "../d/s/victim");

    GWErrorPtr error;
    EXPECT_FALSE(extract(archive, "d", "d", nullptr, &error));
    ASSERT_TRUE(error);
    EXPECT_TRUE(error->is(kGWXARArchiveErrorDomain, GWXARArchiveEntryOutsideDestinationError));
    EXPECT_EQ(error->detailString(kGWXARArchiveUnknownEntityErrorKey), "d/h");
    struct stat outside;
    ASSERT_EQ(stat(outsidePath.c_str(), &outside), 0);
    EXPECT_EQ(outside.st_nlink, 1u) << "linked to a file outside the extraction";
    EXPECT_TRUE(temporaryLeftovers().empty());
}

TEST_F(XarExtraction, TopLevelNameDoesNotPlaceTheItem) {
    auto archive = open(xarFileElement(
        1, "f", "file", "0644", xar.dataElement("data", gwtest::bytesOf("x"), XarEncoding::none)));
    ASSERT_TRUE(archive);
    archive->fileWithPath("f")->setName("../../escape");
    mkdir(directory.file("out").c_str(), 0755);
    GWErrorPtr error;
    ASSERT_TRUE(archive->extractFile(archive->files()[0], output("here"), nullptr, &error))
        << error->localizedDescription();
    EXPECT_EQ(gwtest::readFile(outputPath("here")), gwtest::bytesOf("x"));
    EXPECT_EQ(gwtest::snapshotTree(out).size(), 2u);  // out and here
    EXPECT_EQ(access(directory.file("escape").c_str(), F_OK), -1);
}

TEST_F(XarExtraction, ExistingOrNonFileDestinationIsRefused) {
    auto archive =
        open(xarFileElement(1, "f", "file", "0644",
                            xar.dataElement("data", gwtest::bytesOf("new"), XarEncoding::gzip)));
    ASSERT_TRUE(archive);
    mkdir(directory.file("out").c_str(), 0755);
    gwtest::writeFile(outputPath("f"), gwtest::bytesOf("old"));
    GWErrorPtr error;
    EXPECT_FALSE(extract(archive, "f", "f", nullptr, &error));
    ASSERT_TRUE(error);
    EXPECT_TRUE(error->is(kGWPOSIXErrorDomain, EEXIST));
    EXPECT_EQ(gwtest::readFile(outputPath("f")), gwtest::bytesOf("old"));
    EXPECT_TRUE(temporaryLeftovers().empty());
    // A destination that is no file at all is refused too.
    EXPECT_FALSE(archive->extractFile(archive->fileWithPath("f"),
                                      *GWURL::URLWithString("https://example.com/f"), nullptr,
                                      &error));
    EXPECT_TRUE(error && error->is(kGWCocoaErrorDomain, 518));
}

// Extractions in which entries fail: each is left out with an error naming
// where it was to appear, the rest is extracted, the first failure in tree
// order is the result, and ten runs end alike. `smallDisk` puts the
// destination on a 1 MiB tmpfs.
struct ExtractionOutcome {
    const char* name;
    std::function<std::string(XarBuilder&)> tree;  // an item "d"
    std::function<void(GWXARArchive&)> damage;
    bool smallDisk;
    const char* domain;  // none: success
    long code;
    std::string failedURL;               // the error's, below the test's directory
    std::vector<std::string> extracted;  // below the item; none: nothing at all
};

void PrintTo(const ExtractionOutcome& outcome, std::ostream* out) {
    *out << outcome.name;
}

class XarExtractionOutcome : public XarExtraction,
                             public ::testing::WithParamInterface<ExtractionOutcome> {};

TEST_P(XarExtractionOutcome, FailsEntryByEntryAndAlikeEveryRun) {
    const ExtractionOutcome& outcome = GetParam();
    auto archive = open(outcome.tree(xar));
    ASSERT_TRUE(archive);
    if (outcome.damage) {
        outcome.damage(*archive);
    }
    mkdir(directory.file("out").c_str(), 0755);
    if (outcome.smallDisk &&
        mount("tmpfs", directory.file("out").c_str(), "tmpfs", 0, "size=1m") != 0) {
        GTEST_SKIP() << "cannot mount a tmpfs: " << strerror(errno);
    }
    std::vector<std::string> firstTree;
    // Devices are asked for, so that one without the privileges fails.
    GWExtractOptions devices;
    devices.createDevices = true;
    for (int run = 0; run < 10; ++run) {
        GWErrorPtr error;
        const bool extracted = extract(archive, "d", "d", nullptr, &error, devices);
        std::vector<std::string> tree;
        for (const auto& [path, item] : gwtest::snapshotTree(outputPath("d"))) {
            tree.push_back(path + " " + std::to_string(item.mode) + " " +
                           std::string(item.digest.begin(), item.digest.end()));
        }
        std::filesystem::remove_all(outputPath("d"));
        if (run == 0) {
            firstTree = tree;
            std::vector<std::string> paths;
            for (const std::string& line : tree) {
                paths.push_back(line.substr(0, line.find(' ')));
            }
            EXPECT_EQ(paths, outcome.extracted);
        }
        EXPECT_EQ(tree, firstTree) << "run " << run;
        EXPECT_TRUE(temporaryLeftovers().empty());
        if (!outcome.domain) {
            EXPECT_TRUE(extracted) << (error ? error->localizedDescription() : "");
            continue;
        }
        EXPECT_FALSE(extracted);
        ASSERT_TRUE(error);
        EXPECT_TRUE(error->is(outcome.domain, outcome.code)) << error->localizedDescription();
        ASSERT_TRUE(error->URL());
        EXPECT_EQ(error->URL()->path(), directory.file(outcome.failedURL)) << "run " << run;
    }
    if (outcome.smallDisk) {
        umount2(directory.file("out").c_str(), MNT_DETACH);
    }
    GWOverrideMayCreateDeviceNodes(std::nullopt);
}

const GWData kSevenHundredKiB(700 * 1024, 0);

std::string file(XarBuilder& xar, int id, const std::string& name, const GWData& bytes,
                 XarEncoding encoding = XarEncoding::gzip) {
    return xarFileElement(id, name, "file", "0644", xar.dataElement("data", bytes, encoding));
}

INSTANTIATE_TEST_SUITE_P(
    Trees, XarExtractionOutcome,
    ::testing::Values(
        ExtractionOutcome{"EntriesFailingInDifferentWays",
                          [](XarBuilder& xar) {
                              std::string files;
                              for (int index = 0; index < 12; ++index) {
                                  files += file(xar, index + 10, "f" + std::to_string(index),
                                                gwtest::textBytes(30000, index));
                              }
                              return xarFileElement(
                                  1, "d", "directory", "0750",
                                  files +
                                      xarFileElement(2, "sub", "directory", "0755",
                                                     xarFileElement(3, "sock", "socket", "0644")) +
                                      file(xar, 4, "x", gwtest::bytesOf("x")) +
                                      xarFileElement(
                                          5, "s", "symlink", "0777",
                                          "<link type=\"broken\">x</link>" +
                                              xar.dataElement("ea", gwtest::bytesOf("v"),
                                                              XarEncoding::none, "sha1",
                                                              "<name>user.on-a-link</name>")));
                          },
                          [](GWXARArchive& archive) {
                              archive.fileWithPath("d/f3")->dataFork()->setCompressionType(7);
                              archive.fileWithPath("d/f5")->dataFork()->setUncompressedSize(30001);
                              archive.fileWithPath("d/f9")->dataFork()->setCompressionType(
                                  GWXARCompressionTypeLZMA);
                              archive.fileWithPath("d/x")->setName("..");
                          },
                          false,
                          kGWXARArchiveErrorDomain,
                          GWXARArchiveUnsupportedCompressionError,
                          "out/d/f3",
                          {"", "f0", "f1", "f10", "f11", "f2", "f4", "f6", "f7", "f8", "s", "sub"}},
        ExtractionOutcome{
            "NameThatLeavesTheDirectory",
            [](XarBuilder& xar) {
                return xarFileElement(1, "d", "directory", "0755",
                                      file(xar, 2, "ok", {}) +
                                          "<file id=\"3\"><name enctype=\"base64\">YQBi</name>"
                                          "<type>file</type></file>" +
                                          file(xar, 4, "x", {}));
            },
            [](GWXARArchive& archive) { archive.fileWithPath("d/x")->setName("a/b"); },
            false,
            kGWXARArchiveErrorDomain,
            GWXARArchiveEntryOutsideDestinationError,
            "out/d",
            {"", "ok"}},
        ExtractionOutcome{"DeviceWithoutPrivileges",
                          [](XarBuilder&) {
                              return xarFileElement(
                                  1, "d", "directory", "0755",
                                  xarFileElement(2, "null", "character special", "0666",
                                                 "<device><major>1</major><minor>3</minor>"
                                                 "</device>"));
                          },
                          [](GWXARArchive&) { GWOverrideMayCreateDeviceNodes(false); },
                          false,
                          kGWXARArchiveErrorDomain,
                          GWXARArchiveDeviceNotPermittedError,
                          "out/d/null",
                          {""}},
        ExtractionOutcome{"LastOfOneNameWins",
                          [](XarBuilder& xar) {
                              return xarFileElement(
                                  1, "d", "directory", "0755",
                                  xarFileElement(2, "dup", "directory", "0755",
                                                 file(xar, 3, "inner", {})) +
                                      file(xar, 4, "dup", gwtest::bytesOf("last")) +
                                      file(xar, 5, "f", gwtest::bytesOf("first")) +
                                      xarFileElement(6, "f", "symlink", "0777",
                                                     "<link type=\"broken\">t</link>"));
                          },
                          nullptr,
                          false,
                          nullptr,
                          0,
                          "",
                          {"", "dup", "f"}},
        ExtractionOutcome{
            "UnreadableTopLevelFile",
            [](XarBuilder& xar) { return file(xar, 1, "d", gwtest::textBytes(9000, 1)); },
            [](GWXARArchive& archive) {
                archive.fileWithPath("d")->dataFork()->setCompressionType(7);
            },
            false,
            kGWXARArchiveErrorDomain,
            GWXARArchiveUnsupportedCompressionError,
            "out/d",
            {}},
        ExtractionOutcome{"MislabelledCompression",
                          [](XarBuilder& xar) {
                              std::string data = xar.dataElement("data", gwtest::textBytes(9000, 1),
                                                                 XarEncoding::gzip);
                              data.replace(data.find("x-gzip"), 6, "x-lzma");
                              return xarFileElement(1, "d", "file", "0644", data);
                          },
                          nullptr,
                          false,
                          kGWCocoaErrorDomain,
                          GWFileReadCorruptFileError,
                          "out/d",
                          {}},
        ExtractionOutcome{"FilesLargerThanTheFreeSpace",
                          [](XarBuilder& xar) {
                              return xarFileElement(1, "d", "directory", "0755",
                                                    file(xar, 2, "a", kSevenHundredKiB) +
                                                        file(xar, 3, "b", kSevenHundredKiB));
                          },
                          nullptr,
                          true,
                          kGWPOSIXErrorDomain,
                          ENOSPC,
                          "out",
                          {}},
        ExtractionOutcome{
            "HardLinkedFileCountsOnce",
            [](XarBuilder& xar) { return hardLinkTree(xar, kSevenHundredKiB, kSevenHundredKiB); },
            nullptr,
            true,
            nullptr,
            0,
            "",
            {"", "f", "h"}}),
    [](const auto& info) { return std::string(info.param.name); });

TEST_F(XarExtraction, CancelledOperationCreatesNothing) {
    auto archive = open(xarFileElement(1, "f", "file", "0644"));
    ASSERT_TRUE(archive);
    auto operation =
        GWXARExtractOperation::initWithFile(archive->fileWithPath("f"), output("f"), archive);
    operation->cancel();
    operation->start();  // as its queue does, which then skips the body
    ASSERT_TRUE(operation->error());
    EXPECT_TRUE(operation->error()->is(kGWCocoaErrorDomain, GWUserCancelledError));
    EXPECT_EQ(operation->error()->URL(), output("f"));
    EXPECT_EQ(access(outputPath("f").c_str(), F_OK), -1);
}

TEST_F(XarExtraction, AsynchronousExtractionReportsThroughTheHandler) {
    const GWData content = gwtest::textBytes(70000, 2);
    auto archive = open(xarFileElement(1, "f", "file", "0644",
                                       xar.dataElement("data", content, XarEncoding::gzip)));
    ASSERT_TRUE(archive);
    mkdir(directory.file("out").c_str(), 0755);
    auto queue = std::make_shared<GWOperationQueue>();
    GWSemaphore done;
    bool handlerInvalid = true;
    GWErrorPtr handlerError = GWCocoaError(1);
    GWXARExtractOperationPtr operation;
    archive->extractFile(archive->fileWithPath("f"), output("f"), queue, &operation,
                         [&](bool checksumIsInvalid, const GWErrorPtr& error) {
                             handlerInvalid = checksumIsInvalid;
                             handlerError = error;
                             done.signal();
                         });
    ASSERT_TRUE(operation);
    done.wait();
    EXPECT_FALSE(handlerInvalid);
    EXPECT_FALSE(handlerError);
    EXPECT_EQ(gwtest::readFile(outputPath("f")), content);
}

}  // namespace

TEST_F(XarExtraction, ManyFilesAreWrittenInParallelWithDirectoryMetadataLast) {
    // Enough files per directory that several workers write at once, and
    // read-only directories that must still receive every file first.
    std::string tree;
    int id = 2;
    for (int folder = 0; folder < 3; ++folder) {
        std::string files;
        for (int index = 0; index < 12; ++index) {
            const XarEncoding encoding = XarEncoding(index % 3);
            files += xarFileElement(
                id++, "f" + std::to_string(index), "file", index % 2 ? "0600" : "0644",
                "<mtime>2011-01-01T00:00:00Z</mtime>" +
                    xar.dataElement("data", gwtest::textBytes(100 + 5000 * index, index + folder),
                                    encoding));
        }
        tree += xarFileElement(id++, "d" + std::to_string(folder), "directory", "0555",
                               "<mtime>2012-01-01T00:00:00Z</mtime>" + files);
    }
    auto archive = open(xarFileElement(1, "top", "directory", "0755", tree));
    ASSERT_TRUE(archive);
    bool invalid = true;
    GWErrorPtr error;
    ASSERT_TRUE(extract(archive, "top", "top", &invalid, &error)) << error->localizedDescription();
    EXPECT_FALSE(invalid);

    const auto snapshot = gwtest::snapshotTree(outputPath("top"));
    ASSERT_EQ(snapshot.size(), 1u + 3 * 13);
    for (int folder = 0; folder < 3; ++folder) {
        const std::string name = "d" + std::to_string(folder);
        EXPECT_EQ(snapshot.at(name).mode, S_IFDIR | 0555);
        EXPECT_EQ(snapshot.at(name).modificationSeconds, 1325376000) << "set after its files";
        for (int index = 0; index < 12; ++index) {
            const auto& entry = snapshot.at(name + "/f" + std::to_string(index));
            EXPECT_EQ(entry.mode, S_IFREG | (index % 2 ? 0600u : 0644u));
            EXPECT_EQ(entry.modificationSeconds, 1293840000);
            EXPECT_EQ(entry.digest, GWChecksum::checksumForData(
                                        gwtest::textBytes(100 + 5000 * index, index + folder), 5));
        }
    }
    EXPECT_TRUE(temporaryLeftovers().empty());
    for (int folder = 0; folder < 3; ++folder) {
        chmod(directory.file("out/top/d" + std::to_string(folder)).c_str(), 0755);
    }
}

TEST_F(XarExtraction, FailedAttributeCostsTheItemNothingElse) {
    const std::string inner = xar.dataElement("data", gwtest::bytesOf("data"), XarEncoding::none) +
                              xar.dataElement("ea", gwtest::bytesOf("first"), XarEncoding::gzip,
                                              "sha1", "<name>user.first</name>") +
                              xar.dataElement("ea", gwtest::bytesOf("second"), XarEncoding::gzip,
                                              "sha1", "<name>user.second</name>");
    auto archive = open(xarFileElement(1, "f", "file", "0604", inner));
    ASSERT_TRUE(archive);
    archive->fileWithPath("f")->extendedAttributes().front()->setCompressionType(7);
    bool invalid = false;
    GWErrorPtr error;
    ASSERT_TRUE(extract(archive, "f", "f", &invalid, &error));
    EXPECT_TRUE(invalid);
    const auto tree = gwtest::snapshotTree(outputPath("f"));
    EXPECT_EQ(tree.at("").digest, GWChecksum::checksumForData(gwtest::bytesOf("data"), 5));
    EXPECT_EQ(tree.at("").mode, S_IFREG | 0604);
    EXPECT_EQ(tree.at("").attributes,
              (std::map<std::string, GWData>{{"user.second", gwtest::bytesOf("second")}}));
}
