#include "GWXARDigestSignature.h"

#include <openssl/err.h>
#include <openssl/rsa.h>

namespace {

const EVP_MD* digestForLength(std::size_t length) {
    switch (length) {
        case 20: return EVP_sha1();
        case 16: return EVP_md5();
        default: return nullptr;
    }
}

GWXARSignatureCheck failed() {
    return {GWXARSignatureCheck::failed,
            GWOpenSSLTakeErrorStatus(ERR_PACK(ERR_LIB_EVP, 0, ERR_R_INTERNAL_ERROR))};
}

}  // namespace

GWXARSignatureCheck GWXARVerifyDigestSignature(EVP_PKEY* key, std::span<const std::uint8_t> digest,
                                               std::span<const std::uint8_t> signature) {
    GWOpenSSLPtr<EVP_PKEY_CTX> context(EVP_PKEY_CTX_new(key, nullptr));
    if (!context || EVP_PKEY_verify_init(context.get()) != 1) {
        return failed();
    }
    const bool isRSA = EVP_PKEY_is_a(key, "RSA");
    if (isRSA && EVP_PKEY_CTX_set_rsa_padding(context.get(), RSA_PKCS1_PADDING) != 1) {
        return failed();
    }
    if (const EVP_MD* md = digestForLength(digest.size())) {
        // RSA needs the digest to know what it signed; DSA and ECDSA sign the
        // bare digest and refuse MD5 as a named digest, so for them it is only a hint.
        if (EVP_PKEY_CTX_set_signature_md(context.get(), md) != 1) {
            if (isRSA) {
                return failed();
            }
            ERR_clear_error();
        }
    }
    const int result = EVP_PKEY_verify(context.get(), signature.data(), signature.size(),
                                       digest.data(), digest.size());
    // Anything but a match, a signature that does not even parse included, is a bad signature.
    ERR_clear_error();
    return {result == 1 ? GWXARSignatureCheck::valid : GWXARSignatureCheck::invalid, 0};
}
