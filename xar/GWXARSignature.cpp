#include "GWXARSignature.h"

#include "GWXARDescribing.h"
#include "foundation/GWFormat.h"

namespace {

const char* const kTypeKey = "Type";
const char* const kSignatureDataKey = "SignatureData";
const char* const kCertificatesKey = "Certificates";
const char* const kIsExtendedKey = "IsExtended";
const char* const kVerdictKey = "Verdict";
const char* const kVerdictReasonKey = "VerdictReason";
const char* const kChainKey = "ChainCommonNames";

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

const char* GWXARSignatureVerdictName(std::uint64_t verdict) {
    switch (verdict) {
        case GWXARSignatureVerdictValid: return "valid";
        case GWXARSignatureVerdictUntrusted: return "untrusted";
        case GWXARSignatureVerdictInvalid: return "invalid";
        default: return "none";
    }
}

GWXARSignaturePtr GWXARDecidingSignature(const GWXARSignatureArray& signatures) {
    GWXARSignaturePtr deciding;
    for (const auto& signature : signatures) {
        if (signature && (!deciding || signature->verdict() > deciding->verdict())) {
            deciding = signature;
        }
    }
    return deciding;
}

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

GWXARSignaturePtr GWXARSignature::copyWithVerdict(GWXARSignatureVerdict verdict, std::string reason,
                                                  std::vector<std::string> chain) const {
    auto signature = copy();
    signature->verdict_ = verdict;
    signature->verdictReason_ = std::move(reason);
    signature->chainCommonNames_ = std::move(chain);
    return signature;
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
        "<%s %s\n\ttype=%s\n\tsignatureData=%zu bytes\n\tcertificates=%s\n\tisExtended=%s"
        "\n\tverdict=%s%s%s\n>",
        className().c_str(), GWXARDescribing::pointerText(this).c_str(), typeName(type_),
        signatureData_->size(), names.c_str(), isExtended_ ? "YES" : "NO",
        GWXARSignatureVerdictName(verdict_), verdictReason_.empty() ? "" : " ",
        verdictReason_.c_str());
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
    if (verdict_ != GWXARSignatureVerdictNone) {
        coder.encodeInteger(std::int64_t(verdict_), kVerdictKey);
        coder.encodeValue(GWValue(verdictReason_), kVerdictReasonKey);
        GWArray chain(chainCommonNames_.begin(), chainCommonNames_.end());
        coder.encodeValue(GWValue(std::move(chain)), kChainKey);
    }
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
    auto signature = initWithType(coder.decodeUInt64(kTypeKey),
                                  coder.decodeData(kSignatureDataKey).value_or(GWData()),
                                  std::move(certificates), coder.decodeBool(kIsExtendedKey));
    const std::uint64_t verdict = coder.decodeUInt64(kVerdictKey);
    // An unknown verdict from a later writer is no verdict here.
    if (verdict <= GWXARSignatureVerdictInvalid) {
        signature->verdict_ = GWXARSignatureVerdict(verdict);
    }
    signature->verdictReason_ = coder.decodeString(kVerdictReasonKey).value_or("");
    for (const GWValue& name : coder.decodeArray(kChainKey).value_or(GWArray())) {
        if (const std::string* text = name.string()) {
            signature->chainCommonNames_.push_back(*text);
        }
    }
    return signature;
}

GWXARSignaturePtr GWXARSignature::copy() const {
    auto signature = initSharingData(type_, signatureData_, certificates_, isExtended_);
    signature->verdict_ = verdict_;
    signature->verdictReason_ = verdictReason_;
    signature->chainCommonNames_ = chainCommonNames_;
    return signature;
}
