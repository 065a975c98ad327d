#include "GWOpenSSL.h"

#include <openssl/err.h>

long GWOpenSSLTakeErrorStatus(long fallback) {
    const unsigned long code = ERR_get_error();
    ERR_clear_error();
    return code != 0 ? long(code) : fallback;
}

GWErrorPtr GWSecurityError(long status, bool isVerifyResult) {
    std::string reason;
    if (isVerifyResult) {
        reason = X509_verify_cert_error_string(status);
    } else {
        char buffer[256] = {};
        ERR_error_string_n(static_cast<unsigned long>(status), buffer, sizeof buffer);
        reason = buffer;
    }
    return GWGenerateError(GWSecurityErrorDomain, status, std::nullopt, nullptr, {},
                           "Security error %ld: %s", status, reason.c_str());
}
