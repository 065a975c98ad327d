#include <gtest/gtest.h>
#include <sys/stat.h>

#include <functional>

#include "applefile/GWAppleFileDecoder.h"
#include "foundation/GWConversions.h"
#include "foundation/GWFileInfo.h"
#include "foundation/GWMetadataStore.h"
#include "support/MacBinaryBuilder.h"
#include "support/MetadataTestSupport.h"
#include "support/TestSupport.h"

namespace {

using gwtest::bytesOf;
using gwtest::MacBinaryFile;

GWDate macDate(std::uint32_t seconds) {
    return GWDate::gregorianDateWithYear(1904, 1, 1, 0, 0, 0).dateByAddingTimeInterval(seconds);
}

MacBinaryFile sampleFile(int version) {
    MacBinaryFile file;
    file.version = version;
    file.type = "APPL";
    file.creator = "GWAT";
    file.finderFlags = 0x2104;
    file.extendedFinderFlags = 0x40;
    file.verticalPosition = 40;
    file.horizontalPosition = 60;
    file.creationDate = 3000000000u;
    file.modificationDate = 3100000000u;
    file.dataFork = gwtest::textBytes(5000, std::uint32_t(version));
    file.resourceFork = gwtest::randomBytes(20000, std::uint32_t(version));
    return file;
}

class GWMacBinaryTest : public ::testing::Test {
protected:
    bool decode(const GWData& encoded, GWErrorPtr* error = nullptr,
                const std::string& destination = "decoded") {
        gwtest::writeFile(directory_.file("source.bin"), encoded);
        return GWAppleFileDecoder::sharedInstance()->decodeMacBinaryFileAtURL(
            directory_.url("source.bin"), directory_.url(destination), error);
    }

    GWData resourceFork() {
        return GWMetadataStore(directory_.file("decoded"))
            .attribute(kGWResourceForkAttributeName, nullptr)
            .value_or(GWData());
    }

    std::optional<GWData> comment() {
        return GWMetadataStore(directory_.file("decoded"))
            .attribute(kGWCommentAttributeName, nullptr);
    }

    void expectForks(const MacBinaryFile& file) {
        EXPECT_EQ(gwtest::readFile(directory_.file("decoded")), file.dataFork);
        EXPECT_EQ(resourceFork(), file.resourceFork);
    }

    std::shared_ptr<GWFileInfo> info() {
        return GWFileInfo::initWithURL(directory_.url("decoded"), nullptr);
    }

    gwtest::TemporaryDirectory directory_;
};

}  // namespace

TEST_F(GWMacBinaryTest, CheckValuesOf0x8000AndAboveNeverMatchSoTheHeaderReadsAsVersionI) {
    // The check value is compared as a signed number, so a header whose CRC is
    // 0x8000 or more never matches and is read as version I.
    MacBinaryFile file = sampleFile(2);
    file.comment = "Caf\x8E notes";  // Mac OS Roman
    ASSERT_TRUE(decode(gwtest::buildMacBinary(file)));
    EXPECT_EQ(comment(), bytesOf("Caf\xC3\xA9 notes"));
    EXPECT_EQ(info()->finderFlags(), 0x2104);
    EXPECT_EQ(info()->extendedFinderFlags(), 0);

    // Read as version I, neither the comment, the low flags byte nor the
    // version bytes count.
    file.seal = gwtest::MacBinarySeal::fromx8000;
    file.writerVersion = 200;
    const GWData encoded = gwtest::buildMacBinary(file);
    ASSERT_GE((encoded[124] << 8) | encoded[125], 0x8000);
    ASSERT_TRUE(decode(encoded));
    EXPECT_FALSE(comment());
    EXPECT_EQ(info()->finderFlags(), 0x2100);
    EXPECT_EQ(resourceFork(), file.resourceFork);
}

TEST_F(GWMacBinaryTest, TheSignatureMakesVersionIIIWhateverTheCheckValue) {
    MacBinaryFile file = sampleFile(3);
    file.comment = "three";
    GWData encoded = gwtest::buildMacBinary(file);
    encoded[gwtest::macbinary::kCRC] ^= 0x5A;
    encoded[gwtest::macbinary::kZeroByte82] = 1;
    ASSERT_TRUE(decode(encoded));
    EXPECT_EQ(info()->extendedFinderFlags(), 0x40);
    EXPECT_EQ(info()->finderFlags(), 0x2104);
    EXPECT_EQ(comment(), bytesOf("three"));
    EXPECT_EQ(gwtest::readFile(directory_.file("decoded")), file.dataFork);
}

TEST_F(GWMacBinaryTest, AForkEndingOnABlockBoundaryIsFollowedByAFullBlockSkip) {
    MacBinaryFile file = sampleFile(2);
    file.dataFork = gwtest::randomBytes(256, 4);
    file.resourceFork = gwtest::randomBytes(300, 5);
    ASSERT_TRUE(decode(gwtest::buildMacBinary(file)));
    expectForks(file);

    // A file padded the standard way is therefore read a block late.
    GWErrorPtr error;
    EXPECT_FALSE(decode(gwtest::buildMacBinary(file, gwtest::MacBinaryPadding::standard), &error));
    EXPECT_TRUE(error->is(kGWCocoaErrorDomain, GWFileReadUnknownError));

    // The secondary header is skipped by its exact length.
    file.secondaryHeader = bytesOf("12345");
    ASSERT_TRUE(decode(gwtest::buildMacBinary(file)));
    expectForks(file);
}

TEST_F(GWMacBinaryTest, AHeaderAloneGivesAnEmptyFileWithItsFinderInformationAndDates) {
    MacBinaryFile file = sampleFile(2);
    file.dataFork.clear();
    file.resourceFork.clear();
    const GWData encoded = gwtest::buildMacBinary(file);
    ASSERT_EQ(encoded.size(), 128u);
    ASSERT_TRUE(decode(encoded));
    EXPECT_TRUE(gwtest::readFile(directory_.file("decoded")).empty());
    EXPECT_EQ(info()->typeCode(), GWFourCharCode("APPL"));
    EXPECT_EQ(info()->creatorCode(), GWFourCharCode("GWAT"));
    EXPECT_EQ(info()->location(), (60u << 16) | 40u);
    EXPECT_EQ(info()->modificationDate(), macDate(3100000000u));
    EXPECT_FALSE(GWMetadataStore(directory_.file("decoded"))
                     .attribute(kGWResourceForkAttributeName, nullptr));
}

TEST_F(GWMacBinaryTest, AnExistingDestinationIsReplacedWithItsMetadata) {
    const std::string destination = directory_.file("decoded");
    gwtest::writeFile(destination, bytesOf("old contents"));
    {
        gwtest::ScopedAttributeLimit refuseEverything(0);
        ASSERT_TRUE(
            GWMetadataStore(destination).setAttribute("com.example.old", bytesOf("x"), nullptr));
    }
    ASSERT_TRUE(decode(gwtest::buildMacBinary(sampleFile(2))));
    EXPECT_EQ(gwtest::readFile(destination), sampleFile(2).dataFork);
    EXPECT_FALSE(GWMetadataStore(destination).attribute("com.example.old", nullptr));
}

TEST_F(GWMacBinaryTest, LocationsAreCheckedBeforeTheSourceIsRead) {
    const auto& decoder = GWAppleFileDecoder::sharedInstance();
    const GWURL remote = *GWURL::URLWithString("https://example.com/x.bin");
    GWErrorPtr error;
    EXPECT_FALSE(decoder->decodeMacBinaryFileAtURL(remote, std::nullopt, &error));
    EXPECT_TRUE(error->is(kGWPOSIXErrorDomain, EINVAL));
    EXPECT_FALSE(decoder->decodeMacBinaryFileAtURL(remote, remote, &error));
    EXPECT_TRUE(error->is(kGWCocoaErrorDomain, GWFileWriteUnsupportedSchemeError));
    EXPECT_EQ(error->URL(), remote);
    EXPECT_FALSE(decoder->decodeMacBinaryFileAtURL(remote, directory_.url("out"), &error));
    EXPECT_TRUE(error->is(kGWCocoaErrorDomain, GWFileReadUnsupportedSchemeError));
    EXPECT_FALSE(decoder->decodeMacBinaryFileAtURL(directory_.url("missing"), directory_.url("out"),
                                                   &error));
    EXPECT_TRUE(error->is(kGWPOSIXErrorDomain, ENOENT));
    EXPECT_EQ(error->URL(), directory_.url("missing"));

    // A folder in the way fails before anything is written into it.
    ASSERT_EQ(::mkdir(directory_.file("folder").c_str(), 0755), 0);
    EXPECT_FALSE(decode(gwtest::buildMacBinary(sampleFile(2)), &error, "folder"));
    EXPECT_TRUE(error->is(kGWCocoaErrorDomain, GWFileIsDirectoryError));
    EXPECT_EQ(error->URL(), directory_.url("folder"));
    EXPECT_EQ(gwtest::runCommand("ls -A " + directory_.file("folder")).output, "");
}

// Malformed files: each mutation of a sound version II file, with the error it must give.
namespace {

namespace mb = gwtest::macbinary;

struct MalformedCase {
    const char* name;
    std::function<void(GWData&)> mutate;
    long code;
    bool namesTheSource;  // whether the error carries the source's URL
};

void sealed(GWData& bytes, std::size_t at, std::uint8_t value) {
    bytes[at] = value;
    gwtest::resealMacBinaryHeader(bytes);
}

void forkLengths(GWData& bytes, std::uint32_t data, std::uint32_t resource) {
    for (int i = 0; i < 4; ++i) {
        bytes[83 + i] = std::uint8_t(data >> (24 - 8 * i));
        bytes[87 + i] = std::uint8_t(resource >> (24 - 8 * i));
    }
    gwtest::resealMacBinaryHeader(bytes);
}

class GWMacBinaryMalformedTest : public GWMacBinaryTest,
                                 public ::testing::WithParamInterface<MalformedCase> {};

const MalformedCase kMalformedCases[] = {
    {"ShorterThanAHeader", [](GWData& b) { b.resize(127); }, 259, true},
    {"EmptySource", [](GWData& b) { b.clear(); }, 259, true},
    {"OldVersionByteSet", [](GWData& b) { b[0] = 1; }, 259, true},
    {"Byte74Set", [](GWData& b) { sealed(b, mb::kZeroByte74, 1); }, 259, true},
    {"NeitherSealedNorVersionI", [](GWData& b) { b[mb::kZeroByte82] = 1; }, 259, true},
    {"EmptyName", [](GWData& b) { sealed(b, mb::kNameLength, 0); }, 259, true},
    {"NameOf32Bytes", [](GWData& b) { sealed(b, mb::kNameLength, 32); }, 259, true},
    {"WriterTooNew", [](GWData& b) { sealed(b, mb::kWriterVersion, 131); }, 259, false},
    {"ReaderTooNew", [](GWData& b) { sealed(b, mb::kReaderVersion, 130); }, 259, false},
    {"DataForkCutShort", [](GWData& b) { b.resize(128 + 4000); }, 256, false},
    {"ResourceForkCutShort", [](GWData& b) { b.resize(128 + 5120 + 19999); }, 256, false},
    {"AbsurdDataForkLength", [](GWData& b) { forkLengths(b, 0xFFFFFFF0u, 0); }, 256, false},
    {"AbsurdResourceForkLength", [](GWData& b) { forkLengths(b, 5000, 0xFFFFFFFFu); }, 256, false},
};

}  // namespace

TEST_P(GWMacBinaryMalformedTest, FailsWithTheDocumentedError) {
    GWData encoded = gwtest::buildMacBinary(sampleFile(2));
    GetParam().mutate(encoded);
    GWErrorPtr error;
    ASSERT_FALSE(decode(encoded, &error));
    ASSERT_TRUE(error);
    EXPECT_TRUE(error->is(kGWCocoaErrorDomain, GetParam().code))
        << error->domain() << " " << error->code();
    EXPECT_EQ(error->URL(), GetParam().namesTheSource ? std::optional(directory_.url("source.bin"))
                                                      : std::nullopt);
}

INSTANTIATE_TEST_SUITE_P(Headers, GWMacBinaryMalformedTest, ::testing::ValuesIn(kMalformedCases),
                         [](const auto& info) { return std::string(info.param.name); });
