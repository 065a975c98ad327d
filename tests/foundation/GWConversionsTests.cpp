#include <gtest/gtest.h>

#include <set>

#include "foundation/GWConversions.h"
#include "foundation/GWPropertyListSerialization.h"
#include "foundation/GWStringEncoding.h"
#include "support/TestSupport.h"

TEST(GWConversions, FourCharCodesPutTheFirstCharacterHigh) {
    EXPECT_EQ(GWFourCharCode("TEXT"), 0x54455854u);
    EXPECT_EQ(GWStringWithFourCharCode(0x54455854u), "TEXT");
    // Classic Mac codes use Mac OS Roman: 0xA9 is the copyright sign there.
    EXPECT_EQ(GWFourCharCode("\xC2\xA9"
                             "abc"),
              0xA9616263u);
    EXPECT_EQ(GWStringWithFourCharCode(0xA9616263u),
              "\xC2\xA9"
              "abc");
    EXPECT_EQ(GWFourCharCode(""), 0u);
    EXPECT_EQ(GWFourCharCode("TOOLONG"), 0u);
    EXPECT_EQ(GWFourCharCode("ab"), 0u);
}

TEST(GWBase64, DecodesStandardTextWithSpacesAndLineBreaksAndRefusesAnythingElse) {
    const std::pair<const char*, GWData> good[] = {
        {"aGVsbG8gd29ybGQ=", gwtest::bytesOf("hello world")},
        {"aGVs\nbG8g\r\nd29y bGQ=", gwtest::bytesOf("hello world")},
        {"QUJD", gwtest::bytesOf("ABC")},
        {"QQ==", gwtest::bytesOf("A")},
        {"QQ", gwtest::bytesOf("A")},
        {"", GWData()},
        {"+/+/", GWData{0xFB, 0xFF, 0xBF}}};
    for (const auto& [text, expected] : good) {
        EXPECT_EQ(GWPropertyListSerialization::dataWithBase64String(text, nullptr), expected)
            << text;
    }
    for (const char* text : {"aGVsbG8*", "QQ=A", "Q", "QUJD=", "Q===", "QQ=", "aGVs-bG8"}) {
        GWErrorPtr error;
        EXPECT_FALSE(GWPropertyListSerialization::dataWithBase64String(text, &error)) << text;
        ASSERT_TRUE(error) << text;
        EXPECT_TRUE(error->is(kGWCocoaErrorDomain, GWFileReadCorruptFileError));
    }
}

TEST(GWStringEncoding, UTF8MustBeWellFormed) {
    EXPECT_EQ(GWStringFromBytes(std::string_view("caf\xC3\xA9"), GWStringEncoding::UTF8),
              "caf\xC3\xA9");
    for (const char* bad :
         {"\xC3", "\xC0\xAF", "\xED\xA0\x80", "\xF4\x90\x80\x80", "\xFF", "a\x80"}) {
        EXPECT_FALSE(GWStringFromBytes(std::string_view(bad), GWStringEncoding::UTF8)) << bad;
    }
    // ASCII runs are skipped several bytes at a time: what follows a run of
    // any length is still checked.
    for (std::size_t run = 0; run < 20; ++run) {
        const std::string ascii(run, 'a');
        EXPECT_TRUE(GWStringFromBytes(ascii + "\xC3\xA9" + ascii, GWStringEncoding::UTF8)) << run;
        EXPECT_FALSE(GWStringFromBytes(ascii + "\xC3", GWStringEncoding::UTF8)) << run;
        EXPECT_FALSE(GWStringFromBytes(ascii + "\xFF" + ascii, GWStringEncoding::UTF8)) << run;
    }
}

TEST(GWStringEncoding, LegacyCodePagesDecodeToUTF8) {
    EXPECT_EQ(GWStringFromBytes(std::string_view("caf\x8E"), GWStringEncoding::MacOSRoman),
              "caf\xC3\xA9");
    EXPECT_EQ(GWStringFromBytes(std::string_view("caf\xE9"), GWStringEncoding::WindowsCP1252),
              "caf\xC3\xA9");
    EXPECT_EQ(GWStringFromBytes(std::string_view("\x80"), GWStringEncoding::WindowsCP1252),
              "\xE2\x82\xAC");
    EXPECT_EQ(GWStringFromBytes(std::string_view("\xC4\xE5"), GWStringEncoding::WindowsCP1251),
              "\xD0\x94\xD0\xB5");
    EXPECT_EQ(GWStringFromBytes(std::string_view("\x82\xA0"), GWStringEncoding::ShiftJIS),
              "\xE3\x81\x82");
    EXPECT_EQ(GWStringFromBytes(std::string_view("\xE9"), GWStringEncoding::ISOLatin1), "\xC3\xA9");
    // Bytes that mean nothing in the code page are refused, not guessed.
    EXPECT_FALSE(GWStringFromBytes(std::string_view("\x81"), GWStringEncoding::WindowsCP1252));
    EXPECT_FALSE(GWStringFromBytes(std::string_view("\x82"), GWStringEncoding::ShiftJIS));
}

TEST(GWStringEncoding, EncodingBackRefusesCharactersWithoutAPlace) {
    EXPECT_EQ(GWBytesFromString("caf\xC3\xA9", GWStringEncoding::MacOSRoman), "caf\x8E");
    EXPECT_FALSE(GWBytesFromString("\xE3\x81\x82", GWStringEncoding::MacOSRoman));
}
