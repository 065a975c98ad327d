// Tables of contents written by an independent tool (bsdtar) parse to what
// the file system and the tool's own listing say.

#include <gtest/gtest.h>

#include <sys/stat.h>
#include <sys/sysmacros.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <map>
#include <sstream>

#include "XarTestSupport.h"
#include "foundation/GWByteReader.h"
#include "foundation/GWChecksum.h"
#include "foundation/GWDecompressor.h"
#include "foundation/decoders/GWStreamDecoder.h"
#include "support/DecoderTestSupport.h"
#include "support/TestSupport.h"
#include "support/XarBuilder.h"
#include "xar/GWXARArchive.h"

namespace {

using gwtest::entryAtPath;

struct Fixture {
    gwtest::TemporaryDirectory directory;
    std::string root;
    std::map<std::string, GWData> contents;  // regular files by archive path
    bool hasDevice = false;
    bool hasAttribute = false;
    std::vector<std::string> members;

    Fixture() : root(directory.file("tree")) {
        mkdir(root.c_str(), 0755);
        add("f", gwtest::textBytes(5000, 1));
        mkdir((root + "/d").c_str(), 0750);
        add("d/file10", gwtest::randomBytes(300, 2));
        add("d/file2", {});
        add("d/A", gwtest::bytesOf("upper\n"));
        symlink("f", (root + "/s").c_str());
        link((root + "/f").c_str(), (root + "/h").c_str());
        mkfifo((root + "/p").c_str(), 0640);
        chmod((root + "/p").c_str(), 0640);
        hasDevice = mknod((root + "/c").c_str(), S_IFCHR | 0600, makedev(1, 3)) == 0;
        add("x", gwtest::bytesOf("with attribute"));
        hasAttribute = setxattr((root + "/x").c_str(), "user.x", "y", 1, 0) == 0;
        members = {"f", "d", "s", "h", "p", "x"};
        if (hasDevice) {
            members.push_back("c");
        }
    }

    void add(const std::string& path, const GWData& bytes) {
        gwtest::writeFile(root + "/" + path, bytes);
        contents[path] = bytes;
    }

    std::string archive(const std::string& compression) const {
        const std::string path = directory.file(compression + ".xar");
        std::string command = "bsdtar --format xar --options xar:compression=" + compression +
                              " -cf " + gwtest::shellQuote(path) + " -C " +
                              gwtest::shellQuote(root);
        for (const auto& member : members) {
            command += " " + member;
        }
        EXPECT_EQ(gwtest::runCommand(command + " 2>&1").status, 0) << command;
        return path;
    }
};

std::string modeString(std::uint16_t mode) {
    std::string text;
    switch (mode & 0170000) {
        case 0040000: text = "d"; break;
        case 0120000: text = "l"; break;
        case 0010000: text = "p"; break;
        case 0020000: text = "c"; break;
        case 0060000: text = "b"; break;
        default: text = "-";
    }
    const char* letters = "rwxrwxrwx";
    for (int bit = 8; bit >= 0; --bit) {
        text += (mode >> bit) & 1 ? letters[8 - bit] : '-';
    }
    return text;
}

// The stored bytes of a reference, straight from the archive file.
GWData storedBytes(const GWData& archive, const GWXARDataReference& reference) {
    if (reference.offset() + reference.compressedSize() > archive.size()) {
        return {};
    }
    auto begin = archive.begin() + std::ptrdiff_t(reference.offset());
    return GWData(begin, begin + std::ptrdiff_t(reference.compressedSize()));
}

GWData decoded(const GWData& stored, std::uint64_t compressionType) {
    if (compressionType == GWXARCompressionTypeNone) {
        return stored;
    }
    GWErrorPtr error;
    if (compressionType == GWXARCompressionTypeXZ || compressionType == GWXARCompressionTypeLZMA) {
        GWDecompressor xz(GWMakeXzDecoder());
        return gwtest::decodeInPieces(xz, stored, 0, &error).value_or(GWData{});
    }
    auto plain = GWDecompressor::decompressedDataFromData(stored, &error);
    return plain.value_or(GWData{});
}

void expectStreamMatches(const GWData& archive, const GWXARDataReference& reference,
                         const GWData& content, std::uint64_t compressionType,
                         const std::string& what) {
    SCOPED_TRACE(what);
    EXPECT_EQ(reference.uncompressedSize(), content.size());
    EXPECT_EQ(reference.compressionType(), compressionType);
    const GWData stored = storedBytes(archive, reference);
    EXPECT_EQ(stored.size(), reference.compressedSize());
    EXPECT_EQ(decoded(stored, compressionType), content);
    EXPECT_EQ(reference.compressedChecksumType(), GWXARChecksumTypeSHA1);
    EXPECT_EQ(reference.uncompressedChecksumType(), GWXARChecksumTypeSHA1);
    EXPECT_EQ(reference.compressedChecksum(),
              GWChecksum::checksumForData(stored, GWChecksumAlgorithmSHA1));
    EXPECT_EQ(reference.uncompressedChecksum(),
              GWChecksum::checksumForData(content, GWChecksumAlgorithmSHA1));
}

class GWXARBsdtar : public testing::TestWithParam<std::pair<const char*, std::uint64_t>> {
protected:
    void SetUp() override {
        if (!gwtest::toolAvailable("bsdtar")) {
            GTEST_SKIP() << "bsdtar is not installed";
        }
    }
};

TEST_P(GWXARBsdtar, EntriesMatchTheFileSystemAndTheListing) {
    const auto [compression, compressionType] = GetParam();
    Fixture fixture;
    const std::string path = fixture.archive(compression);
    const GWData archive = gwtest::readFile(path);
    std::string problem;
    auto toc = gwtest::readXarTOC(archive, &problem);
    ASSERT_TRUE(toc) << problem;

    auto operation = GWXARLoadOperation::initWithArchive(nullptr, false);
    operation->setHeapStart(toc->heapStart);
    GWErrorPtr error;
    auto files = operation->filesFromTOCElement(toc->toc(), &error);
    ASSERT_TRUE(files) << (error ? error->localizedDescription() : "no error object");

    std::vector<std::string> expectedTop =
        fixture.hasDevice ? std::vector<std::string>{"c", "d", "f", "h", "p", "s", "x"}
                          : std::vector<std::string>{"d", "f", "h", "p", "s", "x"};
    EXPECT_EQ(gwtest::namesOf(*files), expectedTop);
    EXPECT_EQ(gwtest::namesOf(entryAtPath(*files, "d")->children()),
              (std::vector<std::string>{"A", "file2", "file10"}));

    // Every entry against lstat of its source.
    for (const std::string member :
         {"f", "d", "d/file10", "d/file2", "d/A", "s", "h", "p", "x", "c"}) {
        if (member == "c" && !fixture.hasDevice) {
            continue;
        }
        SCOPED_TRACE(member);
        auto entry = entryAtPath(*files, member);
        ASSERT_TRUE(entry);
        struct stat info {};
        ASSERT_EQ(lstat((fixture.root + "/" + member).c_str(), &info), 0);
        EXPECT_EQ(entry->permissionsMode(), info.st_mode & 0177777);
        EXPECT_EQ(entry->ownerID(), info.st_uid);
        EXPECT_EQ(entry->groupOwnerID(), info.st_gid);
        EXPECT_EQ(entry->inode(), info.st_ino);
        ASSERT_TRUE(entry->modificationDate());
        EXPECT_EQ(entry->modificationDate()->timeIntervalSince1970(), double(info.st_mtim.tv_sec));
        EXPECT_TRUE(entry->accessDate());
        EXPECT_TRUE(entry->attributeModificationDate());
        EXPECT_EQ(entry->path(), member);
        if (auto content = fixture.contents.find(member);
            content != fixture.contents.end() && member != "h") {
            // bsdtar stores no data element for an empty file.
            if (content->second.empty()) {
                EXPECT_FALSE(entry->dataFork());
                continue;
            }
            ASSERT_TRUE(entry->dataFork());
            expectStreamMatches(archive, *entry->dataFork(), content->second, compressionType,
                                member + " data");
        }
    }

    EXPECT_EQ(entryAtPath(*files, "d")->type(), GWXARFileTypeDirectory);
    EXPECT_EQ(entryAtPath(*files, "s")->type(), GWXARFileTypeSymbolicLink);
    EXPECT_EQ(entryAtPath(*files, "s")->symlinkDestination(), "f");
    EXPECT_EQ(entryAtPath(*files, "p")->type(), GWXARFileTypeFIFO);
    // bsdtar marks the first of the pair as the original and links the second to it.
    auto original = entryAtPath(*files, "f");
    auto link = entryAtPath(*files, "h");
    EXPECT_EQ(original->type(), GWXARFileTypeRegular);
    EXPECT_EQ(link->type(), GWXARFileTypeHardLink);
    EXPECT_EQ(link->hardlinkDestination(), original);
    EXPECT_EQ(link->hardlinkPath(), "f");
    if (fixture.hasDevice) {
        auto device = entryAtPath(*files, "c");
        EXPECT_EQ(device->type(), GWXARFileTypeCharacterSpecial);
        EXPECT_EQ(device->deviceMajorNumber(), 1u);
        EXPECT_EQ(device->deviceMinorNumber(), 3u);
    }
    auto attributed = entryAtPath(*files, "x");
    if (fixture.hasAttribute) {
        ASSERT_EQ(attributed->extendedAttributes().size(), 1u);
        EXPECT_EQ(attributed->extendedAttributes()[0]->name(), "user.x");
        expectStreamMatches(archive, *attributed->extendedAttributes()[0], gwtest::bytesOf("y"),
                            compressionType, "attribute");
    }

    // bsdtar's own listing: mode, owner, group, size and name of every member.
    auto listing = gwtest::runCommand("bsdtar -tvf " + gwtest::shellQuote(path));
    ASSERT_EQ(listing.status, 0);
    std::istringstream lines(listing.output);
    std::string line;
    int checked = 0;
    while (std::getline(lines, line)) {
        std::istringstream fields(line);
        std::string mode, links, owner, group, size, month, day, time, name;
        fields >> mode >> links >> owner >> group >> size;
        if (size.ends_with(',')) {
            fields >> size;  // "1, 3": a device's numbers stand where the size would
        }
        fields >> month >> day >> time >> name;
        SCOPED_TRACE(line);
        auto entry = entryAtPath(*files, name);
        ASSERT_TRUE(entry);
        EXPECT_EQ(modeString(entry->permissionsMode()), mode);
        EXPECT_EQ(entry->ownerName(), owner);
        EXPECT_EQ(entry->groupOwnerName(), group);
        if (entry->type() == GWXARFileTypeRegular) {
            EXPECT_EQ(std::to_string(entry->dataFork() ? entry->dataFork()->uncompressedSize() : 0),
                      size);
        }
        ++checked;
    }
    EXPECT_EQ(checked, fixture.hasDevice ? 10 : 9);
}

// Opened as a whole: the checksum bsdtar wrote holds, and the tree is the
// parser's, with the archive reachable from every entry.
TEST_P(GWXARBsdtar, OpensThroughTheArchiveWithAValidChecksum) {
    Fixture fixture;
    const std::string path = fixture.archive(GetParam().first);
    const GWURL url = GWURL::fileURLWithPath(path);
    EXPECT_TRUE(GWXARArchive::isXARArchiveAtURL(url));
    GWErrorPtr error;
    auto archive = GWXARArchive::initWithURL(url, true, &error);
    ASSERT_TRUE(archive) << (error ? error->localizedDescription() : "no error object");
    EXPECT_TRUE(archive->checksumIsValid());
    EXPECT_FALSE(archive->signatureIsValid());
    EXPECT_FALSE(archive->signatureValidationError());
    EXPECT_TRUE(archive->subdocuments().empty());

    const GWData bytes = gwtest::readFile(path);
    auto toc = gwtest::readXarTOC(bytes);
    ASSERT_TRUE(toc);
    auto operation = GWXARLoadOperation::initWithArchive(nullptr, false);
    operation->setHeapStart(toc->heapStart);
    auto parsed = operation->filesFromTOCElement(toc->toc(), &error);
    ASSERT_TRUE(parsed);
    EXPECT_EQ(gwtest::namesOf(archive->files()), gwtest::namesOf(*parsed));
    for (const std::string member : {"f", "d", "d/file10", "d/file2", "d/A", "s", "h", "p", "x"}) {
        SCOPED_TRACE(member);
        auto entry = archive->fileWithPath(member);
        auto expected = entryAtPath(*parsed, member);
        ASSERT_TRUE(entry && expected);
        EXPECT_EQ(entry->path(), member);
        EXPECT_EQ(entry->permissionsMode(), expected->permissionsMode());
        EXPECT_EQ(entry->inode(), expected->inode());
        EXPECT_EQ(entry->archive(), archive);
        EXPECT_EQ(bool(entry->dataFork()), bool(expected->dataFork()));
        if (entry->dataFork()) {
            EXPECT_EQ(entry->dataFork()->offset(), expected->dataFork()->offset());
        }
    }
    EXPECT_EQ(archive->fileWithPath("h")->hardlinkDestination(), archive->fileWithPath("f"));
    // The stored table of contents' digest, as the checksum element locates it.
    const pugi::xml_node checksum = toc->toc().child("checksum");
    const std::size_t offset =
        std::size_t(toc->heapStart) + std::size_t(std::stoull(checksum.child_value("offset")));
    const std::size_t size = std::size_t(std::stoull(checksum.child_value("size")));
    ASSERT_LE(offset + size, bytes.size());
    EXPECT_EQ(archive->tocChecksum(), GWData(bytes.begin() + std::ptrdiff_t(offset),
                                             bytes.begin() + std::ptrdiff_t(offset + size)));

    // One flipped byte of the stored digest: opens unchecked, refuses checked.
    GWData flipped = bytes;
    flipped[offset + size / 2] ^= 0x80;
    const std::string flippedPath = fixture.directory.file("flipped.xar");
    gwtest::writeFile(flippedPath, flipped);
    auto lenient = GWXARArchive::initWithURL(GWURL::fileURLWithPath(flippedPath), false, &error);
    ASSERT_TRUE(lenient);
    EXPECT_FALSE(lenient->checksumIsValid());
    EXPECT_FALSE(lenient->signatureIsValid());
    EXPECT_EQ(gwtest::namesOf(lenient->files()), gwtest::namesOf(*parsed));
    error = nullptr;
    EXPECT_FALSE(GWXARArchive::initWithURL(GWURL::fileURLWithPath(flippedPath), true, &error));
    ASSERT_TRUE(error);
    EXPECT_TRUE(error->is("GWXARArchiveErrorDomain", 5));
}

INSTANTIATE_TEST_SUITE_P(GWXARCompressions, GWXARBsdtar,
                         testing::Values(std::make_pair("gzip", GWXARCompressionTypeGZip),
                                         std::make_pair("bzip2", GWXARCompressionTypeBZ2),
                                         std::make_pair("xz", GWXARCompressionTypeXZ),
                                         std::make_pair("lzma", GWXARCompressionTypeLZMA),
                                         std::make_pair("none", GWXARCompressionTypeNone)),
                         [](const auto& info) { return std::string(info.param.first); });

// The builder's archives are archives to bsdtar too.
TEST(GWXARBuilder, WritesArchivesThatBsdtarReads) {
    if (!gwtest::toolAvailable("bsdtar")) {
        GTEST_SKIP() << "bsdtar is not installed";
    }
    gwtest::TemporaryDirectory directory;
    for (std::uint32_t checksum : {0u, 1u, 2u}) {
        {
            SCOPED_TRACE(checksum);
            gwtest::XarBuilder builder(checksum);
            const GWData one = gwtest::textBytes(2000, 3);
            const GWData two = gwtest::randomBytes(100, 4);
            builder.setFiles(
                "<file id=\"1\"><name>one</name><type>file</type><mode>0644</mode>" +
                builder.dataElement("data", one, gwtest::XarEncoding::gzip) +
                "</file><file id=\"2\"><name>two</name><type>file</type><mode>0600</mode>" +
                builder.dataElement("data", two, gwtest::XarEncoding::bzip2, "md5") + "</file>");
            const std::string path = directory.file("built.xar");
            builder.write(path);
            auto listing = gwtest::runCommand("bsdtar -tf " + gwtest::shellQuote(path));
            EXPECT_EQ(listing.status, 0);
            EXPECT_EQ(listing.output, "one\ntwo\n");
            for (const auto& [name, bytes] : {std::pair{"one", one}, std::pair{"two", two}}) {
                auto extracted =
                    gwtest::runCommand("bsdtar -xOf " + gwtest::shellQuote(path) + " " + name);
                EXPECT_EQ(extracted.status, 0);
                EXPECT_EQ(gwtest::bytesOf(extracted.output), bytes) << name;
            }
        }
    }
}

}  // namespace

namespace {

// Header fields, overrides and the heap's leading digest, read back plainly
// (bsdtar reads only compressed tables of contents, so stored ones are checked here).
TEST(GWXARBuilder, LaysOutHeaderTOCAndHeap) {
    gwtest::XarBuilder builder(2);
    builder.compressTOC = false;
    builder.extraHeaderBytes = {0xAA, 0xBB};
    builder.setFiles("<file id=\"1\"><name>n</name></file>");
    const std::uint64_t heapOffset = builder.addHeapBytes(gwtest::bytesOf("HEAP"));
    EXPECT_EQ(heapOffset, 16u);  // after the MD5 of the table of contents
    const std::string document = builder.tocDocument();
    EXPECT_NE(document.find("<checksum style=\"md5\">"), std::string::npos);

    const GWData bytes = builder.bytes();
    GWByteReader reader(bytes);
    EXPECT_EQ(reader.string(4), "xar!");
    EXPECT_EQ(reader.u16be(), 30);
    EXPECT_EQ(reader.u16be(), 1);
    EXPECT_EQ(reader.u64be(), document.size());
    EXPECT_EQ(reader.u64be(), document.size());
    EXPECT_EQ(reader.u32be(), 2u);
    EXPECT_EQ(reader.u16be(), 0xAABB);
    const auto toc = reader.bytes(document.size());
    EXPECT_EQ(std::string(toc.begin(), toc.end()), document);
    const auto digest = reader.bytes(16);
    EXPECT_EQ(GWData(digest.begin(), digest.end()),
              GWChecksum::checksumForData(toc, GWChecksumAlgorithmMD5));
    EXPECT_EQ(reader.string(4), "HEAP");
    EXPECT_TRUE(reader.ok());
    EXPECT_EQ(reader.remaining(), 0u);

    builder.magic = "xaR!";
    builder.headerSize = 27;
    builder.version = 2;
    builder.compressedTOCLength = 5;
    builder.uncompressedTOCLength = 6;
    builder.headerChecksumField = 9;
    builder.corruptStoredChecksum = true;
    const GWData odd = builder.bytes();
    GWByteReader oddReader(odd);
    EXPECT_EQ(oddReader.string(4), "xaR!");
    EXPECT_EQ(oddReader.u16be(), 27);
    EXPECT_EQ(oddReader.u16be(), 2);
    EXPECT_EQ(oddReader.u64be(), 5u);
    EXPECT_EQ(oddReader.u64be(), 6u);
    EXPECT_EQ(oddReader.u32be(), 9u);
    EXPECT_NE(GWData(odd.end() - 20, odd.end() - 4), GWData(digest.begin(), digest.end()));
}

}  // namespace
