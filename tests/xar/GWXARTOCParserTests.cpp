#include <gtest/gtest.h>

#include <cerrno>

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

std::string node(const GWErrorPtr& error) {
    return error ? error->detailString(kGWXARArchiveAffectedXMLNodeErrorKey) : "(no error)";
}

void expectXARError(const gwtest::ParsedEntries& parsed, long code, const std::string& unknown) {
    EXPECT_FALSE(parsed.files);
    ASSERT_TRUE(parsed.error);
    EXPECT_EQ(parsed.error->domain(), kGWXARArchiveErrorDomain);
    EXPECT_EQ(parsed.error->code(), code) << parsed.error->localizedDescription();
    EXPECT_EQ(entity(parsed.error), unknown);
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
    EXPECT_EQ(entryAtPath(*parsed.files, "dir/z")->path(), "dir/z");
}

TEST(GWXARTOCEntries, NamesKeepOnlyTheirLastComponent) {
    auto parsed = parseEntries(file("1", "a/b/c") + file("2", "/etc/passwd") +
                               file("3", "x", file("4", "../../up")));
    ASSERT_TRUE(parsed.files);
    EXPECT_EQ(namesOf(*parsed.files), (std::vector<std::string>{"c", "passwd", "x"}));
    EXPECT_EQ(namesOf(entryAtPath(*parsed.files, "x")->children()),
              (std::vector<std::string>{"up"}));
}

TEST(GWXARTOCEntries, DotEntriesAtTheTopGiveTheirChildrenToTheTopLevel) {
    for (const std::string name : {".", "..", "", "a/.."}) {
        auto parsed = parseEntries(
            file("1", name, "<type>directory</type>" + file("2", "x") + file("3", "y")) +
            file("4", "w"));
        ASSERT_TRUE(parsed.files) << name;
        EXPECT_EQ(namesOf(*parsed.files), (std::vector<std::string>{"w", "x", "y"})) << name;
        EXPECT_EQ(entryAtPath(*parsed.files, "x")->parent(), nullptr);
    }
    // No "name" element at all counts as empty.
    auto parsed =
        parseEntries("<file id=\"1\"><type>directory</type>" + file("2", "x") + "</file>");
    ASSERT_TRUE(parsed.files);
    EXPECT_EQ(namesOf(*parsed.files), (std::vector<std::string>{"x"}));
}

TEST(GWXARTOCEntries, NestedDotEntriesVanishWithTheirSubtrees) {
    auto parsed = parseEntries(
        file("1", "d",
             "<type>directory</type>" + file("2", "keep") +
                 file("3", ".", "<type>directory</type>" + file("4", "lost1")) +
                 file("5", "..", "<type>directory</type>" + file("6", "lost2")) + file("7", "")));
    ASSERT_TRUE(parsed.files);
    ASSERT_EQ(parsed.files->size(), 1u);
    EXPECT_EQ(namesOf((*parsed.files)[0]->children()), (std::vector<std::string>{"keep"}));
}

TEST(GWXARTOCEntries, ModesDefaultByTypeAndKeepSpecialBits) {
    auto parsed = parseEntries(
        file("1", "dir", "<type>directory</type>") + file("2", "plain", "<type>file</type>") +
        file("3", "setuid", "<type>file</type><mode>4755</mode>") +
        file("4", "modeFirst", "<mode>0700</mode><type>directory</type>") + file("5", "typeless") +
        file("6", "garbage", "<type>file</type><mode>9x</mode>"));
    ASSERT_TRUE(parsed.files);
    EXPECT_EQ(entryAtPath(*parsed.files, "dir")->permissionsMode(), 040755);
    EXPECT_EQ(entryAtPath(*parsed.files, "plain")->permissionsMode(), 0100644);
    EXPECT_EQ(entryAtPath(*parsed.files, "setuid")->permissionsMode(), 0104755);
    EXPECT_EQ(entryAtPath(*parsed.files, "modeFirst")->permissionsMode(), 040700);
    EXPECT_EQ(entryAtPath(*parsed.files, "typeless")->permissionsMode(), 0644);
    EXPECT_EQ(entryAtPath(*parsed.files, "typeless")->type(), GWXARFileTypeUnknown);
    EXPECT_EQ(entryAtPath(*parsed.files, "garbage")->permissionsMode(), 0100000);
}

TEST(GWXARTOCEntries, TypeNamesSetTheFileTypeBits) {
    const std::pair<std::string, GWXARFileType> types[] = {
        {"<type>file</type>", GWXARFileTypeRegular},
        {"<type link=\"original\">hardlink</type>", GWXARFileTypeRegular},
        {"<type>character special</type>", GWXARFileTypeCharacterSpecial},
        {"<type>block special</type>", GWXARFileTypeBlockSpecial},
        {"<type>directory</type>", GWXARFileTypeDirectory},
        {"<type>symlink</type>", GWXARFileTypeSymbolicLink},
        {"<type>fifo</type>", GWXARFileTypeFIFO},
        {"<type>socket</type>", GWXARFileTypeSocket},
        {"<type>whiteout</type>", GWXARFileTypeWhiteout},
    };
    for (const auto& [xml, type] : types) {
        auto parsed = parseEntries(file("1", "x", xml));
        ASSERT_TRUE(parsed.files) << xml;
        EXPECT_EQ((*parsed.files)[0]->type(), type) << xml;
    }
    auto parsed = parseEntries(file("1", "x", "<type>door</type>"));
    expectXARError(parsed, GWXARArchiveMalformedValueError, "door");
    EXPECT_EQ(node(parsed.error), "<type>door</type>");
}

TEST(GWXARTOCEntries, HardLinksResolveToTheEntryWithTheirID) {
    auto parsed = parseEntries(
        file("1", "original", "<type link=\"original\">hardlink</type>") +
        file("2", "dir",
             "<type>directory</type>" + file("3", "inner", "<type link=\"1\">hardlink</type>")) +
        file("4", "top", "<type link=\"3\">hardlink</type>"));
    ASSERT_TRUE(parsed.files) << entity(parsed.error);
    auto original = entryAtPath(*parsed.files, "original");
    auto inner = entryAtPath(*parsed.files, "dir/inner");
    auto top = entryAtPath(*parsed.files, "top");
    EXPECT_EQ(original->type(), GWXARFileTypeRegular);
    EXPECT_EQ(original->hardlinkDestination(), nullptr);
    EXPECT_EQ(inner->type(), GWXARFileTypeHardLink);
    EXPECT_EQ(inner->hardlinkDestination(), original);
    EXPECT_EQ(inner->hardlinkDestinationID(), "1");
    EXPECT_EQ(inner->hardlinkPath(), "../original");
    EXPECT_EQ(top->hardlinkDestination(), inner);
    EXPECT_EQ(top->hardlinkPath(), "dir/inner");
}

TEST(GWXARTOCEntries, HardLinksMayPointAtDroppedEntries) {
    // Dropped entries keep their id: a link to one still resolves while loading.
    auto dropped = parseEntries(
        file("1", "d", "<type>directory</type>" + file("2", ".", "<type>file</type>")) +
        file("3", "l", "<type link=\"2\">hardlink</type>"));
    ASSERT_TRUE(dropped.files) << entity(dropped.error);
    EXPECT_NE(entryAtPath(*dropped.files, "l")->hardlinkDestination(), nullptr);
}

TEST(GWXARTOCEntries, OwnersNumbersAndLinks) {
    auto parsed = parseEntries(
        file("1", "f",
             "<type>symlink</type><link type=\"broken\">../target</link><uid> 501</uid>"
             "<gid>4294967297</gid><user>me</user><group>staff</group><inode>18446744073709551615"
             "</inode><deviceno>-5</deviceno><contents>ignored</contents>"));
    ASSERT_TRUE(parsed.files);
    auto f = (*parsed.files)[0];
    EXPECT_EQ(f->type(), GWXARFileTypeSymbolicLink);
    EXPECT_EQ(f->symlinkDestination(), "../target");
    EXPECT_EQ(f->ownerID(), 501u);
    EXPECT_EQ(f->groupOwnerID(), 1u);  // kept in 32 bits
    EXPECT_EQ(f->ownerName(), "me");
    EXPECT_EQ(f->groupOwnerName(), "staff");
    EXPECT_EQ(f->inode(), 18446744073709551615ull);
    EXPECT_EQ(f->deviceNumber(), -5);

    // Numbers past 64 bits read as unparsable: zero.
    auto huge = parseEntries(file("1", "f",
                                  "<uid>99999999999999999999</uid><inode>18446744073709551616"
                                  "</inode><deviceno>x</deviceno><mode>7777777777777777777777777"
                                  "</mode>"));
    ASSERT_TRUE(huge.files);
    EXPECT_EQ((*huge.files)[0]->ownerID(), 0u);
    EXPECT_EQ((*huge.files)[0]->inode(), 0u);
    EXPECT_EQ((*huge.files)[0]->deviceNumber(), 0);
    EXPECT_EQ((*huge.files)[0]->permissionsMode(), 0);
}

TEST(GWXARTOCEntries, DatesAreUTCWithAnOptionalZ) {
    auto parsed = parseEntries(
        file("1", "f",
             "<atime>2010-01-02T03:04:05Z</atime><mtime>2010-01-02T03:04:05</mtime>"
             "<ctime>1970-01-01T00:00:00Z</ctime><FinderCreateTime><time>2010-01-02T03:04:05"
             "</time><nanoseconds>500000000</nanoseconds></FinderCreateTime>"));
    ASSERT_TRUE(parsed.files);
    auto f = (*parsed.files)[0];
    EXPECT_EQ(f->accessDate(), GWDate(1262401445));
    EXPECT_EQ(f->modificationDate(), GWDate(1262401445));
    EXPECT_EQ(f->attributeModificationDate(), GWDate(0));
    EXPECT_EQ(f->creationDate(), GWDate(1262401445.5));

    // A date that does not parse ends the load without an error object.
    for (const char* bad :
         {"2010-01-02T03:04:05.5Z", "2010-01-02 03:04:05", "2010-01-02T03:04:05ZZ", ""}) {
        auto failed = parseEntries(file("1", "f", std::string("<mtime>") + bad + "</mtime>"));
        EXPECT_FALSE(failed.files) << bad;
        EXPECT_EQ(failed.error, nullptr) << bad;
    }
    auto badNanoseconds =
        parseEntries(file("1", "f",
                          "<FinderCreateTime><time>2010-01-02T03:04:05</time><nanoseconds "
                          "enctype=\"base64\">!!</nanoseconds></FinderCreateTime>"));
    ASSERT_TRUE(badNanoseconds.files);
    EXPECT_EQ((*badNanoseconds.files)[0]->creationDate(), GWDate(1262401445));
}

TEST(GWXARTOCEntries, DevicesNeedBothNumbersBelow256) {
    auto parsed = parseEntries(
        file("1", "c",
             "<type>character special</type><device><major>1</major><minor>3</minor></device>"));
    ASSERT_TRUE(parsed.files);
    EXPECT_EQ((*parsed.files)[0]->deviceMajorNumber(), 1u);
    EXPECT_EQ((*parsed.files)[0]->deviceMinorNumber(), 3u);

    auto major256 =
        parseEntries(file("1", "c", "<device><major>256</major><minor>0</minor></device>"));
    expectXARError(major256, GWXARArchiveMalformedValueError, "256");
    EXPECT_EQ(node(major256.error), "<major>256</major>");
    auto minorNegative =
        parseEntries(file("1", "c", "<device><major>0</major><minor>-1</minor></device>"));
    expectXARError(minorNegative, GWXARArchiveMalformedValueError, "-1");
    EXPECT_EQ(node(minorNegative.error), "<minor>-1</minor>");
}

TEST(GWXARTOCEntries, FlagsCombineAndUnknownNamesFail) {
    auto parsed =
        parseEntries(file("1", "f", "<flags><UserNoDump/><SystemImmutable/><UserOpaque/></flags>"));
    ASSERT_TRUE(parsed.files);
    EXPECT_EQ((*parsed.files)[0]->posixFlags(), 0x20009u);
    auto unknown = parseEntries(file("1", "f", "<flags><UserAppend/><Hidden/></flags>"));
    expectXARError(unknown, GWXARArchiveUnknownFlagError, "Hidden");
    EXPECT_EQ(node(unknown.error), "<Hidden/>");
}

TEST(GWXARTOCEntries, Base64TextIsDecoded) {
    // "h\xc3\xa9llo" and "a\xff" in base64.
    auto parsed = parseEntries("<file id=\"1\"><name enctype=\"base64\">aMOpbGxv</name></file>");
    ASSERT_TRUE(parsed.files);
    EXPECT_EQ((*parsed.files)[0]->name(), "h\xc3\xa9llo");

    auto notUTF8 = parseEntries("<file id=\"1\"><name enctype=\"base64\">Yf8=</name></file>");
    EXPECT_FALSE(notUTF8.files);
    EXPECT_EQ(notUTF8.error, nullptr);

    auto badBase64 = parseEntries("<file id=\"1\"><name enctype=\"base64\">a*b</name></file>");
    EXPECT_FALSE(badBase64.files);
    ASSERT_TRUE(badBase64.error);
    EXPECT_TRUE(badBase64.error->is(kGWCocoaErrorDomain, GWFileReadCorruptFileError));
}

TEST(GWXARTOCEntries, UnknownAttributesAndPropertiesAreLogged) {
    gwtest::LogCapture log;
    auto parsed = parseEntries(
        "<file id=\"1\" color=\"blue\"><name>f</name><colour>red</colour><content/>"
        "<data><bogus>1</bogus></data><acl><posix>u::rw-,g::r--,o::r--</posix></acl></file>");
    ASSERT_TRUE(parsed.files);
    EXPECT_EQ(log.lines(),
              (std::vector<std::string>{
                  "unhandled attribute color=\"blue\"", "unhandled property colour",
                  "unhandled file reference property bogus", "Unhandled ACL type posix"}));
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
    auto parsed = parseEntries(file("1", "f",
                                    "<ea id=\"0\"><name>user.first</name>" + reference + "</ea>" +
                                        "<ea><com.apple.FinderInfo>" + reference +
                                        "</com.apple.FinderInfo><user.b>" + reference +
                                        "</user.b></ea><ea><name></name>" + reference + "</ea>"));
    ASSERT_TRUE(parsed.files) << entity(parsed.error);
    const auto& attributes = (*parsed.files)[0]->extendedAttributes();
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

TEST(GWXARTOCEntries, ACLsGoToTheirSlots) {
    const std::string mac =
        "!#acl 1\ngroup:ABCDEFAB-CDEF-ABCD-EFAB-CDEF0000000C:everyone:12:deny:delete\n";
    auto parsed = parseEntries(file(
        "1", "f",
        "<acl><access>u::rw-,u:4000000:r--,g::r--,m::r--,o::---</access><default>u::rwx,g::rwx,"
        "o::---</default><appleextended>" +
            mac + "</appleextended></acl>"));
    ASSERT_TRUE(parsed.files) << entity(parsed.error);
    auto f = (*parsed.files)[0];
    ASSERT_TRUE(f->accessACL() && f->defaultACL() && f->extendedACL());
    EXPECT_EQ(f->accessACL()->text(),
              "user::rw-\nuser:4000000:r--\ngroup::r--\nmask::r--\nother::---\n");
    EXPECT_EQ(f->defaultACL()->text(), "user::rwx\ngroup::rwx\nother::---\n");
    EXPECT_EQ(f->extendedACL()->macExtendedText(), mac);

    auto bad = parseEntries(file("1", "f", "<acl><access>everyone:rwx</access></acl>"));
    EXPECT_EQ(node(bad.error), "<access>everyone:rwx</access>");
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
    EXPECT_FALSE(
        operation->fileWithXMLElement(document.child("toc").child("file"), nullptr, &error));
    EXPECT_TRUE(error->is(kGWCocoaErrorDomain, GWUserCancelledError));
}

TEST(GWXARTOCValues, ChecksumsInlineOrStoredInTheHeap) {
    auto operation = GWXARLoadOperation::initWithArchive(nullptr, false);
    GWErrorPtr error;
    int type = -7;
    auto inline_ = gwtest::xmlElement("<c style=\"sha256\">ABcd</c>");
    EXPECT_EQ(operation->checksumFromElement(inline_->first_child(), &type, &error),
              (GWData{0xab, 0xcd}));
    EXPECT_EQ(type, GWChecksumAlgorithmSHA256);
    auto empty = gwtest::xmlElement("<c style=\"md5\"></c>");
    EXPECT_EQ(operation->checksumFromElement(empty->first_child(), nullptr, &error), GWData{});
    // The style is only mapped when the caller asks for it.
    auto odd = gwtest::xmlElement("<c style=\"crc\">00</c>");
    EXPECT_EQ(operation->checksumFromElement(odd->first_child(), nullptr, &error), GWData{0});
    EXPECT_FALSE(operation->checksumFromElement(odd->first_child(), &type, &error));
    EXPECT_TRUE(error->is(kGWXARArchiveErrorDomain, GWXARArchiveUnknownChecksumError));
    EXPECT_EQ(entity(error), "crc");

    gwtest::TemporaryDirectory directory;
    gwtest::writeFile(directory.file("heap"), gwtest::bytesOf("0123456789abcdef"));
    operation->setArchiveURL(directory.url("heap"));
    auto stored = gwtest::xmlElement("<c style=\"sha1\"><offset>2</offset><size>4</size></c>");
    // Without an open file there is nothing to read from.
    EXPECT_FALSE(operation->checksumFromElement(stored->first_child(), nullptr, &error));
    EXPECT_TRUE(error->is(kGWPOSIXErrorDomain, EBADF));
    operation->setFileHandle(
        GWRemoteFileHandle::initForReadingFromURL(directory.url("heap"), &error));
    operation->setHeapStart(10);
    EXPECT_EQ(operation->checksumFromElement(stored->first_child(), &type, &error),
              gwtest::bytesOf("cdef"));
    EXPECT_EQ(type, GWChecksumAlgorithmSHA1);

    auto badSize = gwtest::xmlElement("<c style=\"sha1\"><offset>2</offset><size>-4</size></c>");
    EXPECT_FALSE(operation->checksumFromElement(badSize->first_child(), nullptr, &error));
    EXPECT_TRUE(error->is(kGWXARArchiveErrorDomain, GWXARArchiveMalformedValueError));
    EXPECT_EQ(entity(error), "-4");
    EXPECT_EQ(error->URL(), directory.url("heap"));
    EXPECT_EQ(node(error), "<c style=\"sha1\"><offset>2</offset><size>-4</size></c>");
}

TEST(GWXARTOCValues, HexNeedsPairsOfHexDigits) {
    auto operation = GWXARLoadOperation::initWithArchive(nullptr, false);
    GWErrorPtr error;
    EXPECT_EQ(operation->decodeHexString("00fFa9", pugi::xml_node(), &error),
              (GWData{0x00, 0xff, 0xa9}));
    for (const char* bad : {"ABC", "zz", "0x", " 0", "0g"}) {
        error = nullptr;
        EXPECT_FALSE(operation->decodeHexString(bad, pugi::xml_node(), &error)) << bad;
        ASSERT_TRUE(error);
        EXPECT_TRUE(error->is(kGWXARArchiveErrorDomain, GWXARArchiveMalformedValueError));
        EXPECT_EQ(entity(error), bad);
    }
}

TEST(GWXARTOCValues, ChecksumAndCompressionNames) {
    const std::pair<const char*, int> names[] = {{"SHA", 5},    {"sha1", 5},   {"Sha224", 6},
                                                 {"sha256", 7}, {"sha384", 8}, {"SHA512", 9},
                                                 {"MD5", 4},    {"md2", 3},    {"crc32", -1}};
    for (const auto& [name, type] : names) {
        EXPECT_EQ(GWXARLoadOperation::checksumTypeFromName(name), type) << name;
    }

    auto operation = GWXARLoadOperation::initWithArchive(nullptr, false);
    GWErrorPtr error;
    std::uint64_t type = 99;
    auto lzma = gwtest::xmlElement("<encoding style=\"application/x-lzma\"/>");
    EXPECT_TRUE(operation->getCompressionType(&type, lzma->first_child(), &error));
    EXPECT_EQ(type, GWXARCompressionTypeLZMA);
    // Matched exactly, case included.
    auto upper = gwtest::xmlElement("<encoding style=\"Application/X-Gzip\"/>");
    EXPECT_FALSE(operation->getCompressionType(&type, upper->first_child(), &error));
    EXPECT_TRUE(error->is(kGWXARArchiveErrorDomain, GWXARArchiveUnsupportedCompressionError));
    EXPECT_EQ(entity(error), "Application/X-Gzip");
}

}  // namespace
