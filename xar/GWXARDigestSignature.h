#pragma once

#include <cstdint>
#include <span>

#include "GWOpenSSL.h"

struct GWXARSignatureCheck {
    enum Kind { valid, invalid, failed };
    Kind kind;
    long status;  // an OpenSSL error code when failed
};

// Checks an RSA (PKCS #1 v1.5), DSA or ECDSA signature made over `digest`
// itself, not over data still to be hashed. A 20-byte digest is taken as
// SHA-1 and a 16-byte one as MD5.
GWXARSignatureCheck GWXARVerifyDigestSignature(EVP_PKEY* key, std::span<const std::uint8_t> digest,
                                               std::span<const std::uint8_t> signature);
