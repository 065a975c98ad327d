// Mac metadata on extraction: AppleDouble and resource-fork companions,
// MacBinary members, Finder information and ownership.

#include <gtest/gtest.h>
#include <linux/capability.h>
#include <sys/stat.h>
#include <sys/syscall.h>
#include <unistd.h>

#include <filesystem>

#include "foundation/GWConversions.h"
#include "foundation/GWFileInfo.h"
#include "foundation/GWMetadataStore.h"
#include "foundation/GWRemoteFileHandle.h"
#include "support/AppleDoubleBuilder.h"
#include "support/MacBinaryBuilder.h"
#include "support/MetadataTestSupport.h"
#include "support/TestSupport.h"
#include "support/ZipBuilder.h"
#include "support/ZipExtraFields.h"
#include "zip/ZipExtractTestSupport.h"
#include "zip/ZipTestSupport.h"

namespace {

using namespace gwtest;

class GWZipExtractMacMetadata : public ::testing::Test {
protected:
    void SetUp() override {
        if (!userAttributesSupported(directory.path())) {
            GTEST_SKIP() << "no user extended attributes here";
        }
    }

    GWZipExtractOperationPtr extract(const GWZipFilePtr& file, const std::string& name) {
        GWErrorPtr error;
        auto operation = GWZipExtractOperation::initForExtractingFile(
            file, GWURL::fileURLWithPath(archivePath), 0, directory.url(name), true, nullptr,
            &error);
        runToEnd(operation);
        return operation;
    }

    std::optional<GWData> attribute(const std::string& name, std::string_view attributeName) {
        return GWMetadataStore(directory.file(name)).attribute(attributeName, nullptr);
    }

    TemporaryDirectory directory;
    std::string archivePath = directory.file("archive.zip");
};

TEST_F(GWZipExtractMacMetadata, AnUnmergeableCompanionIsNoFailure) {
    ZipBuilder zip;
    zip.addFile("a.txt", bytesOf("data"));
    zip.addFile("__MACOSX/._a.txt", bytesOf("not an AppleDouble file"));
    zip.write(archivePath);
    auto file = zipEntryFromBuilder(zip, 0);
    file->setAppleDoubleFile(zipEntryFromBuilder(zip, 1));
    auto operation = extract(file, "a.txt");
    EXPECT_FALSE(operation->error());
    EXPECT_EQ(readFile(directory.file("a.txt")), bytesOf("data"));
}

// --- A resource fork arrives whole, whichever way it travels -----------------
// With it come the Finder information and attributes its carrier holds.

enum class ForkCarrier { resourceForkMember, appleDouble, macBinary, macBinarySmartZip };

struct ForkCase {
    const char* label;
    ForkCarrier carrier;
    bool atomically = true;
    // So long that "._" and the name exceed NAME_MAX: the fork, kept in a
    // side file as ext4 refuses it as an attribute, is lost with one warning.
    bool longName = false;
};

class GWZipExtractForks : public GWZipExtractMacMetadata,
                          public ::testing::WithParamInterface<ForkCase> {};

TEST_P(GWZipExtractForks, TheForkIsWholeOrWarnedAbout) {
    const ForkCase& c = GetParam();
    // Longer than any attribute, decoded in several pieces.
    const GWData fork = randomBytes(200000, 9);
    const GWData data = bytesOf("the data fork");
    const std::string name = c.longName ? std::string(NAME_MAX - 1, 'n') : "Icon";
    const bool macBinary =
        c.carrier == ForkCarrier::macBinary || c.carrier == ForkCarrier::macBinarySmartZip;
    const bool finderInfo = !c.longName && c.carrier != ForkCarrier::resourceForkMember;
    ZipBuilder zip;
    if (macBinary) {
        MacBinaryFile mac;
        mac.type = "TEXT";
        mac.creator = "R*ch";
        mac.finderFlags = 0x0100;
        mac.dataFork = data;
        mac.resourceFork = fork;
        ZipEntry& entry = zip.addFile(name, buildMacBinary(mac), 8);
        if (c.carrier == ForkCarrier::macBinarySmartZip) {
            SmartZipInfo info;
            info.type = "TEXT";
            info.creator = "R*ch";
            info.finderFlags = 0x0100;
            entry.centralExtra = zipExtraBlock(0x4D63, smartZipPayload(info));
        } else {
            entry.centralExtra =
                zipExtraBlock(0x2605, zipItPayload(std::string("Icon"), "TEXT", "R*ch", 0x0100));
        }
    } else {
        zip.addFile(name, data, 8);
        if (c.carrier == ForkCarrier::appleDouble) {
            AppleDoubleFile companion;
            companion.resourceFork = fork;
            if (finderInfo) {
                companion.finderInfo = finderInfoBytes("TEXT", "R*ch", 0x0100, 12, 34);
                companion.attributes = {{"com.example.label", bytesOf("blue")}};
            }
            zip.addFile("__MACOSX/._" + name, buildAppleDouble(companion), 8);
        } else {
            zip.addFile("XtraStuf.mac/" + name, fork, 8);
        }
    }
    zip.write(archivePath);
    auto file = zipEntryFromBuilder(zip, 0);
    if (c.carrier == ForkCarrier::appleDouble) {
        file->setAppleDoubleFile(zipEntryFromBuilder(zip, 1));
    } else if (c.carrier == ForkCarrier::resourceForkMember) {
        file->setResourceFork(zipEntryFromBuilder(zip, 1));
    }

    ZipLogCapture log;
    GWErrorPtr error;
    auto operation = GWZipExtractOperation::initForExtractingFile(
        file, GWURL::fileURLWithPath(archivePath), 0, directory.url(name), c.atomically, nullptr,
        &error);
    runToEnd(operation);
    ASSERT_FALSE(operation->error()) << operation->error()->localizedDescription();
    EXPECT_EQ(readFile(directory.file(name)), data);
    EXPECT_EQ(attribute(name, "com.apple.ResourceFork"),
              c.longName ? std::nullopt : std::optional(fork));
    EXPECT_EQ(log.lines().size(), c.longName ? 1u : 0u);
    if (finderInfo) {
        auto info = GWFileInfo::initWithURL(directory.url(name), nullptr);
        ASSERT_TRUE(info);
        EXPECT_EQ(info->typeCode(), GWFourCharCode("TEXT"));
        EXPECT_EQ(info->creatorCode(), GWFourCharCode("R*ch"));
        EXPECT_EQ(info->finderFlags(), 0x0100);
    }
    if (finderInfo && !macBinary) {
        EXPECT_EQ(attribute(name, "com.example.label"), bytesOf("blue"));
    }
    // Nothing but the archive and the file: no temporary copy, no stray side file.
    std::size_t items = 0;
    for (const auto& item : std::filesystem::directory_iterator(directory.path())) {
        items += item.path() != archivePath;
    }
    EXPECT_EQ(items, c.longName ? 1u : 2u);
}

INSTANTIATE_TEST_SUITE_P(
    Carriers, GWZipExtractForks,
    ::testing::Values(ForkCase{"ResourceForkMember", ForkCarrier::resourceForkMember},
                      ForkCase{"ResourceForkMemberInPlace", ForkCarrier::resourceForkMember, false},
                      ForkCase{"AppleDouble", ForkCarrier::appleDouble},
                      ForkCase{"MacBinary", ForkCarrier::macBinary},
                      ForkCase{"MacBinarySmartZip", ForkCarrier::macBinarySmartZip},
                      ForkCase{"LongNameAtomically", ForkCarrier::resourceForkMember, true, true},
                      ForkCase{"LongNameInPlace", ForkCarrier::resourceForkMember, false, true},
                      ForkCase{"LongNameAppleDouble", ForkCarrier::appleDouble, false, true}),
    [](const auto& info) { return std::string(info.param.label); });

TEST_F(GWZipExtractMacMetadata, ABrokenMacBinaryMemberFailsAndLeavesNoDecodedFile) {
    ZipBuilder zip;
    ZipEntry& entry = zip.addFile("x.bin", GWData(200, 0xAA));
    entry.centralExtra = zipExtraBlock(0x2605, zipItPayload(std::string("x"), "TEXT", "ttxt", 0));
    zip.write(archivePath);
    auto operation = extract(zipEntryFromBuilder(zip, 0), "x");
    ASSERT_TRUE(operation->error());
    EXPECT_TRUE(operation->error()->is(kGWCocoaErrorDomain, GWFileReadCorruptFileError));
    EXPECT_FALSE(fileExists(directory.file("x")));
}

TEST_F(GWZipExtractMacMetadata, FinderInformationFromTheExtraFieldIsApplied) {
    ZipBuilder zip;
    ZipEntry& entry = zip.addFile("note", bytesOf("text"));
    SmartZipInfo info;
    info.type = "ttro";
    info.creator = "ttxt";
    info.finderFlags = 0x0400;
    info.vertical = 40;
    info.horizontal = 80;
    entry.centralExtra = zipExtraBlock(0x4D63, smartZipPayload(info));
    zip.write(archivePath);
    auto file = zipEntryFromBuilder(zip, 0);
    GWErrorPtr error;
    writeFile(directory.file("plain"), bytesOf("text"));
    auto operation = GWZipExtractOperation::initForExtractingFile(
        file, GWURL::fileURLWithPath(archivePath), 0, directory.url("unused"), false, nullptr,
        &error);
    ASSERT_TRUE(operation->setInfoForFile(file, directory.url("plain"), &error));
    auto applied = GWFileInfo::initWithURL(directory.url("plain"), nullptr);
    ASSERT_TRUE(applied);
    EXPECT_EQ(applied->typeCode(), GWFourCharCode("ttro"));
    EXPECT_EQ(applied->finderFlags(), 0x0400);
    EXPECT_EQ(applied->location(), 40u | (80u << 16));
}

// Takes CAP_CHOWN out of the calling thread's effective set while it lives,
// so that even root is refused another owner. Capabilities are per thread.
class ScopedNoChown {
public:
    ScopedNoChown() {
        if (syscall(SYS_capget, &header_, saved_) == 0) {
            __user_cap_data_struct reduced[2] = {saved_[0], saved_[1]};
            reduced[0].effective &= ~(1u << CAP_CHOWN);
            active_ = syscall(SYS_capset, &header_, reduced) == 0;
        }
    }
    ~ScopedNoChown() {
        if (active_) {
            syscall(SYS_capset, &header_, saved_);
        }
    }
    bool active() const { return active_; }

private:
    __user_cap_header_struct header_{_LINUX_CAPABILITY_VERSION_3, 0};
    __user_cap_data_struct saved_[2]{};
    bool active_ = false;
};

TEST_F(GWZipExtractMacMetadata, AnOwnerThatCannotBeAppliedStillExtracts) {
    ZipBuilder zip;
    ZipEntry& entry = zip.addFile("owned.txt", bytesOf("mine"));
    entry.externalAttributes = 0100640u << 16;
    zip.write(archivePath);
    auto base = zipEntryFromBuilder(zip, 0);
    const std::uint32_t stranger = ::getuid() + 4242;
    auto file = GWZipFile::initWithName(
        base->name(), nullptr, base->compressedSize(), base->storedUncompressedSize(),
        base->privateUncompressedChecksum(), 1, stranger, stranger, base->permissionsMode(),
        base->storedModificationDate(), std::nullopt, base->localHeaderOffset(), 0, 0, {});
    ScopedNoChown noChown;
    if (::getuid() == 0 && !noChown.active()) {
        GTEST_SKIP() << "root without a way to refuse ownership changes";
    }
    // start() runs the whole pipeline on this thread, without CAP_CHOWN.
    auto operation = extract(file, "owned.txt");
    EXPECT_FALSE(operation->error());
    struct stat status {};
    ASSERT_EQ(::stat(directory.file("owned.txt").c_str(), &status), 0);
    EXPECT_NE(status.st_uid, stranger);
    EXPECT_EQ(status.st_mode & 07777, 0640u);
    EXPECT_EQ(readFile(directory.file("owned.txt")), bytesOf("mine"));
}

}  // namespace
