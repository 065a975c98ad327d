#pragma once

#include <memory>
#include <string>
#include <string_view>
#include <vector>

#include "GWError.h"
#include "GWExport.h"

typedef struct x509_st X509;
typedef struct x509_store_st X509_STORE;
struct stack_st_X509;

// The certificates a signing chain may end at: the system's trusted roots
// (SSL_CERT_FILE and SSL_CERT_DIR choose others) and any the caller adds.
// Making one reads the whole system bundle, so one is made per process and
// per set of added anchors, and shared; evaluating is thread-safe.
class GWXARTrust;
using GWXARTrustPtr = std::shared_ptr<const GWXARTrust>;

class GW_EXPORT GWXARTrust {
public:
    // The system's roots as SSL_CERT_FILE and SSL_CERT_DIR now name them;
    // later calls with the same settings get the same object.
    static GWXARTrustPtr systemTrust(GWErrorPtr* error);
    // The system's roots and every PEM certificate in `pem`. Text without a
    // certificate, or with a broken one, is a corrupt-file error (Cocoa 259).
    static GWXARTrustPtr trustWithAnchorsPEM(std::string_view pem, GWErrorPtr* error);
    // The same, read from a file.
    static GWXARTrustPtr trustWithAnchorsFile(const std::string& path, GWErrorPtr* error);

    ~GWXARTrust();
    GWXARTrust(const GWXARTrust&) = delete;
    GWXARTrust& operator=(const GWXARTrust&) = delete;

    // How many certificates the caller added.
    std::size_t addedAnchorCount() const { return addedAnchors_; }

    // The basic X.509 policy: no host name, no key usage demanded.
    // `untrusted` may help build the chain but is never an anchor.
    struct Result;
    Result evaluate(X509* leaf, stack_st_X509* untrusted) const;

private:
    GWXARTrust(X509_STORE* store, std::size_t addedAnchors);
    static GWXARTrustPtr make(std::string_view pem, bool addAnchors, GWErrorPtr* error);

    X509_STORE* store_;
    std::size_t addedAnchors_;
};

struct GWXARTrust::Result {
    enum Kind { trusted, notTrusted, evaluationFailed };
    Kind kind = evaluationFailed;
    // X509_V_OK when trusted; else an X.509 verify result or an OpenSSL error code.
    long status = 0;
    bool statusIsVerifyResult = false;
    // Common names of the chain, leaf first: up to the anchor when trusted,
    // up to the certificate the evaluation stopped at when not.
    std::vector<std::string> chain;

    GWErrorPtr securityError() const;
    // In a few words: "unknown issuer", "expired", "not a CA", ...
    std::string reason() const;
};

using GWXARTrustResult = GWXARTrust::Result;
