// Stored streams in the table of contents: data forks, extended attributes,
// their checksums and encodings, and ACLs.

#include <algorithm>
#include <array>
#include <cerrno>
#include <string_view>

#include "GWArchiveSupport/GWArchiveConstants.h"
#include "GWXARLoadOperation.h"
#include "GWXARNumberScanning.h"
#include "foundation/GWChecksum.h"
#include "foundation/GWConversions.h"
#include "foundation/GWLog.h"

namespace {

int hexDigit(char c) {
    if (c >= '0' && c <= '9') {
        return c - '0';
    }
    if (c >= 'a' && c <= 'f') {
        return c - 'a' + 10;
    }
    return -1;
}

char lowered(char c) {
    return c >= 'A' && c <= 'Z' ? char(c - 'A' + 'a') : c;
}

}  // namespace

std::optional<GWXARDataReferenceArray> GWXARLoadOperation::extendedAttributesFromElement(
    const pugi::xml_node& element, GWErrorPtr* error) {
    // Newer archives describe one attribute per "ea" element; older ones nest
    // one element per attribute, named after it.
    static constexpr std::array<std::string_view, 5> kOwnFields = {"name", "length", "size",
                                                                   "offset", "encoding"};
    const bool describesOne = std::all_of(kOwnFields.begin(), kOwnFields.end(), [&](auto field) {
        return bool(element.child(field.data()));  // literals: terminated
    });
    if (describesOne) {
        auto attribute = fileReferenceFromElement(element, error);
        if (!attribute) {
            return std::nullopt;
        }
        // An empty name could not be set on a file either.
        if (!attribute->name() || attribute->name()->empty()) {
            attribute->setName("Unknown EA " + GWUniqueID());
        }
        return GWXARDataReferenceArray{std::move(attribute)};
    }
    GWXARDataReferenceArray attributes;
    for (const pugi::xml_node& child : element.children()) {
        if (child.type() != pugi::node_element) {
            continue;
        }
        auto attribute = fileReferenceFromElement(child, error);
        if (!attribute) {
            return std::nullopt;
        }
        attribute->setName(std::string(child.name()));
        attributes.push_back(std::move(attribute));
    }
    return attributes;
}

GWXARDataReferencePtr GWXARLoadOperation::fileReferenceFromElement(const pugi::xml_node& element,
                                                                   GWErrorPtr* error) {
    if (!chargeTOCMemory(kReferenceMemoryCharge, error)) {
        return nullptr;
    }
    auto reference = GWXARDataReference::init();
    for (const pugi::xml_node& child : element.children()) {
        if (child.type() != pugi::node_element) {
            continue;
        }
        auto text = textContentOfElement(child, error);
        if (!text) {
            return nullptr;
        }
        const std::string_view name = child.name();
        if (name == "name") {
            reference->setName(*text);
        } else if (name == "archived-checksum" || name == "unarchived-checksum" ||
                   name == "extracted-checksum") {
            int checksumType = GWChecksumAlgorithmNone;
            auto checksum = checksumFromElement(child, &checksumType, error);
            if (!checksum) {
                return nullptr;
            }
            if (name == "archived-checksum") {
                reference->setCompressedChecksum(std::move(checksum));
                reference->setCompressedChecksumType(std::uint64_t(checksumType));
            } else {
                reference->setUncompressedChecksum(std::move(checksum));
                reference->setUncompressedChecksumType(std::uint64_t(checksumType));
            }
        } else if (name == "length" || name == "size" || name == "offset") {
            auto value = GWXARScanUnsigned(*text);
            // References hold absolute file offsets; one past 64 bits is as malformed as no number.
            if (value && name == "offset" && *value > UINT64_MAX - heapStart_) {
                value.reset();
            }
            if (!value) {
                GWFail(error, errorWithCode(GWXARArchiveMalformedValueError, *text, child));
                return nullptr;
            }
            if (name == "length") {
                reference->setCompressedSize(*value);
            } else if (name == "size") {
                reference->setUncompressedSize(*value);
            } else {
                reference->setOffset(heapStart_ + *value);
            }
        } else if (name == "encoding") {
            std::uint64_t compressionType = GWXARCompressionTypeNone;
            if (!getCompressionType(&compressionType, child, error)) {
                return nullptr;
            }
            reference->setCompressionType(compressionType);
        } else {
            GWLog("unhandled file reference property %s", child.name());
        }
    }
    return reference;
}

bool GWXARLoadOperation::addACLsFromElement(const pugi::xml_node& element, GWXARFile& file,
                                            GWErrorPtr* error) {
    for (const pugi::xml_node& child : element.children()) {
        if (child.type() != pugi::node_element) {
            continue;
        }
        auto text = textContentOfElement(child, error);
        if (!text) {
            return false;
        }
        GWErrorPtr conversionError;
        auto acl = GWACL::fromText(*text, &conversionError);
        if (!acl) {
            const long number = conversionError ? conversionError->code() : EINVAL;
            return GWFail(error, errorWithDomain(kGWPOSIXErrorDomain, number, *text, child));
        }
        const std::string_view name = child.name();
        if (name == "default") {
            file.setDefaultACL(&*acl);
        } else if (name == "access") {
            file.setAccessACL(&*acl);
        } else if (name == "appleextended") {
            file.setExtendedACL(&*acl);
        } else {
            GWLog("Unhandled ACL type %s", child.name());
        }
    }
    return true;
}

int GWXARLoadOperation::checksumTypeFromName(std::string_view name) {
    std::string lower(name);
    std::transform(lower.begin(), lower.end(), lower.begin(), lowered);
    if (lower == "sha" || lower == "sha1") {
        return GWChecksumAlgorithmSHA1;
    }
    if (lower == "sha224") {
        return GWChecksumAlgorithmSHA224;
    }
    if (lower == "sha256") {
        return GWChecksumAlgorithmSHA256;
    }
    if (lower == "sha384") {
        return GWChecksumAlgorithmSHA384;
    }
    if (lower == "sha512") {
        return GWChecksumAlgorithmSHA512;
    }
    if (lower == "md5") {
        return GWChecksumAlgorithmMD5;
    }
    if (lower == "md2") {
        return GWChecksumAlgorithmMD2;
    }
    return GWChecksumAlgorithmUnknown;
}

bool GWXARLoadOperation::getCompressionType(std::uint64_t* compressionType,
                                            const pugi::xml_node& element, GWErrorPtr* error) {
    const pugi::xml_attribute style = element.attribute("style");
    if (!style) {
        return GWFail(error, errorWithCode(GWXARArchiveMissingAttributeError, "style", element));
    }
    static const std::pair<std::string_view, GWXARCompressionType> kStyles[] = {
        {"application/octet-stream", GWXARCompressionTypeNone},
        {"application/x-gzip", GWXARCompressionTypeGZip},
        {"application/x-bzip2", GWXARCompressionTypeBZ2},
        {"application/x-lzma", GWXARCompressionTypeLZMA},
        {"application/x-xz", GWXARCompressionTypeXZ},
    };
    for (const auto& [name, type] : kStyles) {
        if (name == style.value()) {
            if (compressionType) {
                *compressionType = type;
            }
            return true;
        }
    }
    return GWFail(error, errorWithCode(GWXARArchiveUnsupportedCompressionError,
                                       std::string(style.value()), element));
}

std::optional<GWData> GWXARLoadOperation::checksumFromElement(const pugi::xml_node& element,
                                                              int* checksumType,
                                                              GWErrorPtr* error) {
    const pugi::xml_attribute style = element.attribute("style");
    if (!style) {
        GWFail(error, errorWithCode(GWXARArchiveMissingAttributeError, "style", element));
        return std::nullopt;
    }
    if (checksumType) {
        const int type = checksumTypeFromName(style.value());
        if (type == GWChecksumAlgorithmUnknown) {
            GWFail(error, errorWithCode(GWXARArchiveUnknownChecksumError,
                                        std::string(style.value()), element));
            return std::nullopt;
        }
        *checksumType = type;
    }

    const pugi::xml_node offsetElement = element.child("offset");
    const pugi::xml_node sizeElement = element.child("size");
    if (!offsetElement || !sizeElement) {
        auto text = textContentOfElement(element, error);
        if (!text) {
            return std::nullopt;
        }
        return decodeHexString(*text, element, error);
    }

    // Stored in the heap, as the table of contents' own checksum is.
    auto offsetText = textContentOfElement(offsetElement, error);
    if (!offsetText) {
        return std::nullopt;
    }
    auto offset = GWXARScanUnsigned(*offsetText);
    if (!offset || *offset > UINT64_MAX - heapStart_) {
        GWFail(error, errorWithCode(GWXARArchiveMalformedValueError, *offsetText, element));
        return std::nullopt;
    }
    auto sizeText = textContentOfElement(sizeElement, error);
    if (!sizeText) {
        return std::nullopt;
    }
    auto size = GWXARScanUnsigned(*sizeText);
    if (!size || *size > kMaxDigestLength) {
        GWFail(error, errorWithCode(GWXARArchiveMalformedValueError, *sizeText, element));
        return std::nullopt;
    }
    auto bytes = heapBytes(*offset, *size, error);
    if (!bytes) {
        return std::nullopt;
    }
    return *bytes;
}

std::shared_ptr<const GWData> GWXARLoadOperation::heapBytes(std::uint64_t offset,
                                                            std::uint64_t size, GWErrorPtr* error) {
    const auto range = std::make_pair(offset, size);
    if (auto known = heapRanges_.find(range); known != heapRanges_.end()) {
        return known->second;
    }
    if (!fileHandle_) {
        GWFail(error, GWPOSIXError(EBADF, archiveURL_));
        return nullptr;
    }
    if (!chargeTOCMemory(kReferenceMemoryCharge + size, error) ||
        !fileHandle_->seekToFileOffset(heapStart_ + offset, error)) {
        return nullptr;
    }
    auto bytes = fileHandle_->readDataOfLength(size, error);
    if (!bytes) {
        return nullptr;
    }
    auto shared = std::make_shared<const GWData>(std::move(*bytes));
    heapRanges_.emplace(range, shared);
    return shared;
}

std::optional<GWData> GWXARLoadOperation::decodeHexString(std::string_view text,
                                                          const pugi::xml_node& node,
                                                          GWErrorPtr* error) {
    auto malformed = [&]() -> std::optional<GWData> {
        GWFail(error, errorWithCode(GWXARArchiveMalformedValueError, std::string(text), node));
        return std::nullopt;
    };
    if (text.size() % 2 != 0) {
        return malformed();
    }
    GWData bytes;
    bytes.reserve(text.size() / 2);
    for (std::size_t i = 0; i < text.size(); i += 2) {
        const int high = hexDigit(lowered(text[i]));
        const int low = hexDigit(lowered(text[i + 1]));
        if (high < 0 || low < 0) {
            return malformed();
        }
        bytes.push_back(std::uint8_t(high << 4 | low));
    }
    return bytes;
}
