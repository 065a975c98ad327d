#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <span>

#include "GWError.h"
#include "GWURL.h"
#include "GWValue.h"

// Checksum algorithm numbers, shared by ZIP entries, XAR headers and data references.
enum GWChecksumAlgorithm : int {
    GWChecksumAlgorithmUnknown = -1,
    GWChecksumAlgorithmNone = 0,
    GWChecksumAlgorithmCRC32 = 1,  // least significant byte first, as ZIP stores it
    GWChecksumAlgorithmMD2 = 3,
    GWChecksumAlgorithmMD5 = 4,
    GWChecksumAlgorithmSHA1 = 5,
    GWChecksumAlgorithmSHA224 = 6,
    GWChecksumAlgorithmSHA256 = 7,
    GWChecksumAlgorithmSHA384 = 8,
    GWChecksumAlgorithmSHA512 = 9,
};

// A digest computed piece by piece.
class GWChecksum {
public:
    // None for algorithm 0 and for numbers that name no digest.
    static std::unique_ptr<GWChecksum> checksumWithAlgorithm(int algorithm);
    virtual ~GWChecksum() = default;

    virtual void update(std::span<const std::uint8_t> bytes) = 0;
    // The digest of everything given so far; the object is spent afterwards.
    virtual GWData finish() = 0;

    // 0 for algorithms without a digest.
    static std::size_t digestLength(int algorithm);

    // The digest of a buffer; empty for algorithms without a digest.
    static GWData checksumForData(std::span<const std::uint8_t> bytes, int algorithm);
    // The digest of a file's whole contents, read in large pieces.
    static std::optional<GWData> checksumAtURL(const GWURL& url, int algorithm, GWErrorPtr* error);
};

// MD2, which OpenSSL builds omit.
class GWMD2 {
public:
    void update(std::span<const std::uint8_t> bytes);
    GWData finish();

private:
    void compress(const std::uint8_t* block);

    std::uint8_t state_[48] = {};
    std::uint8_t checksum_[16] = {};
    std::uint8_t buffer_[16] = {};
    std::size_t buffered_ = 0;
};
