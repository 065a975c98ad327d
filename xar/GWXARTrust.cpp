#include "GWXARTrust.h"

#include <openssl/err.h>

GWOpenSSLPtr<X509_STORE> GWXARCreateTrustStore(long* status) {
    GWOpenSSLPtr<X509_STORE> store(X509_STORE_new());
    // A missing default file or folder is no failure: the store is then just empty.
    if (!store || X509_STORE_set_default_paths(store.get()) != 1) {
        *status = GWOpenSSLTakeErrorStatus(ERR_PACK(ERR_LIB_X509, 0, ERR_R_MALLOC_FAILURE));
        return nullptr;
    }
    ERR_clear_error();
    return store;
}

GWXARTrustResult GWXAREvaluateTrust(X509_STORE* store, X509* leaf, STACK_OF(X509) * untrusted) {
    GWOpenSSLPtr<X509_STORE_CTX> context(X509_STORE_CTX_new());
    if (!context || X509_STORE_CTX_init(context.get(), store, leaf, untrusted) != 1) {
        return {GWXARTrustResult::evaluationFailed,
                GWOpenSSLTakeErrorStatus(ERR_PACK(ERR_LIB_X509, 0, ERR_R_MALLOC_FAILURE)), false};
    }
    // No purpose is set, so no extended key usage is demanded of the leaf.
    const int verified = X509_verify_cert(context.get());
    long result = X509_STORE_CTX_get_error(context.get());
    if (verified == 1) {
        ERR_clear_error();
        return {GWXARTrustResult::trusted, X509_V_OK, true};
    }
    if (result == X509_V_OK) {
        result = X509_V_ERR_UNSPECIFIED;
    }
    if (verified < 0) {
        const long status = GWOpenSSLTakeErrorStatus(0);
        return status != 0 ? GWXARTrustResult{GWXARTrustResult::evaluationFailed, status, false}
                           : GWXARTrustResult{GWXARTrustResult::evaluationFailed, result, true};
    }
    ERR_clear_error();
    return {GWXARTrustResult::notTrusted, result, true};
}
