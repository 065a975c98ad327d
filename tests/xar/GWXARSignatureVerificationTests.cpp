#include <gtest/gtest.h>

#include <cstdlib>
#include <optional>

#include <openssl/x509_vfy.h>

#include "GWArchiveSupport/GWArchiveConstants.h"
#include "XarSignatureTestSupport.h"
#include "foundation/GWChecksum.h"
#include "xar/GWXARLoadOperation.h"

namespace {

using namespace gwtest;

// A signature element to place in a table of contents: its bytes go to the heap.
struct TOCSignature {
    std::string style;
    GWData bytes;
    std::string keyInfoXML;
    bool extended = false;
};

// A table of contents holding `signatures` (and any `extraXML`), a heap file
// holding their bytes behind a few bytes of header, and a load operation
// reading that file with `checksum` as the table-of-contents checksum.
class SignedTOCFixture {
public:
    SignedTOCFixture(const std::vector<TOCSignature>& signatures, const GWData& checksum,
                     const std::string& extraXML = "") {
        // Bytes before the heap, so that offsets are seen to count from the heap's start.
        const std::string header = "HEADER+TOC";
        GWData file = bytesOf(header);
        std::string elements;
        for (const TOCSignature& signature : signatures) {
            elements += XarSigning::signatureElement(signature.style, file.size() - header.size(),
                                                     signature.bytes.size(), signature.keyInfoXML,
                                                     signature.extended);
            file.insert(file.end(), signature.bytes.begin(), signature.bytes.end());
        }
        writeFile(folder_.file("heap"), file);
        const std::string text = "<xar><toc>" + elements + extraXML + "</toc></xar>";
        document_.load_string(text.c_str(), GWXARLoadOperation::kTOCParseOptions);
        operation_->setArchiveURL(folder_.url("heap"));
        operation_->setFileHandle(
            GWRemoteFileHandle::initForReadingFromURL(folder_.url("heap"), nullptr));
        operation_->setHeapStart(header.size());
        operation_->setTOCChecksum(checksum);
    }

    pugi::xml_node toc() const { return document_.child("xar").child("toc"); }
    GWXARLoadOperation& operation() { return *operation_; }
    // verifySignaturesWithTOC with the header's algorithm (a GWChecksum number).
    bool verify(GWErrorPtr* error, int checksumAlgorithm = 5) {
        return operation_->verifySignaturesWithTOC(toc(), checksumAlgorithm, error);
    }

private:
    TemporaryDirectory folder_;
    pugi::xml_document document_;
    GWXARLoadOperationPtr operation_ = GWXARLoadOperation::initWithArchive(nullptr, false);
};

// The XAR-domain detail texts of an error; "(no error)" without one.
std::string unknownEntity(const GWErrorPtr& error) {
    return error ? error->detailString(kGWXARArchiveUnknownEntityErrorKey) : "(no error)";
}

std::string affectedNode(const GWErrorPtr& error) {
    return error ? error->detailString(kGWXARArchiveAffectedXMLNodeErrorKey) : "(no error)";
}

class GWXARSignatureVerification : public ::testing::Test {
protected:
    void SetUp() override {
        ASSERT_TRUE(signing().ok()) << signing().problem();
        trust_.emplace(signing().rootCertificateFile());
    }

    static XarSigning& signing() { return sharedSigning(); }

    // A signature of `style` by the leaf of `type` over `checksum`, carrying its chain.
    static TOCSignature signedBy(const std::string& style, XarKeyType type,
                                 const GWData& checksum) {
        const auto& identity = signing().leaf(type);
        return {style, signing().sign(style, identity, checksum),
                XarSigning::keyInfoElement(identity.chain)};
    }

    static void expectXARError(const GWErrorPtr& error, long code) {
        ASSERT_TRUE(error);
        EXPECT_EQ(error->domain(), kGWXARArchiveErrorDomain) << error->localizedDescription();
        EXPECT_EQ(error->code(), code) << error->localizedDescription();
    }

    const GWData checksum_ =
        GWChecksum::checksumForData(bytesOf("a table of contents"), GWChecksumAlgorithmSHA1);
    std::optional<TrustedRootScope> trust_;
};

// Every key type and CMS, over SHA-1 and MD5 checksums; then with the
// signature's last byte (its value, in all four encodings) flipped, and signed
// over another checksum.
TEST_F(GWXARSignatureVerification, SignaturesVerifyAndAlteredOnesDoNot) {
    const GWData md5 = GWChecksum::checksumForData(bytesOf("toc"), GWChecksumAlgorithmMD5);
    GWData other = checksum_;
    other[7] ^= 0x80;
    const std::pair<std::string, XarKeyType> cases[] = {{"RSA", XarKeyType::rsa},
                                                        {"DSA", XarKeyType::dsa},
                                                        {"ECDSA", XarKeyType::ecdsa},
                                                        {"CMS", XarKeyType::rsa}};
    for (const auto& [style, type] : cases) {
        SCOPED_TRACE(style);
        const TOCSignature signature = signedBy(style, type, checksum_);
        SignedTOCFixture fixture({signature}, checksum_);
        GWErrorPtr error;
        EXPECT_TRUE(fixture.verify(&error)) << (error ? error->localizedDescription() : "");
        ASSERT_EQ(fixture.operation().signatures()->size(), 1u);
        const auto& loaded = *fixture.operation().signatures()->front();
        EXPECT_EQ(loaded.signatureData(), signature.bytes);
        EXPECT_FALSE(loaded.isExtended());
        EXPECT_EQ(loaded.certificateCommonNames(), signing().leaf(type).commonNames);
        if (type != XarKeyType::dsa) {
            SignedTOCFixture overMD5({signedBy(style, type, md5)}, md5);
            EXPECT_TRUE(overMD5.verify(&error, GWChecksumAlgorithmMD5))
                << (error ? error->localizedDescription() : "");
        }

        TOCSignature altered = signature;
        altered.bytes.back() ^= 0x01;
        for (const TOCSignature& bad : {altered, signedBy(style, type, other)}) {
            SignedTOCFixture refused({bad}, checksum_);
            EXPECT_FALSE(refused.verify(&error));
            expectXARError(error, GWXARArchiveInvalidSignatureError);
            EXPECT_EQ(unknownEntity(error), "");
            EXPECT_EQ(affectedNode(error), "");
        }
    }
}

TEST_F(GWXARSignatureVerification, CMSSignerNotTrustedIsASecurityError) {
    const auto& selfSigned = signing().selfSignedLeaf();
    SignedTOCFixture fixture({{"CMS", signing().signCMS(selfSigned, checksum_),
                               XarSigning::keyInfoElement(selfSigned.chain)}},
                             checksum_);
    {
        // With the self-signed certificate as the root, KeyInfo and the signer are trusted.
        TrustedRootScope both(selfSigned.certificateFile);
        GWErrorPtr error;
        EXPECT_TRUE(fixture.verify(&error)) << (error ? error->localizedDescription() : "");
    }

    // KeyInfo names a trusted chain; the message's own signer is not trusted.
    SignedTOCFixture mixed({{"CMS", signing().signCMS(selfSigned, checksum_),
                             XarSigning::keyInfoElement(signing().leaf(XarKeyType::rsa).chain)}},
                           checksum_);
    GWErrorPtr error;
    EXPECT_FALSE(mixed.verify(&error));
    ASSERT_TRUE(error);
    EXPECT_EQ(error->domain(), GWSecurityErrorDomain);
    EXPECT_EQ(error->code(), X509_V_ERR_DEPTH_ZERO_SELF_SIGNED_CERT);
    EXPECT_FALSE(error->URL());
}

// Signature elements that cannot be checked: each fails with its error, the
// entity it names and (a prefix of) the element it names.
TEST_F(GWXARSignatureVerification, UncheckableSignaturesAreRefused) {
    const std::string notCertificate = base64Encode(bytesOf("not a certificate"));
    const auto certificates = [](const std::string& text) {
        return "<KeyInfo><X509Data><X509Certificate>" + text +
               "</X509Certificate></X509Data></KeyInfo>";
    };
    GWData padded = signing().leaf(XarKeyType::rsa).chain.front();
    padded.push_back(0);
    const std::string chain = XarSigning::keyInfoElement(signing().leaf(XarKeyType::rsa).chain);
    const std::string xar = kGWXARArchiveErrorDomain;
    const struct {
        std::string style, keyInfo, element;  // `element` instead of a signature with heap bytes
        std::string domain;
        long code;  // 0: any
        std::string entity = {}, node = {};
    } cases[] = {
        {"RSA", certificates(notCertificate), "", xar, GWXARArchiveUntrustedCertificateError,
         notCertificate, "<X509Certificate>" + notCertificate + "</X509Certificate>"},
        // A certificate followed by stray bytes is not a certificate either.
        {"RSA", XarSigning::keyInfoElement({padded}), "", xar,
         GWXARArchiveUntrustedCertificateError, base64Encode(padded)},
        {"RSA", certificates("***"), "", kGWCocoaErrorDomain, GWFileReadCorruptFileError},
        {"CMS", chain, "", GWSecurityErrorDomain, 0},
        // Without certificates nothing vouches for the key.
        {"RSA", "<KeyInfo><KeyName>k</KeyName></KeyInfo>", "", xar,
         GWXARArchiveMissingCertificateError},
        {"RSA", "", "", xar, GWXARArchiveMissingCertificateError},
        {"RSA", "<KeyInfo><X509Data/></KeyInfo>", "", xar, GWXARArchiveMissingCertificateError, "",
         "<signature style=\"RSA\">"},
        {"SHA1withFOO", "", "", xar, GWXARArchiveUnknownSignatureStyleError, "SHA1withFOO",
         "<signature"},
        {"CMSwithRSA ", "", "", xar, GWXARArchiveUnknownSignatureStyleError, "CMSwithRSA "},
        {"withrsa2", "", "", xar, GWXARArchiveUnknownSignatureStyleError, "withrsa2"},
        {"", "", "", xar, GWXARArchiveUnknownSignatureStyleError, "", "<signature"},
        {"", "", "<signature><offset>0</offset></signature>", xar,
         GWXARArchiveUnknownSignatureStyleError},
        {"", "", "<signature style=\"RSA\"><offset>twelve</offset></signature>", xar,
         GWXARArchiveMalformedValueError, "twelve", "<offset>twelve</offset>"},
        {"", "", "<signature style=\"RSA\"><size>-</size></signature>", xar,
         GWXARArchiveMalformedValueError, "-", "<size>-</size>"},
        {"", "", "<signature style=\"RSA\"><offset>99999999999999999999999</offset></signature>",
         xar, GWXARArchiveMalformedValueError, "99999999999999999999999"},
        // A signature larger than 16 KiB is no signature: nothing is read for it.
        {"", "", "<signature style=\"RSA\"><size>16385</size></signature>", xar,
         GWXARArchiveMalformedValueError, "16385", "<size>16385</size>"},
    };
    for (const auto& c : cases) {
        SCOPED_TRACE(c.style + " " + c.keyInfo + c.element);
        std::vector<TOCSignature> signatures;
        if (c.element.empty()) {
            signatures.push_back({c.style, bytesOf("sig"), c.keyInfo});
        }
        SignedTOCFixture fixture(signatures, checksum_, c.element);
        GWErrorPtr error;
        EXPECT_FALSE(fixture.verify(&error));
        ASSERT_TRUE(error);
        EXPECT_EQ(error->domain(), c.domain) << error->localizedDescription();
        EXPECT_TRUE(c.code ? error->code() == c.code : error->code() != 0) << error->code();
        EXPECT_EQ(unknownEntity(error), c.entity);
        EXPECT_EQ(affectedNode(error).rfind(c.node, 0), 0u) << affectedNode(error);
    }
}

TEST_F(GWXARSignatureVerification, StylesMapToTypesWhateverTheirCase) {
    const std::pair<std::string, std::uint64_t> cases[] = {
        {"SHA1withRSA", GWXARSignatureTypeRSA}, {"sha1WITHrsa", GWXARSignatureTypeRSA},
        {"rsa", GWXARSignatureTypeRSA},         {"SHA1withDSA", GWXARSignatureTypeDSA},
        {"DSA", GWXARSignatureTypeDSA},         {"SHA256withECDSA", GWXARSignatureTypeECDSA},
        {"ecdsa", GWXARSignatureTypeECDSA},     {"Cms", GWXARSignatureTypeCMS},
    };
    for (const auto& [style, type] : cases) {
        SignedTOCFixture fixture({{style, bytesOf("sig"), ""}}, checksum_);
        GWErrorPtr error;
        ASSERT_TRUE(fixture.operation().loadSignaturesWithTOC(fixture.toc(), &error)) << style;
        EXPECT_EQ(fixture.operation().signatures()->front()->type(), type) << style;
    }
}

TEST_F(GWXARSignatureVerification, ExtendedSignaturesLoadAfterTheOthers) {
    const TOCSignature rsa = signedBy("RSA", XarKeyType::rsa, checksum_);
    TOCSignature ecdsa = signedBy("ECDSA", XarKeyType::ecdsa, checksum_);
    ecdsa.extended = true;
    SignedTOCFixture fixture({ecdsa, rsa}, checksum_);
    GWErrorPtr error;
    EXPECT_TRUE(fixture.verify(&error)) << (error ? error->localizedDescription() : "");
    const auto& signatures = *fixture.operation().signatures();
    ASSERT_EQ(signatures.size(), 2u);
    EXPECT_EQ(signatures[0]->type(), GWXARSignatureTypeRSA);
    EXPECT_FALSE(signatures[0]->isExtended());
    EXPECT_EQ(signatures[1]->type(), GWXARSignatureTypeECDSA);
    EXPECT_TRUE(signatures[1]->isExtended());
    EXPECT_EQ(signatures[1]->signatureData(), ecdsa.bytes);
}

TEST_F(GWXARSignatureVerification, TheFirstBadSignatureDecides) {
    const TOCSignature good = signedBy("RSA", XarKeyType::rsa, checksum_);
    TOCSignature bad = signedBy("DSA", XarKeyType::dsa, checksum_);
    bad.bytes.back() ^= 0x01;
    const auto& selfSigned = signing().selfSignedLeaf();
    const TOCSignature untrusted{"RSA", signing().signDigest(selfSigned, checksum_),
                                 XarSigning::keyInfoElement(selfSigned.chain)};

    SignedTOCFixture badFirst({bad, untrusted}, checksum_);
    GWErrorPtr error;
    EXPECT_FALSE(badFirst.verify(&error));
    expectXARError(error, GWXARArchiveInvalidSignatureError);

    SignedTOCFixture untrustedSecond({good, untrusted}, checksum_);
    EXPECT_FALSE(untrustedSecond.verify(&error));
    expectXARError(error, GWXARArchiveUntrustedCertificateError);
}

TEST_F(GWXARSignatureVerification, NoChecksumAlgorithmMeansNoValidSignature) {
    SignedTOCFixture fixture({signedBy("RSA", XarKeyType::rsa, checksum_)}, checksum_);
    GWErrorPtr error = GWCocoaError(GWFileReadUnknownError);
    EXPECT_FALSE(fixture.verify(&error, GWChecksumAlgorithmNone));
    EXPECT_EQ(error, nullptr);
    // The signatures were still loaded.
    EXPECT_EQ(fixture.operation().signatures()->size(), 1u);

    // Unsigned, the table of contents verifies whatever the algorithm.
    for (const int algorithm : {int(GWChecksumAlgorithmNone), 5}) {
        SignedTOCFixture unsigned_({}, checksum_, "<file id=\"1\"><name>a</name></file>");
        EXPECT_TRUE(unsigned_.verify(&error, algorithm));
        ASSERT_TRUE(unsigned_.operation().signatures());
        EXPECT_TRUE(unsigned_.operation().signatures()->empty());
    }
}

}  // namespace
