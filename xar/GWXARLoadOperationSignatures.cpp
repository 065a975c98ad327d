#include <cerrno>

#include <openssl/err.h>

#include "GWArchiveSupport/GWArchiveConstants.h"
#include "GWOpenSSL.h"
#include "GWXARCMSMessage.h"
#include "GWXARDigestSignature.h"
#include "GWXARLoadOperation.h"
#include "GWXARNumberScanning.h"
#include "GWXARTrust.h"
#include "foundation/GWPropertyListSerialization.h"

namespace {

bool endsWith(std::string_view text, std::string_view suffix) {
    return text.size() >= suffix.size() && text.substr(text.size() - suffix.size()) == suffix;
}

// 0 for a style that names no known algorithm.
std::uint64_t signatureTypeFromStyle(std::string style) {
    for (char& c : style) {
        if (c >= 'A' && c <= 'Z') {
            c = char(c - 'A' + 'a');
        }
    }
    if (style == "rsa" || endsWith(style, "withrsa")) {
        return GWXARSignatureTypeRSA;
    }
    if (style == "dsa" || endsWith(style, "withdsa")) {
        return GWXARSignatureTypeDSA;
    }
    if (style == "ecdsa" || endsWith(style, "withecdsa")) {
        return GWXARSignatureTypeECDSA;
    }
    if (style == "cms") {
        return GWXARSignatureTypeCMS;
    }
    return 0;
}

// The character data directly inside `element`.
std::string ownText(const pugi::xml_node& element) {
    std::string text;
    for (const pugi::xml_node& child : element.children()) {
        if (child.type() == pugi::node_pcdata || child.type() == pugi::node_cdata) {
            text += child.value();
        }
    }
    return text;
}

// `error` with `underlying` as the reason behind it.
GWErrorPtr withUnderlyingError(const GWErrorPtr& error, const GWErrorPtr& underlying) {
    return std::make_shared<GWError>(
        error->domain(), error->code(), error->URL(), underlying, error->userInfo(),
        error->localizedDescription() + " (" + underlying->localizedDescription() + ")");
}

}  // namespace

bool GWXARLoadOperation::loadSignaturesWithTOC(const pugi::xml_node& toc, GWErrorPtr* error) {
    std::vector<pugi::xml_node> candidates;
    for (const char* name : {"signature", "x-signature"}) {
        for (const pugi::xml_node& element : toc.children(name)) {
            candidates.push_back(element);
        }
    }

    GWXARSignatureArray loaded;
    loaded.reserve(candidates.size());
    for (const pugi::xml_node& element : candidates) {
        const pugi::xml_attribute style = element.attribute("style");
        const std::uint64_t type = style ? signatureTypeFromStyle(style.value()) : 0;
        if (type == 0) {
            return GWFail(error, errorWithCode(GWXARArchiveUnknownSignatureStyleError,
                                               style ? std::optional<std::string>(style.value())
                                                     : std::nullopt,
                                               element));
        }

        std::uint64_t offset = 0;
        std::uint64_t size = 0;
        std::optional<GWCertificateArray> certificates;
        for (const pugi::xml_node& child : element.children()) {
            if (child.type() != pugi::node_element) {
                continue;
            }
            const std::string_view name = child.name();
            if (name == "offset" || name == "size") {
                auto text = textContentOfElement(child, error);
                if (!text) {
                    return false;
                }
                auto value = GWXARScanUnsigned(*text);
                // An offset past 64 bits from the heap's start is as malformed as no number.
                if (value && name == "offset" && *value > UINT64_MAX - heapStart_) {
                    value.reset();
                }
                if (value && name == "size" && *value > kMaxSignatureLength) {
                    value.reset();
                }
                if (!value) {
                    return GWFail(error,
                                  errorWithCode(GWXARArchiveMalformedValueError, *text, child));
                }
                (name == "offset" ? offset : size) = *value;
            } else if (name == "KeyInfo") {
                certificates = certificatesFromKeyInfo(child, error);
                if (!certificates) {
                    return false;
                }
            }
        }

        auto bytes = heapBytes(offset, size, error);
        if (!bytes || !chargeTOCMemory(kReferenceMemoryCharge, error)) {
            return false;
        }
        loaded.push_back(
            GWXARSignature::initSharingData(type, std::move(bytes), std::move(certificates),
                                            std::string_view(element.name()) == "x-signature"));
    }
    signatures_ = std::move(loaded);
    return true;
}

std::optional<GWCertificateArray> GWXARLoadOperation::certificatesFromKeyInfo(
    const pugi::xml_node& keyInfo, GWErrorPtr* error) {
    GWCertificateArray certificates;
    for (const pugi::xml_node& data : keyInfo.children("X509Data")) {
        if (!data.child("X509Certificate")) {
            GWFail(error, errorWithCode(GWXARArchiveMissingCertificateError, std::nullopt,
                                        keyInfo.parent()));
            return std::nullopt;
        }
        for (const pugi::xml_node& element : data.children("X509Certificate")) {
            std::string text = ownText(element);
            if (auto known = certificatesByText_.find(text); known != certificatesByText_.end()) {
                certificates.push_back(known->second);
                continue;
            }
            auto der = GWPropertyListSerialization::dataWithBase64String(text, error);
            if (!der) {
                return std::nullopt;
            }
            // A parsed certificate takes a few times its encoding.
            if (!chargeTOCMemory(kReferenceMemoryCharge + 4 * der->size(), error)) {
                return std::nullopt;
            }
            auto certificate = GWCertificate::createWithData(*der);
            if (!certificate) {
                GWFail(error, errorWithCode(GWXARArchiveUntrustedCertificateError, text, element));
                return std::nullopt;
            }
            certificatesByText_.emplace(std::move(text), certificate);
            certificates.push_back(std::move(certificate));
        }
    }
    return certificates;
}

bool GWXARLoadOperation::verifySignaturesWithTOC(const pugi::xml_node& toc, int checksumAlgorithm,
                                                 GWErrorPtr* error) {
    if (!loadSignaturesWithTOC(toc, error)) {
        return false;
    }
    if (!signatures_->empty() && checksumAlgorithm == 0) {
        // Nothing was signed, so no signature can hold; callers report this
        // without an error object on purpose.
        return GWFail(error, nullptr);
    }
    const GWData& checksum = computedTOCChecksum_;
    for (const auto& signature : *signatures_) {
        if (!signature->certificates() || signature->certificates()->empty()) {
            return GWFail(error, errorWithCode(GWXARArchiveMissingCertificateError, std::nullopt,
                                               pugi::xml_node()));
        }
        if (!canTrustSignature(*signature, error) || !validateData(checksum, *signature, error)) {
            return false;
        }
    }
    return true;
}

bool GWXARLoadOperation::canTrustSignature(const GWXARSignature& signature, GWErrorPtr* error) {
    const auto& certificates = signature.certificates();
    if (!certificates || certificates->empty() || !certificates->front()) {
        return GWFail(error, errorWithCode(GWXARArchiveMissingCertificateError, std::nullopt,
                                           pugi::xml_node()));
    }
    long status = 0;
    auto store = GWXARCreateTrustStore(&status);
    if (!store) {
        return GWFail(error, GWSecurityError(status, false));
    }
    GWBorrowedCertificateStack intermediates(sk_X509_new_null());
    if (!intermediates) {
        return GWFail(
            error,
            GWSecurityError(
                GWOpenSSLTakeErrorStatus(ERR_PACK(ERR_LIB_X509, 0, ERR_R_MALLOC_FAILURE)), false));
    }
    for (std::size_t i = 1; i < certificates->size(); ++i) {
        if ((*certificates)[i] && !sk_X509_push(intermediates.get(), (*certificates)[i]->x509())) {
            return GWFail(error, GWSecurityError(GWOpenSSLTakeErrorStatus(ERR_PACK(
                                                     ERR_LIB_X509, 0, ERR_R_MALLOC_FAILURE)),
                                                 false));
        }
    }

    const GWXARTrustResult trust =
        GWXAREvaluateTrust(store.get(), certificates->front()->x509(), intermediates.get());
    switch (trust.kind) {
        case GWXARTrustResult::trusted: return true;
        case GWXARTrustResult::evaluationFailed: return GWFail(error, trust.securityError());
        case GWXARTrustResult::notTrusted:
            // The verify result says why, for whoever reads the error.
            return GWFail(error,
                          withUnderlyingError(errorWithCode(GWXARArchiveUntrustedCertificateError,
                                                            std::nullopt, pugi::xml_node()),
                                              trust.securityError()));
    }
    return false;
}

bool GWXARLoadOperation::validateData(const GWData& data, const GWXARSignature& signature,
                                      GWErrorPtr* error) {
    if (signature.type() == GWXARSignatureTypeCMS) {
        return validateDataWithCMSSignature(data, signature, error);
    }
    return validateDataWithTypicalSignature(data, signature, error);
}

bool GWXARLoadOperation::validateDataWithTypicalSignature(const GWData& data,
                                                          const GWXARSignature& signature,
                                                          GWErrorPtr* error) {
    const auto& certificates = signature.certificates();
    EVP_PKEY* key = certificates && !certificates->empty() && certificates->front()
                        ? X509_get0_pubkey(certificates->front()->x509())
                        : nullptr;
    if (!key) {
        const long status = GWOpenSSLTakeErrorStatus(
            ERR_PACK(ERR_LIB_X509, 0, X509_R_UNABLE_TO_GET_CERTS_PUBLIC_KEY));
        return GWFail(
            error, errorWithDomain(kGWOSStatusErrorDomain, status, std::nullopt, pugi::xml_node()));
    }
    const GWXARSignatureCheck check =
        GWXARVerifyDigestSignature(key, data, signature.signatureData());
    switch (check.kind) {
        case GWXARSignatureCheck::valid: return true;
        case GWXARSignatureCheck::failed:
            return GWFail(error, GWSecurityError(check.status, false));
        case GWXARSignatureCheck::invalid:
            return GWFail(error, errorWithCode(GWXARArchiveInvalidSignatureError, std::nullopt,
                                               pugi::xml_node()));
    }
    return false;
}

bool GWXARLoadOperation::validateDataWithCMSSignature(const GWData&,
                                                      const GWXARSignature& signature,
                                                      GWErrorPtr* error) {
    long status = 0;
    auto message = GWXARCMSMessage::decode(signature.signatureData(), &status);
    if (!message) {
        return GWFail(error, GWSecurityError(status, false));
    }
    // A failure here shows as invalid signers below.
    message->setDetachedContent(computedTOCChecksum_);

    const int signers = message->numberOfSigners();
    if (signers <= 0) {
        // A message without signers vouches for nothing yet is accepted, as
        // archives signed that way have always been.
        return true;
    }
    auto store = GWXARCreateTrustStore(&status);
    if (!store) {
        return GWFail(error, GWSecurityError(status, false));
    }
    for (int index = 0; index < signers; ++index) {
        const auto signer = message->signerStatus(index, store.get());
        if (signer.callFailed) {
            return GWFail(error, GWSecurityError(signer.status, false));
        }
        if (signer.trust.kind != GWXARTrustResult::trusted) {
            return GWFail(error, signer.trust.securityError());
        }
        if (!signer.signatureIsValid) {
            return GWFail(error, errorWithCode(GWXARArchiveInvalidSignatureError, std::nullopt,
                                               pugi::xml_node()));
        }
    }
    return true;
}
