// The central directory walk: one record at a time, its local header where
// that is cheap or needed, names, modes and dates, and the entry tree.

#include <algorithm>
#include <array>
#include <cctype>

#include "GWZipFieldReader.h"
#include "GWZipLoadOperation.h"
#include "GWZipNames.h"
#include "GWZipUnicodePathCRC.h"
#include "foundation/GWByteReader.h"
#include "foundation/GWChecksum.h"
#include "foundation/GWFileManager.h"
#include "foundation/GWStringEncoding.h"

namespace {

constexpr std::uint16_t kDataDescriptorFlag = 0x0008;
constexpr std::uint16_t kUTF8NamesFlag = 0x0800;
constexpr std::uint32_t kMSDOSReadOnlyAttribute = 0x01;
constexpr std::uint32_t kMSDOSDirectoryAttribute = 0x10;

bool isMSDOSLikeHost(std::uint8_t host) {
    // Not NTFS (10) or VFAT (14): their archivers store Unix-style modes
    // differently and are handled as "other".
    switch (host) {
        case GWZipHostMSDOS:
        case GWZipHostVMCMS:
        case GWZipHostOS2HPFS:
        case GWZipHostMVS:
        case GWZipHostAcorn:
        case GWZipHostAlternateMVS: return true;
        default: return false;
    }
}

std::string lowercasePathExtension(std::string_view name) {
    const std::string_view last = GWZipLastPOSIXPathComponent(name);
    const auto dot = last.rfind('.');
    if (dot == std::string::npos || dot == 0) {
        return {};
    }
    std::string extension(last.substr(dot + 1));
    std::transform(extension.begin(), extension.end(), extension.begin(),
                   [](unsigned char c) { return char(std::tolower(c)); });
    return extension;
}

std::uint16_t msdosMode(std::string_view name, std::uint32_t externalAttributes) {
    std::uint16_t mode;
    if (externalAttributes & kMSDOSDirectoryAttribute) {
        mode = 040555;
    } else {
        static constexpr std::array<std::string_view, 5> kExecutable = {"com", "exe", "cmd", "bat",
                                                                        "btm"};
        const std::string extension = lowercasePathExtension(name);
        const bool executable =
            std::find(kExecutable.begin(), kExecutable.end(), extension) != kExecutable.end();
        mode = executable ? 0100555 : 0100444;
    }
    if (!(externalAttributes & kMSDOSReadOnlyAttribute)) {
        mode |= 0200;
    }
    // A Unix mode stored by the archiver wins when it agrees on the owner bits.
    const auto unixMode = std::uint16_t(externalAttributes >> 16);
    if ((unixMode & 0700) == (mode & 0700)) {
        mode = unixMode;
    }
    return mode;
}

std::optional<std::uint64_t> infoNumber(const GWDictionary& info, const char* key) {
    // Most entries carry no extra info; a key is not worth building for them.
    if (info.empty()) {
        return std::nullopt;
    }
    const GWValue* value = GWDictionaryValue(info, key);
    if (value && value->isNumber()) {
        return value->unsignedValue();
    }
    return std::nullopt;
}

// The compressed size a central record escapes into its Zip64 field, which
// the extra-info decoder does not take from central records.
std::optional<std::uint64_t> centralZip64CompressedSize(std::span<const std::uint8_t> extra,
                                                        const GWZipCentralDirectoryRecord& record) {
    static constexpr std::uint16_t kZip64FieldID = 0x0001;
    GWByteReader reader(extra);
    while (reader.remaining() >= 4) {
        const std::uint16_t identifier = reader.u16le();
        auto field = reader.bytes(reader.u16le());
        if (!reader.ok()) {
            break;
        }
        if (identifier == kZip64FieldID) {
            GWByteReader values(field);
            if (record.uncompressedSize == kGWZip32BitSentinel) {
                values.u64le();
            }
            const std::uint64_t size = values.u64le();
            return values.ok() ? std::optional(size) : std::nullopt;
        }
    }
    return std::nullopt;
}

std::uint64_t saturatingSum(std::uint64_t a, std::uint64_t b) {
    return b > UINT64_MAX - a ? UINT64_MAX : a + b;
}

// The parent path as NSString's stringByDeletingLastPathComponent gives it.
std::string_view parentPath(std::string_view path) {
    while (path.size() > 1 && path.back() == '/') {
        path.remove_suffix(1);
    }
    const auto slash = path.rfind('/');
    if (slash == std::string_view::npos) {
        return {};
    }
    return path.substr(0, slash == 0 ? 1 : slash);
}

}  // namespace

GWDate GWZipLoadOperation::dateFromDOS(std::uint16_t time, std::uint16_t date) {
    const std::uint32_t key = (std::uint32_t(date) << 16) | time;
    auto found = dosDates_.find(key);
    if (found != dosDates_.end()) {
        return found->second;
    }
    // The seconds field is used as it stands (0 to 31), not doubled.
    const GWDate converted =
        GWDate::gregorianDateWithYear((date >> 9) + 1980, (date >> 5) & 0x0F, date & 0x1F,
                                      time >> 11, (time >> 5) & 0x3F, time & 0x1F);
    dosDates_.emplace(key, converted);
    return converted;
}

bool GWZipLoadOperation::readLocalHeaderRecord(GWZipLocalFileHeader* record,
                                               GWRemoteFileHandle& file, GWErrorPtr* error) const {
    auto bytes = file.readDataOfLength(GWZipLocalFileHeader::kLength, error);
    if (!bytes) {
        return false;
    }
    return readLocalHeaderRecord(record, *bytes, error);
}

bool GWZipLoadOperation::readCentralDirRecord(
    GWZipCentralDirectoryRecord* record, std::span<const std::uint8_t> buffer, std::size_t* pointer,
    std::optional<std::string>* filename, std::optional<GWData>* extraFieldData,
    std::optional<std::string>* comment, GWErrorPtr* error, std::uint64_t bufferOffset) const {
    const std::size_t start = *pointer;
    const auto directoryOffset = (unsigned long long)(bufferOffset + start);
    GWZipCentralDirectoryRecord parsed;
    GWByteReader reader(buffer);
    reader.seek(start);
    parsed.signature = reader.u32le();
    if (!reader.ok() || parsed.signature != GWZipCentralDirectoryRecord::kSignature) {
        return GWFail(error, corruptError("No central directory record at directory offset %llu",
                                          directoryOffset));
    }
    parsed.versionMadeBy = reader.u16le();
    parsed.versionNeeded = reader.u16le();
    parsed.generalPurposeFlags = reader.u16le();
    parsed.compressionMethod = reader.u16le();
    parsed.modificationTime = reader.u16le();
    parsed.modificationDate = reader.u16le();
    parsed.crc32 = reader.u32le();
    parsed.compressedSize = reader.u32le();
    parsed.uncompressedSize = reader.u32le();
    parsed.filenameLength = reader.u16le();
    parsed.extraFieldLength = reader.u16le();
    parsed.commentLength = reader.u16le();
    parsed.diskNumberStart = reader.u16le();
    parsed.internalAttributes = reader.u16le();
    parsed.externalAttributes = reader.u32le();
    parsed.localHeaderOffset = reader.u32le();
    auto nameBytes = reader.bytes(parsed.filenameLength);
    auto extraBytes = reader.bytes(parsed.extraFieldLength);
    auto commentBytes = reader.bytes(parsed.commentLength);
    if (!reader.ok()) {
        return GWFail(error, corruptError("The central directory record at directory offset %llu "
                                          "runs past the directory: %s",
                                          directoryOffset, reader.failureDescription().c_str()));
    }
    if (record) {
        *record = parsed;
    }
    if (filename) {
        filename->reset();
    }
    if (extraFieldData) {
        extraFieldData->reset();
    }
    if (comment) {
        comment->reset();
    }
    if (!nameBytes.empty()) {
        auto name = filenameFromData(nameBytes, parsed, error);
        if (!name) {
            return false;
        }
        if (filename) {
            *filename = std::move(name);
        }
    }
    if (!extraBytes.empty() && extraFieldData) {
        *extraFieldData = GWZipNormaliseUnicodeFieldCRCs(extraBytes, nameBytes, commentBytes);
    }
    if (!commentBytes.empty() && comment) {
        *comment = GWStringFromBytes(commentBytes, GWStringEncoding::UTF8);
    }
    *pointer = reader.offset();
    return true;
}

std::uint8_t GWZipLoadOperation::operatingSystemFromCentralDirectoryRecord(
    const GWZipCentralDirectoryRecord& record) {
    return std::uint8_t(record.versionMadeBy >> 8);
}

std::string GWZipLoadOperation::convertBackslashesInFilename(std::string filename) {
    std::replace(filename.begin(), filename.end(), '\\', '/');
    return filename;
}

std::optional<std::string> GWZipLoadOperation::filenameFromData(
    std::span<const std::uint8_t> data, const GWZipCentralDirectoryRecord& record,
    GWErrorPtr*) const {
    // A caller who names the encoding knows the archive better than any guess.
    if (!filenameEncoding_.empty() && !(record.generalPurposeFlags & kUTF8NamesFlag)) {
        const std::string_view bytes(reinterpret_cast<const char*>(data.data()), data.size());
        if (auto name = GWStringFromBytesInNamedEncoding(bytes, filenameEncoding_)) {
            return name;
        }
    }
    // The UTF-8 flag is not trusted either way: valid UTF-8 wins.
    if (auto name = GWZipFileSystemString(data)) {
        return name;
    }
    static constexpr GWStringEncoding kWindowsEncodings[] = {
        GWStringEncoding::WindowsCP1252, GWStringEncoding::ShiftJIS,
        GWStringEncoding::WindowsCP1253, GWStringEncoding::WindowsCP1254,
        GWStringEncoding::WindowsCP1250, GWStringEncoding::WindowsCP1251};
    static constexpr GWStringEncoding kMacEncodings[] = {GWStringEncoding::MacOSRoman};
    static constexpr GWStringEncoding kOtherEncodings[] = {GWStringEncoding::ISOLatin1};
    std::span<const GWStringEncoding> encodings = kOtherEncodings;
    switch (operatingSystemFromCentralDirectoryRecord(record)) {
        case GWZipHostMSDOS:
        case GWZipHostNTFS: encodings = kWindowsEncodings; break;
        case GWZipHostMacintosh:
        case GWZipHostOSX: encodings = kMacEncodings; break;
        default: break;
    }
    for (GWStringEncoding encoding : encodings) {
        if (auto name = GWStringFromBytes(data, encoding)) {
            return name;
        }
    }
    return std::nullopt;
}

bool GWZipLoadOperation::parseItemFromCentralDirectoryRecord(
    const GWZipCentralDirectoryRecord& record, GWZipReadWindow& file, std::string filename,
    std::span<const std::uint8_t> centralNameBytes, const std::optional<GWData>& extraFieldData,
    const std::optional<std::string>& comment, GWZipParsedBatch& batch, GWErrorPtr* error) {
    GWDictionary extraInfo;
    if (extraFieldData) {
        extraInfo =
            infoFromExtraFieldData(*extraFieldData, false, nullptr).value_or(GWDictionary());
    }
    std::uint64_t localHeaderOffset = record.localHeaderOffset;
    if (localHeaderOffset == kGWZip32BitSentinel) {
        if (auto offset = infoNumber(extraInfo, kGWZipLocalHeaderOffsetKey)) {
            localHeaderOffset = *offset;
        }
    }
    std::uint64_t compressedSize = record.compressedSize;
    std::uint64_t uncompressedSize = record.uncompressedSize;
    std::uint16_t flags = record.generalPurposeFlags;
    std::uint16_t method = record.compressionMethod;
    std::uint16_t dosTime = record.modificationTime;
    std::uint16_t dosDate = record.modificationDate;
    std::uint32_t crc32 = record.crc32;

    const bool consultLocalHeader =
        (record.uncompressedSize == kGWZip32BitSentinel || url_.isFileURL()) &&
        localHeaderOffset != kGWZip32BitSentinel;
    // Without the local header its name and extra field are left out of the
    // entry's extent: an estimate that never reaches past the true end
    // refuses no honest archive, and still catches shared local headers and
    // any entry that starts inside another's data.
    std::uint64_t headerLength = GWZipLocalFileHeader::kLength;
    if (consultLocalHeader) {
        if (localHeaderOffset > UINT64_MAX - startOffset_) {
            return GWFail(error,
                          corruptError("Entry \"%s\": local header offset %llu is out of "
                                       "range",
                                       filename.c_str(), (unsigned long long)localHeaderOffset));
        }
        const std::uint64_t headerOffset = startOffset_ + localHeaderOffset;
        auto fixed = file.read(headerOffset, GWZipLocalFileHeader::kLength, error);
        if (!fixed) {
            return false;
        }
        GWZipLocalFileHeader local;
        GWErrorPtr localError;
        if (!readLocalHeaderRecord(&local, *fixed, &localError)) {
            return GWFail(error, corruptError("Entry \"%s\": no valid local header at offset "
                                              "%llu: %s",
                                              filename.c_str(), (unsigned long long)headerOffset,
                                              localError->localizedDescription().c_str()));
        }
        const std::uint64_t variableOffset = headerOffset + GWZipLocalFileHeader::kLength;
        const std::size_t variableLength =
            std::size_t(local.filenameLength) + local.extraFieldLength;
        headerLength += variableLength;
        auto variable = file.read(variableOffset, variableLength, error);
        if (!variable) {
            return false;
        }
        if (variable->size() < variableLength) {
            return GWFail(error, corruptError("Entry \"%s\": the local header at offset %llu is "
                                              "cut short by the end of the file",
                                              filename.c_str(), (unsigned long long)headerOffset));
        }
        const auto localNameBytes = variable->first(local.filenameLength);
        // Archivers write the same name twice; decoding it once is enough.
        if (local.filenameLength && !std::ranges::equal(localNameBytes, centralNameBytes)) {
            auto localName = filenameFromData(localNameBytes, record, error);
            if (!localName) {
                return false;
            }
            filename = std::move(*localName);
        }
        if (local.extraFieldLength) {
            const GWData localExtra = GWZipNormaliseUnicodeFieldCRCs(
                variable->subspan(local.filenameLength), variable->first(local.filenameLength), {});
            auto localInfo = infoFromExtraFieldData(localExtra, true, error);
            if (!localInfo) {
                return false;
            }
            extraInfo = std::move(*localInfo);
        }
        flags = local.generalPurposeFlags;
        method = local.compressionMethod;
        dosTime = local.modificationTime;
        dosDate = local.modificationDate;
        if (!(flags & kDataDescriptorFlag)) {
            compressedSize = local.compressedSize;
            uncompressedSize = local.uncompressedSize;
            if (crc32 != kGWZip32BitSentinel && local.crc32 != 0) {
                crc32 = local.crc32;
            }
        }
        auto zip64Size = [&](std::uint64_t size, const char* key, std::uint64_t central) {
            if (size != kGWZip32BitSentinel) {
                return size;
            }
            auto value = infoNumber(extraInfo, key);
            if (!value) {
                return size;
            }
            if (*value != 0) {
                return *value;
            }
            return central == kGWZip32BitSentinel ? std::uint64_t(0) : central;
        };
        compressedSize = zip64Size(compressedSize, kGWZipCompressedSizeKey, record.compressedSize);
        uncompressedSize =
            zip64Size(uncompressedSize, kGWZipUncompressedSizeKey, record.uncompressedSize);
    }

    if (compressedSize == kGWZip32BitSentinel) {
        // Escaped with no Zip64 value where it was taken from: the central
        // record's, then its Zip64 field's. Read without the local header, an
        // entry escaping this size alone would otherwise claim 4 GiB of data.
        compressedSize = record.compressedSize;
        if (compressedSize == kGWZip32BitSentinel && extraFieldData) {
            compressedSize =
                centralZip64CompressedSize(*extraFieldData, record).value_or(compressedSize);
        }
    }
    std::uint64_t dataLength = compressedSize;
    if (consultLocalHeader && (flags & kDataDescriptorFlag)) {
        // The shortest descriptor: no signature, 32-bit sizes.
        dataLength = saturatingSum(dataLength, 12);
    }

    std::uint16_t mode;
    const std::uint8_t host = operatingSystemFromCentralDirectoryRecord(record);
    if (isMSDOSLikeHost(host)) {
        filename = convertBackslashesInFilename(std::move(filename));
        mode = msdosMode(filename, record.externalAttributes);
    } else if (host == GWZipHostUnix) {
        mode = std::uint16_t(record.externalAttributes >> 16);
    } else if (!filename.empty() && filename.back() == '/') {
        mode = 040755;
    } else {
        // No file-type bits for unknown hosts, deliberately.
        mode = host == GWZipHostMacintosh ? 0100755 : 0755;
    }

    if (comment && !comment->empty()) {
        const GWValue* existing = GWDictionaryValue(extraInfo, kGWZipCommentKey);
        if (!existing || !existing->string() || existing->string()->empty()) {
            extraInfo.insert_or_assign(kGWZipCommentKey, GWValue(*comment));
        }
    }
    GWZipParsedEntry& entry = batch.entries.emplace_back();
    entry.nameStart = batch.names.size();
    entry.nameLength = filename.size();
    batch.names += filename;
    entry.compressedSize = compressedSize;
    entry.uncompressedSize = uncompressedSize;
    entry.localHeaderOffset = localHeaderOffset;
    entry.dataEnd = saturatingSum(localHeaderOffset, saturatingSum(headerLength, dataLength));
    entry.crc32 = crc32;
    entry.compressionMethod = method;
    entry.generalPurposeFlags = flags;
    entry.permissionsMode = mode;
    entry.modificationDate = dateFromDOS(dosTime, dosDate);
    entry.extraInfo = std::move(extraInfo);
    return true;
}

bool GWZipLoadOperation::addItemWithFilename(
    std::string_view filename, std::uint64_t compressedSize, std::uint64_t uncompressedSize,
    std::uint16_t compressionMethod, std::uint16_t generalPurposeFlags, std::uint32_t crc32,
    std::uint64_t localHeaderOffset, GWDate modificationDate, std::uint16_t permissionsMode,
    GWDictionary extraInfo, GWZipTreeBuilder& rootItems, GWErrorPtr*) {
    if (!filename.empty() && filename.back() == '/') {
        filename.remove_suffix(1);
        permissionsMode = std::uint16_t((permissionsMode & 07777) | 040000);
    }
    const auto owner = infoNumber(extraInfo, kGWZipUserIDKey);
    const auto group = infoNumber(extraInfo, kGWZipGroupIDKey);

    // Missing directories on the way are made; "." and ".." are resolved.
    // Entries of one directory usually follow each other, so the last
    // parent is reused until a replacement could change what a path finds.
    const std::string_view directoryPath = parentPath(filename);
    GWZipFilePtr parent;
    if (lastParent_ && directoryPath == lastParentPath_) {
        parent = lastParent_;
    } else {
        parent = rootItems.fileWithPathComponents(
            GWZipFile::standardizedComponentsForPath(directoryPath), true);
        lastParent_ = parent;
        lastParentPath_ = directoryPath;
    }
    // "/" is its own last component, as the platform's paths have it.
    std::string name(filename == "/" ? filename : GWZipLastPOSIXPathComponent(filename));

    std::optional<std::string> linkTarget;
    const GWValue* link =
        extraInfo.empty() ? nullptr : GWDictionaryValue(extraInfo, kGWZipSymbolicLinkFilenameKey);
    if (link && link->string()) {
        linkTarget = *link->string();
    }
    GWData checksum = {std::uint8_t(crc32), std::uint8_t(crc32 >> 8), std::uint8_t(crc32 >> 16),
                       std::uint8_t(crc32 >> 24)};
    auto node = GWZipFile::initWithName(
        std::move(name), parent, compressedSize, uncompressedSize, std::move(checksum),
        GWChecksumAlgorithmCRC32, owner ? std::uint32_t(*owner) : GWProcessUserID(),
        group ? std::uint32_t(*group) : GWProcessGroupID(), permissionsMode, modificationDate,
        std::move(linkTarget), localHeaderOffset, generalPurposeFlags, compressionMethod,
        std::move(extraInfo));
    auto existing = rootItems.addChild(parent, node);
    // An explicit directory entry replaces the implicit one made for its
    // children earlier, and takes its place at the end. At the root a
    // duplicate stays, by design.
    if (parent && existing && existing->isDirectory()) {
        rootItems.moveChildren(existing, node);
        rootItems.removeChild(parent, existing);
        lastParent_ = nullptr;
    }
    return true;
}
