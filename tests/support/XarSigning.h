#pragma once

#include <cstdint>
#include <map>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "TestSupport.h"
#include "XarBuilder.h"
#include "foundation/GWValue.h"

namespace gwtest {

// Signing material for XAR tests, made with the openssl tool and API in a
// temporary folder: a test root CA, an intermediate CA it issued, leaves the
// intermediate issued (RSA, DSA, ECDSA keys; one expired), a leaf the RSA
// leaf issued as if it were a CA, and a self-signed leaf no root vouches
// for. Nothing is trusted until a TrustedRootScope or an added anchor says so.
//
//     XarSigning signing;
//     ASSERT_TRUE(signing.ok()) << signing.problem();
//     TrustedRootScope trust(signing.rootCertificateFile());
//     XarBuilder xar;
//     xar.setFiles(...);
//     ASSERT_TRUE(signing.signArchive(xar, {{"RSA", signing.leaf(XarKeyType::rsa)}}));
//     xar.write(path);  // opens with signatureIsValid
enum class XarKeyType { rsa, dsa, ecdsa };

struct XarSigningIdentity {
    XarKeyType keyType = XarKeyType::rsa;
    std::string keyFile;          // PEM private key
    std::string certificateFile;  // PEM leaf certificate
    std::string chainFile;        // PEM certificates that help build the chain (may be empty)
    std::vector<GWData> chain;    // DER, leaf first, then the intermediate; never the root
    std::vector<std::string> commonNames;  // of `chain`, in order
};

class XarSigning {
public:
    XarSigning();
    XarSigning(const XarSigning&) = delete;
    XarSigning& operator=(const XarSigning&) = delete;

    // False when the openssl tool failed; `problem` then says which command.
    bool ok() const { return problem_.empty(); }
    const std::string& problem() const { return problem_; }

    const std::string& rootCertificateFile() const { return rootCertificateFile_; }

    // Made on first use, then reused. An empty identity when openssl failed.
    const XarSigningIdentity& leaf(XarKeyType type);
    // Signed by its own key; its chain is the leaf alone.
    const XarSigningIdentity& selfSignedLeaf();
    // An ECDSA leaf of the intermediate whose validity ended yesterday.
    const XarSigningIdentity& expiredLeaf();
    // An ECDSA leaf issued by the RSA leaf, which is no CA; its chain runs
    // through the RSA leaf to the intermediate.
    const XarSigningIdentity& leafIssuedByLeaf();

    // A raw signature over `checksum` taken as a digest: SHA-1 for 20 bytes,
    // MD5 for 16 (RSA only; DSA and ECDSA sign other lengths bare). Empty on failure.
    GWData signDigest(const XarSigningIdentity& identity, const GWData& checksum);
    // A detached CMS signature over the checksum bytes (DER), carrying the
    // identity's chain. Empty on failure.
    GWData signCMS(const XarSigningIdentity& identity, const GWData& checksum);
    // A CMS signed-data message with the identity's certificates and no signer.
    GWData certificatesOnlyCMS(const XarSigningIdentity& identity);
    // signCMS for a style of "CMS" (any case), else signDigest.
    GWData sign(const std::string& style, const XarSigningIdentity& identity,
                const GWData& checksum);

    // One signature for signArchive. `certificates` replaces the identity's
    // chain in the KeyInfo.
    struct Request {
        Request(std::string style, const XarSigningIdentity& identity, bool extended = false)
            : style(std::move(style)), identity(&identity), extended(extended) {}

        std::string style;  // "RSA", "SHA1withRSA", "DSA", "ECDSA", "CMS", ...
        const XarSigningIdentity* identity;
        bool extended;                // an "x-signature" element
        bool withoutSigners = false;  // a CMS message carrying only the certificates
        std::optional<std::vector<GWData>> certificates;
    };
    // Puts a signature element per request at the start of the builder's
    // table of contents and appends the signature bytes to its heap, so that
    // they sign the final table-of-contents checksum. The builder must have
    // a checksum algorithm; its files must be set first and not changed after.
    bool signArchive(XarBuilder& xar, const std::vector<Request>& requests);

    // <KeyInfo> with one <X509Data> holding each certificate in base64.
    static std::string keyInfoElement(const std::vector<GWData>& certificates);
    // <signature style=...> (or <x-signature>) with offset, size and `keyInfoXML`.
    static std::string signatureElement(const std::string& style, std::uint64_t offset,
                                        std::uint64_t size, const std::string& keyInfoXML,
                                        bool extended = false);

private:
    bool run(const std::string& command);
    // A certificate for the key valid for `days` (negative: already expired), issued
    // by `issuer` or self-signed without one.
    std::optional<XarSigningIdentity> makeIdentity(const std::string& name, XarKeyType type,
                                                   const std::string& keyFile,
                                                   const XarSigningIdentity* issuer, int days);
    GWData derOf(const std::string& pemFile);

    TemporaryDirectory folder_;
    std::string problem_;
    std::string config_;
    std::string rootCertificateFile_;
    XarSigningIdentity intermediate_;  // as an issuer: its chain is only itself
    std::map<int, XarSigningIdentity> leaves_;
    std::optional<XarSigningIdentity> selfSigned_;
    std::optional<XarSigningIdentity> expired_;
    std::optional<XarSigningIdentity> issuedByLeaf_;
    XarSigningIdentity empty_;
    int serial_ = 1;
    int files_ = 0;
};

// Points the system's trust store at one PEM file (SSL_CERT_FILE, with
// SSL_CERT_DIR at an empty folder) while alive; restores both afterwards.
class TrustedRootScope {
public:
    explicit TrustedRootScope(const std::string& certificateFile);

private:
    TemporaryDirectory emptyFolder_;
    ScopedEnvironment file_, directory_;
};

std::string base64Encode(const GWData& bytes);

}  // namespace gwtest
