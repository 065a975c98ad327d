// Signed archives opened whole: the verdicts the archive publishes, and the
// signatures it keeps through persistence and copying.

#include <gtest/gtest.h>

#include <condition_variable>
#include <mutex>
#include <optional>

#include "GWArchiveSupport/GWArchiveConstants.h"
#include "XarSignatureTestSupport.h"
#include "XarTestSupport.h"
#include "support/CoderTestSupport.h"
#include "support/XarSigning.h"
#include "xar/GWXARArchive.h"

namespace {

using gwtest::XarKeyType;
using gwtest::XarSigning;

const std::string kFiles =
    "<file id=\"1\"><name>dir</name><type>directory</type>"
    "<file id=\"2\"><name>inner</name><type>file</type></file></file>";

std::string describe(const GWErrorPtr& error) {
    return error ? error->domain() + " " + std::to_string(error->code()) + ": " +
                       error->localizedDescription()
                 : "no error";
}

class GWXARArchiveSigned : public ::testing::Test {
protected:
    void SetUp() override { ASSERT_TRUE(signing().ok()) << signing().problem(); }

    static XarSigning& signing() { return gwtest::sharedSigning(); }

    // An archive signed once in `style` by `identity`, written to the directory.
    GWURL signedArchive(const std::string& style, const gwtest::XarSigningIdentity& identity,
                        bool corruptChecksum = false) {
        gwtest::XarBuilder builder;
        builder.corruptStoredChecksum = corruptChecksum;
        builder.setFiles(kFiles);
        EXPECT_TRUE(signing().signArchive(builder, {{style, identity}}));
        bytes_ = builder.bytes();
        gwtest::writeFile(directory_.file("signed.xar"), bytes_);
        return directory_.url("signed.xar");
    }

    // The same archive with one byte of its signature flipped.
    GWURL withDamagedSignature() {
        auto toc = gwtest::readXarTOC(bytes_);
        EXPECT_TRUE(toc);
        const pugi::xml_node signature = toc->toc().child("signature");
        const std::size_t offset =
            std::size_t(toc->heapStart) + std::size_t(std::stoull(signature.child_value("offset")));
        const std::size_t size = std::size_t(std::stoull(signature.child_value("size")));
        GWData damaged = bytes_;
        damaged.at(offset + size / 2) ^= 0x10;
        gwtest::writeFile(directory_.file("damaged.xar"), damaged);
        return directory_.url("damaged.xar");
    }

    gwtest::TemporaryDirectory directory_;
    GWData bytes_;
};

TEST_F(GWXARArchiveSigned, TrustedSignaturesOfEveryKindAreValid) {
    gwtest::TrustedRootScope trust(signing().rootCertificateFile());
    const std::pair<std::string, XarKeyType> cases[] = {
        {"RSA", XarKeyType::rsa}, {"ECDSA", XarKeyType::ecdsa}, {"CMS", XarKeyType::rsa}};
    for (const auto& [style, type] : cases) {
        SCOPED_TRACE(style);
        const auto& identity = signing().leaf(type);
        GWErrorPtr error;
        auto archive = GWXARArchive::initWithURL(signedArchive(style, identity), true, &error);
        ASSERT_TRUE(archive) << describe(error);
        EXPECT_TRUE(archive->checksumIsValid());
        EXPECT_TRUE(archive->signatureIsValid());
        EXPECT_FALSE(archive->signatureValidationError());
        const GWXARSignatureArray signatures = archive->signatures();
        ASSERT_EQ(signatures.size(), 1u);
        // The chain as the table of contents lists it, leaf first.
        EXPECT_EQ(signatures[0]->certificateCommonNames(), identity.commonNames);
        EXPECT_GE(identity.commonNames.size(), 2u);
        EXPECT_EQ(gwtest::namesOf(archive->files()), (std::vector<std::string>{"dir"}));
    }
}

TEST_F(GWXARArchiveSigned, ADamagedSignatureFailsACheckedOpen) {
    gwtest::TrustedRootScope trust(signing().rootCertificateFile());
    signedArchive("RSA", signing().leaf(XarKeyType::rsa));
    const GWURL damaged = withDamagedSignature();

    GWErrorPtr error;
    EXPECT_FALSE(GWXARArchive::initWithURL(damaged, true, &error));
    ASSERT_TRUE(error);
    EXPECT_TRUE(error->is(kGWXARArchiveErrorDomain, 6)) << describe(error);

    error = nullptr;
    auto lenient = GWXARArchive::initWithURL(damaged, false, &error);
    ASSERT_TRUE(lenient) << describe(error);
    EXPECT_TRUE(lenient->checksumIsValid());
    EXPECT_FALSE(lenient->signatureIsValid());
    ASSERT_TRUE(lenient->signatureValidationError());
    EXPECT_TRUE(lenient->signatureValidationError()->is(kGWXARArchiveErrorDomain, 6));
    EXPECT_EQ(lenient->signatures().size(), 1u);
}

TEST_F(GWXARArchiveSigned, AnUntrustedChainIsReportedNotTrusted) {
    // A leaf that signed its own certificate: no trusted root vouches for it.
    gwtest::TrustedRootScope trust(signing().rootCertificateFile());
    const GWURL url = signedArchive("RSA", signing().selfSignedLeaf());
    GWErrorPtr error;
    EXPECT_FALSE(GWXARArchive::initWithURL(url, true, &error));
    ASSERT_TRUE(error);
    EXPECT_TRUE(error->is(kGWXARArchiveErrorDomain, 7)) << describe(error);

    auto lenient = GWXARArchive::initWithURL(url, false, &error);
    ASSERT_TRUE(lenient);
    EXPECT_FALSE(lenient->signatureIsValid());
    ASSERT_TRUE(lenient->signatureValidationError());
    EXPECT_TRUE(lenient->signatureValidationError()->is(kGWXARArchiveErrorDomain, 7));
}

TEST_F(GWXARArchiveSigned, AValidSignatureCountsOnlyWithAValidChecksum) {
    gwtest::TrustedRootScope trust(signing().rootCertificateFile());
    const GWURL url = signedArchive("RSA", signing().leaf(XarKeyType::rsa), true);
    GWErrorPtr error;
    auto archive = GWXARArchive::initWithURL(url, false, &error);
    ASSERT_TRUE(archive) << describe(error);
    EXPECT_FALSE(archive->checksumIsValid());
    // The signature signs the checksum computed from the stored bytes, which holds.
    EXPECT_TRUE(archive->privateSignatureIsValid());
    EXPECT_FALSE(archive->signatureIsValid());
    archive->setChecksumIsValid(true);
    EXPECT_TRUE(archive->signatureIsValid());

    EXPECT_FALSE(GWXARArchive::initWithURL(url, true, &error));
    ASSERT_TRUE(error);
    EXPECT_TRUE(error->is(kGWXARArchiveErrorDomain, 5)) << describe(error);
}

TEST_F(GWXARArchiveSigned, TheAsynchronousOpenReportsAValidSignature) {
    gwtest::TrustedRootScope trust(signing().rootCertificateFile());
    const GWURL url = signedArchive("RSA", signing().leaf(XarKeyType::rsa));
    std::mutex mutex;
    std::condition_variable condition;
    std::optional<std::pair<bool, GWErrorPtr>> result;
    auto archive = GWXARArchive::initWithURL(url, true, nullptr, nullptr,
                                             [&](bool invalid, const GWErrorPtr& error) {
                                                 std::lock_guard<std::mutex> lock(mutex);
                                                 result.emplace(invalid, error);
                                                 condition.notify_all();
                                             });
    ASSERT_TRUE(archive);
    std::unique_lock<std::mutex> lock(mutex);
    ASSERT_TRUE(condition.wait_for(lock, std::chrono::seconds(30), [&] { return bool(result); }));
    EXPECT_FALSE(result->first);
    EXPECT_FALSE(result->second) << describe(result->second);
    EXPECT_TRUE(archive->signatureIsValid());
    EXPECT_EQ(archive->signatures().size(), 1u);
}

TEST_F(GWXARArchiveSigned, SignaturesSurvivePersistenceAndCopying) {
    gwtest::TrustedRootScope trust(signing().rootCertificateFile());
    const auto& identity = signing().leaf(XarKeyType::rsa);
    GWErrorPtr error;
    auto archive = GWXARArchive::initWithURL(signedArchive("CMS", identity), true, &error);
    ASSERT_TRUE(archive) << describe(error);
    const auto original = archive->signatures().at(0);

    gwtest::RecordingCoder keys(true);
    archive->encodeWithCoder(keys);
    EXPECT_EQ(keys.keys,
              (std::vector<std::string>{"GWRef", "Files", "TOCChecksum", "ChecksumIsValid",
                                        "Signatures", "SignatureIsValid"}));

    auto decoded = GWKeyedUnarchiver::unarchiveObjectWithData<GWXARArchive>(
        GWKeyedArchiver::archivedDataWithRootObject(*archive, &error), &error);
    ASSERT_TRUE(decoded) << describe(error);
    auto copy = archive->copy();
    for (const auto& other : {decoded, copy}) {
        EXPECT_TRUE(other->signatureIsValid());
        const GWXARSignatureArray signatures = other->signatures();
        ASSERT_EQ(signatures.size(), 1u);
        const GWXARSignaturePtr& signature = signatures[0];
        EXPECT_NE(signature, original);
        EXPECT_EQ(signature->type(), original->type());
        EXPECT_EQ(signature->signatureData(), original->signatureData());
        EXPECT_EQ(signature->certificateCommonNames(), identity.commonNames);
    }
}

}  // namespace
