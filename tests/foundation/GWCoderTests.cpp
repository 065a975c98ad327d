#include <gtest/gtest.h>

#include "foundation/GWBinaryPropertyList.h"
#include "foundation/GWCoder.h"
#include "support/CoderTestSupport.h"
#include "support/TestSupport.h"

namespace {

class TestLeaf : public GWCoding {
public:
    static constexpr const char* kClassName = "TestLeaf";

    std::string name;
    std::uint64_t size = 0;

    std::string className() const override { return kClassName; }
    void encodeWithCoder(GWCoder& coder) const override {
        if (!coder.allowsKeyedCoding()) {
            return;
        }
        coder.encodeValue(name, "Name");
        coder.encodeUInt64(size, "Size");
    }
    static std::shared_ptr<TestLeaf> initWithCoder(GWCoder& coder) {
        if (!coder.allowsKeyedCoding()) {
            return nullptr;
        }
        auto leaf = std::make_shared<TestLeaf>();
        leaf->name = coder.decodeString("Name").value_or("");
        leaf->size = coder.decodeUInt64("Size");
        return leaf;
    }
};

// Decoded through its base class only, so it must be registered by hand.
class TestLeafSubclass : public TestLeaf {
public:
    static constexpr const char* kClassName = "TestLeafSubclass";

    std::int32_t extra = 0;

    std::string className() const override { return kClassName; }
    void encodeWithCoder(GWCoder& coder) const override {
        TestLeaf::encodeWithCoder(coder);
        coder.encodeInt32(extra, "Extra");
    }
    static std::shared_ptr<TestLeafSubclass> initWithCoder(GWCoder& coder) {
        auto base = TestLeaf::initWithCoder(coder);
        if (!base) {
            return nullptr;
        }
        auto leaf = std::make_shared<TestLeafSubclass>();
        static_cast<TestLeaf&>(*leaf) = *base;
        leaf->extra = coder.decodeInt32("Extra");
        return leaf;
    }
};

// Never registered: archives name it, nothing can decode it.
class TestUnregisteredLeaf : public TestLeaf {
public:
    std::string className() const override { return "TestUnregisteredLeaf"; }
};

class TestNode : public GWCoding {
public:
    static constexpr const char* kClassName = "TestNode";

    std::string name;
    std::uint32_t owner = 0;
    std::int64_t offset = 0;
    std::int64_t count = 0;
    std::uint64_t big = 0;
    bool flag = false;
    double ratio = 0;
    GWDate date;
    std::optional<GWData> checksum;
    std::optional<std::string> link;
    GWDictionary extra;
    std::optional<std::vector<std::shared_ptr<TestNode>>> children;
    std::shared_ptr<TestLeaf> fork;
    std::vector<std::shared_ptr<TestLeaf>> leaves;
    GWErrorPtr error;

    std::string className() const override { return kClassName; }
    void encodeWithCoder(GWCoder& coder) const override {
        if (!coder.allowsKeyedCoding()) {
            return;
        }
        coder.encodeValue(name, "Name");
        coder.encodeInt32(std::int32_t(owner), "Owner");
        coder.encodeInt64(offset, "Offset");
        coder.encodeInteger(count, "Count");
        coder.encodeUInt64(big, "Big");
        coder.encodeBool(flag, "Flag");
        coder.encodeDouble(ratio, "Ratio");
        coder.encodeValue(date, "Date");
        coder.encodeValue(checksum, "Checksum");
        coder.encodeValue(link, "Link");
        coder.encodeValue(extra, "Extra");
        coder.encodeArrayOfObjects(children, "Children");
        coder.encodeObject(fork, "Fork");
        coder.encodeArrayOfObjects(leaves, "Leaves");
        coder.encodeError(error, "Error");
    }
    static std::shared_ptr<TestNode> initWithCoder(GWCoder& coder) {
        if (!coder.allowsKeyedCoding()) {
            return nullptr;
        }
        auto node = std::make_shared<TestNode>();
        node->name = coder.decodeString("Name").value_or("");
        node->owner = std::uint32_t(coder.decodeInt32("Owner"));
        node->offset = coder.decodeInt64("Offset");
        node->count = coder.decodeInteger("Count");
        node->big = coder.decodeUInt64("Big");
        node->flag = coder.decodeBool("Flag");
        node->ratio = coder.decodeDouble("Ratio");
        node->date = coder.decodeDate("Date").value_or(GWDate());
        node->checksum = coder.decodeData("Checksum");
        node->link = coder.decodeString("Link");
        node->extra = coder.decodeDictionary("Extra").value_or(GWDictionary());
        node->children = coder.decodeArrayOfObjectsOfClass<TestNode>("Children");
        node->fork = coder.decodeObjectOfClass<TestLeaf>("Fork");
        node->leaves =
            coder.decodeArrayOfObjectsOfClass<TestLeaf>("Leaves").value_or(decltype(leaves)());
        node->error = coder.decodeError("Error");
        return node;
    }
};

// Refuses to be decoded, as a class does when its stored state is unusable.
class TestRefusing : public GWCoding {
public:
    static constexpr const char* kClassName = "TestRefusing";
    std::string className() const override { return kClassName; }
    void encodeWithCoder(GWCoder&) const override {}
    static std::shared_ptr<TestRefusing> initWithCoder(GWCoder&) { return nullptr; }
};

std::shared_ptr<TestNode> fullNode() {
    GWCodingRegistry::registerClass<TestLeafSubclass>();
    auto node = std::make_shared<TestNode>();
    node->name = "r\xC3\xA9sum\xC3\xA9";
    node->owner = 4000000000u;  // above INT32_MAX
    node->offset = -1234567890123LL;
    node->count = 42;
    node->big = UINT64_MAX - 5;
    node->flag = true;
    node->ratio = 0.1;
    node->date = GWDate(-2082844800.5);  // 1904, with a fraction
    node->checksum = gwtest::randomBytes(100000, 7);
    node->link = "";
    node->extra = {{"Comment", GWValue("\xE6\x97\xA5\xE6\x9C\xAC")},
                   {"Dates", GWValue(GWArray{GWValue(GWDate(4102444800.0))})},
                   {"Nested", GWValue(GWDictionary{{"Empty", GWValue(GWData())}})}};
    auto subclassLeaf = std::make_shared<TestLeafSubclass>();
    subclassLeaf->name = "fork";
    subclassLeaf->size = 100;
    subclassLeaf->extra = -9;
    node->fork = subclassLeaf;
    for (int i = 0; i < 3; ++i) {
        auto leaf = std::make_shared<TestLeaf>();
        leaf->name = "leaf" + std::to_string(i);
        leaf->size = std::uint64_t(i) << 40;
        node->leaves.push_back(leaf);
    }
    auto child = std::make_shared<TestNode>();
    child->name = "child";
    child->children = std::vector<std::shared_ptr<TestNode>>();
    node->children = std::vector{child};
    node->error =
        GWGenerateError(kGWPOSIXErrorDomain, 2, GWURL::fileURLWithPath("/a b"),
                        GWCocoaError(GWFileReadUnknownError), {{"Key", GWValue(1)}}, "missing");
    return node;
}

}  // namespace

TEST(GWKeyedArchiver, RoundTripsEveryKindOfValueAndNestedObjects) {
    auto node = fullNode();
    GWErrorPtr error;
    GWData archive = GWKeyedArchiver::archivedDataWithRootObject(node, &error);
    ASSERT_FALSE(archive.empty()) << error->localizedDescription();
    auto back = GWKeyedUnarchiver::unarchiveObjectWithData<TestNode>(archive, &error);
    ASSERT_TRUE(back) << error->localizedDescription();
    EXPECT_EQ(std::tie(back->name, back->owner, back->offset, back->count, back->big, back->flag,
                       back->ratio, back->date, back->checksum, back->link),
              std::tie(node->name, node->owner, node->offset, node->count, node->big, node->flag,
                       node->ratio, node->date, node->checksum, node->link));
    EXPECT_EQ(GWValue(back->extra), GWValue(node->extra));
    ASSERT_EQ(back->leaves.size(), 3u);
    ASSERT_TRUE(back->children);
    // Nested objects decoded exactly archive to the same bytes again.
    EXPECT_TRUE(GWKeyedArchiver::archivedDataWithRootObject(back) == archive);

    // The subclass comes back as itself, through a base-class decode.
    auto fork = std::dynamic_pointer_cast<TestLeafSubclass>(back->fork);
    ASSERT_TRUE(fork);
    EXPECT_EQ(fork->extra, -9);

    ASSERT_TRUE(back->error);
    EXPECT_TRUE(back->error->is(kGWPOSIXErrorDomain, 2));
    EXPECT_EQ(back->error->URL(), GWURL::fileURLWithPath("/a b"));
    EXPECT_EQ(back->error->localizedDescription(), "missing");
    EXPECT_EQ(GWValue(back->error->userInfo()), GWValue(GWDictionary{{"Key", GWValue(1)}}));
    ASSERT_TRUE(back->error->underlyingError());
    EXPECT_TRUE(back->error->underlyingError()->is(kGWCocoaErrorDomain, GWFileReadUnknownError));

    // Absent values stay absent, not empty.
    TestNode bare;
    back = GWKeyedUnarchiver::unarchiveObjectWithData<TestNode>(
        GWKeyedArchiver::archivedDataWithRootObject(bare));
    ASSERT_TRUE(back);
    EXPECT_FALSE(back->checksum || back->link || back->children || back->fork || back->error);
}

TEST(GWKeyedArchiver, CyclesDeepNestingAndNoRootAreRefused) {
    auto cycle = std::make_shared<TestNode>();
    cycle->children = std::vector{cycle};
    auto deep = std::make_shared<TestNode>();
    auto current = deep;
    for (int i = 0; i < 600; ++i) {
        current->children = std::vector{std::make_shared<TestNode>()};
        current = current->children->front();
    }
    const std::pair<std::shared_ptr<TestNode>, const char*> cases[] = {
        {cycle, "contains itself"}, {deep, ""}, {nullptr, ""}};
    for (const auto& [root, message] : cases) {
        SCOPED_TRACE(message);
        GWErrorPtr error;
        EXPECT_TRUE(GWKeyedArchiver::archivedDataWithRootObject(root, &error).empty());
        ASSERT_TRUE(error);
        EXPECT_TRUE(error->is(kGWCocoaErrorDomain, GWCoderInvalidValueError));
        EXPECT_NE(error->localizedDescription().find(message), std::string::npos);
    }
    cycle->children.reset();
}

TEST(GWKeyedUnarchiver, WrongKindsUnderAKeyDecodeAsNothingAndDollarKeysAreKeptApart) {
    GWKeyedArchiver archiver;
    auto leaf = std::make_shared<TestLeaf>();
    archiver.encodeValue(GWValue("text"), "String");
    archiver.encodeInt64(5, "Five");
    archiver.encodeInt64(std::int64_t(1) << 40, "Wide");
    archiver.encodeUInt64(UINT32_MAX, "AllOnes32");
    archiver.encodeInt64(-1, "MinusOne");
    archiver.encodeDouble(2.5, "Real");
    archiver.encodeObject(leaf, "Leaf");
    archiver.encodeValue(GWDictionary{{"a", GWValue(1)}}, "Dictionary");
    archiver.encodeArrayOfObjects(
        std::vector<std::shared_ptr<GWCoding>>{leaf, std::make_shared<TestNode>()}, "Mixed");
    archiver.encodeObject(std::make_shared<TestUnregisteredLeaf>(), "Unknown");
    archiver.encodeValue(GWValue(GWArray{GWValue(1)}), "Values");
    // Keys beginning with "$" are kept apart from the archive's own.
    GWDictionary tricky{{"$class", GWValue("NotAClass")},
                        {"$$already", GWValue(1)},
                        {"$", GWValue(2)},
                        {"plain", GWValue(GWDictionary{{"$top", GWValue(3)}})}};
    archiver.encodeValue(tricky, "$class");
    archiver.encodeValue(GWValue("x"), "$$");
    auto coder = GWKeyedUnarchiver::initForReadingWithData(archiver.encodedData());
    ASSERT_TRUE(coder);
    EXPECT_EQ(coder->decodeDictionary("$class"), tricky);
    EXPECT_EQ(coder->decodeString("$$"), "x");
    EXPECT_FALSE(coder->decodeObject("$class"));

    EXPECT_EQ(coder->decodeInt64("String"), 0);
    EXPECT_EQ(coder->decodeInt64("Real"), 0);
    EXPECT_EQ(coder->decodeDouble("String"), 0);
    EXPECT_EQ(coder->decodeDouble("Five"), 5.0);
    EXPECT_FALSE(coder->decodeBool("String"));
    EXPECT_TRUE(coder->decodeBool("Five"));
    EXPECT_FALSE(coder->decodeString("Five"));
    EXPECT_FALSE(coder->decodeData("String"));
    EXPECT_FALSE(coder->decodeDate("Five"));
    EXPECT_FALSE(coder->decodeArray("Dictionary"));
    EXPECT_FALSE(coder->decodeDictionary("Leaf"));
    EXPECT_FALSE(coder->decodeValue("Leaf"));
    EXPECT_FALSE(coder->decodeValue("Mixed"));
    EXPECT_FALSE(coder->decodeObject("Dictionary"));
    EXPECT_FALSE(coder->decodeObjectOfClass<TestNode>("Leaf"));
    EXPECT_TRUE(coder->decodeObjectOfClass<TestLeaf>("Leaf"));
    EXPECT_FALSE(coder->decodeObject("Unknown"));
    EXPECT_FALSE(coder->decodeArrayOfObjectsOfClass<TestLeaf>("Mixed"));
    EXPECT_EQ(coder->decodeArrayOfObjectsOfClass<GWCoding>("Mixed")->size(), 2u);
    EXPECT_FALSE(coder->decodeArrayOfObjectsOfClass<TestLeaf>("Values"));
    EXPECT_FALSE(coder->decodeError("Leaf"));

    // Integer widths: a 32-bit decode takes either signedness, nothing wider.
    EXPECT_EQ(coder->decodeInt32("Wide"), 0);
    EXPECT_EQ(coder->decodeInt32("AllOnes32"), -1);
    EXPECT_EQ(coder->decodeInt32("MinusOne"), -1);
    EXPECT_EQ(coder->decodeUInt64("MinusOne"), UINT64_MAX);

    EXPECT_FALSE(coder->containsValueForKey("Missing"));
    EXPECT_TRUE(coder->containsValueForKey("Leaf"));
    EXPECT_EQ(coder->decodeInt64("Missing"), 0);
}

TEST(GWKeyedUnarchiver, ArchivesThatCannotBeReadAreCorrupt) {
    const auto keyed = [](const char* archiver, int version, GWValue top) {
        return GWBinaryPropertyList::dataWithValue(GWValue(GWDictionary{
            {"$archiver", GWValue(archiver)}, {"$version", GWValue(version)}, {"$top", top}}));
    };
    const GWValue root(
        GWDictionary{{"root", GWValue(GWDictionary{{"$class", GWValue("TestLeaf")}})}});
    GWCodingRegistry::registerClass<TestLeaf>();
    GWCodingRegistry::registerClass<TestRefusing>();
    const std::pair<GWData, const char*> cases[] = {
        {gwtest::bytesOf("This is not a property list, only a few words in a file."), "bplist00"},
        {GWBinaryPropertyList::dataWithValue(GWValue(5)), "not a keyed archive"},
        {keyed("Other", 1, root), "not a keyed archive"},
        {keyed("GWKeyedArchiver", 2, root), "unsupported version 2"},
        {keyed("GWKeyedArchiver", 1, GWValue(5)), "no \"$top\""},
        {keyed("GWKeyedArchiver", 1, GWValue(GWDictionary{{"root", GWValue("text")}})),
         "no root object"},
        {GWKeyedArchiver::archivedDataWithRootObject(TestUnregisteredLeaf()),
         "unknown class \"TestUnregisteredLeaf\""},
        {GWKeyedArchiver::archivedDataWithRootObject(TestRefusing()), "could not be decoded"},
    };
    for (const auto& [data, expected] : cases) {
        SCOPED_TRACE(expected);
        GWErrorPtr error;
        EXPECT_FALSE(GWKeyedUnarchiver::unarchiveObjectWithData(data, &error));
        ASSERT_TRUE(error);
        EXPECT_TRUE(error->is(kGWCocoaErrorDomain, GWFileReadCorruptFileError));
        EXPECT_NE(error->localizedDescription().find(expected), std::string::npos)
            << error->localizedDescription();
    }
    GWErrorPtr error;
    GWData leafArchive = GWKeyedArchiver::archivedDataWithRootObject(TestLeaf());
    EXPECT_FALSE(GWKeyedUnarchiver::unarchiveObjectWithData<TestNode>(leafArchive, &error));
    ASSERT_TRUE(error);
    EXPECT_NE(error->localizedDescription().find("not of the class asked for"), std::string::npos);
}

TEST(GWKeyedUnarchiver, EveryTruncatedArchiveIsCorrupt) {
    const GWData full = GWKeyedArchiver::archivedDataWithRootObject(TestNode());
    for (std::size_t length = 0; length < full.size(); ++length) {
        GWErrorPtr error;
        EXPECT_FALSE(GWKeyedUnarchiver::unarchiveObjectWithData<TestNode>(
            std::span(full).first(length), &error));
        ASSERT_TRUE(error);
        EXPECT_TRUE(error->is(kGWCocoaErrorDomain, GWFileReadCorruptFileError)) << length;
    }
}
