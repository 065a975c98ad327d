#include "GWZipWorkOperation.h"

#include <cerrno>

#include "GWArchiveSupport/GWArchiveConstants.h"
#include "GWZipErrors.h"
#include "foundation/GWByteReader.h"
#include "foundation/GWLog.h"

bool GWZipWorkOperation::readLocalHeaderRecord(GWZipLocalFileHeader* record,
                                               std::span<const std::uint8_t> data,
                                               GWErrorPtr* error) const {
    if (record) {
        *record = GWZipLocalFileHeader();
    }
    GWZipLocalFileHeader header;
    GWByteReader reader(data);
    header.signature = reader.u32le();
    header.versionNeeded = reader.u16le();
    header.generalPurposeFlags = reader.u16le();
    header.compressionMethod = reader.u16le();
    header.modificationTime = reader.u16le();
    header.modificationDate = reader.u16le();
    header.crc32 = reader.u32le();
    header.compressedSize = reader.u32le();
    header.uncompressedSize = reader.u32le();
    header.filenameLength = reader.u16le();
    header.extraFieldLength = reader.u16le();
    if (!reader.ok()) {
        return GWFail(
            error,
            GWGenerateError(kGWCocoaErrorDomain, GWFileReadCorruptFileError, std::nullopt, nullptr,
                            {}, "local file header: %zu bytes, 30 needed", data.size()));
    }
    if (header.signature != GWZipLocalFileHeader::kSignature) {
        return GWFail(
            error, GWGenerateError(kGWCocoaErrorDomain, GWFileReadCorruptFileError, std::nullopt,
                                   nullptr, {}, "local file header: signature 0x%08x, not 0x%08x",
                                   header.signature, GWZipLocalFileHeader::kSignature));
    }
    if (record) {
        *record = header;
    }
    return true;
}

std::shared_ptr<GWDecompressor> GWZipWorkOperation::decompressorForFile(
    const GWZipFilePtr& file, std::uint16_t compressionMethod, GWErrorPtr* error) const {
    switch (compressionMethod) {
        case 0: return GWDecompressor::initForStreamingWithAlgorithm(0, error);
        case 1:
            if (!file) {
                GWFail(error, GWPOSIXError(EINVAL));
                return nullptr;
            }
            // The data's own size: the one that counts companions would let
            // the decoder read on past the end of its stream.
            return GWDecompressor::initForUnshrinkStreamingWithUncompressedSize(
                file->storedUncompressedSize(), error);
        case 6:
            if (!file) {
                GWFail(error, GWPOSIXError(EINVAL));
                return nullptr;
            }
            return GWDecompressor::initForExplodeStreamingWithUncompressedSize(
                file->storedUncompressedSize(), (file->generalPurposeFlags() & 0x0002) != 0,
                (file->generalPurposeFlags() & 0x0004) != 0, error);
        case 8: return GWDecompressor::initForStreamingWithAlgorithm(1, error);
        case 9:
        case 93:
        case 95: return GWDecompressor::initForStreamingWithAlgorithm(compressionMethod, error);
        case 12: return GWDecompressor::initForStreamingWithAlgorithm(5, error);
        case 14:
            // Without a file (data inside an extra field) only the end marker can end it.
            return GWDecompressor::initForLZMAStreamingWithUncompressedSize(
                file ? file->storedUncompressedSize() : UINT64_MAX,
                !file || (file->generalPurposeFlags() & 0x0002) != 0, error);
        default:
            GWLog("unsupported compression method: %u", unsigned(compressionMethod));
            GWFail(error, GWZipUnknownEntityError(
                              GWZipArchiveUnsupportedCompressionMethodError, compressionMethod,
                              "unsupported compression method %u", unsigned(compressionMethod)));
            return nullptr;
    }
}

std::optional<GWDictionary> GWZipWorkOperation::infoFromExtraFieldBlock(
    std::uint16_t headerID, std::span<const std::uint8_t> block, bool isLocalHeader, bool* known,
    GWErrorPtr* error) const {
    const std::size_t length = block.size();
    *known = true;
    switch (headerID) {
        case 0x0001: return infoFromZip64ExtendedInfo(block, length, isLocalHeader, error);
        case 0x000A: return infoFromNTFSExtraField(block, length, error);
        case 0x000D:
            return infoFromPKWareUnixExtraField(block, length, false, isLocalHeader, error);
        case 0x07C8: return infoFromJLEEMacExtraField(block, length, error);
        case 0x2605: return infoFromZipItExtraField(block, length, true, error);
        case 0x2705: return infoFromZipItExtraField(block, length, false, error);
        case 0x2805: return infoFromZipIt135DirExtraField(block, length, error);
        case 0x334D: return infoFromMac3ExtraField(block, length, isLocalHeader, error);
        case 0x4D63: return infoFromSmartZipExtraField(block, length, error);
        case 0x5455:
            return infoFromExtendedTimestampExtraField(block, length, isLocalHeader, error);
        case 0x5855: return infoFromPKWareUnixExtraField(block, length, true, isLocalHeader, error);
        case 0x6375:
            return infoFromInfoZipUnixUTF8CommentExtraField(block, length, isLocalHeader, error);
        case 0x7075:
            return infoFromInfoZipUnixUTF8PathExtraField(block, length, isLocalHeader, error);
        case 0x756E: return infoFromASiUnixExtraField(block, length, error);
        case 0x7855: return infoFromInfoZipUnixExtraField(block, length, isLocalHeader, error);
        case 0x7875: return infoFromInfoZipUnix3GExtraField(block, length, isLocalHeader, error);
        case 0x9901: return infoFromWinZipAESExtraField(block, length, error);
        case 0xA220: return infoFromMSOpenPackagingGrowthHintField(block, length, error);
        case 0xCAFE: return GWDictionary();  // marks a Java archive; nothing to decode
        case 0xD935: return GWDictionary();  // Android's alignment padding
        default: *known = false; return std::nullopt;
    }
}

std::optional<GWDictionary> GWZipWorkOperation::infoFromExtraFieldData(
    std::span<const std::uint8_t> data, bool isLocalHeader, GWErrorPtr* error) const {
    GWDictionary info;
    GWErrorPtr lastError;
    GWByteReader reader(data);
    // Fewer than 4 bytes left cannot hold a block header; such a tail (padding
    // some writers leave) is ignored.
    while (reader.remaining() >= 4) {
        const std::uint16_t headerID = reader.u16le();
        const std::uint16_t declared = reader.u16le();
        // A block that claims more than the field holds is cut to what is there.
        const auto block = reader.bytes(std::min<std::size_t>(declared, reader.remaining()));
        bool known = false;
        GWErrorPtr blockError;
        auto decoded = infoFromExtraFieldBlock(headerID, block, isLocalHeader, &known, &blockError);
        if (!known) {
            // Android alignment, NT security descriptors, strong-encryption
            // headers and whatever comes next: an archive is no worse for a block
            // this reader has no use for.
            GWLog("unknown extra info signature: 0x%x", unsigned(headerID));
            continue;
        }
        if (decoded) {
            for (auto& [key, value] : *decoded) {
                info.insert_or_assign(key, std::move(value));
            }
        } else {
            if (!blockError) {
                blockError = GWCocoaError(GWFileReadCorruptFileError);
            }
            GWLog("Error: %s", GWZipErrorLogDescription(blockError).c_str());
            lastError = blockError;
        }
    }
    if (!lastError || !info.empty()) {
        return info;
    }
    GWFail(error, lastError);
    return std::nullopt;
}
