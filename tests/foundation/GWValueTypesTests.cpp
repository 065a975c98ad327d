#include <gtest/gtest.h>

#include <cstdlib>
#include <ctime>

#include "GWArchiveSupport/GWArchiveConstants.h"
#include "foundation/GWFoundation.h"
#include "support/TestSupport.h"

TEST(GWURL, ParsingStrings) {
    auto file = GWURL::URLWithString("file:///tmp/caf%C3%A9.zip");
    ASSERT_TRUE(file);
    EXPECT_EQ(file->path(), "/tmp/caf\xC3\xA9.zip");
    EXPECT_EQ(*file, GWURL::fileURLWithPath("/tmp/caf\xC3\xA9.zip"));
    EXPECT_EQ(GWURL::URLWithString(file->absoluteString()), file);

    auto web = GWURL::URLWithString("HTTPS://example.com/dir/a.xar?x=1");
    ASSERT_TRUE(web);
    EXPECT_EQ(web->scheme(), "https");
    EXPECT_EQ(web->host(), "example.com");
    EXPECT_EQ(web->path(), "/dir/a.xar");
    EXPECT_EQ(web->absoluteString(), "https://example.com/dir/a.xar?x=1");

    auto relative = GWURL::URLWithString("dir/a.zip");
    ASSERT_TRUE(relative);
    EXPECT_TRUE(relative->scheme().empty());
    EXPECT_FALSE(relative->isFileURL());

    EXPECT_FALSE(GWURL::URLWithString(""));
    EXPECT_FALSE(GWURL::URLWithString("file:///bad%zzescape"));
    EXPECT_FALSE(GWURL::URLWithString("file://otherhost/x"));
    EXPECT_FALSE(GWURL::URLWithString("file:relative"));
    EXPECT_FALSE(GWURL::URLWithString("has space"));
}

TEST(GWDate, GregorianFieldsInAZoneAndRollingOver) {
    const GWTimeZone utc = GWTimeZone::UTC();
    EXPECT_EQ(GWDate::gregorianDateWithYear(1970, 1, 1, 0, 0, 0, utc).timeIntervalSince1970(), 0);
    EXPECT_EQ(GWDate::gregorianDateWithYear(2001, 1, 1, 0, 0, 0, utc).timeIntervalSince1970(),
              978307200);
    EXPECT_EQ(GWDate::gregorianDateWithYear(1904, 1, 1, 0, 0, 0, utc).timeIntervalSince1970(),
              -2082844800);
    // A DOS time can say second 31 or month 0; both roll into the next field.
    EXPECT_EQ(GWDate::gregorianDateWithYear(2000, 1, 1, 0, 0, 61, utc).timeIntervalSince1970(),
              GWDate::gregorianDateWithYear(2000, 1, 1, 0, 1, 1, utc).timeIntervalSince1970());
    EXPECT_EQ(GWDate::gregorianDateWithYear(2000, 0, 1, 0, 0, 0, utc).timeIntervalSince1970(),
              GWDate::gregorianDateWithYear(1999, 12, 1, 0, 0, 0, utc).timeIntervalSince1970());
    EXPECT_EQ(GWDate::gregorianDateWithYear(2000, 1, 1, 2, 0, 0, GWTimeZone{7200})
                  .timeIntervalSince1970(),
              946684800);
}

TEST(GWDate, NoZoneMeansTheCurrentOne) {
    {
        gwtest::ScopedEnvironment zone("TZ", "America/New_York");
        tzset();
        // Winter is five hours behind UTC there, summer four.
        for (const auto& [month, hours] : {std::pair(1, 5), std::pair(7, 4)}) {
            EXPECT_EQ(
                GWDate::gregorianDateWithYear(2020, month, 15, 12, 0, 0).timeIntervalSince1970(),
                GWDate::gregorianDateWithYear(2020, month, 15, 12 + hours, 0, 0, GWTimeZone::UTC())
                    .timeIntervalSince1970());
        }
    }
    tzset();
}

TEST(GWDate, ISO8601AndNTFSTicks) {
    auto date = GWDate::dateWithISO8601String("2021-03-04T05:06:07");
    ASSERT_TRUE(date);
    EXPECT_EQ(date->timeIntervalSince1970(), 1614834367);
    EXPECT_EQ(date->ISO8601String(), "2021-03-04T05:06:07Z");
    for (const char* bad : {"2021-03-04T05:06:07.5", "2021-13-04T05:06:07", "2021-03-04 05:06:07",
                            "", "2021-03-04T05:06"}) {
        EXPECT_FALSE(GWDate::dateWithISO8601String(bad)) << bad;
    }
    EXPECT_EQ(GWDate::dateWithNTFSTicks(116444736000000000ull).timeIntervalSince1970(), 0);
    EXPECT_DOUBLE_EQ(GWDate::dateWithNTFSTicks(116444736000000001ull).timeIntervalSince1970(),
                     1e-7);
}

TEST(GWError, GeneratedErrorsFormatTheirDescriptionAndLogLinesGoToTheSink) {
    auto error = GWGenerateError(kGWZipArchiveErrorDomain, 1, GWURL::fileURLWithPath("/tmp/a.zip"),
                                 GWPOSIXError(ENOENT), {}, "method %d is not supported", 9);
    EXPECT_EQ(error->localizedDescription(), "method 9 is not supported");
    EXPECT_EQ(error->underlyingError()->localizedDescription(), "No such file or directory");

    std::vector<std::string> lines;
    auto previous = GWSetLogSink([&](const std::string& line) { lines.push_back(line); });
    GWLog("unknown extra info signature: 0x%x", 0x1234);
    GWSetLogSink(previous);
    EXPECT_EQ(lines, std::vector<std::string>{"unknown extra info signature: 0x1234"});
}

TEST(GWByteReader, ReadsAreCheckedAndFailureIsSticky) {
    const GWData bytes{0x01, 0x02, 0x03, 0x04, 0x05, 0x06};
    GWByteReader reader(bytes);
    EXPECT_EQ(reader.u16le(), 0x0201);
    EXPECT_EQ(reader.u16be(), 0x0304);
    EXPECT_TRUE(reader.ok());
    EXPECT_EQ(reader.u32le(), 0u);
    EXPECT_FALSE(reader.ok());
    EXPECT_EQ(reader.u8(), 0);  // still failed, even though a byte remains
    EXPECT_EQ(reader.failureDescription(),
              "unexpected end of data at offset 0x6 while reading [0x4, 0x8)");

    GWByteReader whole(bytes);
    EXPECT_FALSE(GWByteReader(bytes).skip(7));  // one past the end
    EXPECT_TRUE(GWByteReader(bytes).skip(6));
    EXPECT_FALSE(whole.slice(4, 3).ok());
    EXPECT_FALSE(whole.slice(SIZE_MAX, 2).ok());
    GWByteReader part = whole.slice(2, 3);
    EXPECT_EQ(part.uintBE(3), 0x030405u);
    EXPECT_TRUE(part.ok());
    EXPECT_FALSE(whole.seek(7));
}
