// Finding the ZIP data in a file: the first local header, the end record
// (classic and Zip64), and the quick "is this a ZIP" test.

#include <algorithm>
#include <cstring>

#include "GWZipLoadOperation.h"
#include "foundation/GWByteReader.h"
#include "foundation/GWLog.h"

namespace {

constexpr std::size_t kSearchChunkSize = 16384;
constexpr std::size_t kLargestSearchChunk = 1 << 20;
// The classic end record plus the longest archive comment, with some slack.
constexpr std::uint64_t kEndRecordSearchWindow = 66000;

}  // namespace

bool GWZipLoadOperation::searchForData(std::span<const std::uint8_t> pattern,
                                       GWRemoteFileHandle& file, std::uint64_t startOffset,
                                       std::uint64_t length, std::uint64_t* foundOffset,
                                       const std::function<bool()>& cancelBlock,
                                       GWErrorPtr* error) {
    if (foundOffset) {
        *foundOffset = kNotFound;
    }
    if (pattern.empty()) {
        return true;
    }
    const std::uint64_t end = length > UINT64_MAX - startOffset ? UINT64_MAX : startOffset + length;
    if (!file.seekToFileOffset(startOffset, error)) {
        return false;
    }
    GWData buffer;
    std::uint64_t position = startOffset;
    std::uint64_t reads = 0;
    while (true) {
        if (cancelBlock && cancelBlock()) {
            return GWFail(
                error, GWGenerateError(kGWCocoaErrorDomain, GWUserCancelledError, file.URL(),
                                       nullptr, {}, "The search for the ZIP data was cancelled"));
        }
        // Reads grow as the search goes on, so a long one costs few round trips.
        const std::uint64_t want = std::min<std::uint64_t>(
            std::min<std::uint64_t>(kSearchChunkSize << std::min<std::uint64_t>(reads++, 6),
                                    kLargestSearchChunk),
            end - position);
        auto chunk = file.readDataOfLength(want, error);
        if (!chunk) {
            return false;
        }
        // Keep the tail of the previous buffer so that a pattern split
        // between two reads is still found.
        const std::size_t keep = std::min(buffer.size(), pattern.size() - 1);
        buffer.erase(buffer.begin(), buffer.end() - std::ptrdiff_t(keep));
        buffer.insert(buffer.end(), chunk->begin(), chunk->end());
        auto match = std::search(buffer.begin(), buffer.end(), pattern.begin(), pattern.end());
        if (match != buffer.end()) {
            if (foundOffset) {
                *foundOffset = position - keep + std::uint64_t(match - buffer.begin());
            }
            return true;
        }
        position += chunk->size();
        if (chunk->empty() || position >= end) {
            return true;
        }
    }
}

bool GWZipLoadOperation::parseEndOfCentralDirRecord(GWZipEndOfCentralDirectoryRecord* record,
                                                    std::span<const std::uint8_t> data,
                                                    GWErrorPtr* error) const {
    GWZipEndOfCentralDirectoryRecord parsed;
    GWByteReader reader(data);
    parsed.signature = reader.u32le();
    parsed.diskNumber = reader.u16le();
    parsed.centralDirectoryDisk = reader.u16le();
    parsed.entriesOnDisk = reader.u16le();
    parsed.totalEntries = reader.u16le();
    parsed.centralDirectorySize = reader.u32le();
    parsed.centralDirectoryOffset = reader.u32le();
    parsed.commentLength = reader.u16le();
    if (!reader.ok() || parsed.signature != GWZipEndOfCentralDirectoryRecord::kSignature) {
        GWLog("error parsing zip end of central dir record");
        return GWFail(
            error, corruptError("Bad end of central directory record (%s)",
                                reader.ok() ? "signature" : reader.failureDescription().c_str()));
    }
    if (record) {
        *record = parsed;
    }
    return true;
}

bool GWZipLoadOperation::parseZip64EndOfCentralDirRecord(GWZipEndOfCentralDirectoryRecord* record,
                                                         std::span<const std::uint8_t> data,
                                                         GWErrorPtr* error) const {
    GWZipEndOfCentralDirectoryRecord parsed;
    GWByteReader reader(data);
    parsed.signature = reader.u32le();
    reader.skip(8);  // size of the rest of the record
    parsed.versionMadeBy = reader.u16le();
    parsed.versionNeeded = reader.u16le();
    parsed.diskNumber = reader.u32le();
    parsed.centralDirectoryDisk = reader.u32le();
    parsed.entriesOnDisk = reader.u64le();
    parsed.totalEntries = reader.u64le();
    parsed.centralDirectorySize = reader.u64le();
    parsed.centralDirectoryOffset = reader.u64le();
    if (!reader.ok() || parsed.signature != GWZipEndOfCentralDirectoryRecord::kZip64Signature) {
        GWLog("error parsing Zip64 end of central dir record");
        return GWFail(
            error, corruptError("Bad Zip64 end of central directory record (%s)",
                                reader.ok() ? "signature" : reader.failureDescription().c_str()));
    }
    if (record) {
        *record = parsed;
    }
    return true;
}

std::optional<std::uint64_t> GWZipLoadOperation::getEnd(GWZipEndOfCentralDirectoryRecord* record,
                                                        GWRemoteFileHandle& file,
                                                        GWErrorPtr* error) const {
    const std::uint64_t size = file.fileSize();
    const std::size_t kLength = GWZipEndOfCentralDirectoryRecord::kLength;
    if (size < kLength) {
        GWFail(error, corruptError("The file is %llu bytes long, too short for a ZIP end record",
                                   (unsigned long long)size));
        return std::nullopt;
    }
    if (!file.seekToFileOffset(size - kLength, error)) {
        return std::nullopt;
    }
    auto tail = file.readDataOfLength(kLength, error);
    if (!tail) {
        return std::nullopt;
    }
    std::uint64_t endOffset = 0;
    GWData recordBytes;
    static constexpr std::uint8_t kSignature[] = {'P', 'K', 5, 6};
    if (tail->size() == kLength && std::equal(kSignature, kSignature + 4, tail->begin()) &&
        (*tail)[20] == 0 && (*tail)[21] == 0) {
        endOffset = size - kLength;
        recordBytes = std::move(*tail);
    } else {
        const std::uint64_t window = std::min(size, kEndRecordSearchWindow);
        if (!file.seekToFileOffset(size - window, error)) {
            return std::nullopt;
        }
        auto block = file.readDataOfLength(window, error);
        if (!block) {
            return std::nullopt;
        }
        if (block->size() < kLength) {
            GWFail(error, corruptError("The end of the file could not be read"));
            return std::nullopt;
        }
        // The record nearest the end wins; its comment length is not checked.
        std::optional<std::size_t> match;
        for (std::size_t position = block->size() - kLength + 1; position-- > 0;) {
            if (std::memcmp(block->data() + position, kSignature, 4) == 0) {
                match = position;
                break;
            }
        }
        if (!match) {
            GWFail(error, corruptError("No end of central directory record in the last %llu "
                                       "bytes",
                                       (unsigned long long)window));
            return std::nullopt;
        }
        endOffset = size - block->size() + *match;
        recordBytes.assign(block->begin() + std::ptrdiff_t(*match), block->end());
    }
    GWZipEndOfCentralDirectoryRecord end;
    if (!parseEndOfCentralDirRecord(&end, recordBytes, error)) {
        return std::nullopt;
    }
    if (end.centralDirectoryOffset == kGWZip32BitSentinel) {
        auto zip64Offset = getEnd(&end, endOffset, file, error);
        if (!zip64Offset) {
            return std::nullopt;
        }
        endOffset = *zip64Offset;
    } else if (end.totalEntries == 0xFFFF || end.entriesOnDisk == 0xFFFF ||
               end.centralDirectorySize == kGWZip32BitSentinel) {
        // Writers that need Zip64 only for the entry count (more than 65,535)
        // or the directory's size leave the offset real; their Zip64 record is
        // found by its locator, and without one the classic values stand.
        GWZipEndOfCentralDirectoryRecord zip64;
        GWErrorPtr ignored;
        if (auto zip64Offset = getEnd(&zip64, endOffset, file, &ignored)) {
            end = zip64;
            endOffset = *zip64Offset;
        }
    }
    if (record) {
        *record = end;
    }
    return endOffset;
}

std::optional<std::uint64_t> GWZipLoadOperation::getEnd(GWZipEndOfCentralDirectoryRecord* record,
                                                        std::uint64_t endingAtOffset,
                                                        GWRemoteFileHandle& file,
                                                        GWErrorPtr* error) const {
    const std::size_t kLocatorLength = GWZipEndOfCentralDirectoryRecord::kZip64LocatorLength;
    if (endingAtOffset < kLocatorLength) {
        GWFail(error, corruptError("No room for a Zip64 locator before the end record at "
                                   "offset %llu",
                                   (unsigned long long)endingAtOffset));
        return std::nullopt;
    }
    if (!file.seekToFileOffset(endingAtOffset - kLocatorLength, error)) {
        return std::nullopt;
    }
    auto locator = file.readDataOfLength(kLocatorLength, error);
    if (!locator) {
        return std::nullopt;
    }
    GWByteReader reader(*locator);
    const std::uint32_t signature = reader.u32le();
    reader.skip(4);  // disk holding the Zip64 record
    // Absolute, even behind a prefix: writers that adjust offsets adjust this too.
    const std::uint64_t zip64Offset = reader.u64le();
    if (!reader.ok() || signature != GWZipEndOfCentralDirectoryRecord::kZip64LocatorSignature) {
        GWFail(error, corruptError("No Zip64 end of central directory locator at offset %llu",
                                   (unsigned long long)(endingAtOffset - kLocatorLength)));
        return std::nullopt;
    }
    if (zip64Offset > endingAtOffset - kLocatorLength) {
        GWFail(error, corruptError("The Zip64 end record offset %llu lies past its locator",
                                   (unsigned long long)zip64Offset));
        return std::nullopt;
    }
    if (!file.seekToFileOffset(zip64Offset, error)) {
        return std::nullopt;
    }
    auto bytes = file.readDataOfLength(GWZipEndOfCentralDirectoryRecord::kZip64Length, error);
    if (!bytes) {
        return std::nullopt;
    }
    if (!parseZip64EndOfCentralDirRecord(record, *bytes, error)) {
        return std::nullopt;
    }
    return zip64Offset;
}

bool GWZipLoadOperation::isZipArchiveAtURL(const GWURL& url) {
    auto file = GWRemoteFileHandle::initForReadingFromURL(url, nullptr);
    if (!file) {
        return false;
    }
    auto head = file->readDataOfLength(4, nullptr);
    if (!head || head->size() < 4) {
        return false;
    }
    if ((*head)[0] == 'P' && (*head)[1] == 'K' && (*head)[2] == 3 && (*head)[3] == 4) {
        return true;
    }
    if ((*head)[0] == 'M' && (*head)[1] == 'Z' && isSelfExtractingZipArchiveAtURL(url)) {
        return true;
    }
    if (!file->isSeekable() || !url.isFileURL()) {
        return false;
    }
    const std::uint64_t size = file->fileSize();
    const std::uint64_t tailLength = std::min<std::uint64_t>(size, 512);
    if (!file->seekToFileOffset(size - tailLength, nullptr)) {
        return false;
    }
    auto tail = file->readDataOfLength(tailLength, nullptr);
    if (!tail || tail->size() < 4) {
        return false;
    }
    for (std::size_t position = tail->size() - 3; position-- > 0;) {
        if (std::memcmp(tail->data() + position, "PK\x05\x06", 4) == 0) {
            return true;
        }
    }
    return false;
}
