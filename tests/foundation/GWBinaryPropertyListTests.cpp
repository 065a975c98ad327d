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
    std::string signature = "bplist00";

    GWData build() const {
        GWData out = gwtest::bytesOf(signature);
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

}  // namespace

TEST(GWBinaryPropertyList, ValuesRoundTripExactly) {
    GWDictionary inner{{"data", GWValue(GWData{1, 2, 3})}, {"empty", GWValue(GWArray())}};
    GWArray list{GWValue(1), GWValue("two"), GWValue(inner), GWValue(GWDictionary()),
                 GWValue(GWArray{GWValue(GWArray{GWValue(true)})})};
    GWArray many;  // past 65535 objects: references and offsets of four bytes
    for (int i = 0; i < 70000; ++i) {
        many.push_back(GWValue(i * 3));
    }
    std::vector<GWValue> values = {
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
        GWValue(many),
        // Unsigned values that fit come back signed, and still compare equal.
        GWValue(std::uint64_t(42)),
    };
    for (std::int64_t number :
         std::initializer_list<std::int64_t>{0, 1, 255, 256, 65535, 65536, 4294967295, 4294967296,
                                             INT64_MAX, -1, -256, INT64_MIN}) {
        values.push_back(GWValue(number));
    }
    for (std::uint64_t number : {std::uint64_t(INT64_MAX) + 1, UINT64_MAX - 1, UINT64_MAX}) {
        values.push_back(GWValue(number));
    }
    for (double seconds : {0.0, 978307200.0 /* the format's epoch */, -2082844800.0 /* Mac's */,
                           -2077660801.0, 4133980799.0, -2082844800.5, -2082844800.25,
                           4102444800.123, 978307200.001, 1700000000.75, 1234567890.123456}) {
        values.push_back(GWValue(GWDate(seconds)));
    }
    for (const GWValue& value : values) {
        const GWValue back = roundTrip(value);
        EXPECT_EQ(back, value) << value.description().substr(0, 60);
        // Signedness survives: only what is past INT64_MAX comes back unsigned.
        const bool fitsSigned = std::holds_alternative<std::uint64_t>(value.storage) &&
                                value.unsignedValue() <= INT64_MAX;
        EXPECT_EQ(back.storage.index(), fitsSigned ? 1u : value.storage.index());
        if (value.date()) {
            ASSERT_NE(back.date(), nullptr);
            EXPECT_EQ(std::bit_cast<std::uint64_t>(back.date()->timeIntervalSince1970()),
                      std::bit_cast<std::uint64_t>(value.date()->timeIntervalSince1970()));
        }
    }

    GWValue deep = GWValue(GWArray());
    for (std::size_t i = 1; i < kGWPropertyListMaxDepth; ++i) {
        deep = GWValue(GWArray{std::move(deep)});
    }
    EXPECT_EQ(roundTrip(deep), deep);  // exactly at the limit, and one deeper is refused
    GWErrorPtr error;
    EXPECT_TRUE(GWBinaryPropertyList::dataWithValue(GWValue(GWArray{deep}), &error).empty());
    ASSERT_TRUE(error);
    EXPECT_TRUE(error->is(kGWCocoaErrorDomain, GWPropertyListWriteInvalidError));
}

// --- Damaged files -------------------------------------------------------------

TEST(GWBinaryPropertyList, EveryTruncationAndCorruptedByteIsCorruptOrReadable) {
    GWDictionary value{{"list", GWValue(GWArray{GWValue(1), GWValue("t\xC3\xA9xt"),
                                                GWValue(GWDictionary{{"k", GWValue(2.5)}})})},
                       {"date", GWValue(GWDate(5))},
                       {"data", GWValue(GWData(18, 1))}};
    const GWData full = GWBinaryPropertyList::dataWithValue(GWValue(value));
    for (std::size_t i = 0; i < full.size(); ++i) {
        GWErrorPtr error = readError(GWData(full.begin(), full.begin() + std::ptrdiff_t(i)));
        ASSERT_TRUE(error) << i;
        EXPECT_TRUE(error->is(kGWCocoaErrorDomain, GWFileReadCorruptFileError)) << i;
        for (int replacement : {0x00, 0x01, 0x0F, 0x7F, 0x80, 0xAF, 0xDF, 0xFF}) {
            GWData damaged = full;
            damaged[i] = std::uint8_t(replacement);
            if (!GWBinaryPropertyList::valueWithData(damaged, &error)) {
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

// Array i holds array i + 1, far past the depth limit.
Assembly deepArrays() {
    Assembly deep;
    deep.refSize = 2;
    deep.offsetSize = 2;
    for (int i = 0; i < 2000; ++i) {
        deep.objects.push_back(bytes({0xA1, (i + 1) >> 8, (i + 1) & 0xFF}));
    }
    deep.objects.push_back(kOne);
    return deep;
}

// Each array names the next one twice: 2^60 values from a few hundred bytes.
Assembly doublingArrays() {
    Assembly doubling;
    for (int i = 0; i < 60; ++i) {
        doubling.objects.push_back(bytes({0xA2, i + 1, i + 1}));
    }
    doubling.objects.push_back(kOne);
    return doubling;
}

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
        Damage{"DoubleRunsIntoTheTable", with({bytes({0x23, 0, 0})}), "runs into"},
        Damage{"BadSignature", with({kOne}, [](Assembly& a) { a.signature = "bplist01"; }),
               "signature"},
        Damage{"DeeperThanTheLimit", deepArrays(), "deeper than 512"},
        Damage{"RunawaySharing", doublingArrays(), "expand"}),
    [](const testing::TestParamInfo<Damage>& info) { return info.param.name; });

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
