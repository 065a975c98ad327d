// Extra fields that any host writes: Zip64 sizes, NTFS times, padding hints.

#include "GWZipExtraInfoKeys.h"
#include "GWZipFieldReader.h"
#include "GWZipWorkOperation.h"

std::optional<GWDictionary> GWZipWorkOperation::infoFromZip64ExtendedInfo(
    std::span<const std::uint8_t> data, std::size_t length, bool isLocal, GWErrorPtr*) const {
    const GWZipFieldReader field(data, length);
    GWDictionary info;
    if (!isLocal) {
        // Taken from the first slot whatever the record escaped; an entry
        // whose central sizes are escaped as well gets a wrong offset.
        GWZipSetInfo(info, kGWZipLocalHeaderOffsetKey, field.u64le(0));
    } else if (field.size() > 15) {
        GWZipSetInfo(info, kGWZipUncompressedSizeKey, field.u64le(0));
        GWZipSetInfo(info, kGWZipCompressedSizeKey, field.u64le(8));
    }
    return info;
}

std::optional<GWDictionary> GWZipWorkOperation::infoFromNTFSExtraField(
    std::span<const std::uint8_t> data, std::size_t length, GWErrorPtr*) const {
    // 4 reserved bytes, then attribute 1 (tag and size, not checked) with
    // the three times.
    const GWZipFieldReader field(data, length);
    GWDictionary info;
    auto setTime = [&](const char* key, std::size_t offset) {
        if (auto ticks = field.u64le(offset)) {
            info.insert_or_assign(key, GWValue(GWDate::dateWithNTFSTicks(*ticks)));
        }
    };
    setTime(kGWZipUTCModificationDateKey, 8);
    setTime(kGWZipUTCAccessDateKey, 16);
    setTime(kGWZipUTCCreationDateKey, 24);
    return info;
}

std::optional<GWDictionary> GWZipWorkOperation::infoFromWinZipAESExtraField(
    std::span<const std::uint8_t> data, std::size_t length, GWErrorPtr*) const {
    // Version, "AE", strength, method. Another vendor's block under this ID
    // says nothing; extraction then refuses the entry for want of its keys.
    const GWZipFieldReader field(data, length);
    GWDictionary info;
    if (field.size() >= 7 && field.u16le(2) == 0x4541) {
        GWZipSetInfo(info, kGWZipAESVendorVersionKey, field.u16le(0));
        GWZipSetInfo(info, kGWZipAESStrengthKey, field.u8(4));
        GWZipSetInfo(info, kGWZipAESCompressionMethodKey, field.u16le(5));
    }
    return info;
}

std::optional<GWDictionary> GWZipWorkOperation::infoFromMSOpenPackagingGrowthHintField(
    std::span<const std::uint8_t>, std::size_t, GWErrorPtr*) const {
    return GWDictionary();
}
