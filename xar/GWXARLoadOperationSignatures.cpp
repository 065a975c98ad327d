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
    // Every signature gets its verdict; the worst one decides, the first of
    // equals. Only the deciding error is kept: there may be 100,000 signatures.
    std::optional<SignatureCheck> deciding;
    for (auto& signature : *signatures_) {
        // Without a checksum nothing was signed, so no signature can hold;
        // callers report this without an error object on purpose.
        SignatureCheck check{GWXARSignatureVerdictInvalid, "no checksum was signed", {}, nullptr};
        if (checksumAlgorithm != 0) {
            check = checkSignature(*signature);
        }
        signature = signature->copyWithVerdict(check.verdict, check.reason, check.chain);
        if (!deciding || check.verdict > deciding->verdict) {
            deciding = std::move(check);
        }
    }
    if (!deciding || deciding->verdict == GWXARSignatureVerdictValid) {
        return true;
    }
    return GWFail(error, deciding->error);
}

const GWXARTrust* GWXARLoadOperation::effectiveTrust(GWErrorPtr* error) {
    if (!trust_) {
        trust_ = GWXARTrust::systemTrust(error);
    }
    return trust_.get();
}

GWXARTrustResult GWXARLoadOperation::evaluateKeyInfo(const GWXARSignature& signature,
                                                     GWErrorPtr* error) {
    GWXARTrustResult failed;
    const auto& certificates = signature.certificates();
    if (!certificates || certificates->empty() || !certificates->front()) {
        GWFail(error,
               errorWithCode(GWXARArchiveMissingCertificateError, std::nullopt, pugi::xml_node()));
        return failed;
    }
    std::vector<const GWCertificate*> key;
    for (const auto& certificate : *certificates) {
        key.push_back(certificate.get());
    }
    auto known = trustByChain_.find(key);
    if (known == trustByChain_.end()) {
        const GWXARTrust* trust = effectiveTrust(error);
        if (!trust) {
            return failed;
        }
        GWBorrowedCertificateStack intermediates(sk_X509_new_null());
        for (std::size_t i = 1; intermediates && i < certificates->size(); ++i) {
            if ((*certificates)[i] &&
                !sk_X509_push(intermediates.get(), (*certificates)[i]->x509())) {
                intermediates.reset();
            }
        }
        if (!intermediates) {
            failed.status =
                GWOpenSSLTakeErrorStatus(ERR_PACK(ERR_LIB_X509, 0, ERR_R_MALLOC_FAILURE));
            GWFail(error, failed.securityError());
            return failed;
        }
        known = trustByChain_
                    .emplace(std::move(key),
                             trust->evaluate(certificates->front()->x509(), intermediates.get()))
                    .first;
    }
    const GWXARTrustResult& result = known->second;
    if (result.kind == GWXARTrustResult::evaluationFailed) {
        GWFail(error, result.securityError());
    } else if (result.kind == GWXARTrustResult::notTrusted) {
        // The verify result says why, for whoever reads the error.
        GWFail(error, withUnderlyingError(errorWithCode(GWXARArchiveUntrustedCertificateError,
                                                        std::nullopt, pugi::xml_node()),
                                          result.securityError()));
    }
    return result;
}

bool GWXARLoadOperation::canTrustSignature(const GWXARSignature& signature, GWErrorPtr* error) {
    return evaluateKeyInfo(signature, error).kind == GWXARTrustResult::trusted;
}

bool GWXARLoadOperation::validateData(const GWData& data, const GWXARSignature& signature,
                                      GWErrorPtr* error) {
    const SignatureCheck check = signature.type() == GWXARSignatureTypeCMS
                                     ? checkCMSSignature(signature)
                                     : checkTypicalSignature(data, signature);
    return check.verdict == GWXARSignatureVerdictValid || GWFail(error, check.error);
}

GWXARLoadOperation::SignatureCheck GWXARLoadOperation::checkSignature(
    const GWXARSignature& signature) {
    const auto& certificates = signature.certificates();
    if (!certificates || certificates->empty()) {
        return {GWXARSignatureVerdictInvalid,
                "no certificates",
                {},
                errorWithCode(GWXARArchiveMissingCertificateError, std::nullopt, pugi::xml_node())};
    }
    // A signature that does not check out is invalid whoever vouches for its certificates.
    SignatureCheck check = signature.type() == GWXARSignatureTypeCMS
                               ? checkCMSSignature(signature)
                               : checkTypicalSignature(computedTOCChecksum_, signature);
    if (check.verdict == GWXARSignatureVerdictInvalid) {
        return check;
    }
    GWErrorPtr trustError;
    GWXARTrustResult trust = evaluateKeyInfo(signature, &trustError);
    if (trust.kind != GWXARTrustResult::trusted) {
        return {GWXARSignatureVerdictUntrusted, trust.reason(), std::move(trust.chain), trustError};
    }
    if (check.chain.empty()) {
        check.chain = std::move(trust.chain);
    }
    return check;
}

GWXARLoadOperation::SignatureCheck GWXARLoadOperation::checkTypicalSignature(
    const GWData& data, const GWXARSignature& signature) {
    const auto& certificates = signature.certificates();
    EVP_PKEY* key = certificates && !certificates->empty() && certificates->front()
                        ? X509_get0_pubkey(certificates->front()->x509())
                        : nullptr;
    if (!key) {
        const long status = GWOpenSSLTakeErrorStatus(
            ERR_PACK(ERR_LIB_X509, 0, X509_R_UNABLE_TO_GET_CERTS_PUBLIC_KEY));
        return {GWXARSignatureVerdictInvalid,
                "the leaf's public key is unusable",
                {},
                errorWithDomain(kGWOSStatusErrorDomain, status, std::nullopt, pugi::xml_node())};
    }
    const GWXARSignatureCheck check =
        GWXARVerifyDigestSignature(key, data, signature.signatureData());
    switch (check.kind) {
        case GWXARSignatureCheck::valid: return {GWXARSignatureVerdictValid, "", {}, nullptr};
        case GWXARSignatureCheck::failed:
            return {GWXARSignatureVerdictInvalid,
                    "the signature could not be checked",
                    {},
                    GWSecurityError(check.status, false)};
        case GWXARSignatureCheck::invalid: break;
    }
    return {GWXARSignatureVerdictInvalid,
            "the signature does not match the checksum",
            {},
            errorWithCode(GWXARArchiveInvalidSignatureError, std::nullopt, pugi::xml_node())};
}

GWXARLoadOperation::SignatureCheck GWXARLoadOperation::checkCMSSignature(
    const GWXARSignature& signature) {
    long status = 0;
    auto message = GWXARCMSMessage::decode(signature.signatureData(), &status);
    if (!message) {
        return {GWXARSignatureVerdictInvalid,
                "not a CMS signed-data message",
                {},
                GWSecurityError(status, false)};
    }
    // A failure here shows as invalid signers below.
    message->setDetachedContent(computedTOCChecksum_);

    const int signers = message->numberOfSigners();
    if (signers <= 0) {
        // Any certificates at all could ride in such a message: it vouches for nothing.
        return {GWXARSignatureVerdictInvalid,
                "no signers",
                {},
                errorWithCode(GWXARArchiveInvalidSignatureError, std::nullopt, pugi::xml_node())};
    }
    GWErrorPtr trustError;
    const GWXARTrust* trust = effectiveTrust(&trustError);
    if (!trust) {
        return {GWXARSignatureVerdictUntrusted, "trust could not be evaluated", {}, trustError};
    }
    std::optional<SignatureCheck> untrusted;
    std::vector<std::string> chain;
    for (int index = 0; index < signers; ++index) {
        auto signer = message->signerStatus(index, *trust);
        if (signer.callFailed) {
            return {GWXARSignatureVerdictInvalid,
                    "a signer's certificate is missing",
                    {},
                    GWSecurityError(signer.status, false)};
        }
        if (!signer.signatureIsValid) {
            return {
                GWXARSignatureVerdictInvalid,
                "a signer's signature does not match the checksum",
                {},
                errorWithCode(GWXARArchiveInvalidSignatureError, std::nullopt, pugi::xml_node())};
        }
        if (signer.trust.kind != GWXARTrustResult::trusted && !untrusted) {
            untrusted = SignatureCheck{GWXARSignatureVerdictUntrusted, signer.trust.reason(),
                                       signer.trust.chain, signer.trust.securityError()};
        }
        if (index == 0) {
            chain = std::move(signer.trust.chain);
        }
    }
    if (untrusted) {
        return *untrusted;
    }
    return {GWXARSignatureVerdictValid, "", std::move(chain), nullptr};
}
