#include "GWXARSignature.h"

#include "GWXARDescribing.h"
#include "foundation/GWFormat.h"

namespace {

const char* const kTypeKey = "Type";
const char* const kSignatureDataKey = "SignatureData";
const char* const kCertificatesKey = "Certificates";
const char* const kIsExtendedKey = "IsExtended";

const char* typeName(std::uint64_t type) {
    switch (type) {
        case GWXARSignatureTypeRSA: return "RSA";
        case GWXARSignatureTypeDSA: return "DSA";
        case GWXARSignatureTypeECDSA: return "ECDSA";
        case GWXARSignatureTypeCMS: return "CMS";
        default: return "Unknown";
    }
}

}  // namespace

GWXARSignature::GWXARSignature(std::uint64_t type, std::shared_ptr<const GWData> signatureData,
                               std::optional<GWCertificateArray> certificates, bool isExtended)
    : type_(type),
      signatureData_(signatureData ? std::move(signatureData) : std::make_shared<const GWData>()),
      certificates_(std::move(certificates)),
      isExtended_(isExtended) {}

GWXARSignaturePtr GWXARSignature::initWithType(std::uint64_t type, GWData signatureData,
                                               std::optional<GWCertificateArray> certificates,
                                               bool isExtended) {
    return initSharingData(type, std::make_shared<const GWData>(std::move(signatureData)),
                           std::move(certificates), isExtended);
}

GWXARSignaturePtr GWXARSignature::initSharingData(std::uint64_t type,
                                                  std::shared_ptr<const GWData> signatureData,
                                                  std::optional<GWCertificateArray> certificates,
                                                  bool isExtended) {
    return GWXARSignaturePtr(
        new GWXARSignature(type, std::move(signatureData), std::move(certificates), isExtended));
}

std::optional<std::vector<std::string>> GWXARSignature::certificateCommonNames() const {
    if (!certificates_) {
        return std::nullopt;
    }
    std::vector<std::string> names;
    names.reserve(certificates_->size());
    for (const auto& certificate : *certificates_) {
        auto name = certificate ? certificate->commonName() : std::nullopt;
        if (!name) {
            return std::nullopt;
        }
        names.push_back(std::move(*name));
    }
    return names;
}

std::string GWXARSignature::description() const {
    std::string names = "(none)";
    if (auto commonNames = certificateCommonNames()) {
        names.clear();
        for (const auto& name : *commonNames) {
            names += (names.empty() ? "" : ", ") + name;
        }
    }
    return GWFormat(
        "<%s %s\n\ttype=%s\n\tsignatureData=%zu bytes\n\tcertificates=%s\n\tisExtended=%s\n>",
        className().c_str(), GWXARDescribing::pointerText(this).c_str(), typeName(type_),
        signatureData_->size(), names.c_str(), isExtended_ ? "YES" : "NO");
}

void GWXARSignature::encodeWithCoder(GWCoder& coder) const {
    if (!coder.allowsKeyedCoding()) {
        return;
    }
    coder.encodeInteger(std::int64_t(type_), kTypeKey);
    coder.encodeValue(*signatureData_, kSignatureDataKey);
    if (certificates_) {
        GWArray encodings;
        encodings.reserve(certificates_->size());
        for (const auto& certificate : *certificates_) {
            if (certificate) {
                encodings.emplace_back(certificate->data());
            }
        }
        coder.encodeValue(GWValue(std::move(encodings)), kCertificatesKey);
    }
    coder.encodeBool(isExtended_, kIsExtendedKey);
}

GWXARSignaturePtr GWXARSignature::initWithCoder(GWCoder& coder) {
    if (!coder.allowsKeyedCoding()) {
        return nullptr;
    }
    std::optional<GWCertificateArray> certificates;
    if (auto encodings = coder.decodeArray(kCertificatesKey)) {
        certificates.emplace();
        certificates->reserve(encodings->size());
        for (const GWValue& encoding : *encodings) {
            const GWData* der = encoding.data();
            auto certificate = der ? GWCertificate::createWithData(*der) : nullptr;
            if (!certificate) {
                return nullptr;
            }
            certificates->push_back(std::move(certificate));
        }
    }
    return initWithType(coder.decodeUInt64(kTypeKey),
                        coder.decodeData(kSignatureDataKey).value_or(GWData()),
                        std::move(certificates), coder.decodeBool(kIsExtendedKey));
}

GWXARSignaturePtr GWXARSignature::copy() const {
    return initSharingData(type_, signatureData_, certificates_, isExtended_);
}
