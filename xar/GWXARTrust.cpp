#include "GWXARTrust.h"

#include <cerrno>
#include <climits>
#include <fstream>
#include <map>
#include <mutex>
#include <sstream>
#include <tuple>

#include <openssl/err.h>
#include <openssl/pem.h>

#include "GWCertificate.h"
#include "GWOpenSSL.h"

namespace {

std::string environmentValue(const char* name) {
    const char* value = std::getenv(name);
    return value ? value : "";
}

GWErrorPtr corruptAnchors(const char* problem) {
    return GWGenerateError(kGWCocoaErrorDomain, GWFileReadCorruptFileError, std::nullopt, nullptr,
                           {}, "The trusted certificates %s", problem);
}

}  // namespace

GWXARTrust::GWXARTrust(X509_STORE* store, std::size_t addedAnchors)
    : store_(store), addedAnchors_(addedAnchors) {}

GWXARTrust::~GWXARTrust() {
    X509_STORE_free(store_);
}

GWXARTrustPtr GWXARTrust::systemTrust(GWErrorPtr* error) {
    return make({}, false, error);
}

GWXARTrustPtr GWXARTrust::trustWithAnchorsPEM(std::string_view pem, GWErrorPtr* error) {
    return make(pem, true, error);
}

GWXARTrustPtr GWXARTrust::trustWithAnchorsFile(const std::string& path, GWErrorPtr* error) {
    std::ifstream file(path, std::ios::binary);
    std::ostringstream text;
    if (!file || !(text << file.rdbuf())) {
        const int number = errno != 0 ? errno : EIO;
        GWFail(error, GWPOSIXError(number, GWURL::fileURLWithPath(path)));
        return nullptr;
    }
    return trustWithAnchorsPEM(text.str(), error);
}

GWXARTrustPtr GWXARTrust::make(std::string_view pem, bool addAnchors, GWErrorPtr* error) {
    static std::mutex mutex;
    static std::map<std::tuple<std::string, std::string, std::string>, GWXARTrustPtr> made;
    auto key = std::make_tuple(environmentValue("SSL_CERT_FILE"), environmentValue("SSL_CERT_DIR"),
                               std::string(addAnchors ? pem : std::string_view()));
    std::lock_guard<std::mutex> lock(mutex);
    if (auto found = made.find(key); found != made.end()) {
        return found->second;
    }

    GWOpenSSLPtr<X509_STORE> store(X509_STORE_new());
    // A missing default file or folder is no failure: the store is then just empty.
    if (!store || X509_STORE_set_default_paths(store.get()) != 1) {
        GWFail(error, GWSecurityError(
                          GWOpenSSLTakeErrorStatus(ERR_PACK(ERR_LIB_X509, 0, ERR_R_MALLOC_FAILURE)),
                          false));
        return nullptr;
    }
    ERR_clear_error();
    std::size_t added = 0;
    if (addAnchors) {
        if (pem.size() > std::size_t(INT_MAX)) {
            GWFail(error, corruptAnchors("are too large"));
            return nullptr;
        }
        GWOpenSSLPtr<BIO> source(BIO_new_mem_buf(pem.data(), int(pem.size())));
        for (;;) {
            GWOpenSSLPtr<X509> certificate(
                source ? PEM_read_bio_X509(source.get(), nullptr, nullptr, nullptr) : nullptr);
            if (!certificate) {
                // The end of the text reads as a missing "BEGIN" line.
                const bool atEnd = ERR_GET_REASON(ERR_peek_last_error()) == PEM_R_NO_START_LINE;
                ERR_clear_error();
                if (atEnd && added > 0) {
                    break;
                }
                GWFail(error, corruptAnchors(atEnd ? "hold no PEM certificate"
                                                   : "hold a PEM certificate that does not parse"));
                return nullptr;
            }
            if (X509_STORE_add_cert(store.get(), certificate.get()) != 1) {
                GWFail(error, GWSecurityError(GWOpenSSLTakeErrorStatus(0), false));
                return nullptr;
            }
            ++added;
        }
    }
    GWXARTrustPtr trust(new GWXARTrust(store.release(), added));
    made.emplace(std::move(key), trust);
    return trust;
}

GWXARTrustResult GWXARTrust::evaluate(X509* leaf, STACK_OF(X509) * untrusted) const {
    GWXARTrustResult result;
    GWOpenSSLPtr<X509_STORE_CTX> context(X509_STORE_CTX_new());
    if (!context || X509_STORE_CTX_init(context.get(), store_, leaf, untrusted) != 1) {
        result.status = GWOpenSSLTakeErrorStatus(ERR_PACK(ERR_LIB_X509, 0, ERR_R_MALLOC_FAILURE));
        return result;
    }
    // No purpose is set, so no extended key usage is demanded of the leaf.
    const int verified = X509_verify_cert(context.get());
    result.status = X509_STORE_CTX_get_error(context.get());
    result.statusIsVerifyResult = true;
    const STACK_OF(X509)* chain = X509_STORE_CTX_get0_chain(context.get());
    int length = chain ? sk_X509_num(chain) : 0;
    if (verified != 1) {
        // The chain stops at the certificate that failed it.
        length = std::min(length, X509_STORE_CTX_get_error_depth(context.get()) + 1);
    }
    for (int index = 0; index < length; ++index) {
        result.chain.push_back(
            GWCertificate::commonNameOf(sk_X509_value(chain, index)).value_or("(no common name)"));
    }
    if (verified == 1) {
        ERR_clear_error();
        result.kind = GWXARTrustResult::trusted;
        result.status = X509_V_OK;
        return result;
    }
    if (result.status == X509_V_OK) {
        result.status = X509_V_ERR_UNSPECIFIED;
    }
    if (verified < 0) {
        if (const long status = GWOpenSSLTakeErrorStatus(0)) {
            result.status = status;
            result.statusIsVerifyResult = false;
        }
        return result;
    }
    ERR_clear_error();
    result.kind = GWXARTrustResult::notTrusted;
    return result;
}

GWErrorPtr GWXARTrustResult::securityError() const {
    return GWSecurityError(status, statusIsVerifyResult);
}

std::string GWXARTrustResult::reason() const {
    if (!statusIsVerifyResult) {
        return "trust could not be evaluated";
    }
    switch (status) {
        case X509_V_OK: return "";
        // Each of these means the chain does not reach an anchor.
        case X509_V_ERR_UNABLE_TO_GET_ISSUER_CERT:
        case X509_V_ERR_UNABLE_TO_GET_ISSUER_CERT_LOCALLY:
        case X509_V_ERR_DEPTH_ZERO_SELF_SIGNED_CERT:
        case X509_V_ERR_SELF_SIGNED_CERT_IN_CHAIN: return "unknown issuer";
        case X509_V_ERR_CERT_HAS_EXPIRED: return "expired";
        case X509_V_ERR_CERT_NOT_YET_VALID: return "not yet valid";
        case X509_V_ERR_INVALID_CA: return "not a CA";
        default: return X509_verify_cert_error_string(status);
    }
}
