#include <gtest/gtest.h>

#include "GWArchiveSupport/GWXARSignature.h"
#include "XarSignatureTestSupport.h"
#include "support/CoderTestSupport.h"

namespace {

using gwtest::bytesOf;
using gwtest::XarKeyType;

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

class GWXARSignatureValue : public ::testing::Test {
protected:
    void SetUp() override {
        ASSERT_TRUE(gwtest::sharedSigning().ok()) << gwtest::sharedSigning().problem();
    }
    const gwtest::XarSigningIdentity& identity() {
        return gwtest::sharedSigning().leaf(XarKeyType::ecdsa);
    }
};

TEST_F(GWXARSignatureValue, CertificatesKeepTheirBytesAndNames) {
    const GWData der = identity().chain.front();
    auto certificate = GWCertificate::createWithData(der);
    ASSERT_TRUE(certificate);
    EXPECT_EQ(certificate->data(), der);
    EXPECT_EQ(certificate->commonName(), "GW Test ECDSA Signer");

    GWData truncated(der.begin(), der.end() - 1);
    GWData padded = der;
    padded.push_back(0);
    EXPECT_FALSE(GWCertificate::createWithData(truncated));
    EXPECT_FALSE(GWCertificate::createWithData(padded));
    EXPECT_FALSE(GWCertificate::createWithData({}));
    EXPECT_FALSE(GWCertificate::createWithData(bytesOf("0\x82garbage")));
}

TEST_F(GWXARSignatureValue, CommonNamesFollowTheChain) {
    auto signature = GWXARSignature::initWithType(GWXARSignatureTypeECDSA, bytesOf("sig"),
                                                  certificatesOf(identity().chain), false);
    EXPECT_EQ(signature->certificateCommonNames(),
              (std::vector<std::string>{"GW Test ECDSA Signer", "GW Test Intermediate CA"}));

    EXPECT_FALSE(
        GWXARSignature::initWithType(1, {}, std::nullopt, false)->certificateCommonNames());
    EXPECT_EQ(
        GWXARSignature::initWithType(1, {}, GWCertificateArray(), false)->certificateCommonNames(),
        std::vector<std::string>());
}

TEST_F(GWXARSignatureValue, ACertificateWithoutCommonNameLeavesNoNames) {
    gwtest::TemporaryDirectory folder;
    const auto result = gwtest::runCommand(
        "openssl req -x509 -new -newkey ec -pkeyopt ec_paramgen_curve:P-256 -nodes -keyout " +
        gwtest::shellQuote(folder.file("key")) + " -subj /O=Nameless -days 1 -outform DER -out " +
        gwtest::shellQuote(folder.file("cert")) + " 2>&1");
    ASSERT_EQ(result.status, 0) << result.output;
    auto nameless = GWCertificate::createWithData(gwtest::readFile(folder.file("cert")));
    ASSERT_TRUE(nameless);
    EXPECT_FALSE(nameless->commonName());

    GWCertificateArray certificates = certificatesOf(identity().chain);
    certificates.push_back(nameless);
    auto signature = GWXARSignature::initWithType(1, {}, certificates, false);
    EXPECT_FALSE(signature->certificateCommonNames());
}

TEST_F(GWXARSignatureValue, KeyedArchivingRoundTrips) {
    for (const bool extended : {false, true}) {
        auto signature =
            GWXARSignature::initWithType(GWXARSignatureTypeCMS, bytesOf("signature bytes"),
                                         certificatesOf(identity().chain), extended);
        GWErrorPtr error;
        const GWData archive = GWKeyedArchiver::archivedDataWithRootObject(signature, &error);
        ASSERT_FALSE(archive.empty()) << (error ? error->localizedDescription() : "");
        auto decoded = GWKeyedUnarchiver::unarchiveObjectWithData<GWXARSignature>(archive, &error);
        ASSERT_TRUE(decoded);
        EXPECT_EQ(decoded->type(), GWXARSignatureTypeCMS);
        EXPECT_EQ(decoded->signatureData(), bytesOf("signature bytes"));
        EXPECT_EQ(decoded->isExtended(), extended);
        EXPECT_EQ(encodingsOf(decoded->certificates()), identity().chain);
        EXPECT_EQ(decoded->certificateCommonNames(), signature->certificateCommonNames());
    }

    // No certificates stay no certificates, not an empty list.
    auto bare = GWXARSignature::initWithType(GWXARSignatureTypeRSA, {}, std::nullopt, false);
    auto decoded = GWKeyedUnarchiver::unarchiveObjectWithData<GWXARSignature>(
        GWKeyedArchiver::archivedDataWithRootObject(bare));
    ASSERT_TRUE(decoded);
    EXPECT_FALSE(decoded->certificates());
    EXPECT_EQ(decoded->type(), GWXARSignatureTypeRSA);
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

TEST_F(GWXARSignatureValue, StoredCertificatesThatAreNoneAreRefused) {
    GWCodingRegistry::registerClass<GWXARSignature>();
    for (const GWValue& stored : {GWValue(bytesOf("not DER")), GWValue(std::string("text"))}) {
        const GWData archive = GWKeyedArchiver::archivedDataWithRootObject(ForgedSignature(stored));
        ASSERT_FALSE(archive.empty());
        EXPECT_FALSE(GWKeyedUnarchiver::unarchiveObjectWithData<GWXARSignature>(archive));
    }
    const GWData good = GWKeyedArchiver::archivedDataWithRootObject(
        ForgedSignature(GWValue(identity().chain.front())));
    auto decoded = GWKeyedUnarchiver::unarchiveObjectWithData<GWXARSignature>(good);
    ASSERT_TRUE(decoded);
    EXPECT_EQ(encodingsOf(decoded->certificates()), std::vector<GWData>{identity().chain.front()});
}

TEST_F(GWXARSignatureValue, NonKeyedCodersSeeNothing) {
    auto signature = GWXARSignature::initWithType(GWXARSignatureTypeRSA, bytesOf("x"),
                                                  certificatesOf(identity().chain), true);
    gwtest::WriteCountingCoder coder;
    signature->encodeWithCoder(coder);
    EXPECT_EQ(coder.writes, 0);
    GWNonKeyedCoder nonKeyed;
    EXPECT_FALSE(GWXARSignature::initWithCoder(nonKeyed));
}

TEST_F(GWXARSignatureValue, CopiesAreEqual) {
    auto signature = GWXARSignature::initWithType(GWXARSignatureTypeDSA, bytesOf("abc"),
                                                  certificatesOf(identity().chain), true);
    auto copy = signature->copy();
    ASSERT_TRUE(copy);
    EXPECT_NE(copy.get(), signature.get());
    EXPECT_EQ(copy->type(), GWXARSignatureTypeDSA);
    EXPECT_EQ(copy->signatureData(), bytesOf("abc"));
    EXPECT_TRUE(copy->isExtended());
    EXPECT_EQ(encodingsOf(copy->certificates()), identity().chain);
}

}  // namespace
