#pragma once

#include "GWOpenSSL.h"

// Trust in signing certificates: chains are built to the system's trusted
// roots (SSL_CERT_FILE and SSL_CERT_DIR choose others) under the basic X.509
// policy, without host name or key usage constraints.

// None, with the provider's status, when the store cannot be made.
GWOpenSSLPtr<X509_STORE> GWXARCreateTrustStore(long* status);

struct GWXARTrustResult {
    enum Kind { trusted, notTrusted, evaluationFailed };
    Kind kind;
    // X509_V_OK when trusted; else an X.509 verify result or an OpenSSL error code.
    long status;
    bool statusIsVerifyResult;

    GWErrorPtr securityError() const { return GWSecurityError(status, statusIsVerifyResult); }
};

// `untrusted` may help build the chain but is never an anchor.
GWXARTrustResult GWXAREvaluateTrust(X509_STORE* store, X509* leaf, STACK_OF(X509) * untrusted);
