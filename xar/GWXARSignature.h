#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "GWCertificate.h"
#include "foundation/GWCoder.h"
#include "foundation/GWValue.h"

// The algorithm of a signature, from its "style" in the table of contents.
enum GWXARSignatureType : std::uint64_t {
    GWXARSignatureTypeRSA = 1,
    GWXARSignatureTypeDSA = 2,
    GWXARSignatureTypeECDSA = 3,
    GWXARSignatureTypeCMS = 4,
};

class GWXARSignature;
using GWXARSignaturePtr = std::shared_ptr<GWXARSignature>;
using GWXARSignatureArray = std::vector<GWXARSignaturePtr>;

// One signature of a XAR archive: its bytes from the heap and the certificates
// the table of contents names for it, leaf first. Immutable.
class GWXARSignature : public GWCoding {
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

    std::string description() const;

    std::string className() const override { return kClassName; }
    // "Type", "SignatureData", "Certificates" (their DER encodings) and
    // "IsExtended"; nothing to a non-keyed coder.
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
};
