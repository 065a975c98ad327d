#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <span>
#include <string>
#include <vector>

#include "GWCoder.h"
#include "GWError.h"
#include "GWExport.h"
#include "GWValue.h"

// Digest algorithms of stored streams: the GWChecksum numbers (1 and 2 are
// not used by XAR and print as unknown).
enum GWXARChecksumType : std::uint64_t {
    GWXARChecksumTypeNone = 0,
    GWXARChecksumTypeMD2 = 3,
    GWXARChecksumTypeMD5 = 4,
    GWXARChecksumTypeSHA1 = 5,
    GWXARChecksumTypeSHA224 = 6,
    GWXARChecksumTypeSHA256 = 7,
    GWXARChecksumTypeSHA384 = 8,
    GWXARChecksumTypeSHA512 = 9,
};

// How a stored stream is encoded in the heap.
enum GWXARCompressionType : std::uint64_t {
    GWXARCompressionTypeNone = 0,
    GWXARCompressionTypeGZip = 1,
    GWXARCompressionTypeBZ2 = 2,
    GWXARCompressionTypeLZMA = 3,
    GWXARCompressionTypeXZ = 4,
};

class GWXARDataReference;
using GWXARDataReferencePtr = std::shared_ptr<GWXARDataReference>;
using GWXARDataReferenceArray = std::vector<GWXARDataReferencePtr>;

// (decoded piece or none, last call, stored digests did not match, error)
// -> go on? The last call of a stream alone carries `isDone`; the checksum
// verdict arrives with it.
using GWXARDataHandler =
    std::function<bool(std::optional<std::span<const std::uint8_t>> data, bool isDone,
                       bool checksumFailed, const GWErrorPtr& error)>;

// One stored stream of an entry: its data fork or one extended attribute.
// A plain value: it never reads the archive itself.
class GW_EXPORT GWXARDataReference : public GWCoding {
public:
    static constexpr const char* kClassName = "GWXARDataReference";

    static GWXARDataReferencePtr init() { return std::make_shared<GWXARDataReference>(); }

    // The attribute name of an extended attribute; unused for a data fork.
    const std::optional<std::string>& name() const { return name_; }
    void setName(std::optional<std::string> name) { name_ = std::move(name); }
    // Absolute position of the stored bytes in the archive file.
    std::uint64_t offset() const { return offset_; }
    void setOffset(std::uint64_t offset) { offset_ = offset; }
    std::uint64_t compressedSize() const { return compressedSize_; }
    void setCompressedSize(std::uint64_t size) { compressedSize_ = size; }
    // Digest of the stored bytes.
    const std::optional<GWData>& compressedChecksum() const { return compressedChecksum_; }
    void setCompressedChecksum(std::optional<GWData> checksum) {
        compressedChecksum_ = std::move(checksum);
    }
    std::uint64_t compressedChecksumType() const { return compressedChecksumType_; }
    void setCompressedChecksumType(std::uint64_t type) { compressedChecksumType_ = type; }
    std::uint64_t uncompressedSize() const { return uncompressedSize_; }
    void setUncompressedSize(std::uint64_t size) { uncompressedSize_ = size; }
    // Digest of the decoded bytes.
    const std::optional<GWData>& uncompressedChecksum() const { return uncompressedChecksum_; }
    void setUncompressedChecksum(std::optional<GWData> checksum) {
        uncompressedChecksum_ = std::move(checksum);
    }
    std::uint64_t uncompressedChecksumType() const { return uncompressedChecksumType_; }
    void setUncompressedChecksumType(std::uint64_t type) { uncompressedChecksumType_ = type; }
    std::uint64_t compressionType() const { return compressionType_; }
    void setCompressionType(std::uint64_t type) { compressionType_ = type; }

    // "None", "MD2", ... "SHA512"; "Unknown" for any other number.
    static std::string stringFromChecksumType(std::uint64_t type);
    // "none", "GZip", "BZ2", "LZMA"; "Unknown" for any other number.
    static std::string stringFromCompressionType(std::uint64_t type);

    std::string description() const;

    std::string className() const override { return kClassName; }
    // Writes nothing to a non-keyed coder.
    void encodeWithCoder(GWCoder& coder) const override;
    // None from a non-keyed coder.
    static GWXARDataReferencePtr initWithCoder(GWCoder& coder);

    // Always a GWXARDataReference, whatever the receiver's class.
    GWXARDataReferencePtr copy() const;

private:
    std::optional<std::string> name_;
    std::uint64_t offset_ = 0;
    std::uint64_t compressedSize_ = 0;
    std::optional<GWData> compressedChecksum_;
    std::uint64_t compressedChecksumType_ = 0;
    std::uint64_t uncompressedSize_ = 0;
    std::optional<GWData> uncompressedChecksum_;
    std::uint64_t uncompressedChecksumType_ = 0;
    std::uint64_t compressionType_ = 0;
};
