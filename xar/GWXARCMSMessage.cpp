#include "GWXARCMSMessage.h"

#include <climits>

#include <openssl/cmserr.h>
#include <openssl/err.h>

GWXARCMSMessage::GWXARCMSMessage(GWOpenSSLPtr<CMS_ContentInfo> message)
    : message_(std::move(message)) {}

std::unique_ptr<GWXARCMSMessage> GWXARCMSMessage::decode(std::span<const std::uint8_t> der,
                                                         long* status) {
    const long fallback = ERR_PACK(ERR_LIB_CMS, 0, CMS_R_CONTENT_TYPE_NOT_SIGNED_DATA);
    if (der.empty() || der.size() > std::size_t(LONG_MAX)) {
        *status = fallback;
        return nullptr;
    }
    const unsigned char* cursor = der.data();
    GWOpenSSLPtr<CMS_ContentInfo> message(d2i_CMS_ContentInfo(nullptr, &cursor, long(der.size())));
    if (!message) {
        *status = GWOpenSSLTakeErrorStatus(fallback);
        return nullptr;
    }
    if (OBJ_obj2nid(CMS_get0_type(message.get())) != NID_pkcs7_signed ||
        !CMS_get0_SignerInfos(message.get())) {
        ERR_clear_error();
        *status = fallback;
        return nullptr;
    }
    // Gives each signer the certificate the message carries for it, if any.
    CMS_set1_signers_certs(message.get(), nullptr, 0);
    ERR_clear_error();
    return std::unique_ptr<GWXARCMSMessage>(new GWXARCMSMessage(std::move(message)));
}

bool GWXARCMSMessage::setDetachedContent(std::span<const std::uint8_t> content) {
    static const unsigned char kNothing = 0;
    digestChain_.reset();
    if (content.size() > std::size_t(INT_MAX)) {
        return false;
    }
    GWOpenSSLPtr<BIO> source(
        BIO_new_mem_buf(content.empty() ? &kNothing : content.data(), int(content.size())));
    BIO* chain = source ? CMS_dataInit(message_.get(), source.get()) : nullptr;
    if (!chain) {
        ERR_clear_error();
        return false;
    }
    source.release();  // now the end of the chain
    GWOpenSSLPtr<BIO> owned(chain);
    unsigned char buffer[4096];
    int got = 0;
    while ((got = BIO_read(owned.get(), buffer, int(sizeof buffer))) > 0) {
    }
    if (got < 0) {
        ERR_clear_error();
        return false;
    }
    digestChain_ = std::move(owned);
    return true;
}

int GWXARCMSMessage::numberOfSigners() const {
    return sk_CMS_SignerInfo_num(CMS_get0_SignerInfos(message_.get()));
}

GWXARCMSMessage::SignerStatus GWXARCMSMessage::signerStatus(int index,
                                                            const GWXARTrust& trust) const {
    SignerStatus result{false, 0, false, {}};
    CMS_SignerInfo* signer = sk_CMS_SignerInfo_value(CMS_get0_SignerInfos(message_.get()), index);
    X509* certificate = nullptr;
    if (signer) {
        CMS_SignerInfo_get0_algs(signer, nullptr, &certificate, nullptr, nullptr);
    }
    if (!certificate) {
        result.callFailed = true;
        result.status = ERR_PACK(ERR_LIB_CMS, 0, CMS_R_SIGNER_CERTIFICATE_NOT_FOUND);
        return result;
    }

    GWOwnedCertificateStack others(CMS_get1_certs(message_.get()));
    result.trust = trust.evaluate(certificate, others.get());

    // Signed attributes carry their own signature and the content's digest;
    // without them the signature covers the content's digest directly.
    bool valid = digestChain_ != nullptr;
    if (valid && CMS_signed_get_attr_count(signer) >= 0) {
        valid = CMS_SignerInfo_verify(signer) == 1;
    }
    if (valid) {
        valid = CMS_SignerInfo_verify_content(signer, digestChain_.get()) == 1;
    }
    ERR_clear_error();
    result.signatureIsValid = valid;
    return result;
}
