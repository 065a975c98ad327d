#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <span>
#include <string>
#include <vector>

#include "GWExport.h"
#include "GWValue.h"

typedef struct x509_st X509;

class GWCertificate;
using GWCertificatePtr = std::shared_ptr<const GWCertificate>;
using GWCertificateArray = std::vector<GWCertificatePtr>;

// An X.509 certificate, immutable once made, so that copies may share it.
class GW_EXPORT GWCertificate {
public:
    // None when the bytes are not exactly one DER-encoded certificate.
    static GWCertificatePtr createWithData(std::span<const std::uint8_t> der);

    ~GWCertificate();
    GWCertificate(const GWCertificate&) = delete;
    GWCertificate& operator=(const GWCertificate&) = delete;

    // The DER encoding, as it was given.
    const GWData& data() const { return der_; }
    // The last common name of the subject; none when it has none.
    std::optional<std::string> commonName() const { return commonNameOf(certificate_); }
    static std::optional<std::string> commonNameOf(const X509* certificate);

    // Owned by the certificate; valid as long as it lives.
    X509* x509() const { return certificate_; }

private:
    GWCertificate(X509* certificate, GWData der);

    X509* certificate_;
    GWData der_;
};
