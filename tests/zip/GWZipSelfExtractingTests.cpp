// Recognising ZIP archives and self-extracting executables. Opening archives
// behind a prefix is GWZipArchiveOpen's and GWZipArchiveRemote's to test.

#include <gtest/gtest.h>

#include <cstring>

#include "support/TestSupport.h"
#include "support/ZipBuilder.h"
#include "zip/GWZipArchive.h"

namespace {

using namespace gwtest;

constexpr std::size_t kPEHeader = 0x80;
constexpr std::size_t kSectionTable = kPEHeader + 0xF8;

struct Section {
    std::string name;
    std::uint32_t rawOffset;
    std::uint32_t rawSize;
};

void put32(GWData& bytes, std::size_t at, std::uint32_t value) {
    for (int i = 0; i < 4; ++i) {
        bytes[at + i] = std::uint8_t(value >> (8 * i));
    }
}

// An MS-DOS header, a stub, a PE (or other) signature and section headers;
// the image is padded to `size` bytes.
GWData executable(const std::string& stub, const std::vector<Section>& sections,
                  std::size_t size = 0x1000, const char* signature = "PE\0\0") {
    GWData bytes(size, 0);
    bytes[0] = 'M';
    bytes[1] = 'Z';
    bytes[8] = 4;  // header paragraphs: the stub starts at 64
    put32(bytes, 0x3C, kPEHeader);
    std::memcpy(bytes.data() + 64, stub.data(), std::min<std::size_t>(stub.size(), 64));
    std::memcpy(bytes.data() + kPEHeader, signature, 4);
    for (std::size_t i = 0; i < sections.size(); ++i) {
        const std::size_t header = kSectionTable + 40 * i;
        std::memcpy(bytes.data() + header, sections[i].name.data(),
                    std::min<std::size_t>(sections[i].name.size(), 8));
        put32(bytes, header + 16, sections[i].rawSize);
        put32(bytes, header + 20, sections[i].rawOffset);
    }
    return bytes;
}

GWData smallZip() {
    ZipBuilder zip;
    zip.addFile("inside.txt", bytesOf("packed"));
    return zip.bytes();
}

// Trailing bytes that push the ZIP's end record out of the fallback's reach,
// so only the marker being tested can answer yes.
GWData farFromTheEnd(GWData bytes) {
    bytes.insert(bytes.end(), 70000, 0);
    return bytes;
}

GWData withZipAt(GWData image, std::size_t offset) {
    image.resize(offset);
    const GWData zip = smallZip();
    image.insert(image.end(), zip.begin(), zip.end());
    return image;
}

class GWZipSelfExtracting : public ::testing::Test {
protected:
    bool isSelfExtracting(const GWData& bytes) {
        writeFile(directory.file("setup.exe"), bytes);
        return GWZipArchive::isSelfExtractingZipArchiveAtURL(directory.url("setup.exe"));
    }
    bool isZip(const GWData& bytes) {
        writeFile(directory.file("file"), bytes);
        return GWZipArchive::isZipArchiveAtURL(directory.url("file"));
    }

    TemporaryDirectory directory;
};

// A PKSFX stub is enough without a PE image (only the stub's first 32 bytes
// are searched); a PE image needs a local header just after its relocations,
// a "_winzip_" section, or a ZIP right after a packed or .idata section; the
// fallback looks for an end record near the end.
TEST_F(GWZipSelfExtracting, MarkersAndTheFallbackAreRecognised) {
    const GWData plain = executable("stub", {{".text", 0x400, 0x200}});
    const GWData relocated =
        executable("stub", {{".text", 0x400, 0x200}, {".reloc", 0x600, 0x100}});
    const GWData notPE = executable("stub", {}, 0x400, "NE\0\0");
    const std::pair<GWData, bool> rows[] = {
        {executable("PKSFX ready", {}, 0x400, "NE\0\0"), true},
        {executable(std::string(40, ' ') + "PKSFX", {}, 0x400, "NE\0\0"), false},
        {farFromTheEnd(withZipAt(relocated, 0x700 + 0x20)), true},
        {farFromTheEnd(withZipAt(relocated, 0x700 + 0x200)), false},
        {farFromTheEnd(executable("stub", {{".text", 0x400, 0x200}, {"_winzip_", 0x600, 0x10}})),
         true},
        {farFromTheEnd(withZipAt(executable("stub", {{"UPX0", 0x400, 0x300}}), 0x700)), true},
        {farFromTheEnd(withZipAt(executable("stub", {{"PEC2", 0x400, 0x300}}), 0x700)), true},
        {farFromTheEnd(withZipAt(executable("stub", {{"UPX2", 0x400, 0x300}}), 0x700)), true},
        {farFromTheEnd(withZipAt(executable("stub", {{"UPX0", 0x400, 0x300}}), 0x704)), false},
        {farFromTheEnd(withZipAt(executable("stub", {{".idata", 0x400, 0x100}}), 0x500)), true},
        {withZipAt(plain, 0x600), true},
        {farFromTheEnd(withZipAt(plain, 0x600)), false},
        {plain, false},
        {withZipAt(notPE, 0x400), true},
        {withZipAt(executable("stub", {{".idata", 0x400, 0x10}}), 0x600), true},
        {[] {
             GWData cut = executable("PKSFX", {}, 0x400);
             cut.resize(63);
             return cut;
         }(),
         false},
        {smallZip(), false},
        {{}, false},
    };
    for (std::size_t i = 0; i < std::size(rows); ++i) {
        EXPECT_EQ(isSelfExtracting(rows[i].first), rows[i].second) << "row " << i;
    }
}

TEST_F(GWZipSelfExtracting, IsZipArchiveAcceptsZipsExecutablesAndTrailingEndRecords) {
    EXPECT_TRUE(isZip(smallZip()));
    EXPECT_TRUE(isZip(executable("PKSFX", {}, 0x400)));
    GWData prefixed = randomBytes(5000, 1);
    prefixed[0] = 'X';
    const GWData zip = smallZip();
    prefixed.insert(prefixed.end(), zip.begin(), zip.end());
    EXPECT_TRUE(isZip(prefixed));

    ZipBuilder commented;
    commented.prefix = bytesOf("XXXX");
    commented.addFile("a", bytesOf("x"));
    commented.archiveComment = GWData(600, 'c');
    EXPECT_FALSE(isZip(commented.bytes()));
    EXPECT_FALSE(isZip(bytesOf("PK\x03")));
    EXPECT_FALSE(isZip(textBytes(3000, 2)));
    EXPECT_FALSE(GWZipArchive::isZipArchiveAtURL(directory.url("absent.zip")));
    EXPECT_FALSE(GWZipArchive::isSelfExtractingZipArchiveAtURL(directory.url("absent.exe")));
    EXPECT_FALSE(GWZipArchive::isSelfExtractingZipArchiveAtURL(
        *GWURL::URLWithString("https://example.invalid/setup.exe")));
}

}  // namespace
