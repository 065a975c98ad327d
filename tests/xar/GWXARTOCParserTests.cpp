// What the table-of-contents parser makes of well-formed entries: the tree,
// names that must not climb out, every property, and the value readers.
// Malformed entries are in GWXARTOCHostileTests.

#include <gtest/gtest.h>

#include "GWArchiveSupport/GWArchiveConstants.h"
#include "XarTestSupport.h"
#include "foundation/GWChecksum.h"
#include "support/TestSupport.h"

namespace {

using gwtest::entryAtPath;
using gwtest::namesOf;
using gwtest::parseEntries;

std::string file(const std::string& id, const std::string& name, const std::string& body = "") {
    return "<file id=\"" + id + "\"><name>" + name + "</name>" + body + "</file>";
}

std::string entity(const GWErrorPtr& error) {
    return error ? error->detailString(kGWXARArchiveUnknownEntityErrorKey) : "(no error)";
}

GWXARFilePtr only(const std::string& body) {
    auto parsed = parseEntries(file("1", "f", body));
    EXPECT_TRUE(parsed.files && parsed.files->size() == 1) << entity(parsed.error) << body;
    return parsed.files && !parsed.files->empty() ? (*parsed.files)[0] : nullptr;
}

TEST(GWXARTOCEntries, BuildsTheTreeWithSortedLevels) {
    auto parsed =
        parseEntries(file("1", "b") + file("2", "A") + file("3", "file10") + file("4", "file2") +
                     file("5", "dir", "<type>directory</type>" + file("6", "z") + file("7", "Y")));
    ASSERT_TRUE(parsed.files) << entity(parsed.error);
    EXPECT_EQ(namesOf(*parsed.files),
              (std::vector<std::string>{"A", "b", "dir", "file2", "file10"}));
    auto dir = entryAtPath(*parsed.files, "dir");
    EXPECT_EQ(namesOf(dir->children()), (std::vector<std::string>{"Y", "z"}));
    EXPECT_EQ(dir->children()[0]->parent(), dir);
    EXPECT_EQ(dir->parent(), nullptr);
    EXPECT_EQ(dir->itemID(), "5");
}

TEST(GWXARTOCEntries, NamesCannotClimbOutOfTheirLevel) {
    auto parsed = parseEntries(file("1", "a/b/c") + file("2", "/etc/passwd") +
                               file("3", "x", file("4", "../../up")));
    ASSERT_TRUE(parsed.files);
    EXPECT_EQ(namesOf(*parsed.files), (std::vector<std::string>{"c", "passwd", "x"}));
    EXPECT_EQ(namesOf(entryAtPath(*parsed.files, "x")->children()),
              (std::vector<std::string>{"up"}));

    // Dot entries at the top give their children to the top level ...
    for (const std::string name : {".", "..", "", "a/.."}) {
        auto top = parseEntries(
            file("1", name, "<type>directory</type>" + file("2", "x") + file("3", "y")) +
            file("4", "w"));
        ASSERT_TRUE(top.files) << name;
        EXPECT_EQ(namesOf(*top.files), (std::vector<std::string>{"w", "x", "y"})) << name;
        EXPECT_EQ(entryAtPath(*top.files, "x")->parent(), nullptr);
    }
    auto unnamed =
        parseEntries("<file id=\"1\"><type>directory</type>" + file("2", "x") + "</file>");
    ASSERT_TRUE(unnamed.files);
    EXPECT_EQ(namesOf(*unnamed.files), (std::vector<std::string>{"x"}));
    // ... and below it vanish with their subtrees.
    auto nested = parseEntries(
        file("1", "d",
             "<type>directory</type>" + file("2", "keep") +
                 file("3", ".", "<type>directory</type>" + file("4", "lost1")) +
                 file("5", "..", "<type>directory</type>" + file("6", "lost2")) + file("7", "")));
    ASSERT_TRUE(nested.files);
    ASSERT_EQ(nested.files->size(), 1u);
    EXPECT_EQ(namesOf((*nested.files)[0]->children()), (std::vector<std::string>{"keep"}));
}

TEST(GWXARTOCEntries, TypesAndModes) {
    const std::tuple<std::string, GWXARFileType, std::uint16_t> cases[] = {
        {"<type>file</type>", GWXARFileTypeRegular, 0100644},
        {"<type link=\"original\">hardlink</type>", GWXARFileTypeRegular, 0100644},
        {"<type>character special</type>", GWXARFileTypeCharacterSpecial, 020644},
        {"<type>block special</type>", GWXARFileTypeBlockSpecial, 060644},
        {"<type>directory</type>", GWXARFileTypeDirectory, 040755},
        {"<type>symlink</type>", GWXARFileTypeSymbolicLink, 0120644},
        {"<type>fifo</type>", GWXARFileTypeFIFO, 010644},
        {"<type>socket</type>", GWXARFileTypeSocket, 0140644},
        {"<type>whiteout</type>", GWXARFileTypeWhiteout, 0160644},
        {"<type>file</type><mode>4755</mode>", GWXARFileTypeRegular, 0104755},
        {"<mode>0700</mode><type>directory</type>", GWXARFileTypeDirectory, 040700},
        {"", GWXARFileTypeUnknown, 0644},
        {"<type>file</type><mode>9x</mode>", GWXARFileTypeRegular, 0100000},
        {"<mode>7777777777777777777777777</mode>", GWXARFileTypeUnknown, 0},
    };
    for (const auto& [xml, type, mode] : cases) {
        auto entry = only(xml);
        ASSERT_TRUE(entry);
        EXPECT_EQ(entry->type(), type) << xml;
        EXPECT_EQ(entry->permissionsMode(), mode) << xml;
    }
}

TEST(GWXARTOCEntries, HardLinksResolveToTheEntryWithTheirID) {
    auto parsed = parseEntries(
        file("1", "original", "<type link=\"original\">hardlink</type>") +
        file("2", "dir",
             "<type>directory</type>" + file("3", "inner", "<type link=\"1\">hardlink</type>")) +
        file("4", "top", "<type link=\"3\">hardlink</type>") +
        // Dropped entries keep their id: a link to one still resolves while loading.
        file("5", "d", "<type>directory</type>" + file("6", ".", "<type>file</type>")) +
        file("7", "l", "<type link=\"6\">hardlink</type>"));
    ASSERT_TRUE(parsed.files) << entity(parsed.error);
    auto original = entryAtPath(*parsed.files, "original");
    auto inner = entryAtPath(*parsed.files, "dir/inner");
    auto top = entryAtPath(*parsed.files, "top");
    EXPECT_EQ(original->hardlinkDestination(), nullptr);
    EXPECT_EQ(inner->hardlinkDestination(), original);
    EXPECT_EQ(inner->hardlinkDestinationID(), "1");
    EXPECT_EQ(inner->hardlinkPath(), "../original");
    EXPECT_EQ(top->hardlinkDestination(), inner);
    EXPECT_EQ(top->hardlinkPath(), "dir/inner");
    EXPECT_NE(entryAtPath(*parsed.files, "l")->hardlinkDestination(), nullptr);
}

TEST(GWXARTOCEntries, EveryPropertyIsRead) {
    const std::string mac =
        "!#acl 1\ngroup:ABCDEFAB-CDEF-ABCD-EFAB-CDEF0000000C:everyone:12:deny:delete\n";
    auto f = only(
        "<type>symlink</type><link type=\"broken\">../target</link><uid> 501</uid>"
        "<gid>4294967297</gid><user>me</user><group>staff</group><inode>18446744073709551615"
        "</inode><deviceno>-5</deviceno><contents>ignored</contents>"
        "<device><major>1</major><minor>3</minor></device>"
        "<flags><UserNoDump/><SystemImmutable/><UserOpaque/></flags>"
        "<atime>2010-01-02T03:04:05Z</atime><mtime>2010-01-02T03:04:05</mtime>"
        "<ctime>1970-01-01T00:00:00Z</ctime><FinderCreateTime><time>2010-01-02T03:04:05"
        "</time><nanoseconds>500000000</nanoseconds></FinderCreateTime>"
        "<acl><access>u::rw-,u:4000000:r--,g::r--,m::r--,o::---</access><default>u::rwx,g::rwx,"
        "o::---</default><appleextended>" +
        mac + "</appleextended></acl>");
    ASSERT_TRUE(f);
    EXPECT_EQ(f->symlinkDestination(), "../target");
    EXPECT_EQ(f->ownerID(), 501u);
    EXPECT_EQ(f->groupOwnerID(), 1u);  // kept in 32 bits
    EXPECT_EQ(f->ownerName(), "me");
    EXPECT_EQ(f->groupOwnerName(), "staff");
    EXPECT_EQ(f->inode(), 18446744073709551615ull);
    EXPECT_EQ(f->deviceNumber(), -5);
    EXPECT_EQ(f->deviceMajorNumber(), 1u);
    EXPECT_EQ(f->deviceMinorNumber(), 3u);
    EXPECT_EQ(f->posixFlags(), 0x20009u);
    // Dates are UTC with an optional Z.
    EXPECT_EQ(f->accessDate(), GWDate(1262401445));
    EXPECT_EQ(f->modificationDate(), GWDate(1262401445));
    EXPECT_EQ(f->attributeModificationDate(), GWDate(0));
    EXPECT_EQ(f->creationDate(), GWDate(1262401445.5));
    ASSERT_TRUE(f->accessACL() && f->defaultACL() && f->extendedACL());
    EXPECT_EQ(f->accessACL()->text(),
              "user::rw-\nuser:4000000:r--\ngroup::r--\nmask::r--\nother::---\n");
    EXPECT_EQ(f->defaultACL()->text(), "user::rwx\ngroup::rwx\nother::---\n");
    EXPECT_EQ(f->extendedACL()->macExtendedText(), mac);

    // Numbers past 64 bits read as unparsable: zero.
    auto huge = only(
        "<uid>99999999999999999999</uid><inode>18446744073709551616</inode><deviceno>x</deviceno>"
        "<FinderCreateTime><time>2010-01-02T03:04:05</time><nanoseconds enctype=\"base64\">!!"
        "</nanoseconds></FinderCreateTime>");
    ASSERT_TRUE(huge);
    EXPECT_EQ(huge->ownerID(), 0u);
    EXPECT_EQ(huge->inode(), 0u);
    EXPECT_EQ(huge->deviceNumber(), 0);
    EXPECT_EQ(huge->creationDate(), GWDate(1262401445));
    // Base64 text is decoded.
    EXPECT_EQ(parseEntries("<file id=\"1\"><name enctype=\"base64\">aMOpbGxv</name></file>")
                  .files->at(0)
                  ->name(),
              "h\xc3\xa9llo");
}

TEST(GWXARTOCEntries, DataForkOffsetsCountFromTheHeap) {
    auto parsed = parseEntries(
        file("1", "f",
             "<type>file</type><data><length>11</length><offset>29</offset><size>3</size>"
             "<encoding style=\"application/x-bzip2\"/><archived-checksum style=\"SHA1\">"
             "B779EE76a9ffdfb02bfefae78061f789376c32d9</archived-checksum>"
             "<unarchived-checksum style=\"md5\">00ff</unarchived-checksum></data>"),
        1000);
    ASSERT_TRUE(parsed.files) << entity(parsed.error);
    auto data = (*parsed.files)[0]->dataFork();
    ASSERT_TRUE(data);
    EXPECT_EQ(data->offset(), 1029u);
    EXPECT_EQ(data->compressedSize(), 11u);
    EXPECT_EQ(data->uncompressedSize(), 3u);
    EXPECT_EQ(data->compressionType(), GWXARCompressionTypeBZ2);
    EXPECT_EQ(gwtest::hex(*data->compressedChecksum()), "b779ee76a9ffdfb02bfefae78061f789376c32d9");
    EXPECT_EQ(data->compressedChecksumType(), GWXARChecksumTypeSHA1);
    EXPECT_EQ(*data->uncompressedChecksum(), (GWData{0x00, 0xff}));
    EXPECT_EQ(data->uncompressedChecksumType(), GWXARChecksumTypeMD5);
}

TEST(GWXARTOCEntries, ExtendedAttributesInBothLayouts) {
    const std::string reference =
        "<length>1</length><offset>2</offset><size>3</size>"
        "<encoding style=\"application/octet-stream\"/>";
    auto f = only("<ea id=\"0\"><name>user.first</name>" + reference + "</ea>" +
                  "<ea><com.apple.FinderInfo>" + reference + "</com.apple.FinderInfo><user.b>" +
                  reference + "</user.b></ea><ea><name></name>" + reference + "</ea>");
    ASSERT_TRUE(f);
    const auto& attributes = f->extendedAttributes();
    ASSERT_EQ(attributes.size(), 4u);
    EXPECT_EQ(attributes[0]->name(), "user.first");
    EXPECT_EQ(attributes[1]->name(), "com.apple.FinderInfo");
    EXPECT_EQ(attributes[2]->name(), "user.b");
    EXPECT_TRUE(attributes[3]->name()->starts_with("Unknown EA "));
    EXPECT_GT(attributes[3]->name()->size(), std::string("Unknown EA ").size());
    for (const auto& attribute : attributes) {
        EXPECT_EQ(attribute->offset(), 2u);
        EXPECT_EQ(attribute->compressedSize(), 1u);
        EXPECT_EQ(attribute->uncompressedSize(), 3u);
    }
}

TEST(GWXARTOCEntries, CancellationStopsTheParse) {
    pugi::xml_document document;
    document.load_string("<toc><file id=\"1\"><name>a</name></file></toc>");
    auto operation = GWXARLoadOperation::initWithArchive(nullptr, false);
    operation->cancel();
    GWErrorPtr error;
    EXPECT_FALSE(operation->filesFromTOCElement(document.child("toc"), &error));
    ASSERT_TRUE(error);
    EXPECT_TRUE(error->is(kGWCocoaErrorDomain, GWUserCancelledError));
}

TEST(GWXARTOCValues, NamesOfChecksums) {
    const std::pair<const char*, int> names[] = {{"SHA", 5},    {"sha1", 5},   {"Sha224", 6},
                                                 {"sha256", 7}, {"sha384", 8}, {"SHA512", 9},
                                                 {"MD5", 4},    {"md2", 3},    {"crc32", -1}};
    for (const auto& [name, type] : names) {
        EXPECT_EQ(GWXARLoadOperation::checksumTypeFromName(name), type) << name;
    }
}

}  // namespace
