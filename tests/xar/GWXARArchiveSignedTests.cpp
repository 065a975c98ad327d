// Signed archives opened whole: the verdicts the archive publishes, and the
// signatures it keeps through persistence and copying.

#include <gtest/gtest.h>

#include <chrono>
#include <condition_variable>
#include <mutex>
#include <optional>

#include "GWArchiveSupport/GWArchiveConstants.h"
#include "XarSignatureTestSupport.h"
#include "XarTestSupport.h"
#include "support/CoderTestSupport.h"
#include "support/XarSigning.h"
#include "xar/GWXARArchive.h"
#include "xar/GWXARTrust.h"

namespace {

#ifdef GW_SANITIZED
constexpr int kSanitizerFactor = 3;
#else
constexpr int kSanitizerFactor = 1;
#endif

using gwtest::XarKeyType;
using gwtest::XarSigning;

const std::string kFiles =
    "<file id=\"1\"><name>dir</name><type>directory</type>"
    "<file id=\"2\"><name>inner</name><type>file</type></file></file>";

std::string fileText(const std::string& path) {
    const GWData bytes = gwtest::readFile(path);
    return std::string(bytes.begin(), bytes.end());
}

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

// Who signs, and what becomes of the archive afterwards.
enum class Signer { rsa, dsa, ecdsa, expired, issuedByLeaf, selfSigned, publicRoot };
enum class Change { none, withoutIntermediate, withoutSigners, tamperedTOC, tamperedChecksum };

struct VerdictCase {
    const char* name;
    Signer signer;
    const char* style;
    Change change;
    // With the test root added as an anchor, then with the system's roots alone.
    GWXARSignatureVerdict withAnchor;
    const char* reason;
    std::vector<std::string> chain;
    GWXARSignatureVerdict withoutAnchor;
    const char* reasonWithoutAnchor;
};

const std::string kRSA = "GW Test RSA Signer";
const std::string kIntermediate = "GW Test Intermediate CA";
const std::string kRoot = "GW Test Root CA";
const char* const kMismatch = "the signature does not match the checksum";

const VerdictCase kVerdictCases[] = {
    {"RSA",
     Signer::rsa,
     "RSA",
     Change::none,
     GWXARSignatureVerdictValid,
     "",
     {kRSA, kIntermediate, kRoot},
     GWXARSignatureVerdictUntrusted,
     "unknown issuer"},
    {"DSA",
     Signer::dsa,
     "SHA1withDSA",
     Change::none,
     GWXARSignatureVerdictValid,
     "",
     {"GW Test DSA Signer", kIntermediate, kRoot},
     GWXARSignatureVerdictUntrusted,
     "unknown issuer"},
    {"ECDSA",
     Signer::ecdsa,
     "ECDSA",
     Change::none,
     GWXARSignatureVerdictValid,
     "",
     {"GW Test ECDSA Signer", kIntermediate, kRoot},
     GWXARSignatureVerdictUntrusted,
     "unknown issuer"},
    {"CMS",
     Signer::rsa,
     "CMS",
     Change::none,
     GWXARSignatureVerdictValid,
     "",
     {kRSA, kIntermediate, kRoot},
     GWXARSignatureVerdictUntrusted,
     "unknown issuer"},
    {"ExpiredLeaf",
     Signer::expired,
     "ECDSA",
     Change::none,
     GWXARSignatureVerdictUntrusted,
     "expired",
     {"GW Test Expired Signer"},
     GWXARSignatureVerdictUntrusted,
     "unknown issuer"},
    {"ExpiredCMSSigner",
     Signer::expired,
     "CMS",
     Change::none,
     GWXARSignatureVerdictUntrusted,
     "expired",
     {"GW Test Expired Signer"},
     GWXARSignatureVerdictUntrusted,
     "unknown issuer"},
    {"LeafUsedAsCA",
     Signer::issuedByLeaf,
     "ECDSA",
     Change::none,
     GWXARSignatureVerdictUntrusted,
     "not a CA",
     {"GW Test Leaf-Issued Signer", kRSA},
     GWXARSignatureVerdictUntrusted,
     "unknown issuer"},
    {"MissingIntermediate",
     Signer::rsa,
     "RSA",
     Change::withoutIntermediate,
     GWXARSignatureVerdictUntrusted,
     "unknown issuer",
     {kRSA},
     GWXARSignatureVerdictUntrusted,
     "unknown issuer"},
    {"SelfSigned",
     Signer::selfSigned,
     "RSA",
     Change::none,
     GWXARSignatureVerdictUntrusted,
     "unknown issuer",
     {"GW Test SelfSigned Signer"},
     GWXARSignatureVerdictUntrusted,
     "unknown issuer"},
    // Without signers a message vouches for nothing, whatever certificates ride along.
    {"CMSWithoutSigners",
     Signer::rsa,
     "CMS",
     Change::withoutSigners,
     GWXARSignatureVerdictInvalid,
     "no signers",
     {},
     GWXARSignatureVerdictInvalid,
     "no signers"},
    // The forgery that needed no key: a root every Debian system trusts, and no signer.
    {"CMSWithoutSignersUnderAPublicRoot",
     Signer::publicRoot,
     "CMS",
     Change::withoutSigners,
     GWXARSignatureVerdictInvalid,
     "no signers",
     {},
     GWXARSignatureVerdictInvalid,
     "no signers"},
    {"TamperedTOC",
     Signer::rsa,
     "RSA",
     Change::tamperedTOC,
     GWXARSignatureVerdictInvalid,
     kMismatch,
     {},
     GWXARSignatureVerdictInvalid,
     kMismatch},
    {"TamperedCMSTOC",
     Signer::ecdsa,
     "CMS",
     Change::tamperedTOC,
     GWXARSignatureVerdictInvalid,
     "a signer's signature does not match the checksum",
     {},
     GWXARSignatureVerdictInvalid,
     "a signer's signature does not match the checksum"},
    {"TamperedChecksum",
     Signer::rsa,
     "RSA",
     Change::tamperedChecksum,
     GWXARSignatureVerdictInvalid,
     "the checksum does not match the table of contents",
     {kRSA, kIntermediate, kRoot},
     GWXARSignatureVerdictInvalid,
     "the checksum does not match the table of contents"},
};

class GWXARArchiveVerdict : public GWXARArchiveSigned,
                            public ::testing::WithParamInterface<VerdictCase> {
protected:
    static const gwtest::XarSigningIdentity& identityOf(Signer signer) {
        switch (signer) {
            case Signer::rsa: return signing().leaf(XarKeyType::rsa);
            case Signer::dsa: return signing().leaf(XarKeyType::dsa);
            case Signer::ecdsa: return signing().leaf(XarKeyType::ecdsa);
            case Signer::expired: return signing().expiredLeaf();
            case Signer::issuedByLeaf: return signing().leafIssuedByLeaf();
            case Signer::publicRoot: return publicRoot();
            case Signer::selfSigned: break;
        }
        return signing().selfSignedLeaf();
    }

    // The first root of the system's bundle as an identity without a key; empty without a bundle.
    static const gwtest::XarSigningIdentity& publicRoot() {
        static gwtest::TemporaryDirectory folder;
        static gwtest::XarSigningIdentity root = [] {
            gwtest::XarSigningIdentity identity;
            const std::string pem = folder.file("root.pem");
            const std::string der = folder.file("root.der");
            const std::string bundle = "/etc/ssl/certs/ca-certificates.crt";
            if (gwtest::runCommand("openssl x509 -in " + bundle + " -out " + pem +
                                   " && openssl "
                                   "x509 -in " +
                                   pem + " -outform DER -out " + der)
                    .status == 0) {
                identity.certificateFile = pem;
                identity.chain = {gwtest::readFile(der)};
            }
            return identity;
        }();
        return root;
    }
};

TEST_P(GWXARArchiveVerdict, IsGivenWithItsReasonAndChain) {
    const VerdictCase& test = GetParam();
    const auto& identity = identityOf(test.signer);
    ASSERT_TRUE(signing().ok()) << signing().problem();
    if (identity.chain.empty()) {
        GTEST_SKIP() << "no system certificate bundle";
    }
    XarSigning::Request request(test.style, identity);
    request.withoutSigners = test.change == Change::withoutSigners;
    if (test.change == Change::withoutIntermediate) {
        request.certificates = std::vector<GWData>{identity.chain.front()};
    }
    gwtest::XarBuilder builder;
    builder.corruptStoredChecksum = test.change == Change::tamperedChecksum;
    builder.setFiles(kFiles);
    ASSERT_TRUE(signing().signArchive(builder, {request})) << signing().problem();
    if (test.change == Change::tamperedTOC) {
        // The checksum is made anew for the changed table of contents; the signature is not.
        builder.setFiles(builder.files() + "<file id=\"9\"><name>added</name></file>");
    }
    gwtest::writeFile(directory_.file("signed.xar"), builder.bytes());

    GWErrorPtr error;
    auto anchor =
        GWXARTrust::trustWithAnchorsPEM(fileText(signing().rootCertificateFile()), &error);
    ASSERT_TRUE(anchor) << describe(error);
    EXPECT_EQ(anchor->addedAnchorCount(), 1u);
    for (const bool added : {true, false}) {
        SCOPED_TRACE(added ? "with the anchor" : "without the anchor");
        const GWXARTrustPtr trust = added ? anchor : nullptr;
        auto archive =
            GWXARArchive::initWithURL(directory_.url("signed.xar"), false, trust, &error);
        ASSERT_TRUE(archive) << describe(error);
        const GWXARSignatureVerdict verdict = added ? test.withAnchor : test.withoutAnchor;
        EXPECT_EQ(archive->signatureVerdict(), verdict);
        EXPECT_EQ(archive->signatureVerdictReason(),
                  added ? test.reason : test.reasonWithoutAnchor);
        EXPECT_EQ(archive->signatureIsValid(), verdict == GWXARSignatureVerdictValid);
        const GWXARSignatureArray signatures = archive->signatures();
        ASSERT_EQ(signatures.size(), 1u);
        if (added) {
            EXPECT_EQ(signatures[0]->chainCommonNames(), test.chain);
        }
        // The flag keeps its meaning: only a valid signature opens a checked archive.
        auto checked = GWXARArchive::initWithURL(directory_.url("signed.xar"), true, trust, &error);
        EXPECT_EQ(bool(checked), verdict == GWXARSignatureVerdictValid) << describe(error);
        if (!checked) {
            const long code = test.change == Change::tamperedChecksum   ? 5
                              : verdict == GWXARSignatureVerdictInvalid ? 6
                                                                        : 7;
            EXPECT_TRUE(error && (error->is(kGWXARArchiveErrorDomain, code) ||
                                  error->domain() == GWSecurityErrorDomain))
                << describe(error);
        }
    }
}

INSTANTIATE_TEST_SUITE_P(Signatures, GWXARArchiveVerdict, ::testing::ValuesIn(kVerdictCases),
                         [](const auto& info) { return std::string(info.param.name); });

TEST_F(GWXARArchiveSigned, ThreeHundredSignaturesOpenQuickly) {
    const auto& identity = signing().leaf(XarKeyType::rsa);
    gwtest::XarBuilder builder;
    builder.setFiles(kFiles);
    ASSERT_TRUE(signing().signArchive(
        builder, std::vector<XarSigning::Request>(300, XarSigning::Request("RSA", identity))))
        << signing().problem();
    gwtest::writeFile(directory_.file("signed.xar"), builder.bytes());
    const std::string root = fileText(signing().rootCertificateFile());

    // The system's bundle is read once, not once per signature.
    const auto start = std::chrono::steady_clock::now();
    GWErrorPtr error;
    auto archive = GWXARArchive::initWithURL(directory_.url("signed.xar"), true,
                                             GWXARTrust::trustWithAnchorsPEM(root, &error), &error);
    const auto elapsed = std::chrono::steady_clock::now() - start;
    ASSERT_TRUE(archive) << describe(error);
    EXPECT_EQ(archive->signatures().size(), 300u);
    RecordProperty("openMilliseconds",
                   int(std::chrono::duration_cast<std::chrono::milliseconds>(elapsed).count()));
    EXPECT_LT(elapsed, std::chrono::milliseconds(500 * kSanitizerFactor));
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
        // The verdict and the chain as evaluated are kept, not evaluated again.
        EXPECT_EQ(other->signatureVerdict(), GWXARSignatureVerdictValid);
        EXPECT_EQ(signature->verdict(), GWXARSignatureVerdictValid);
        EXPECT_EQ(signature->chainCommonNames(), original->chainCommonNames());
        EXPECT_EQ(signature->chainCommonNames().size(), 3u);
    }
}

}  // namespace
