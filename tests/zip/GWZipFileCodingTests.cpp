#include <gtest/gtest.h>

#include "foundation/GWCoder.h"
#include "zip/GWZipFile.h"

namespace {

// Records the keys written at the top level, in order.
class KeyRecordingCoder : public GWCoder {
public:
    bool allowsKeyedCoding() const override { return true; }
    std::vector<std::string> keys;

protected:
    void writeValue(const std::string& key, const GWValue&) override { keys.push_back(key); }
    void writeObject(const std::string& key, const GWCoding&) override { keys.push_back(key); }
    void writeObjects(const std::string& key, std::span<const GWCoding* const>) override {
        keys.push_back(key);
    }
};

GWZipFilePtr makeNode(const std::string& name, const GWZipFilePtr& parent, std::uint16_t mode,
                      GWDictionary extraInfo = {}) {
    auto node = GWZipFile::initWithName(name, parent, 123, 4567, GWData{0xDE, 0xAD, 0xBE, 0xEF}, 1,
                                        0xFFFFFFF0u, 20, mode, GWDate(1600000000.5), std::nullopt,
                                        0x1'0000'0000ull, 0x0808, 8, std::move(extraInfo));
    if (parent) {
        parent->addChild(node);
    }
    return node;
}

// root/
//   file (with resource fork and AppleDouble companions)
//   link -> target
//   sub/ (an empty array of children)
//   leaf/ (no children array at all)
GWZipFilePtr sampleTree() {
    auto root = makeNode("root", nullptr, 040755);
    auto file = makeNode("file", root, 0100644,
                         {{kGWZipTypeCodeKey, "TEXT"},
                          {kGWZipUTCCreationDateKey, GWDate(1500000000)},
                          {kGWZipUserIDKey, std::uint64_t(501)},
                          {kGWZipIsResourceForkKey, false},
                          {kGWZipVerticalIconLocationKey, std::int64_t(-3)}});
    file->setResourceFork(makeNode("rsrc", nullptr, 0100644));
    file->setAppleDoubleFile(makeNode("._file", nullptr, 0100644));
    auto link = makeNode("link", root, 0120755);
    link->setSymlinkDestination("target");
    link->setPrivateUncompressedChecksum(std::nullopt);
    link->setPrivateUncompressedChecksumAlgorithm(0x1'0000'0001ull);  // wider than kept inline
    auto sub = makeNode("sub", root, 040700);
    sub->setChildren(GWZipFileArray{});
    makeNode("leaf", root, 040700);
    return root;
}

void expectSameFields(const GWZipFile& a, const GWZipFile& b) {
    EXPECT_EQ(a.name(), b.name());
    EXPECT_EQ(a.permissionsMode(), b.permissionsMode());
    EXPECT_EQ(a.generalPurposeFlags(), b.generalPurposeFlags());
    EXPECT_EQ(a.compressionMethod(), b.compressionMethod());
    EXPECT_EQ(a.owner(), b.owner());
    EXPECT_EQ(a.groupOwner(), b.groupOwner());
    EXPECT_EQ(a.storedModificationDate(), b.storedModificationDate());
    EXPECT_EQ(a.storedUncompressedSize(), b.storedUncompressedSize());
    EXPECT_EQ(a.compressedSize(), b.compressedSize());
    EXPECT_EQ(a.symlinkDestination(), b.symlinkDestination());
    EXPECT_EQ(a.localHeaderOffset(), b.localHeaderOffset());
    EXPECT_EQ(a.privateUncompressedChecksum(), b.privateUncompressedChecksum());
    EXPECT_EQ(a.privateUncompressedChecksumAlgorithm(), b.privateUncompressedChecksumAlgorithm());
    EXPECT_EQ(a.extraInfo(), b.extraInfo());
    EXPECT_EQ(a.children() == nullptr, b.children() == nullptr) << a.name();
}

// Same fields everywhere, each child's parent link pointing at its new parent.
void expectSameTree(const GWZipFilePtr& original, const GWZipFilePtr& other) {
    ASSERT_NE(other, nullptr);
    EXPECT_NE(original, other);
    expectSameFields(*original, *other);
    ASSERT_EQ(original->resourceFork() == nullptr, other->resourceFork() == nullptr);
    if (original->resourceFork()) {
        expectSameTree(original->resourceFork(), other->resourceFork());
    }
    ASSERT_EQ(original->appleDoubleFile() == nullptr, other->appleDoubleFile() == nullptr);
    if (original->appleDoubleFile()) {
        expectSameTree(original->appleDoubleFile(), other->appleDoubleFile());
    }
    if (!original->children()) {
        return;
    }
    ASSERT_EQ(original->children()->size(), other->children()->size());
    for (std::size_t i = 0; i < original->children()->size(); ++i) {
        const auto& child = (*other->children())[i];
        EXPECT_EQ(child->parent(), other);
        expectSameTree((*original->children())[i], child);
    }
}

TEST(GWZipFileCoding, WritesTheKeysInOrder) {
    KeyRecordingCoder coder;
    sampleTree()->encodeWithCoder(coder);
    EXPECT_EQ(coder.keys,
              (std::vector<std::string>{"Name", "Children", "CompressedSize", "UncompressedSize",
                                        "UncompressedChecksum", "UncompressedChecksumAlgorithm",
                                        "Owner", "GroupOwner", "PermissionsMode",
                                        "ModificationDate", "LocalHeaderOffset",
                                        "GeneralPurposeFlags", "CompressionMethod", "ExtraInfo"}));
    // Optional values and companions appear where they exist, in their places.
    KeyRecordingCoder fileCoder;
    sampleTree()->childNamed("file")->encodeWithCoder(fileCoder);
    EXPECT_EQ(fileCoder.keys,
              (std::vector<std::string>{
                  "Name", "CompressedSize", "UncompressedSize", "UncompressedChecksum",
                  "UncompressedChecksumAlgorithm", "Owner", "GroupOwner", "PermissionsMode",
                  "ModificationDate", "ResourceFork", "AppleDoubleFile", "LocalHeaderOffset",
                  "GeneralPurposeFlags", "CompressionMethod", "ExtraInfo"}));
    KeyRecordingCoder linkCoder;
    sampleTree()->childNamed("link")->encodeWithCoder(linkCoder);
    EXPECT_EQ(
        linkCoder.keys,
        (std::vector<std::string>{
            "Name", "CompressedSize", "UncompressedSize", "UncompressedChecksumAlgorithm", "Owner",
            "GroupOwner", "PermissionsMode", "ModificationDate", "SymlinkDestination",
            "LocalHeaderOffset", "GeneralPurposeFlags", "CompressionMethod", "ExtraInfo"}));
}

TEST(GWZipFileCoding, KeyedRoundTripRebuildsTheTree) {
    auto tree = sampleTree();
    GWErrorPtr error;
    const GWData archive = GWKeyedArchiver::archivedDataWithRootObject(tree, &error);
    ASSERT_FALSE(archive.empty()) << (error ? error->localizedDescription() : "");
    auto decoded = GWKeyedUnarchiver::unarchiveObjectWithData<GWZipFile>(archive, &error);
    ASSERT_NE(decoded, nullptr) << (error ? error->localizedDescription() : "");
    expectSameTree(tree, decoded);
    EXPECT_EQ(decoded->parent(), nullptr);
    auto file = decoded->childNamed("file");
    ASSERT_NE(file, nullptr);
    EXPECT_EQ(file->path(), "root/file");
    EXPECT_EQ(file->owner(), 0xFFFFFFF0u);
    EXPECT_EQ(file->localHeaderOffset(), 0x1'0000'0000ull);
    EXPECT_EQ(file->iconLocationV(), -3);
    EXPECT_EQ(file->uncompressedSize(), 3u * 4567u);
    EXPECT_EQ(decoded->childNamed("sub")->children()->size(), 0u);
    EXPECT_EQ(decoded->childNamed("leaf")->children(), nullptr);
}

TEST(GWZipFileCoding, NonKeyedCodersWriteAndReadNothing) {
    GWNonKeyedCoder coder;
    sampleTree()->encodeWithCoder(coder);
    EXPECT_EQ(GWZipFile::initWithCoder(coder), nullptr);
}

// Writes what a tampered archive could hold under the entry's class name.
class WideFieldsEntry : public GWCoding {
public:
    std::string className() const override { return GWZipFile::kClassName; }
    void encodeWithCoder(GWCoder& coder) const override {
        coder.encodeValue(GWValue("wide"), "Name");
        coder.encodeInteger(0x1A1ED, "PermissionsMode");
        coder.encodeInt32(0x12345, "GeneralPurposeFlags");
        coder.encodeInt32(0x10008, "CompressionMethod");
        coder.encodeValue(GWValue("not a dictionary"), "ExtraInfo");
    }
};

TEST(GWZipFileCoding, WideNumbersAreTruncatedAndWrongKindsIgnored) {
    const GWData archive = GWKeyedArchiver::archivedDataWithRootObject(WideFieldsEntry());
    auto decoded = GWKeyedUnarchiver::unarchiveObjectWithData<GWZipFile>(archive);
    ASSERT_NE(decoded, nullptr);
    EXPECT_EQ(decoded->name(), "wide");
    EXPECT_EQ(decoded->permissionsMode(), 0xA1ED);
    EXPECT_EQ(decoded->generalPurposeFlags(), 0x2345);
    EXPECT_EQ(decoded->compressionMethod(), 8);
    EXPECT_TRUE(decoded->extraInfo().empty());
    EXPECT_EQ(decoded->children(), nullptr);
    EXPECT_FALSE(decoded->storedModificationDate());
}

TEST(GWZipFileCopying, CopiesAreDeepAndDetached) {
    auto tree = sampleTree();
    auto file = tree->childNamed("file");
    auto copy = file->copy();
    EXPECT_EQ(copy->parent(), nullptr);
    EXPECT_EQ(file->parent(), tree);
    expectSameTree(file, copy);
    EXPECT_NE(copy->resourceFork(), file->resourceFork());
    EXPECT_EQ(copy->resourceFork()->parent(), nullptr);

    auto treeCopy = tree->copy();
    expectSameTree(tree, treeCopy);
    // Changes to the copy stay there.
    treeCopy->childNamed("file")->setName("changed");
    treeCopy->addChild(GWZipFile::initWithName("new", treeCopy, 0, 0, std::nullopt, 0, 0, 0,
                                               0100644, std::nullopt, std::nullopt, 0, 0, 0, {}));
    EXPECT_EQ(tree->childNamed("file"), file);
    EXPECT_EQ(tree->children()->size(), 4u);
    EXPECT_EQ(treeCopy->children()->size(), 5u);
}

}  // namespace
