#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "GWCertificate.h"
#include "GWCoder.h"
#include "GWExport.h"
#include "GWValue.h"

// The algorithm of a signature, from its "style" in the table of contents.
enum GWXARSignatureType : std::uint64_t {
    GWXARSignatureTypeRSA = 1,
    GWXARSignatureTypeDSA = 2,
    GWXARSignatureTypeECDSA = 3,
    GWXARSignatureTypeCMS = 4,
};

// What a load found of a signature, or of an archive's signatures together.
enum GWXARSignatureVerdict : std::uint64_t {
    // Not checked; an archive without signatures has this verdict.
    GWXARSignatureVerdictNone = 0,
    // Checks out over the table of contents' checksum, and its chain reaches a trust anchor.
    GWXARSignatureVerdictValid = 1,
    // Checks out, but its chain does not reach a trust anchor.
    GWXARSignatureVerdictUntrusted = 2,
    // Does not check out over the checksum, or the checksum does not match the table of contents.
    GWXARSignatureVerdictInvalid = 3,
};
// "none", "valid", "untrusted" or "invalid".
GW_EXPORT const char* GWXARSignatureVerdictName(std::uint64_t verdict);

class GWXARSignature;
using GWXARSignaturePtr = std::shared_ptr<GWXARSignature>;
using GWXARSignatureArray = std::vector<GWXARSignaturePtr>;

// The signature whose verdict is the worst (invalid, then untrusted, then
// valid), the first of equals; none when there are no signatures.
GW_EXPORT GWXARSignaturePtr GWXARDecidingSignature(const GWXARSignatureArray& signatures);

// One signature of a XAR archive: its bytes from the heap and the certificates
// the table of contents names for it, leaf first. Immutable.
class GW_EXPORT GWXARSignature : public GWCoding {
public:
    static constexpr const char* kClassName = "GWXARSignature";

    // `certificates` is none when the table of contents gave no "KeyInfo".
    static GWXARSignaturePtr initWithType(std::uint64_t type, GWData signatureData,
                                          std::optional<GWCertificateArray> certificates,
                                          bool isExtended);
    // Shares `signatureData`: signatures of one heap range hold its bytes once.
    static GWXARSignaturePtr initSharingData(std::uint64_t type,
                                             std::shared_ptr<const GWData> signatureData,
                                             std::optional<GWCertificateArray> certificates,
                                             bool isExtended);

    std::uint64_t type() const { return type_; }
    const GWData& signatureData() const { return *signatureData_; }
    const std::optional<GWCertificateArray>& certificates() const { return certificates_; }
    // True for an "x-signature" element.
    bool isExtended() const { return isExtended_; }

    // The common name of every certificate in order; none when there are no
    // certificates or any of them has no common name.
    std::optional<std::vector<std::string>> certificateCommonNames() const;

    // Set by the load that checked the signature; none until then.
    GWXARSignatureVerdict verdict() const { return verdict_; }
    // Why the verdict is not "valid", in a few words ("no signers", "expired").
    const std::string& verdictReason() const { return verdictReason_; }
    // The common names of the chain as it was evaluated, leaf first: to the
    // anchor for a valid signature, to the certificate that failed it for an
    // untrusted one.
    const std::vector<std::string>& chainCommonNames() const { return chainCommonNames_; }
    // A copy that carries a verdict.
    GWXARSignaturePtr copyWithVerdict(GWXARSignatureVerdict verdict, std::string reason,
                                      std::vector<std::string> chain) const;

    std::string description() const;

    std::string className() const override { return kClassName; }
    // "Type", "SignatureData", "Certificates" (their DER encodings),
    // "IsExtended", and once checked "Verdict", "VerdictReason" and
    // "ChainCommonNames"; nothing to a non-keyed coder.
    void encodeWithCoder(GWCoder& coder) const override;
    // None from a non-keyed coder, and when a stored certificate is not one.
    static GWXARSignaturePtr initWithCoder(GWCoder& coder);

    // Certificates and bytes are immutable, so the copy shares them.
    GWXARSignaturePtr copy() const;

private:
    GWXARSignature(std::uint64_t type, std::shared_ptr<const GWData> signatureData,
                   std::optional<GWCertificateArray> certificates, bool isExtended);

    std::uint64_t type_;
    std::shared_ptr<const GWData> signatureData_;
    std::optional<GWCertificateArray> certificates_;
    bool isExtended_;
    GWXARSignatureVerdict verdict_ = GWXARSignatureVerdictNone;
    std::string verdictReason_;
    std::vector<std::string> chainCommonNames_;
};
