#include "GWXARDataReference.h"

#include "GWXARDescribing.h"
#include "foundation/GWFormat.h"

namespace {

const char* const kNameKey = "Name";
const char* const kOffsetKey = "Offset";
const char* const kCompressedSizeKey = "CompressedSize";
const char* const kCompressedChecksumKey = "CompressedChecksum";
const char* const kCompressedChecksumAlgorithmKey = "CompressedChecksumAlgorithm";
const char* const kUncompressedSizeKey = "UncompressedSize";
const char* const kUncompressedChecksumKey = "UncompressedChecksum";
const char* const kUncompressedChecksumAlgorithmKey = "UncompressedChecksumAlgorithm";
const char* const kCompressionTypeKey = "CompressionType";

}  // namespace

std::string GWXARDataReference::stringFromChecksumType(std::uint64_t type) {
    switch (type) {
        case GWXARChecksumTypeNone: return "None";
        case GWXARChecksumTypeMD2: return "MD2";
        case GWXARChecksumTypeMD5: return "MD5";
        case GWXARChecksumTypeSHA1: return "SHA1";
        case GWXARChecksumTypeSHA224: return "SHA224";
        case GWXARChecksumTypeSHA256: return "SHA256";
        case GWXARChecksumTypeSHA384: return "SHA384";
        case GWXARChecksumTypeSHA512: return "SHA512";
        default: return "Unknown";
    }
}

std::string GWXARDataReference::stringFromCompressionType(std::uint64_t type) {
    switch (type) {
        case GWXARCompressionTypeNone: return "none";
        case GWXARCompressionTypeGZip: return "GZip";
        case GWXARCompressionTypeBZ2: return "BZ2";
        case GWXARCompressionTypeLZMA: return "LZMA";
        case GWXARCompressionTypeXZ: return "XZ";
        default: return "Unknown";
    }
}

std::string GWXARDataReference::description() const {
    using namespace GWXARDescribing;
    return GWFormat(
        "<%s %s\n\tname=%s\n\toffset=0x%llx\n\tcompressedSize=%llu bytes\n\tuncompressedSize=%llu "
        "bytes\n\tcompressedChecksum=%s (%s)\n\tuncompressedChecksum=%s "
        "(%s)\n\tcompressionType=%s\n>",
        className().c_str(), pointerText(this).c_str(), objectText(name_).c_str(),
        static_cast<unsigned long long>(offset_), static_cast<unsigned long long>(compressedSize_),
        static_cast<unsigned long long>(uncompressedSize_), objectText(compressedChecksum_).c_str(),
        stringFromChecksumType(compressedChecksumType_).c_str(),
        objectText(uncompressedChecksum_).c_str(),
        stringFromChecksumType(uncompressedChecksumType_).c_str(),
        stringFromCompressionType(compressionType_).c_str());
}

void GWXARDataReference::encodeWithCoder(GWCoder& coder) const {
    if (!coder.allowsKeyedCoding()) {
        return;
    }
    coder.encodeValue(name_, kNameKey);
    coder.encodeInt64(std::int64_t(offset_), kOffsetKey);
    coder.encodeInt64(std::int64_t(compressedSize_), kCompressedSizeKey);
    coder.encodeValue(compressedChecksum_, kCompressedChecksumKey);
    coder.encodeInteger(std::int64_t(compressedChecksumType_), kCompressedChecksumAlgorithmKey);
    coder.encodeInt64(std::int64_t(uncompressedSize_), kUncompressedSizeKey);
    coder.encodeValue(uncompressedChecksum_, kUncompressedChecksumKey);
    coder.encodeInteger(std::int64_t(uncompressedChecksumType_), kUncompressedChecksumAlgorithmKey);
    coder.encodeInteger(std::int64_t(compressionType_), kCompressionTypeKey);
}

GWXARDataReferencePtr GWXARDataReference::initWithCoder(GWCoder& coder) {
    if (!coder.allowsKeyedCoding()) {
        return nullptr;
    }
    auto reference = init();
    reference->name_ = coder.decodeString(kNameKey);
    reference->offset_ = coder.decodeUInt64(kOffsetKey);
    reference->compressedSize_ = coder.decodeUInt64(kCompressedSizeKey);
    reference->compressedChecksum_ = coder.decodeData(kCompressedChecksumKey);
    reference->compressedChecksumType_ = coder.decodeUInt64(kCompressedChecksumAlgorithmKey);
    reference->uncompressedSize_ = coder.decodeUInt64(kUncompressedSizeKey);
    reference->uncompressedChecksum_ = coder.decodeData(kUncompressedChecksumKey);
    reference->uncompressedChecksumType_ = coder.decodeUInt64(kUncompressedChecksumAlgorithmKey);
    reference->compressionType_ = coder.decodeUInt64(kCompressionTypeKey);
    return reference;
}

GWXARDataReferencePtr GWXARDataReference::copy() const {
    // Copying through the base class leaves any subclass's state behind, by design.
    return std::make_shared<GWXARDataReference>(static_cast<const GWXARDataReference&>(*this));
}
