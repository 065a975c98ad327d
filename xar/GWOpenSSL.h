#pragma once

#include <memory>
#include <string>

#include <openssl/bio.h>
#include <openssl/cms.h>
#include <openssl/evp.h>
#include <openssl/x509.h>
#include <openssl/x509_vfy.h>

#include "foundation/GWError.h"

// Owning pointers for the OpenSSL objects the signature checks use, so that
// every early return releases what was made.
struct GWOpenSSLFree {
    void operator()(X509* object) const { X509_free(object); }
    void operator()(X509_STORE* object) const { X509_STORE_free(object); }
    void operator()(X509_STORE_CTX* object) const { X509_STORE_CTX_free(object); }
    void operator()(EVP_PKEY* object) const { EVP_PKEY_free(object); }
    void operator()(EVP_PKEY_CTX* object) const { EVP_PKEY_CTX_free(object); }
    void operator()(CMS_ContentInfo* object) const { CMS_ContentInfo_free(object); }
    void operator()(BIO* object) const { BIO_free_all(object); }
};

template <typename T>
using GWOpenSSLPtr = std::unique_ptr<T, GWOpenSSLFree>;

// A stack that owns a reference to each certificate it holds.
struct GWOpenSSLFreeCertificates {
    void operator()(STACK_OF(X509) * stack) const { sk_X509_pop_free(stack, X509_free); }
};
using GWOwnedCertificateStack = std::unique_ptr<STACK_OF(X509), GWOpenSSLFreeCertificates>;

// A stack that borrows its certificates from their owners.
struct GWOpenSSLFreeStack {
    void operator()(STACK_OF(X509) * stack) const { sk_X509_free(stack); }
};
using GWBorrowedCertificateStack = std::unique_ptr<STACK_OF(X509), GWOpenSSLFreeStack>;

// The oldest error OpenSSL queued (or `fallback` when none was), and an empty
// queue afterwards so that a later check does not report a stale reason.
long GWOpenSSLTakeErrorStatus(long fallback);

// An error of the security domain: `status` is the provider's code and the
// description its text. `isVerifyResult` tells an X.509 verify result from a
// queued OpenSSL error code.
GWErrorPtr GWSecurityError(long status, bool isVerifyResult);
