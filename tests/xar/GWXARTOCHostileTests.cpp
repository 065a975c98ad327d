#include <gtest/gtest.h>

#include "GWArchiveSupport/GWArchiveConstants.h"
#include "XarTestSupport.h"
#include "support/TestSupport.h"

namespace {

struct HostileTOC {
    const char* name;
    std::string fileElements;
    const char* domain;  // null: the parse fails without an error object
    long code;
    std::string entity;
};

std::string nested(std::size_t depth, const std::string& innermost = "") {
    std::string xml;
    for (std::size_t i = 0; i < depth; ++i) {
        xml += "<file id=\"" + std::to_string(i + 1) + "\"><name>d</name><type>directory</type>";
    }
    xml += innermost;
    for (std::size_t i = 0; i < depth; ++i) {
        xml += "</file>";
    }
    return xml;
}

// Directories nested `depth` deep, each named with `nameLength` letters.
std::string longNames(std::size_t depth, std::size_t nameLength) {
    std::string xml;
    for (std::size_t i = 0; i < depth; ++i) {
        xml += "<file><name>" + std::string(nameLength, 'a' + i % 26) + "</name>";
    }
    for (std::size_t i = 0; i < depth; ++i) {
        xml += "</file>";
    }
    return xml;
}

std::string withData(const std::string& dataBody) {
    return "<file id=\"1\"><name>f</name><data>" + dataBody + "</data></file>";
}

std::string withProperty(const std::string& property) {
    return "<file id=\"1\"><name>f</name>" + property + "</file>";
}

class GWXARTOCHostile : public testing::TestWithParam<HostileTOC> {};

TEST_P(GWXARTOCHostile, FailsWithTheDocumentedError) {
    const HostileTOC& sample = GetParam();
    auto parsed = gwtest::parseEntries(sample.fileElements, 28);
    EXPECT_FALSE(parsed.files);
    if (!sample.domain) {
        EXPECT_EQ(parsed.error, nullptr);
        return;
    }
    ASSERT_TRUE(parsed.error);
    EXPECT_EQ(parsed.error->domain(), sample.domain);
    EXPECT_EQ(parsed.error->code(), sample.code) << parsed.error->localizedDescription();
    EXPECT_EQ(parsed.error->detailString(kGWXARArchiveUnknownEntityErrorKey), sample.entity);
}

const char* const kXAR = "GWXARArchiveErrorDomain";

INSTANTIATE_TEST_SUITE_P(
    GWXARSamples, GWXARTOCHostile,
    testing::Values(
        HostileTOC{"TooDeep", nested(GWXARLoadOperation::kMaxFileNestingDepth + 1),
                   "NSCocoaErrorDomain", GWFileReadCorruptFileError, ""},
        HostileTOC{"FarTooDeep", nested(20000), "NSCocoaErrorDomain", GWFileReadCorruptFileError,
                   ""},
        // Full paths of 255 levels of 20,000-byte names would take 650 MB.
        HostileTOC{"PathsPastTheMemoryBound", longNames(255, 20000), "NSCocoaErrorDomain",
                   GWFileReadCorruptFileError, ""},
        HostileTOC{"HeapChecksumLongerThanADigest",
                   withData("<archived-checksum style=\"sha1\"><offset>0</offset><size>65</size>"
                            "</archived-checksum>"),
                   kXAR, GWXARArchiveMalformedValueError, "65"},
        HostileTOC{"LengthPast64Bits", withData("<length>18446744073709551616</length>"), kXAR,
                   GWXARArchiveMalformedValueError, "18446744073709551616"},
        HostileTOC{"LengthNotANumber", withData("<length>twelve</length>"), kXAR,
                   GWXARArchiveMalformedValueError, "twelve"},
        HostileTOC{"SizeNegative", withData("<size>-1</size>"), kXAR,
                   GWXARArchiveMalformedValueError, "-1"},
        HostileTOC{"OffsetPastTheEndOfTheAddressSpace",
                   withData("<offset>18446744073709551600</offset>"), kXAR,
                   GWXARArchiveMalformedValueError, "18446744073709551600"},
        HostileTOC{"OddHex", withData("<archived-checksum style=\"sha1\">ABC</archived-checksum>"),
                   kXAR, GWXARArchiveMalformedValueError, "ABC"},
        HostileTOC{"HexWithNonDigits",
                   withData("<extracted-checksum style=\"sha1\">0x12</extracted-checksum>"), kXAR,
                   GWXARArchiveMalformedValueError, "0x12"},
        HostileTOC{"ChecksumWithoutStyle", withData("<archived-checksum>00</archived-checksum>"),
                   kXAR, GWXARArchiveMissingAttributeError, "style"},
        HostileTOC{"UnknownChecksum",
                   withData("<archived-checksum style=\"crc32\">00</archived-checksum>"), kXAR,
                   GWXARArchiveUnknownChecksumError, "crc32"},
        HostileTOC{"EncodingWithoutStyle", withData("<encoding/>"), kXAR,
                   GWXARArchiveMissingAttributeError, "style"},
        HostileTOC{"UnknownEncoding", withData("<encoding style=\"application/zstd\"/>"), kXAR,
                   GWXARArchiveUnsupportedCompressionError, "application/zstd"},
        // Encodings are matched exactly, case included.
        HostileTOC{"EncodingInCapitals", withData("<encoding style=\"Application/X-Gzip\"/>"), kXAR,
                   GWXARArchiveUnsupportedCompressionError, "Application/X-Gzip"},
        HostileTOC{"UnknownType", withProperty("<type>portal</type>"), kXAR,
                   GWXARArchiveMalformedValueError, "portal"},
        HostileTOC{"HardLinkWithoutLink", withProperty("<type>hardlink</type>"), kXAR,
                   GWXARArchiveMissingAttributeError, "link"},
        HostileTOC{"HardLinkToNothing", withProperty("<type link=\"42\">hardlink</type>"), kXAR,
                   GWXARArchiveHardLinkTargetNotFoundError, "42"},
        HostileTOC{"UnknownFlag", withProperty("<flags><Sparkly/></flags>"), kXAR,
                   GWXARArchiveUnknownFlagError, "Sparkly"},
        HostileTOC{"DeviceWithoutMajor", withProperty("<device><minor>1</minor></device>"), kXAR,
                   GWXARArchiveMissingElementError, "major"},
        HostileTOC{"DeviceMajorTooLarge",
                   withProperty("<device><major>18446744073709551615</major><minor>0</minor>"
                                "</device>"),
                   kXAR, GWXARArchiveMalformedValueError, "9223372036854775807"},
        HostileTOC{"DeviceMinorTooLarge",
                   withProperty("<device><major>0</major><minor>256</minor></device>"), kXAR,
                   GWXARArchiveMalformedValueError, "256"},
        HostileTOC{"DeviceMinorNegative",
                   withProperty("<device><major>0</major><minor>-1</minor></device>"), kXAR,
                   GWXARArchiveMalformedValueError, "-1"},
        HostileTOC{"CreationWithoutTime", withProperty("<FinderCreateTime></FinderCreateTime>"),
                   kXAR, GWXARArchiveMissingElementError, "time"},
        HostileTOC{"DeepFailureSurfaces", nested(10, withProperty("<type>portal</type>")), kXAR,
                   GWXARArchiveMalformedValueError, "portal"},
        HostileTOC{"ACLThatIsNeither", withProperty("<acl><access>rwxrwxrwx</access></acl>"),
                   "NSPOSIXErrorDomain", EINVAL, "rwxrwxrwx"},
        HostileTOC{"ACLWithANul",
                   withProperty("<acl><access enctype=\"base64\">"
                                "dTo6cnctLGc6OnItLSxvOjotLS0AanVuaw==</access></acl>"),
                   "NSPOSIXErrorDomain", EINVAL, std::string("u::rw-,g::r--,o::---\0junk", 25)},
        HostileTOC{"BrokenBase64", withProperty("<user enctype=\"base64\">====</user>"),
                   "NSCocoaErrorDomain", GWFileReadCorruptFileError, ""},
        HostileTOC{"EmptyID", "<file id=\"\"><name>f</name></file>", nullptr, 0, ""},
        HostileTOC{"BadDate", withProperty("<atime>yesterday</atime>"), nullptr, 0, ""},
        HostileTOC{"DateWithFraction", withProperty("<mtime>2010-01-02T03:04:05.5Z</mtime>"),
                   nullptr, 0, ""},
        HostileTOC{"DateWithTwoZones", withProperty("<mtime>2010-01-02T03:04:05ZZ</mtime>"),
                   nullptr, 0, ""},
        HostileTOC{"NameNotUTF8", "<file id=\"1\"><name enctype=\"base64\">Yf8=</name></file>",
                   nullptr, 0, ""},
        HostileTOC{"BadDateDeepDown", nested(3, withProperty("<ctime>2010-13-01T00:00:00</ctime>")),
                   nullptr, 0, ""}),
    [](const testing::TestParamInfo<HostileTOC>& info) { return std::string(info.param.name); });

TEST(GWXARTOCHostileLimits, NestingUpToTheLimitIsAccepted) {
    auto parsed = gwtest::parseEntries(nested(GWXARLoadOperation::kMaxFileNestingDepth));
    ASSERT_TRUE(parsed.files) << (parsed.error ? parsed.error->localizedDescription() : "");
    std::size_t depth = 0;
    for (auto level = *parsed.files; !level.empty(); level = level[0]->children()) {
        ++depth;
    }
    EXPECT_EQ(depth, GWXARLoadOperation::kMaxFileNestingDepth);
}

TEST(GWXARTOCHostileLimits, ManyDroppedEntriesStayCheap) {
    // Each "." below the top hands its children to an entry under construction;
    // a quadratic hand-over would make this crawl.
    std::string inner;
    for (int i = 0; i < 20000; ++i) {
        inner += "<file id=\"d" + std::to_string(i) + "\"><name>.</name><file id=\"c" +
                 std::to_string(i) + "\"><name>c</name></file></file>";
    }
    auto parsed = gwtest::parseEntries(
        "<file id=\"top\"><name>top</name><type>directory</type>" + inner +
        "</file><file id=\"l\"><name>l</name><type link=\"c19999\">hardlink</type></file>");
    ASSERT_TRUE(parsed.files);
    EXPECT_TRUE(gwtest::entryAtPath(*parsed.files, "top")->children().empty());
}

}  // namespace
