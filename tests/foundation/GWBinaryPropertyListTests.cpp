#include <gtest/gtest.h>

#include <bit>
#include <numeric>

#include "foundation/GWBinaryPropertyList.h"
#include "support/TestSupport.h"

namespace {

GWValue roundTrip(const GWValue& value) {
    GWErrorPtr error;
    GWData data = GWBinaryPropertyList::dataWithValue(value, &error);
    EXPECT_FALSE(data.empty()) << (error ? error->localizedDescription() : "");
    auto back = GWBinaryPropertyList::valueWithData(data, &error);
    EXPECT_TRUE(back.has_value()) << (error ? error->localizedDescription() : "");
    return back.value_or(GWValue());
}

GWData bytes(std::initializer_list<int> list) {
    GWData out;
    for (int b : list) {
        out.push_back(std::uint8_t(b));
    }
    return out;
}

void putBE(GWData& out, std::uint64_t value, std::size_t width) {
    for (std::size_t i = width; i-- > 0;) {
        out.push_back(std::uint8_t(value >> (8 * i)));
    }
}

// Hand-assembled files: the objects as given, then the offset table and the
// trailer, whose fields can be overridden to describe damage.
struct Assembly {
    std::vector<GWData> objects;
    std::uint8_t refSize = 1;
    std::uint8_t offsetSize = 1;
    std::optional<std::uint64_t> count;
    std::uint64_t top = 0;
    std::optional<std::uint64_t> tableOffset;
    std::vector<std::uint64_t> offsetOverrides;  // replaces the first offsets

    GWData build() const {
        GWData out = bytes({'b', 'p', 'l', 'i', 's', 't', '0', '0'});
        std::vector<std::uint64_t> offsets;
        for (const GWData& object : objects) {
            offsets.push_back(out.size());
            out.insert(out.end(), object.begin(), object.end());
        }
        for (std::size_t i = 0; i < offsetOverrides.size(); ++i) {
            offsets[i] = offsetOverrides[i];
        }
        const std::uint64_t table = out.size();
        for (std::uint64_t offset : offsets) {
            putBE(out, offset, offsetSize);
        }
        out.insert(out.end(), 6, 0);
        out.push_back(offsetSize);
        out.push_back(refSize);
        putBE(out, count.value_or(objects.size()), 8);
        putBE(out, top, 8);
        putBE(out, tableOffset.value_or(table), 8);
        return out;
    }
};

GWErrorPtr readError(const GWData& data) {
    GWErrorPtr error;
    auto value = GWBinaryPropertyList::valueWithData(data, &error);
    EXPECT_FALSE(value.has_value());
    return error;
}

bool holdsSigned(const GWValue& value) {
    return std::holds_alternative<std::int64_t>(value.storage);
}

}  // namespace

TEST(GWBinaryPropertyList, ScalarsAndNestedContainersRoundTripExactly) {
    GWDictionary inner{{"data", GWValue(GWData{1, 2, 3})}, {"empty", GWValue(GWArray())}};
    GWArray list{GWValue(1), GWValue("two"), GWValue(inner), GWValue(GWDictionary()),
                 GWValue(GWArray{GWValue(GWArray{GWValue(true)})})};
    const std::vector<GWValue> values = {
        GWValue(true),
        GWValue(false),
        GWValue(0.0),
        GWValue(-2.5),
        GWValue(1e300),
        GWValue(std::string()),
        GWValue("fourteen chars"),         // the longest count held in the marker
        GWValue("fifteen chars.."),        // the first count that follows the marker
        GWValue(std::string(70000, 'x')),  // a count of four bytes
        GWValue("Gr\xC3\xBC\xC3\x9F"
                "e"),                         // Latin
        GWValue("\xE6\x97\xA5\xE6\x9C\xAC"),  // CJK
        GWValue("a\xF0\x9F\x98\x80z"),        // outside the BMP: a surrogate pair
        GWValue(GWData()),
        GWValue(gwtest::randomBytes(15, 1)),
        GWValue(gwtest::randomBytes(300000, 2)),
        GWValue(GWDictionary{{"list", GWValue(list)},
                             {"same", GWValue(list)},
                             {"\xC3\xA9t\xC3\xA9", GWValue("summer")},
                             {"", GWValue(-7)}}),
    };
    for (const GWValue& value : values) {
        EXPECT_EQ(roundTrip(value), value) << value.description().substr(0, 60);
    }
}

TEST(GWBinaryPropertyList, IntegersKeepTheirValueAndSign) {
    const std::vector<std::int64_t> signedValues = {
        0, 1, 255, 256, 65535, 65536, 4294967295LL, 4294967296LL, INT64_MAX, -1, -256, INT64_MIN};
    for (std::int64_t number : signedValues) {
        GWValue back = roundTrip(GWValue(number));
        EXPECT_TRUE(holdsSigned(back)) << number;
        EXPECT_EQ(back.integerValue(), number);
    }
    for (std::uint64_t number : {std::uint64_t(INT64_MAX) + 1, UINT64_MAX - 1, UINT64_MAX}) {
        GWValue back = roundTrip(GWValue(number));
        EXPECT_FALSE(holdsSigned(back)) << number;
        EXPECT_EQ(back.unsignedValue(), number);
    }
    // Unsigned values that fit come back signed, and still compare equal.
    EXPECT_EQ(roundTrip(GWValue(std::uint64_t(42))), GWValue(std::uint64_t(42)));
}

TEST(GWBinaryPropertyList, DatesRoundTripExactly) {
    const std::vector<GWDate> dates = {
        GWDate(0),
        GWDate(978307200),  // the format's epoch
        GWDate::gregorianDateWithYear(1904, 1, 1, 0, 0, 0, GWTimeZone::UTC()),  // Mac epoch
        GWDate::gregorianDateWithYear(1904, 2, 29, 23, 59, 59, GWTimeZone::UTC()),
        GWDate::gregorianDateWithYear(2100, 12, 31, 23, 59, 59, GWTimeZone::UTC()),
        GWDate(-2082844800.5),
        GWDate(-2082844800.25),
        GWDate(4102444800.123),
        GWDate(978307200.001),
        GWDate(1700000000.75),
        GWDate(1234567890.123456),
    };
    for (const GWDate& date : dates) {
        GWValue back = roundTrip(GWValue(date));
        ASSERT_NE(back.date(), nullptr);
        EXPECT_EQ(back.date()->timeIntervalSince1970(), date.timeIntervalSince1970())
            << std::bit_cast<std::uint64_t>(date.timeIntervalSince1970());
    }
}

TEST(GWBinaryPropertyList, ManyObjectsUseWideReferencesAndOffsets) {
    GWArray many;
    for (int i = 0; i < 70000; ++i) {
        many.push_back(GWValue(i * 3));
    }
    GWData data = GWBinaryPropertyList::dataWithValue(GWValue(many));
    ASSERT_GE(data.size(), 32u);
    EXPECT_EQ(data[data.size() - 25], 4);  // reference size
    EXPECT_EQ(data[data.size() - 26], 4);  // offset size
    EXPECT_EQ(roundTrip(GWValue(many)), GWValue(many));
}

TEST(GWBinaryPropertyList, NestingDeeperThanTheLimitIsRefusedWhenWriting) {
    GWValue deep = GWValue(GWArray());
    for (std::size_t i = 1; i < kGWPropertyListMaxDepth; ++i) {
        deep = GWValue(GWArray{std::move(deep)});
    }
    EXPECT_EQ(roundTrip(deep), deep);  // exactly at the limit

    GWErrorPtr error;
    GWValue deeper = GWValue(GWArray{deep});
    EXPECT_TRUE(GWBinaryPropertyList::dataWithValue(deeper, &error).empty());
    ASSERT_TRUE(error);
    EXPECT_TRUE(error->is(kGWCocoaErrorDomain, GWPropertyListWriteInvalidError));
}

// --- Files of other writers --------------------------------------------------

TEST(GWBinaryPropertyList, ReadsWhatPythonWrites) {
    if (!gwtest::toolAvailable("python3")) {
        GTEST_SKIP() << "python3 is not installed";
    }
    gwtest::TemporaryDirectory directory;
    const std::string path = directory.file("python.plist");
    const std::string script = R"PY(
import datetime, plistlib, sys
shared = [1, 2, 3]
value = {
    "small": 7, "negative": -5, "min": -2**63, "big": 2**63, "max": 2**64 - 1,
    "real": 0.1, "true": True, "false": False,
    "ascii": "plain", "latin": "Gr\u00fc\u00dfe", "emoji": "a\U0001F600z",
    "data": bytes(range(40)), "empty": b"",
    "mac": datetime.datetime(1904, 1, 1), "future": datetime.datetime(2100, 6, 1, 12, 30, 15),
    "list": [shared, shared, {"k": "v"}], "wide": list(range(300)),
}
with open(sys.argv[1], "wb") as f:
    plistlib.dump(value, f, fmt=plistlib.FMT_BINARY)
)PY";
    auto result = gwtest::runCommand("python3 -c " + gwtest::shellQuote(script) + " " +
                                     gwtest::shellQuote(path));
    ASSERT_EQ(result.status, 0) << result.output;

    GWErrorPtr error;
    auto value = GWBinaryPropertyList::valueWithData(gwtest::readFile(path), &error);
    ASSERT_TRUE(value) << error->localizedDescription();
    GWData forty(40);
    std::iota(forty.begin(), forty.end(), std::uint8_t(0));
    GWArray wide;
    for (int i = 0; i < 300; ++i) {
        wide.push_back(GWValue(i));
    }
    const GWValue shared(GWArray{GWValue(1), GWValue(2), GWValue(3)});
    const GWDictionary expected{
        {"small", GWValue(7)},
        {"negative", GWValue(-5)},
        {"min", GWValue(INT64_MIN)},
        {"big", GWValue(std::uint64_t(1) << 63)},
        {"max", GWValue(UINT64_MAX)},
        {"real", GWValue(0.1)},
        {"true", GWValue(true)},
        {"false", GWValue(false)},
        {"ascii", GWValue("plain")},
        {"latin", GWValue("Gr\xC3\xBC\xC3\x9F"
                          "e")},
        {"emoji", GWValue("a\xF0\x9F\x98\x80z")},
        {"data", GWValue(forty)},
        {"empty", GWValue(GWData())},
        {"mac", GWValue(GWDate(-2082844800))},
        {"future",
         GWValue(GWDate::gregorianDateWithYear(2100, 6, 1, 12, 30, 15, GWTimeZone::UTC()))},
        {"list", GWValue(GWArray{shared, shared, GWValue(GWDictionary{{"k", GWValue("v")}})})},
        {"wide", GWValue(wide)}};
    EXPECT_EQ(*value, GWValue(expected));
}

TEST(GWBinaryPropertyList, PythonReadsWhatWeWrite) {
    if (!gwtest::toolAvailable("python3")) {
        GTEST_SKIP() << "python3 is not installed";
    }
    GWDictionary value{
        {"negative", GWValue(-5)},
        {"max", GWValue(UINT64_MAX)},
        {"wide", GWValue(std::int64_t(1) << 40)},
        {"text", GWValue("Gr\xC3\xBC\xC3\x9F"
                         "e \xF0\x9F\x98\x80")},
        {"data", GWValue(GWData{0, 255, 16})},
        {"mac", GWValue(GWDate(-2082844800))},
        {"future", GWValue(GWDate(4102444800.5))},
        {"nested", GWValue(GWArray{GWValue(true), GWValue(GWDictionary{{"x", GWValue(1.5)}})})},
    };
    gwtest::TemporaryDirectory directory;
    const std::string path = directory.file("ours.plist");
    gwtest::writeFile(path, GWBinaryPropertyList::dataWithValue(GWValue(value)));
    const std::string script = R"PY(
import plistlib, sys
d = plistlib.load(open(sys.argv[1], "rb"))
print(d["negative"], d["max"], d["wide"], d["text"].encode("unicode_escape").decode(),
      d["data"].hex(), d["mac"].isoformat(), d["future"].isoformat(), d["nested"])
)PY";
    auto result = gwtest::runCommand("python3 -c " + gwtest::shellQuote(script) + " " +
                                     gwtest::shellQuote(path));
    ASSERT_EQ(result.status, 0) << result.output;
    EXPECT_EQ(result.output,
              "-5 18446744073709551615 1099511627776 Gr\\xfc\\xdfe \\U0001f600 00ff10 "
              "1904-01-01T00:00:00 2100-01-01T00:00:00.500000 [True, {'x': 1.5}]\n");
}

// --- Damaged files -------------------------------------------------------------

TEST(GWBinaryPropertyList, EveryTruncationIsReportedAsCorrupt) {
    GWDictionary value{{"a", GWValue(GWArray{GWValue(1), GWValue("text")})},
                       {"b", GWValue(GWData(20, 7))},
                       {"c", GWValue(GWDate(5))}};
    const GWData full = GWBinaryPropertyList::dataWithValue(GWValue(value));
    for (std::size_t length = 0; length < full.size(); ++length) {
        GWData cut(full.begin(), full.begin() + length);
        GWErrorPtr error = readError(cut);
        ASSERT_TRUE(error) << length;
        EXPECT_TRUE(error->is(kGWCocoaErrorDomain, GWFileReadCorruptFileError)) << length;
    }
}

TEST(GWBinaryPropertyList, CorruptedBytesNeverCrash) {
    GWDictionary value{{"list", GWValue(GWArray{GWValue(1), GWValue("t\xC3\xA9xt"),
                                                GWValue(GWDictionary{{"k", GWValue(2.5)}})})},
                       {"date", GWValue(GWDate(5))},
                       {"data", GWValue(GWData(18, 1))}};
    const GWData full = GWBinaryPropertyList::dataWithValue(GWValue(value));
    for (std::size_t i = 0; i < full.size(); ++i) {
        for (int replacement : {0x00, 0x01, 0x0F, 0x7F, 0x80, 0xAF, 0xDF, 0xFF}) {
            GWData damaged = full;
            damaged[i] = std::uint8_t(replacement);
            GWErrorPtr error;
            auto result = GWBinaryPropertyList::valueWithData(damaged, &error);
            if (!result) {
                ASSERT_TRUE(error);
                EXPECT_TRUE(error->is(kGWCocoaErrorDomain, GWFileReadCorruptFileError));
            }
        }
    }
}

struct Damage {
    const char* name;
    Assembly assembly;
    const char* expected;  // a piece of the description
};

class GWBinaryPropertyListDamage : public testing::TestWithParam<Damage> {};

TEST_P(GWBinaryPropertyListDamage, IsCorruptFileErrorNamingTheProblem) {
    GWErrorPtr error = readError(GetParam().assembly.build());
    ASSERT_TRUE(error);
    EXPECT_TRUE(error->is(kGWCocoaErrorDomain, GWFileReadCorruptFileError));
    EXPECT_NE(error->localizedDescription().find(GetParam().expected), std::string::npos)
        << error->localizedDescription();
    EXPECT_NE(error->localizedDescription().find("0x"), std::string::npos);
}

namespace {

Assembly with(std::vector<GWData> objects, std::function<void(Assembly&)> change = {}) {
    Assembly assembly;
    assembly.objects = std::move(objects);
    if (change) {
        change(assembly);
    }
    return assembly;
}

const GWData kOne = bytes({0x10, 0x01});

}  // namespace

INSTANTIATE_TEST_SUITE_P(
    GWBinaryPropertyList, GWBinaryPropertyListDamage,
    testing::Values(
        Damage{"OffsetSizeZero", with({kOne}, [](Assembly& a) { a.offsetSize = 0; }),
               "offset size 0"},
        Damage{"ReferenceSizeNine", with({kOne}, [](Assembly& a) { a.refSize = 9; }),
               "reference size 9"},
        Damage{"NoObjects", with({kOne}, [](Assembly& a) { a.count = 0; }), "do not fit"},
        Damage{"HugeObjectCount", with({kOne}, [](Assembly& a) { a.count = UINT64_MAX / 2; }),
               "do not fit"},
        Damage{"TopPastTheObjects", with({kOne}, [](Assembly& a) { a.top = 1; }), "top object 1"},
        Damage{"TableBeforeHeaderEnds", with({kOne}, [](Assembly& a) { a.tableOffset = 4; }),
               "outside the object area"},
        Damage{"TablePastTheEnd", with({kOne}, [](Assembly& a) { a.tableOffset = 1000; }),
               "outside the object area"},
        Damage{"ObjectOffsetInTheTable",
               with({kOne}, [](Assembly& a) { a.offsetOverrides = {10}; }),
               "outside the object area"},
        Damage{"ReferencePastTheObjects", with({bytes({0xA1, 0x05}), kOne}), "refers to object 5"},
        Damage{"ArrayCountPastTheEnd", with({bytes({0xAF, 0x10, 0xFF, 0x01}), kOne}),
               "claims 255 elements"},
        Damage{"HugeDataCount",
               with({bytes({0x4F, 0x13, 0x7F, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF})}),
               "claims 9223372036854775807 elements"},
        Damage{"DictionaryCountOverflowsTheReferences",
               with({bytes({0xDF, 0x13, 0x80, 0, 0, 0, 0, 0, 0, 0, 0x00, 0x00})}),
               "claims 9223372036854775808 elements of 2 bytes"},
        Damage{"StringPastTheObjects", with({bytes({0x55, 'a', 'b'})}), "claims 5 elements"},
        Damage{"CountMarkerNotAnInteger", with({bytes({0x5F, 0x23, 0, 0, 0, 0, 0, 0, 0, 1})}),
               "count marker 0x23"},
        Damage{"ArrayContainsItself", with({bytes({0xA1, 0x00})}), "contains itself"},
        Damage{"IndirectCycle",
               with({bytes({0xA1, 0x01}), bytes({0xD1, 0x02, 0x00}), bytes({0x51, 'k'})}),
               "contains itself"},
        Damage{"KeyNotAString", with({bytes({0xD1, 0x01, 0x01}), kOne}), "not a string"},
        Damage{"NullObject", with({bytes({0x00})}), "unsupported marker 0x00"},
        Damage{"UIDObject", with({bytes({0x80, 0x01})}), "unsupported marker 0x80"},
        Damage{"SetObject", with({bytes({0xC0})}), "unsupported marker 0xc0"},
        Damage{"IntegerWiderThan16Bytes", with({bytes({0x15, 0x00})}), "32 bytes wide"},
        Damage{"IntegerBeyond64Bits",
               with({bytes({0x14, 0, 0, 0, 0, 0, 0, 0, 1, 0, 0, 0, 0, 0, 0, 0, 0})}),
               "does not fit in 64 bits"},
        Damage{"FloatOfTwoBytes", with({bytes({0x21, 0, 0})}), "unsupported marker 0x21"},
        Damage{"DoubleRunsIntoTheTable", with({bytes({0x23, 0, 0})}), "runs into"}),
    [](const testing::TestParamInfo<Damage>& info) { return info.param.name; });

TEST(GWBinaryPropertyList, BadSignaturesDeepNestingAndRunawaySharingAreCorrupt) {
    GWData badSignature = with({kOne}).build();
    badSignature[7] = '1';
    // Array i holds array i + 1, far past the limit.
    Assembly deep;
    deep.refSize = 2;
    deep.offsetSize = 2;
    for (int i = 0; i < 2000; ++i) {
        deep.objects.push_back(bytes({0xA1, (i + 1) >> 8, (i + 1) & 0xFF}));
    }
    deep.objects.push_back(kOne);
    // Each array names the next one twice: 2^60 values from a few hundred bytes.
    Assembly doubling;
    for (int i = 0; i < 60; ++i) {
        doubling.objects.push_back(bytes({0xA2, i + 1, i + 1}));
    }
    doubling.objects.push_back(kOne);
    const std::pair<GWData, const char*> cases[] = {{badSignature, "signature"},
                                                    {deep.build(), "deeper than 512"},
                                                    {doubling.build(), "expand"}};
    for (const auto& [data, expected] : cases) {
        GWErrorPtr error = readError(data);
        ASSERT_TRUE(error) << expected;
        EXPECT_TRUE(error->is(kGWCocoaErrorDomain, GWFileReadCorruptFileError));
        EXPECT_NE(error->localizedDescription().find(expected), std::string::npos)
            << error->localizedDescription();
    }
}

TEST(GWBinaryPropertyList, SharedObjectsWithinReasonAreExpanded) {
    // Ten references to one string and one array are an ordinary file.
    Assembly assembly;
    assembly.objects.push_back(bytes({0xAA, 1, 1, 1, 1, 1, 2, 2, 2, 2, 2}));
    assembly.objects.push_back(bytes({0x53, 'a', 'b', 'c'}));
    assembly.objects.push_back(bytes({0xA2, 1, 1}));
    auto value = GWBinaryPropertyList::valueWithData(assembly.build());
    ASSERT_TRUE(value);
    ASSERT_EQ(value->array()->size(), 10u);
    EXPECT_EQ(value->array()->at(9), GWValue(GWArray{GWValue("abc"), GWValue("abc")}));
}

TEST(GWBinaryPropertyList, TextThatIsNotUnicodeIsReadAndWrittenWithReplacements) {
    // Latin bytes in an "ASCII" string, then a high surrogate that "A"
    // follows and a low one that nothing precedes.
    EXPECT_EQ(GWBinaryPropertyList::valueWithData(with({bytes({0x52, 'a', 0xE9})}).build()),
              GWValue("a\xC3\xA9"));
    EXPECT_EQ(GWBinaryPropertyList::valueWithData(
                  with({bytes({0x63, 0xD8, 0x00, 0x00, 'A', 0xDC, 0x00})}).build()),
              GWValue("\xEF\xBF\xBD"
                      "A\xEF\xBF\xBD"));
    // Stray, overlong and surrogate encodings in UTF-8 are not text either.
    EXPECT_EQ(roundTrip(GWValue("a\xFF"
                                "b\xC3")),
              GWValue("a\xEF\xBF\xBD"
                      "b\xEF\xBF\xBD"));
    EXPECT_EQ(roundTrip(GWValue("\xC0\xAF\xED\xA0\x80!")),
              GWValue("\xEF\xBF\xBD\xEF\xBF\xBD\xEF\xBF\xBD\xEF\xBF\xBD\xEF\xBF\xBD!"));
}
