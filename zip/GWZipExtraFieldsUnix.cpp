// Extra fields of Unix archivers: times, owners, link targets, UTF-8 names.

#include "GWArchiveSupport/GWArchiveConstants.h"
#include "GWZipErrors.h"
#include "GWZipExtraInfoKeys.h"
#include "GWZipFieldReader.h"
#include "GWZipWorkOperation.h"
#include "foundation/GWChecksum.h"
#include "foundation/GWConversions.h"
#include "foundation/GWLog.h"
#include "foundation/GWStringEncoding.h"

namespace {

void setUnixTime(GWDictionary& info, const char* key, std::optional<std::uint32_t> seconds) {
    if (seconds) {
        info.insert_or_assign(key, GWValue(GWZipDateFromUnixTime(*seconds)));
    }
}

// A link target only when there is one: an empty tail names nothing.
void setLinkTarget(GWDictionary& info, std::span<const std::uint8_t> bytes) {
    if (!bytes.empty()) {
        GWZipSetInfo(info, kGWZipSymbolicLinkFilenameKey, GWZipFileSystemString(bytes));
    }
}

}  // namespace

std::optional<GWDictionary> GWZipWorkOperation::infoFromPKWareUnixExtraField(
    std::span<const std::uint8_t> data, std::size_t length, bool isOldFormat, bool isLocalHeader,
    GWErrorPtr*) const {
    const GWZipFieldReader field(data, length);
    GWDictionary info;
    setUnixTime(info, kGWZipUTCAccessDateKey, field.u32le(0));
    setUnixTime(info, kGWZipUTCModificationDateKey, field.u32le(4));
    if (!isOldFormat || isLocalHeader) {
        GWZipSetInfo(info, kGWZipUserIDKey, field.u16le(8));
        GWZipSetInfo(info, kGWZipGroupIDKey, field.u16le(10));
    } else {
        // The central form of the original Info-ZIP field leaves out the owner.
        info.insert_or_assign(kGWZipMoreInfoAvailableInLocalHeaderKey, GWValue(true));
    }
    if (!isOldFormat) {
        setLinkTarget(info, field.bytesFrom(12));
    }
    return info;
}

std::optional<GWDictionary> GWZipWorkOperation::infoFromExtendedTimestampExtraField(
    std::span<const std::uint8_t> data, std::size_t length, bool isLocalHeader, GWErrorPtr*) const {
    const GWZipFieldReader field(data, length);
    GWDictionary info;
    const auto flags = field.u8(0);
    if (!flags) {
        return info;
    }
    // The flags say which times follow, in this order. Central copies keep the
    // local flags but often carry only the modification time; what the block
    // does not hold is left out.
    const char* const keys[] = {kGWZipUTCModificationDateKey, kGWZipUTCAccessDateKey,
                                kGWZipUTCCreationDateKey};
    std::size_t offset = 1;
    for (unsigned bit = 0; bit < 3; ++bit) {
        if (*flags & (1u << bit)) {
            setUnixTime(info, keys[bit], field.u32le(offset));
            offset += 4;
        }
    }
    if (!isLocalHeader && (*flags & 0x07) != 0x07) {
        info.insert_or_assign(kGWZipMoreInfoAvailableInLocalHeaderKey, GWValue(true));
    }
    return info;
}

std::optional<GWDictionary> GWZipWorkOperation::infoFromInfoZipUnixExtraField(
    std::span<const std::uint8_t> data, std::size_t length, bool isLocalHeader, GWErrorPtr*) const {
    const GWZipFieldReader field(data, length);
    GWDictionary info;
    if (isLocalHeader) {
        GWZipSetInfo(info, kGWZipUserIDKey, field.u16le(0));
        GWZipSetInfo(info, kGWZipGroupIDKey, field.u16le(2));
    } else {
        info.insert_or_assign(kGWZipMoreInfoAvailableInLocalHeaderKey, GWValue(true));
    }
    return info;
}

std::optional<GWDictionary> GWZipWorkOperation::infoFromInfoZipUnix3GExtraField(
    std::span<const std::uint8_t> data, std::size_t length, bool, GWErrorPtr* error) const {
    const GWZipFieldReader field(data, length);
    GWDictionary info;
    const auto version = field.u8(0);
    if (!version) {
        return info;
    }
    if (*version != 1) {
        GWLog("Unknown version of the Info-ZIP Unix 3G extra field: %d", int(*version));
        GWFail(error, GWZipUnknownEntityError(GWZipArchiveUnknownExtraFieldVersionError, *version,
                                              "Info-ZIP Unix 3G extra field of version %d",
                                              int(*version)));
        return std::nullopt;
    }
    // Each ID is as wide as its size byte says; widths past 8 bytes or past
    // the block give no number.
    auto readID = [&](std::size_t sizeOffset, std::size_t* next) -> std::optional<std::uint64_t> {
        const auto size = field.u8(sizeOffset);
        *next = sizeOffset + 1 + (size ? *size : 0);
        if (!size) {
            return std::nullopt;
        }
        auto bytes = field.bytes(sizeOffset + 1, *size);
        return bytes ? GWNumberWithLittleEndianIntegerData(*bytes) : std::nullopt;
    };
    std::size_t next = 0;
    GWZipSetInfo(info, kGWZipUserIDKey, readID(1, &next));
    GWZipSetInfo(info, kGWZipGroupIDKey, readID(next, &next));
    return info;
}

std::optional<GWDictionary> GWZipWorkOperation::infoFromInfoZipUnicodeField(
    std::span<const std::uint8_t> data, std::size_t length, bool isPath, GWErrorPtr* error) const {
    const GWZipFieldReader field(data, length);
    GWDictionary info;
    const auto version = field.u8(0);
    if (!version) {
        return info;
    }
    const char* const kind = isPath ? "path" : "comment";
    if (*version != 1) {
        GWLog(isPath ? "Unknown version of the Info-ZIP Unix path extra field: %d"
                     : "Unknown version of the Info-ZIP Unix comment extra field: %d",
              int(*version));
        GWFail(error, GWZipUnknownEntityError(GWZipArchiveUnknownExtraFieldVersionError, *version,
                                              "Info-ZIP Unicode %s extra field of version %d", kind,
                                              int(*version)));
        return std::nullopt;
    }
    const auto storedCRC = field.u32le(1);
    if (!storedCRC) {
        return info;
    }
    const auto text = field.bytesFrom(5);
    // The CRC is compared with the UTF-8 text itself, not with the header's
    // own name or comment field.
    const GWData digest = GWChecksum::checksumForData(text, GWChecksumAlgorithmCRC32);
    const std::uint32_t computed =
        digest.size() >= 4 ? std::uint32_t(digest[0]) | std::uint32_t(digest[1]) << 8 |
                                 std::uint32_t(digest[2]) << 16 | std::uint32_t(digest[3]) << 24
                           : 0;
    if (computed != *storedCRC) {
        GWLog(isPath ? "Bad checksum for UTF-8 Path" : "Bad checksum for UTF-8 Comment");
        GWFail(error, GWGenerateError(kGWCocoaErrorDomain, GWFileReadCorruptFileError, std::nullopt,
                                      nullptr, {},
                                      "Info-ZIP Unicode %s extra field: CRC-32 0x%08x stored, "
                                      "0x%08x computed",
                                      kind, *storedCRC, computed));
        return std::nullopt;
    }
    GWZipSetInfo(info, isPath ? kGWZipPOSIXPathKey : kGWZipCommentKey,
                 GWStringFromBytes(text, GWStringEncoding::UTF8));
    return info;
}

std::optional<GWDictionary> GWZipWorkOperation::infoFromInfoZipUnixUTF8PathExtraField(
    std::span<const std::uint8_t> data, std::size_t length, bool, GWErrorPtr* error) const {
    return infoFromInfoZipUnicodeField(data, length, true, error);
}

std::optional<GWDictionary> GWZipWorkOperation::infoFromInfoZipUnixUTF8CommentExtraField(
    std::span<const std::uint8_t> data, std::size_t length, bool, GWErrorPtr* error) const {
    return infoFromInfoZipUnicodeField(data, length, false, error);
}

std::optional<GWDictionary> GWZipWorkOperation::infoFromASiUnixExtraField(
    std::span<const std::uint8_t> data, std::size_t length, GWErrorPtr*) const {
    const GWZipFieldReader field(data, length);
    GWDictionary info;
    GWZipSetInfo(info, kGWZipCRC32Key, field.u32le(0));  // not verified
    GWZipSetInfo(info, kGWZipPermissionsModeKey, field.u16le(4));
    // The u32 at 6 (device or link size) is not used.
    GWZipSetInfo(info, kGWZipUserIDKey, field.u16le(10));
    GWZipSetInfo(info, kGWZipGroupIDKey, field.u16le(12));
    setLinkTarget(info, field.bytesFrom(14));
    return info;
}
