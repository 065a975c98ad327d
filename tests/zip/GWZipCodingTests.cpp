// Keyed persistence and copying of ZIP entries and opened archives.

#include <gtest/gtest.h>

#include <sstream>

#include "support/CoderTestSupport.h"
#include "support/TestSupport.h"
#include "support/ZipBuilder.h"
#include "zip/GWZipArchive.h"

namespace {

using namespace gwtest;

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

// root/ holds a file with both companions, a link, an empty folder and a
// folder without a children array.
GWZipFilePtr sampleTree() {
    auto root = makeNode("root", nullptr, 040755);
    auto file = makeNode("file", root, 0100644,
                         {{kGWZipTypeCodeKey, "TEXT"},
                          {kGWZipUTCCreationDateKey, GWDate(1500000000)},
                          {kGWZipVerticalIconLocationKey, std::int64_t(-3)}});
    file->setResourceFork(makeNode("rsrc", nullptr, 0100644));
    file->setAppleDoubleFile(makeNode("._file", nullptr, 0100644));
    auto link = makeNode("link", root, 0120755);
    link->setSymlinkDestination("target");
    link->setPrivateUncompressedChecksum(std::nullopt);
    link->setPrivateUncompressedChecksumAlgorithm(0x1'0000'0001ull);  // wider than kept inline
    makeNode("sub", root, 040700)->setChildren(GWZipFileArray{});
    makeNode("leaf", root, 040700);
    return root;
}

// Every stored field of the entry, its companions and children; "!" marks a
// node whose parent link does not lead to `parent`.
std::string fields(const GWZipFilePtr& file, const GWZipFilePtr& parent = nullptr) {
    if (!file) {
        return "-";
    }
    std::ostringstream out;
    out << file->name() << (file->parent() != parent ? "!" : "") << " " << file->permissionsMode()
        << " " << file->generalPurposeFlags() << " " << file->compressionMethod() << " "
        << file->owner() << " " << file->groupOwner() << " "
        << GWValue(file->storedModificationDate().value_or(GWDate(-1))).description() << " "
        << file->storedUncompressedSize() << " " << file->compressedSize() << " "
        << file->symlinkDestination().value_or("-") << " " << file->localHeaderOffset() << " "
        << GWValue(file->privateUncompressedChecksum().value_or(GWData{9})).description() << " "
        << file->privateUncompressedChecksumAlgorithm() << " "
        << GWValue(file->extraInfo()).description() << " rsrc " << fields(file->resourceFork())
        << " ad " << fields(file->appleDoubleFile());
    if (auto children = file->children()) {
        out << " (";
        for (const auto& child : *children) {
            out << fields(child, file) << "; ";
        }
        out << ")";
    }
    return out.str();
}

TEST(GWZipFileCoding, KeyedRoundTripAndCopiesRebuildTheTree) {
    auto tree = sampleTree();
    GWErrorPtr error;
    const GWData archive = GWKeyedArchiver::archivedDataWithRootObject(tree, &error);
    ASSERT_FALSE(archive.empty()) << (error ? error->localizedDescription() : "");
    auto decoded = GWKeyedUnarchiver::unarchiveObjectWithData<GWZipFile>(archive, &error);
    ASSERT_NE(decoded, nullptr) << (error ? error->localizedDescription() : "");
    EXPECT_EQ(fields(decoded), fields(tree));
    EXPECT_EQ(decoded->childNamed("file")->path(), "root/file");
    EXPECT_EQ(decoded->childNamed("file")->uncompressedSize(), 3u * 4567u);

    auto file = tree->childNamed("file");
    auto copy = file->copy();
    EXPECT_EQ(fields(copy), fields(file, tree));
    EXPECT_EQ(file->parent(), tree);
    auto treeCopy = tree->copy();
    EXPECT_EQ(fields(treeCopy), fields(tree));
    treeCopy->childNamed("file")->setName("changed");
    treeCopy->addChild(makeNode("new", treeCopy, 0100644));
    EXPECT_EQ(tree->childNamed("file"), file);
    EXPECT_EQ(tree->children()->size(), 4u);
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
    EXPECT_EQ(decoded->permissionsMode(), 0xA1ED);
    EXPECT_EQ(decoded->generalPurposeFlags(), 0x2345);
    EXPECT_EQ(decoded->compressionMethod(), 8);
    EXPECT_TRUE(decoded->extraInfo().empty());
    EXPECT_EQ(decoded->children(), nullptr);
    EXPECT_FALSE(decoded->storedModificationDate());
}

TEST(GWZipArchiveCoding, RoundTripsAndCopiesKeepTheTreeAndStartOffsetButNotTheSize) {
    TemporaryDirectory directory;
    ZipBuilder zip;
    zip.prefix = GWData(300, 'S');
    zip.addFile("a.txt", bytesOf("alpha"));
    zip.addFile("dir/b.txt", bytesOf("beta"));
    zip.addFile("__MACOSX/dir/._b.txt", GWData(82, 1));
    zip.write(directory.file("coded.zip"));
    GWErrorPtr error;
    auto archive = GWZipArchive::initWithURL(directory.url("coded.zip"), &error);
    ASSERT_TRUE(archive);
    archive->setCompressedSize(77);

    WriteCountingCoder nonKeyed;
    archive->encodeWithCoder(nonKeyed);
    sampleTree()->encodeWithCoder(nonKeyed);
    EXPECT_EQ(nonKeyed.writes, 0);
    GWNonKeyedCoder reader;
    sampleTree()->encodeWithCoder(reader);
    EXPECT_EQ(GWZipFile::initWithCoder(reader), nullptr);

    const GWData data = GWKeyedArchiver::archivedDataWithRootObject(*archive, &error);
    ASSERT_FALSE(data.empty()) << error->localizedDescription();
    auto restored = GWKeyedUnarchiver::unarchiveObjectWithData<GWZipArchive>(data, &error);
    ASSERT_TRUE(restored) << error->localizedDescription();
    auto copy = archive->copy();
    for (const auto& other : {restored, copy}) {
        ASSERT_TRUE(other);
        EXPECT_EQ(other->startOffset(), 300u);
        ASSERT_TRUE(other->ref());
        EXPECT_EQ(*other->ref(), *archive->ref());
        EXPECT_NE(other->ref(), archive->ref());
        EXPECT_EQ(other->URL(), archive->URL());
        EXPECT_EQ(other->compressedSize(), 0u);
        ASSERT_EQ(other->files().size(), 2u);
        auto b = other->fileWithPath("dir/b.txt");
        ASSERT_TRUE(b);
        EXPECT_EQ(fields(other->fileWithPath("dir")), fields(archive->fileWithPath("dir")));
    }
    copy->files()[0]->setName("renamed");
    EXPECT_EQ(archive->files()[0]->name(), "a.txt");
}

}  // namespace
