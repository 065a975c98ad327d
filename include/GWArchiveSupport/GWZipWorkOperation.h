#pragma once

#include <cstddef>
#include <cstdint>
#include <memory>
#include <optional>
#include <span>

#include "GWError.h"
#include "GWExport.h"
#include "GWOperation.h"
#include "GWValue.h"
#include "GWZipFile.h"

class GWDecompressor;

// A local file header, normalised (all multi-byte fields are little-endian in
// the archive).
struct GW_EXPORT GWZipLocalFileHeader {
    static constexpr std::uint32_t kSignature = 0x04034B50;  // "PK" 03 04
    static constexpr std::size_t kLength = 30;

    std::uint32_t signature = 0;
    std::uint16_t versionNeeded = 0;
    std::uint16_t generalPurposeFlags = 0;
    std::uint16_t compressionMethod = 0;
    std::uint16_t modificationTime = 0;  // MS-DOS time
    std::uint16_t modificationDate = 0;  // MS-DOS date
    std::uint32_t crc32 = 0;
    std::uint64_t compressedSize = 0;
    std::uint64_t uncompressedSize = 0;
    std::uint16_t filenameLength = 0;
    std::uint16_t extraFieldLength = 0;
};

// The ZIP record parsing that loading and extraction share: local headers,
// the decompressor for an entry, and the extra-field decoders that fill an
// entry's extra-info dictionary (keys in GWZipExtraInfoKeys.h).
//
// Decoders take a block's data and its declared size and never read outside
// either; a block too short for a field leaves that key out. They fail only
// for an unknown version of a versioned field, a bad checksum of a Unicode
// path or comment, and an undecodable Mac attribute block.
class GW_EXPORT GWZipWorkOperation : public GWOperation {
public:
    // Fills `record` from the first 30 bytes; fewer bytes or another
    // signature fail with GWFileReadCorruptFileError.
    bool readLocalHeaderRecord(GWZipLocalFileHeader* record, std::span<const std::uint8_t> data,
                               GWErrorPtr* error) const;

    // A streaming decompressor for the entry's method: 0, 8 and 12 need no
    // file; 1 and 6 need it for its size (and, for 6, its flags) and fail with
    // EINVAL without one. Other methods: kGWZipArchiveErrorDomain code 1.
    std::shared_ptr<GWDecompressor> decompressorForFile(const GWZipFilePtr& file,
                                                        std::uint16_t compressionMethod,
                                                        GWErrorPtr* error) const;

    // Decodes every block of an extra field into one dictionary, later blocks
    // winning. A failing or unknown block is logged and skipped; the call
    // fails (with the last error) only when nothing else decoded.
    std::optional<GWDictionary> infoFromExtraFieldData(std::span<const std::uint8_t> data,
                                                       bool isLocalHeader, GWErrorPtr* error) const;

    // --- One decoder per kind of block -----------------------------------------

    // 0x0001
    std::optional<GWDictionary> infoFromZip64ExtendedInfo(std::span<const std::uint8_t> data,
                                                          std::size_t length, bool isLocal,
                                                          GWErrorPtr* error) const;
    // 0x000A
    std::optional<GWDictionary> infoFromNTFSExtraField(std::span<const std::uint8_t> data,
                                                       std::size_t length, GWErrorPtr* error) const;
    // 0x07C8
    std::optional<GWDictionary> infoFromJLEEMacExtraField(std::span<const std::uint8_t> data,
                                                          std::size_t length,
                                                          GWErrorPtr* error) const;
    // 0x2605 (old format, with the file name) and 0x2705
    std::optional<GWDictionary> infoFromZipItExtraField(std::span<const std::uint8_t> data,
                                                        std::size_t length, bool isOldFormat,
                                                        GWErrorPtr* error) const;
    // 0x2805
    std::optional<GWDictionary> infoFromZipIt135DirExtraField(std::span<const std::uint8_t> data,
                                                              std::size_t length,
                                                              GWErrorPtr* error) const;
    // 0x334D
    std::optional<GWDictionary> infoFromMac3ExtraField(std::span<const std::uint8_t> data,
                                                       std::size_t length, bool isLocalHeader,
                                                       GWErrorPtr* error) const;
    // 0x4D63
    std::optional<GWDictionary> infoFromSmartZipExtraField(std::span<const std::uint8_t> data,
                                                           std::size_t length,
                                                           GWErrorPtr* error) const;
    // 0x000D (isOldFormat false) and 0x5855 (true)
    std::optional<GWDictionary> infoFromPKWareUnixExtraField(std::span<const std::uint8_t> data,
                                                             std::size_t length, bool isOldFormat,
                                                             bool isLocalHeader,
                                                             GWErrorPtr* error) const;
    // 0x5455
    std::optional<GWDictionary> infoFromExtendedTimestampExtraField(
        std::span<const std::uint8_t> data, std::size_t length, bool isLocalHeader,
        GWErrorPtr* error) const;
    // 0x7075
    std::optional<GWDictionary> infoFromInfoZipUnixUTF8PathExtraField(
        std::span<const std::uint8_t> data, std::size_t length, bool isLocalHeader,
        GWErrorPtr* error) const;
    // 0x6375
    std::optional<GWDictionary> infoFromInfoZipUnixUTF8CommentExtraField(
        std::span<const std::uint8_t> data, std::size_t length, bool isLocalHeader,
        GWErrorPtr* error) const;
    // 0x7855
    std::optional<GWDictionary> infoFromInfoZipUnixExtraField(std::span<const std::uint8_t> data,
                                                              std::size_t length,
                                                              bool isLocalHeader,
                                                              GWErrorPtr* error) const;
    // 0x7875
    std::optional<GWDictionary> infoFromInfoZipUnix3GExtraField(std::span<const std::uint8_t> data,
                                                                std::size_t length,
                                                                bool isLocalHeader,
                                                                GWErrorPtr* error) const;
    // 0x756E
    std::optional<GWDictionary> infoFromASiUnixExtraField(std::span<const std::uint8_t> data,
                                                          std::size_t length,
                                                          GWErrorPtr* error) const;
    // 0x9901
    std::optional<GWDictionary> infoFromWinZipAESExtraField(std::span<const std::uint8_t> data,
                                                            std::size_t length,
                                                            GWErrorPtr* error) const;
    // 0xA220
    std::optional<GWDictionary> infoFromMSOpenPackagingGrowthHintField(
        std::span<const std::uint8_t> data, std::size_t length, GWErrorPtr* error) const;

private:
    // The decoder for one block; `known` is false for an ID without one.
    std::optional<GWDictionary> infoFromExtraFieldBlock(std::uint16_t headerID,
                                                        std::span<const std::uint8_t> block,
                                                        bool isLocalHeader, bool* known,
                                                        GWErrorPtr* error) const;
    // The Unicode path and comment fields share their layout and checks.
    std::optional<GWDictionary> infoFromInfoZipUnicodeField(std::span<const std::uint8_t> data,
                                                            std::size_t length, bool isPath,
                                                            GWErrorPtr* error) const;
    // A Mac3 attribute block, decompressed if it is stored compressed.
    std::optional<GWData> mac3AttributeBlock(std::span<const std::uint8_t> block,
                                             std::uint32_t statedSize, std::uint16_t flags,
                                             GWErrorPtr* error) const;
};

using GWZipWorkOperationPtr = std::shared_ptr<GWZipWorkOperation>;
