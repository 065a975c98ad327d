#include "GWCertificate.h"

#include <climits>

#include <openssl/x509.h>

#include "GWOpenSSL.h"

GWCertificatePtr GWCertificate::createWithData(std::span<const std::uint8_t> der) {
    if (der.empty() || der.size() > std::size_t(LONG_MAX)) {
        return nullptr;
    }
    const unsigned char* cursor = der.data();
    GWOpenSSLPtr<X509> certificate(d2i_X509(nullptr, &cursor, long(der.size())));
    // Bytes after the certificate would make the same text stand for different data.
    if (!certificate || cursor != der.data() + der.size()) {
        GWOpenSSLTakeErrorStatus(0);
        return nullptr;
    }
    return GWCertificatePtr(
        new GWCertificate(certificate.release(), GWData(der.begin(), der.end())));
}

GWCertificate::GWCertificate(X509* certificate, GWData der)
    : certificate_(certificate), der_(std::move(der)) {}

GWCertificate::~GWCertificate() {
    X509_free(certificate_);
}

std::optional<std::string> GWCertificate::commonNameOf(const X509* certificate) {
    const X509_NAME* subject = certificate ? X509_get_subject_name(certificate) : nullptr;
    if (!subject) {
        return std::nullopt;
    }
    // The most specific name comes last when a subject carries several.
    int index = -1;
    for (int next = X509_NAME_get_index_by_NID(subject, NID_commonName, -1); next >= 0;
         next = X509_NAME_get_index_by_NID(subject, NID_commonName, next)) {
        index = next;
    }
    if (index < 0) {
        return std::nullopt;
    }
    const ASN1_STRING* value = X509_NAME_ENTRY_get_data(X509_NAME_get_entry(subject, index));
    unsigned char* utf8 = nullptr;
    const int length = value ? ASN1_STRING_to_UTF8(&utf8, value) : -1;
    if (length < 0) {
        GWOpenSSLTakeErrorStatus(0);
        return std::nullopt;
    }
    std::string name(reinterpret_cast<const char*>(utf8), std::size_t(length));
    OPENSSL_free(utf8);
    return name;
}
