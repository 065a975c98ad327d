// The archive's text form, keyed persistence and copying.

#include <gtest/gtest.h>

#include <sstream>

#include "XarTestSupport.h"
#include "foundation/GWFormat.h"
#include "support/CoderTestSupport.h"
#include "support/TestSupport.h"
#include "support/XarBuilder.h"
#include "xar/GWXARArchive.h"

namespace {

// A linked pair, a nested file, and a subdocument, with a checksum that fails.
struct LoadedArchive {
    gwtest::TemporaryDirectory directory;
    GWXARArchivePtr archive;

    LoadedArchive() {
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
        archive = GWXARArchive::initWithURL(directory.url("a.xar"), false, &error);
        EXPECT_TRUE(archive) << (error ? error->localizedDescription() : "");
    }
};

std::string xmlText(const std::shared_ptr<pugi::xml_document>& document) {
    std::ostringstream stream;
    document->save(stream, "", pugi::format_raw | pugi::format_no_declaration);
    return stream.str();
}

void expectLinkedWithin(const GWXARArchivePtr& archive) {
    auto link = archive->fileWithPath("link");
    auto original = archive->fileWithPath("dir/original");
    ASSERT_TRUE(link && original);
    EXPECT_EQ(link->hardlinkDestination(), original);
    EXPECT_EQ(link->type(), GWXARFileTypeHardLink);
    EXPECT_EQ(link->archive(), archive);
    EXPECT_EQ(original->archive(), archive);
}

TEST(GWXARArchiveText, DescriptionIndentsEachTopLevelEntry) {
    LoadedArchive loaded;
    ASSERT_TRUE(loaded.archive);
    const GWXARFileArray files = loaded.archive->files();
    ASSERT_EQ(files.size(), 2u);
    auto indent = [](const std::string& text) {
        std::string out;
        for (char c : text) {
            out += c;
            if (c == '\n') {
                out += '\t';
            }
        }
        return out;
    };
    const std::string expected =
        GWFormat("<GWXARArchive %p files={", static_cast<const void*>(loaded.archive.get())) +
        "\n\t" + indent(files[0]->description()) + ",\n\t" + indent(files[1]->description()) +
        "\n}>";
    EXPECT_EQ(loaded.archive->description(), expected);

    auto empty = GWXARArchive::init();
    EXPECT_EQ(empty->description(),
              GWFormat("<GWXARArchive %p files={\n}>", static_cast<const void*>(empty.get())));
}

TEST(GWXARArchiveCoding, WritesItsKeysInOrderAndNothingWithoutKeys) {
    LoadedArchive loaded;
    ASSERT_TRUE(loaded.archive);
    loaded.archive->setChecksumValidationError(GWCocoaError(GWFileReadCorruptFileError));
    loaded.archive->setSignatureValidationError(GWCocoaError(GWFileReadUnknownError));
    gwtest::RecordingCoder keyed(true);
    loaded.archive->encodeWithCoder(keyed);
    EXPECT_EQ(keyed.keys,
              (std::vector<std::string>{"GWRef", "Files", "Subdocuments", "TOCChecksum",
                                        "ChecksumIsValid", "ChecksumValidationError", "Signatures",
                                        "SignatureIsValid", "SignatureValidationError"}));
    EXPECT_EQ(*keyed.values["Subdocuments"].dictionary()->at("info").string(),
              "<about kind=\"test\">text</about>");

    gwtest::WriteCountingCoder plain;
    loaded.archive->encodeWithCoder(plain);
    EXPECT_EQ(plain.writes, 0);
    GWNonKeyedCoder nonKeyed;
    EXPECT_FALSE(GWXARArchive::initWithCoder(nonKeyed));
}

TEST(GWXARArchiveCoding, KeyedRoundTripRestoresEverythingButTheQueue) {
    LoadedArchive loaded;
    ASSERT_TRUE(loaded.archive);
    const GWXARArchivePtr& source = loaded.archive;
    source->setChecksumValidationError(GWCocoaError(GWFileReadCorruptFileError));
    source->setPrivateSignatureIsValid(true);
    source->setIsCancelled(true);

    GWErrorPtr error;
    const GWData data = GWKeyedArchiver::archivedDataWithRootObject(*source, &error);
    ASSERT_FALSE(data.empty()) << (error ? error->localizedDescription() : "");
    auto decoded = GWKeyedUnarchiver::unarchiveObjectWithData<GWXARArchive>(data, &error);
    ASSERT_TRUE(decoded) << (error ? error->localizedDescription() : "");

    EXPECT_EQ(decoded->URL(), source->URL());
    EXPECT_EQ(gwtest::namesOf(decoded->files()), gwtest::namesOf(source->files()));
    EXPECT_EQ(gwtest::namesOf(decoded->fileWithPath("dir")->children()),
              (std::vector<std::string>{"original"}));
    EXPECT_EQ(decoded->tocChecksum(), source->tocChecksum());
    EXPECT_EQ(decoded->tocChecksum().size(), 20u);
    EXPECT_FALSE(decoded->checksumIsValid());
    EXPECT_TRUE(decoded->privateSignatureIsValid());
    EXPECT_FALSE(decoded->signatureIsValid());  // the checksum still fails
    ASSERT_TRUE(decoded->checksumValidationError());
    EXPECT_TRUE(decoded->checksumValidationError()->is(kGWCocoaErrorDomain, 259));
    EXPECT_FALSE(decoded->privateSignatureValidationError());
    // Without an error of its own, the signature reports the checksum's.
    EXPECT_EQ(decoded->signatureValidationError(), decoded->checksumValidationError());
    ASSERT_EQ(decoded->subdocuments().size(), 1u);
    EXPECT_EQ(xmlText(decoded->subdocuments().at("info")),
              xmlText(source->subdocuments().at("info")));
    EXPECT_FALSE(decoded->operationQueue());
    EXPECT_FALSE(decoded->isCancelled());
    expectLinkedWithin(decoded);
    EXPECT_EQ(decoded->fileWithPath("dir/original")->parent(), decoded->fileWithPath("dir"));
}

TEST(GWXARArchiveCoding, AnEmptyArchiveRoundTrips) {
    auto empty = GWXARArchive::init();
    auto decoded = GWKeyedUnarchiver::unarchiveObjectWithData<GWXARArchive>(
        GWKeyedArchiver::archivedDataWithRootObject(*empty));
    ASSERT_TRUE(decoded);
    EXPECT_FALSE(decoded->ref());
    EXPECT_TRUE(decoded->files().empty());
    EXPECT_TRUE(decoded->subdocuments().empty());
    EXPECT_TRUE(decoded->tocChecksum().empty());
}

TEST(GWXARArchiveCopy, IsDeepAndLinkedWithinItself) {
    LoadedArchive loaded;
    ASSERT_TRUE(loaded.archive);
    const GWXARArchivePtr& source = loaded.archive;
    source->setPrivateSignatureValidationError(GWCocoaError(GWFileReadUnknownError));
    auto copy = source->copy();

    EXPECT_TRUE(copy->operationQueue());
    EXPECT_NE(copy->operationQueue(), source->operationQueue());
    EXPECT_EQ(copy->URL(), source->URL());
    EXPECT_NE(copy->ref(), source->ref());
    EXPECT_EQ(copy->tocChecksum(), source->tocChecksum());
    EXPECT_EQ(copy->checksumIsValid(), source->checksumIsValid());
    EXPECT_EQ(copy->privateSignatureValidationError(), source->privateSignatureValidationError());
    EXPECT_EQ(gwtest::namesOf(copy->files()), gwtest::namesOf(source->files()));
    EXPECT_NE(copy->files()[0], source->files()[0]);
    expectLinkedWithin(copy);
    expectLinkedWithin(source);
    // Intended: copied children keep the source entry as their parent.
    EXPECT_EQ(copy->fileWithPath("dir/original")->parent(), source->fileWithPath("dir"));

    // Subdocuments are the copy's own.
    auto document = copy->subdocuments().at("info");
    document->document_element().set_name("changed");
    EXPECT_STREQ(source->subdocuments().at("info")->document_element().name(), "about");
}

}  // namespace
