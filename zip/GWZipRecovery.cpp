// Entries of an archive whose end record or central directory is lost (an
// interrupted download, a damaged disk), found by walking the local headers
// from the start of the ZIP data, as the entries were written.

#include <algorithm>

#include "GWZipExtraInfoKeys.h"
#include "GWZipLoadOperation.h"
#include "foundation/GWByteReader.h"
#include "foundation/GWLog.h"

namespace {

constexpr std::uint8_t kDescriptorSignature[] = {'P', 'K', 7, 8};
// Where a walk gives up: far more entries than any archive of its size holds
// would mean the walk is not reading what it thinks.
constexpr std::uint64_t kMaxRecoveredEntries = 10'000'000;

struct Extent {
    std::uint64_t compressedSize = 0;
    std::uint64_t uncompressedSize = 0;
    std::uint32_t crc32 = 0;
    std::uint64_t descriptorLength = 0;
};

}  // namespace

// A data descriptor follows data whose length the local header could not
// know: the first signature whose recorded size is the distance walked ends it.
static std::optional<Extent> extentFromDescriptor(GWRemoteFileHandle& file, GWZipReadWindow& window,
                                                  std::uint64_t dataStart, std::uint64_t fileSize,
                                                  bool zip64,
                                                  const std::function<bool()>& cancelled) {
    std::uint64_t from = dataStart;
    while (from < fileSize) {
        std::uint64_t found = GWZipLoadOperation::kNotFound;
        GWErrorPtr ignored;
        if (!GWZipLoadOperation::searchForData(kDescriptorSignature, file, from, fileSize - from,
                                               &found, cancelled, &ignored) ||
            found == GWZipLoadOperation::kNotFound) {
            return std::nullopt;
        }
        auto bytes = window.read(found + 4, 20, &ignored);
        if (!bytes) {
            return std::nullopt;
        }
        // A Zip64 entry's descriptor holds 8-byte sizes; which one this is
        // only the header's Zip64 block tells, since either could match.
        const std::uint64_t walked = found - dataStart;
        for (const bool wide : {zip64, !zip64}) {
            GWByteReader reader(*bytes);
            const std::uint32_t crc = reader.u32le();
            const std::uint64_t size = wide ? reader.u64le() : reader.u32le();
            const std::uint64_t expanded = wide ? reader.u64le() : reader.u32le();
            if (reader.ok() && size == walked) {
                return Extent{walked, expanded, crc, wide ? 24u : 16u};
            }
        }
        from = found + 1;
    }
    return std::nullopt;
}

std::optional<GWZipFileArray> GWZipLoadOperation::recoverFilesFromLocalHeaders(
    GWRemoteFileHandle& file, GWErrorPtr* error) {
    const std::uint64_t fileSize = file.fileSize();
    auto cancelled = [this] { return isCancelled(); };
    // Names and extra fields are copied out before the next read reuses it.
    GWZipReadWindow window(file);
    GWZipEntryPipe pipe(GWZipEntryPipe::kUnbounded);
    GWZipParsedBatch batch;
    std::uint64_t position = startOffset_;
    std::uint64_t count = 0;
    while (count < kMaxRecoveredEntries && !isCancelled()) {
        GWErrorPtr stepError;
        auto fixed = window.read(position, GWZipLocalFileHeader::kLength, &stepError);
        GWZipLocalFileHeader local;
        if (!fixed || !readLocalHeaderRecord(&local, *fixed, nullptr)) {
            break;
        }
        const std::size_t variableLength =
            std::size_t(local.filenameLength) + local.extraFieldLength;
        auto variable =
            window.read(position + GWZipLocalFileHeader::kLength, variableLength, &stepError);
        if (!variable || variable->size() < variableLength) {
            break;
        }
        const GWData nameBytes(variable->begin(), variable->begin() + local.filenameLength);
        const GWData extra(variable->begin() + local.filenameLength, variable->end());
        const std::uint64_t dataStart = position + GWZipLocalFileHeader::kLength + variableLength;

        Extent extent{local.compressedSize, local.uncompressedSize, local.crc32, 0};
        const GWDictionary info =
            infoFromExtraFieldData(extra, true, nullptr).value_or(GWDictionary());
        if (const GWValue* size = GWDictionaryValue(info, kGWZipCompressedSizeKey)) {
            extent.compressedSize = size->unsignedValue();
        }
        if (const GWValue* size = GWDictionaryValue(info, kGWZipUncompressedSizeKey)) {
            extent.uncompressedSize = size->unsignedValue();
        }
        if (local.generalPurposeFlags & 0x0008) {
            const bool zip64 = GWDictionaryValue(info, kGWZipUncompressedSizeKey) != nullptr;
            auto described =
                extentFromDescriptor(file, window, dataStart, fileSize, zip64, cancelled);
            if (!described) {
                break;
            }
            extent = *described;
        }
        // An entry cut by the end of the file is not recovered.
        if (extent.compressedSize > fileSize - std::min(fileSize, dataStart)) {
            break;
        }
        GWZipCentralDirectoryRecord record;
        record.signature = GWZipCentralDirectoryRecord::kSignature;
        record.versionMadeBy = local.versionNeeded & 0x00FF;  // host unknown: MS-DOS
        record.versionNeeded = local.versionNeeded;
        record.generalPurposeFlags = local.generalPurposeFlags;
        record.compressionMethod = local.compressionMethod;
        record.modificationTime = local.modificationTime;
        record.modificationDate = local.modificationDate;
        record.crc32 = extent.crc32;
        record.compressedSize = std::min<std::uint64_t>(extent.compressedSize, kGWZip32BitSentinel);
        record.uncompressedSize =
            std::min<std::uint64_t>(extent.uncompressedSize, kGWZip32BitSentinel);
        record.filenameLength = local.filenameLength;
        record.extraFieldLength = local.extraFieldLength;
        record.localHeaderOffset = position - startOffset_;
        auto name = filenameFromData(nameBytes, record, &stepError);
        if (!name ||
            !parseItemFromCentralDirectoryRecord(record, window, std::move(*name), nameBytes, extra,
                                                 std::nullopt, batch, &stepError)) {
            break;
        }
        if (!batch.entries.empty()) {
            // The header's sizes may be zero for an entry with a descriptor.
            GWZipParsedEntry& added = batch.entries.back();
            added.compressedSize = extent.compressedSize;
            added.uncompressedSize = extent.uncompressedSize;
            added.crc32 = extent.crc32;
        }
        ++count;
        position = dataStart + extent.compressedSize + extent.descriptorLength;
    }
    if (count == 0) {
        GWFail(error, corruptError("No complete entry could be recovered from local headers"));
        return std::nullopt;
    }
    GWLog("central directory missing: %llu entries recovered from local headers",
          (unsigned long long)count);
    recoveredEntryCount_ = count;
    pipe.push(std::move(batch));
    pipe.close(true);
    GWZipTreeBuilder tree;
    if (!buildTree(pipe, tree, error)) {
        return std::nullopt;
    }
    return finishTree(tree, error);
}
