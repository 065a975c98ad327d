// Signed archives opened whole: the verdicts the archive publishes, and the
// signatures it keeps through persistence and copying.

#include <gtest/gtest.h>

#include <optional>

#include "GWArchiveSupport/GWArchiveConstants.h"
#include "GWArchiveSupport/GWXARSignature.h"
#include "XarSignatureTestSupport.h"
#include "XarTestSupport.h"
#include "support/XarSigning.h"
#include "xar/GWXARArchive.h"
#include "xar/GWXARTrust.h"

namespace {

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
    GWURL signedArchive(const std::string& style, const gwtest::XarSigningIdentity& identity) {
        gwtest::XarBuilder builder;
        builder.setFiles(kFiles);
        EXPECT_TRUE(signing().signArchive(builder, {{style, identity}}));
        gwtest::writeFile(directory_.file("signed.xar"), builder.bytes());
        return directory_.url("signed.xar");
    }

    gwtest::TemporaryDirectory directory_;
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
    GWXARSignatureVerdict withoutAnchor = GWXARSignatureVerdictUntrusted;
    const char* reasonWithoutAnchor = "unknown issuer";
};

const char *const kRSA = "GW Test RSA Signer", *const kCA = "GW Test Intermediate CA",
                  *const kRoot = "GW Test Root CA",
                  *const kMismatch = "the signature does not match the checksum",
                  *const kCMSMismatch = "a signer's signature does not match the checksum",
                  *const kBadChecksum = "the checksum does not match the table of contents";
const auto kValid = GWXARSignatureVerdictValid, kUntrusted = GWXARSignatureVerdictUntrusted,
           kInvalid = GWXARSignatureVerdictInvalid;
using Chain = std::vector<std::string>;

// Without an anchor every signature that matches is untrusted: its issuer is unknown.
const VerdictCase kVerdictCases[] = {
    {"RSA", Signer::rsa, "RSA", Change::none, kValid, "", Chain{kRSA, kCA, kRoot}},
    {"DSA", Signer::dsa, "SHA1withDSA", Change::none, kValid, "",
     Chain{"GW Test DSA Signer", kCA, kRoot}},
    {"ECDSA", Signer::ecdsa, "ECDSA", Change::none, kValid, "",
     Chain{"GW Test ECDSA Signer", kCA, kRoot}},
    {"CMS", Signer::rsa, "CMS", Change::none, kValid, "", Chain{kRSA, kCA, kRoot}},
    {"ExpiredLeaf", Signer::expired, "ECDSA", Change::none, kUntrusted, "expired",
     Chain{"GW Test Expired Signer"}},
    {"ExpiredCMSSigner", Signer::expired, "CMS", Change::none, kUntrusted, "expired",
     Chain{"GW Test Expired Signer"}},
    {"LeafUsedAsCA", Signer::issuedByLeaf, "ECDSA", Change::none, kUntrusted, "not a CA",
     Chain{"GW Test Leaf-Issued Signer", kRSA}},
    {"MissingIntermediate", Signer::rsa, "RSA", Change::withoutIntermediate, kUntrusted,
     "unknown issuer", Chain{kRSA}},
    {"SelfSigned", Signer::selfSigned, "RSA", Change::none, kUntrusted, "unknown issuer",
     Chain{"GW Test SelfSigned Signer"}},
    // Without signers a message vouches for nothing, whatever certificates ride along.
    {"CMSWithoutSigners", Signer::rsa, "CMS", Change::withoutSigners, kInvalid, "no signers",
     Chain{}, kInvalid, "no signers"},
    // The forgery that needed no key: a root every Debian system trusts, and no signer.
    {"CMSWithoutSignersUnderAPublicRoot", Signer::publicRoot, "CMS", Change::withoutSigners,
     kInvalid, "no signers", Chain{}, kInvalid, "no signers"},
    {"TamperedTOC", Signer::rsa, "RSA", Change::tamperedTOC, kInvalid, kMismatch, Chain{}, kInvalid,
     kMismatch},
    {"TamperedCMSTOC", Signer::ecdsa, "CMS", Change::tamperedTOC, kInvalid, kCMSMismatch, Chain{},
     kInvalid, kCMSMismatch},
    {"TamperedChecksum", Signer::rsa, "RSA", Change::tamperedChecksum, kInvalid, kBadChecksum,
     Chain{kRSA, kCA, kRoot}, kInvalid, kBadChecksum},
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

TEST_F(GWXARArchiveSigned, ThreeHundredSignaturesOpenAndEachIsChecked) {
    const auto& identity = signing().leaf(XarKeyType::rsa);
    gwtest::XarBuilder builder;
    builder.setFiles(kFiles);
    ASSERT_TRUE(signing().signArchive(
        builder, std::vector<XarSigning::Request>(300, XarSigning::Request("RSA", identity))))
        << signing().problem();
    gwtest::writeFile(directory_.file("signed.xar"), builder.bytes());
    const std::string root = fileText(signing().rootCertificateFile());
    GWErrorPtr error;
    auto archive = GWXARArchive::initWithURL(directory_.url("signed.xar"), true,
                                             GWXARTrust::trustWithAnchorsPEM(root, &error), &error);
    ASSERT_TRUE(archive) << describe(error);
    EXPECT_EQ(archive->signatures().size(), 300u);
    EXPECT_EQ(archive->signatureVerdict(), GWXARSignatureVerdictValid);
}

TEST_F(GWXARArchiveSigned, SignaturesSurvivePersistenceAndCopying) {
    gwtest::TrustedRootScope trust(signing().rootCertificateFile());
    const auto& identity = signing().leaf(XarKeyType::rsa);
    GWErrorPtr error;
    auto archive = GWXARArchive::initWithURL(signedArchive("CMS", identity), true, &error);
    ASSERT_TRUE(archive) << describe(error);
    const auto original = archive->signatures().at(0);

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

GWCertificateArray certificatesOf(const std::vector<GWData>& ders) {
    GWCertificateArray certificates;
    for (const GWData& der : ders) {
        certificates.push_back(GWCertificate::createWithData(der));
    }
    return certificates;
}

std::vector<GWData> encodingsOf(const std::optional<GWCertificateArray>& certificates) {
    std::vector<GWData> ders;
    for (const auto& certificate : certificates.value_or(GWCertificateArray())) {
        ders.push_back(certificate->data());
    }
    return ders;
}

TEST_F(GWXARArchiveSigned, CertificatesAreWholeDER) {
    const auto& chain = signing().leaf(XarKeyType::ecdsa).chain;
    auto certificate = GWCertificate::createWithData(chain.front());
    ASSERT_TRUE(certificate);
    EXPECT_EQ(certificate->data(), chain.front());
    GWData truncated(chain.front().begin(), chain.front().end() - 1), padded = chain.front();
    padded.push_back(0);
    for (const GWData& bad : {truncated, padded, GWData{}, gwtest::bytesOf("0\x82garbage")}) {
        EXPECT_FALSE(GWCertificate::createWithData(bad)) << gwtest::hex(bad);
    }
    // Without certificates there are no names either.
    EXPECT_FALSE(
        GWXARSignature::initWithType(1, {}, std::nullopt, false)->certificateCommonNames());
}

// Writes what a signature would, with bytes of its choosing as a certificate.
class ForgedSignature : public GWCoding {
public:
    explicit ForgedSignature(GWValue certificate) : certificate_(std::move(certificate)) {}
    std::string className() const override { return GWXARSignature::kClassName; }
    void encodeWithCoder(GWCoder& coder) const override {
        coder.encodeInteger(1, "Type");
        coder.encodeValue(GWValue(GWArray{certificate_}), "Certificates");
    }

private:
    GWValue certificate_;
};

TEST_F(GWXARArchiveSigned, SignatureValuesRoundTripAndStoredNonCertificatesAreRefused) {
    const auto& chain = signing().leaf(XarKeyType::ecdsa).chain;
    // The archive round trip above keeps the rest; here the extended flag.
    auto signature = GWXARSignature::initWithType(
        GWXARSignatureTypeCMS, gwtest::bytesOf("signature bytes"), certificatesOf(chain), true);
    auto decoded = GWKeyedUnarchiver::unarchiveObjectWithData<GWXARSignature>(
        GWKeyedArchiver::archivedDataWithRootObject(signature));
    ASSERT_TRUE(decoded);
    EXPECT_TRUE(decoded->isExtended());
    EXPECT_EQ(encodingsOf(decoded->certificates()), chain);
    EXPECT_TRUE(signature->copy()->isExtended());
    // No certificates stay no certificates, not an empty list.
    auto bare = GWKeyedUnarchiver::unarchiveObjectWithData<GWXARSignature>(
        GWKeyedArchiver::archivedDataWithRootObject(
            GWXARSignature::initWithType(GWXARSignatureTypeRSA, {}, std::nullopt, false)));
    ASSERT_TRUE(bare);
    EXPECT_FALSE(bare->certificates());

    GWCodingRegistry::registerClass<GWXARSignature>();
    for (const GWValue& stored :
         {GWValue(gwtest::bytesOf("not DER")), GWValue(std::string("text"))}) {
        EXPECT_FALSE(GWKeyedUnarchiver::unarchiveObjectWithData<GWXARSignature>(
            GWKeyedArchiver::archivedDataWithRootObject(ForgedSignature(stored))));
    }
    auto good = GWKeyedUnarchiver::unarchiveObjectWithData<GWXARSignature>(
        GWKeyedArchiver::archivedDataWithRootObject(ForgedSignature(GWValue(chain.front()))));
    ASSERT_TRUE(good);
    EXPECT_EQ(encodingsOf(good->certificates()), std::vector<GWData>{chain.front()});
}

}  // namespace
