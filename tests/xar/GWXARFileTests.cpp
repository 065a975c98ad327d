// The entry and archive model: types, paths, ordering, ACLs, keyed
// persistence and copying.

#include <gtest/gtest.h>

#include <sstream>

#include <sys/acl.h>

#include "XarTestSupport.h"
#include "foundation/GWCoder.h"
#include "support/TestSupport.h"
#include "support/XarBuilder.h"
#include "xar/GWXARArchive.h"

namespace {

GWXARFilePtr entry(const std::string& name, std::uint16_t mode = 0100644) {
    auto file = GWXARFile::initWithArchive(nullptr);
    file->setName(name);
    file->setPermissionsMode(mode);
    return file;
}

// A description with the object addresses blanked: equal exactly when every
// described field is equal.
std::string fields(const GWXARFile& file) {
    std::string text = file.description();
    for (const std::string prefix :
         {"<GWXARFile ", "<GWXARDataReference ", "parent=", "hardlinkDestination="}) {
        for (std::size_t at = text.find(prefix); at != std::string::npos;
             at = text.find(prefix, at + 1)) {
            const std::size_t start = at + prefix.size();
            const std::size_t end = text.find_first_of(" \n", start);
            text.replace(start, end - start, "@");
        }
    }
    return text;
}

// GWXARArchive is not defined at this level; an aliasing pointer gives a
// stand-in whose identity entries can hold without ever using it.
std::shared_ptr<GWXARArchive> standInArchive() {
    auto owner = std::make_shared<int>(0);
    return std::shared_ptr<GWXARArchive>(owner, reinterpret_cast<GWXARArchive*>(owner.get()));
}

GWACL aclFromText(const std::string& text) {
    auto acl = GWACL::fromText(text, nullptr);
    EXPECT_TRUE(acl) << text;
    return acl ? std::move(*acl) : GWACL::adopt(acl_init(0));
}

const char* const kMacACL =
    "!#acl 1\ngroup:ABCDEFAB-CDEF-ABCD-EFAB-CDEF0000000C:everyone:12:deny:write,chown\n";

GWXARDataReferencePtr sampleReference() {
    auto reference = GWXARDataReference::init();
    reference->setOffset(0x1c);
    reference->setCompressedSize(11);
    reference->setUncompressedSize(3);
    reference->setCompressedChecksum(GWData{0xab, 0xcd, 0xef, 0x01, 0x23});
    reference->setCompressedChecksumType(GWXARChecksumTypeSHA1);
    reference->setUncompressedChecksumType(2);
    reference->setCompressionType(GWXARCompressionTypeGZip);
    return reference;
}

// A directory holding a file with every field set and a resolved hard link to it.
struct SampleTree {
    GWXARFilePtr directory = entry("dir", 0040755), file = entry("file", 0104755),
                 link = entry("link");

    SampleTree() {
        directory->setItemID("1");
        file->setItemID("2");
        file->setOwnerID(4000000000u);
        file->setGroupOwnerID(20);
        file->setOwnerName("owner");
        file->setGroupOwnerName("group");
        file->setCreationDate(GWDate(1262401445.25));
        file->setModificationDate(GWDate(1262401446));
        file->setAccessDate(GWDate(1262401447));
        file->setAttributeModificationDate(GWDate(1262401448));
        file->setPosixFlags(0x40004);
        GWACL access = aclFromText("u::rw-,u:4000000:r--,g::r--,m::r--,o::---");
        GWACL defaults = aclFromText("u::rwx,g::r-x,o::---");
        GWACL extended = aclFromText(kMacACL);
        file->setAccessACL(&access);
        file->setDefaultACL(&defaults);
        file->setExtendedACL(&extended);
        file->setInode(0xFFFFFFFFFFFFFFF0ull);
        file->setDeviceNumber(-2);
        file->setDeviceMajorNumber(8);
        file->setDeviceMinorNumber(255);
        file->setDataFork(sampleReference());
        auto attribute = sampleReference();
        attribute->setName("com.apple.FinderInfo");
        attribute->setUncompressedChecksum(GWData{});
        file->addExtendedAttribute(attribute);
        link->setItemID("3");
        link->setHardlinkDestinationID("stale");
        link->setHardlinkDestination(file);
        directory->setChildren({link, file});
        directory->setArchive(standInArchive());
    }
};

TEST(GWXARFileType, FollowsTheModeAndTheResolvedHardLink) {
    const std::pair<std::uint16_t, GWXARFileType> cases[] = {
        {0100644, GWXARFileTypeRegular},      {0040755, GWXARFileTypeDirectory},
        {0120777, GWXARFileTypeSymbolicLink}, {0020644, GWXARFileTypeCharacterSpecial},
        {0060644, GWXARFileTypeBlockSpecial}, {0010644, GWXARFileTypeFIFO},
        {0140755, GWXARFileTypeSocket},       {0160000, GWXARFileTypeWhiteout},
        {0000644, GWXARFileTypeUnknown},      {0030644, GWXARFileTypeUnknown},
    };
    for (const auto& [mode, type] : cases) {
        EXPECT_EQ(entry("x", mode)->type(), type) << std::oct << mode;
    }
    auto link = entry("link");
    {
        auto target = entry("target");
        link->setHardlinkDestination(target);
        EXPECT_EQ(link->type(), GWXARFileTypeHardLink);
    }
    // The link is weak: with the target gone the entry is a plain file again.
    EXPECT_EQ(link->type(), GWXARFileTypeRegular);
    // Compression numbers 4 and 5 were once named one off.
    EXPECT_EQ(GWXARDataReference::stringFromCompressionType(4), "XZ");
    EXPECT_EQ(GWXARDataReference::stringFromCompressionType(5), "Unknown");
}

TEST(GWXARFileTree, PathsHardLinkPathsAndTheArchive) {
    auto x = entry("x", 0040755), y = entry("y");
    x->setChildren({y});
    auto a = entry("a", 0040755), b = entry("b", 0040755), c = entry("c", 0040755);
    auto deep = entry("deep"), shallow = entry("shallow"), top = entry("top");
    a->setChildren({b, shallow});
    b->setChildren({c});
    c->setChildren({deep});
    EXPECT_EQ(deep->path(), "a/b/c/deep");
    EXPECT_EQ(deep->hardlinkPath(), std::nullopt);
    for (const auto& link : {deep, shallow, top}) {
        link->setHardlinkDestination(y);
    }
    EXPECT_EQ(deep->hardlinkPath(), "../../../x/y");
    EXPECT_EQ(shallow->hardlinkPath(), "../x/y");
    EXPECT_EQ(top->hardlinkPath(), "x/y");

    // The archive comes from the nearest ancestor that has one.
    auto archive = standInArchive(), other = standInArchive();
    auto root = GWXARFile::initWithArchive(archive);
    root->setChildren({a});
    EXPECT_EQ(deep->archive(), archive);
    b->setArchive(other);
    EXPECT_EQ(deep->archive(), other);
    EXPECT_EQ(entry("alone")->archive(), nullptr);
}

TEST(GWXARFileTree, ChildrenSortCaseInsensitivelyWithNumbersByValue) {
    // Case aside, equal names keep their order; long digit runs compare by value.
    auto directory = entry("d", 0040755), file2 = entry("file2");
    auto same1 = entry("Same"), same2 = entry("same"), zero = entry("file02");
    auto huge = entry("v100000000000000000000000"), big = entry("v99999999999999999999999");
    directory->setChildren({huge, same1, same2, file2, zero, big});
    EXPECT_EQ(directory->children(), (GWXARFileArray{file2, zero, same1, same2, big, huge}));
    EXPECT_EQ(file2->parent(), directory);
}

TEST(GWXARFileACL, SlotsOwnTheirCopies) {
    auto file = entry("f");
    const std::string text = "user::rw-\ngroup::r--\nother::r--\n";
    {
        GWACL acl = aclFromText(text);
        file->setAccessACL(&acl);
        EXPECT_NE(file->accessACL()->handle(), acl.handle());
    }
    EXPECT_EQ(file->accessACL()->text(), text);
    // Storing a slot's own ACL into it again must not free it first.
    file->setAccessACL(file->accessACL());
    EXPECT_EQ(file->accessACL()->text(), text);
    file->setAccessACL(nullptr);
    EXPECT_EQ(file->accessACL(), nullptr);
}

TEST(GWXARFileACL, TextAndPersistentFormRoundTripAndRefuseDamage) {
    EXPECT_FALSE(aclFromText("user::rwx,group::r-x,other::r--").isMacExtended());
    EXPECT_TRUE(
        aclFromText("!#acl 1 defer_inherit\n"
                    "user:FFFFEEEE-DDDD-CCCC-BBBB-AAAA000001F5:me:501:allow:read,file_inherit\n"
                    "group:ABCDEFAB-CDEF-ABCD-EFAB-CDEF0000000C::-2:deny\n")
            .isMacExtended());
    for (const char* bad : {"user::rwz", "!#acl\n", "!#acl 1\nuser:x:y:1:allow:read\n",
                            "!#acl 1\nuser:FFFFEEEE-DDDD-CCCC-BBBB-AAAA000001F5:me:501:maybe\n"}) {
        GWErrorPtr error;
        EXPECT_FALSE(GWACL::fromText(bad, &error)) << bad;
        EXPECT_TRUE(error && error->is(kGWPOSIXErrorDomain, EINVAL)) << bad;
    }
    for (const char* text : {"u::rw-,u:1000:r--,g::r--,g:50:rw-,m::rw-,o::---", kMacACL}) {
        auto bytes = GWXARFile::dataFromACL(aclFromText(text), nullptr);
        ASSERT_TRUE(bytes);
        auto back = GWXARFile::aclFromData(*bytes, nullptr);
        ASSERT_TRUE(back);
        EXPECT_EQ(back->text(), aclFromText(text).text());
    }
    const GWData good = *GWXARFile::dataFromACL(aclFromText("u::rw-,g::r--,o::---"), nullptr);
    std::vector<GWData> damaged = {
        GWData(good.begin(), good.end() - 1), good, good, good, GWData{1, 2, 3}, GWData{}};
    damaged[1].push_back(0);
    damaged[2][0] ^= 0x40;  // the size word no longer matches
    damaged[3][4] = 1;      // nor does its upper half
    const std::string brokenMac = "!#acl 1\nuser:nonsense\n";
    damaged.emplace_back(brokenMac.begin(), brokenMac.end());
    for (const auto& sample : damaged) {
        GWErrorPtr error;
        EXPECT_FALSE(GWXARFile::aclFromData(sample, &error));
        EXPECT_TRUE(error && error->is(kGWPOSIXErrorDomain, EINVAL));
    }
}

TEST(GWXARFileCoding, RoundTripAndCopyKeepValuesButNotTheWeakLinks) {
    SampleTree tree;
    GWErrorPtr error;
    auto decoded = GWKeyedUnarchiver::unarchiveObjectWithData<GWXARFile>(
        GWKeyedArchiver::archivedDataWithRootObject(*tree.directory, &error), &error);
    ASSERT_TRUE(decoded) << (error ? error->localizedDescription() : "");

    // The link comes back unresolved, which shows in its type and description.
    tree.link->setHardlinkDestination(nullptr);
    EXPECT_EQ(fields(*decoded), fields(*tree.directory));
    EXPECT_EQ(decoded->archive(), nullptr);
    auto file = decoded->children()[0];
    auto link = decoded->children()[1];
    EXPECT_EQ(file->parent(), decoded);
    EXPECT_EQ(file->itemID(), "2");
    // The resolved target's identifier, not the stale one the entry recorded.
    EXPECT_EQ(link->hardlinkDestinationID(), "2");
    EXPECT_EQ(file->extendedACL()->macExtendedText(), kMacACL);
    EXPECT_EQ(file->extendedAttributes()[0]->uncompressedChecksum(), GWData{});
    GWNonKeyedCoder nonKeyed;
    EXPECT_EQ(GWXARFile::initWithCoder(nonKeyed), nullptr);

    // A copy is deep, but its children still name the source as their parent.
    SampleTree source;
    auto copy = source.directory->copy();
    auto copied = copy->children()[0];
    EXPECT_EQ(copied->parent(), source.directory);
    EXPECT_EQ(fields(*copied), fields(*source.file));
    EXPECT_EQ(copy->children()[1]->hardlinkDestinationID(), "stale");
    EXPECT_NE(copied->accessACL()->handle(), source.file->accessACL()->handle());
    EXPECT_NE(copied->extendedAttributes()[0], source.file->extendedAttributes()[0]);
    source.file->dataFork()->setOffset(1);
    EXPECT_EQ(copied->dataFork()->offset(), 0x1cu);
}

// A linked pair, a nested file, and a subdocument, with a checksum that fails.
GWXARArchivePtr loadedArchive(const gwtest::TemporaryDirectory& directory) {
    gwtest::XarBuilder builder;
    builder.corruptStoredChecksum = true;
    builder.setTOCDocument(
        "<xar><subdoc subdoc_name=\"info\"><about kind=\"test\">text</about></subdoc><toc>"
        "<checksum style=\"sha1\"><offset>0</offset><size>20</size></checksum>"
        "<file id=\"1\"><name>dir</name><type>directory</type>"
        "<file id=\"2\"><name>original</name><type>file</type></file></file>"
        "<file id=\"3\"><name>link</name><type link=\"2\">hardlink</type></file>"
        "</toc></xar>");
    gwtest::writeFile(directory.file("a.xar"), builder.bytes());
    GWErrorPtr error;
    auto archive = GWXARArchive::initWithURL(directory.url("a.xar"), false, &error);
    EXPECT_TRUE(archive) << (error ? error->localizedDescription() : "");
    return archive;
}

std::string xmlText(const std::shared_ptr<pugi::xml_document>& document) {
    std::ostringstream stream;
    document->save(stream, "", pugi::format_raw | pugi::format_no_declaration);
    return stream.str();
}

// Decoded or copied, an archive keeps its values and its own linked tree; a
// decoded one has no queue and is not cancelled, a copy gets a queue of its own.
TEST(GWXARArchiveCoding, RoundTripAndCopyRestoreEverythingButTheQueue) {
    gwtest::TemporaryDirectory directory;
    const GWXARArchivePtr source = loadedArchive(directory);
    ASSERT_TRUE(source);
    source->setChecksumValidationError(GWCocoaError(GWFileReadCorruptFileError));
    source->setPrivateSignatureIsValid(true);
    GWErrorPtr error;
    auto decoded = GWKeyedUnarchiver::unarchiveObjectWithData<GWXARArchive>(
        GWKeyedArchiver::archivedDataWithRootObject(*source, &error), &error);
    ASSERT_TRUE(decoded) << (error ? error->localizedDescription() : "");
    source->setIsCancelled(true);
    auto copy = source->copy();
    for (const auto& other : {decoded, copy}) {
        SCOPED_TRACE(other == copy ? "copy" : "decoded");
        EXPECT_EQ(other->URL(), source->URL());
        EXPECT_EQ(gwtest::namesOf(other->files()), gwtest::namesOf(source->files()));
        EXPECT_NE(other->files()[0], source->files()[0]);
        EXPECT_EQ(other->tocChecksum(), source->tocChecksum());
        EXPECT_EQ(other->tocChecksum().size(), 20u);
        EXPECT_FALSE(other->checksumIsValid());
        EXPECT_TRUE(other->privateSignatureIsValid());
        EXPECT_FALSE(other->signatureIsValid());  // the checksum still fails
        ASSERT_TRUE(other->checksumValidationError());
        EXPECT_TRUE(other->checksumValidationError()->is(kGWCocoaErrorDomain, 259));
        // Without an error of its own, the signature reports the checksum's.
        EXPECT_EQ(other->signatureValidationError(), other->checksumValidationError());
        EXPECT_EQ(xmlText(other->subdocuments().at("info")),
                  xmlText(source->subdocuments().at("info")));
        auto link = other->fileWithPath("link");
        auto original = other->fileWithPath("dir/original");
        ASSERT_TRUE(link && original);
        EXPECT_EQ(link->hardlinkDestination(), original);
        EXPECT_EQ(link->archive(), other);
        EXPECT_EQ(original->archive(), other);
    }
    // A copy's children still name the source's entries as their parents.
    EXPECT_EQ(decoded->fileWithPath("dir/original")->parent(), decoded->fileWithPath("dir"));
    EXPECT_FALSE(decoded->operationQueue());
    EXPECT_FALSE(decoded->isCancelled());
    EXPECT_TRUE(copy->operationQueue());
    EXPECT_NE(copy->operationQueue(), source->operationQueue());
    EXPECT_NE(copy->ref(), source->ref());
    source->setPrivateSignatureValidationError(GWCocoaError(GWFileReadUnknownError));
    EXPECT_EQ(source->copy()->privateSignatureValidationError(),
              source->privateSignatureValidationError());
    // Subdocuments are the copy's own.
    copy->subdocuments().at("info")->document_element().set_name("changed");
    EXPECT_STREQ(source->subdocuments().at("info")->document_element().name(), "about");

    auto empty = GWKeyedUnarchiver::unarchiveObjectWithData<GWXARArchive>(
        GWKeyedArchiver::archivedDataWithRootObject(*GWXARArchive::init()));
    ASSERT_TRUE(empty);
    EXPECT_TRUE(empty->files().empty() && empty->tocChecksum().empty());
    GWNonKeyedCoder nonKeyed;
    EXPECT_FALSE(GWXARArchive::initWithCoder(nonKeyed));
}

}  // namespace
