#include <algorithm>
#include <cerrno>
#include <cstring>

#include "GWArchiveSupport/GWArchiveConstants.h"
#include "GWZipDecryption.h"
#include "GWZipErrors.h"
#include "GWZipExtractOperation.h"
#include "GWZipNames.h"
#include "foundation/GWFileManager.h"
#include "foundation/GWFormat.h"
#include "foundation/GWLog.h"
#include "foundation/GWRemoteFileHandle.h"
#include "foundation/GWStreamPipeline.h"

namespace {

// A link's target is collected whole; a longer one cannot be a path.
constexpr std::size_t kMaximumLinkTextLength = 64 * 1024;

GWErrorPtr corruptOffsetError(const GWZipFilePtr& file) {
    return GWGenerateError(kGWCocoaErrorDomain, GWFileReadCorruptFileError, std::nullopt, nullptr,
                           {}, "entry %s: its data lies past any file", file->path().c_str());
}

// An entry whose stored data is at most this long is read in one piece with
// its local header, whose name and extra field rarely pass the slack.
constexpr std::uint64_t kSmallEntryLength = 64 * 1024;
constexpr std::uint64_t kLocalHeaderSlack = 512;

// Reads and parses the 30 fixed bytes of the entry's local header, and as
// much as `following` of what comes after them into `bytes` (less at the end
// of the file).
bool readLocalHeader(const GWZipWorkOperation& operation, const GWZipFilePtr& file,
                     GWRemoteFileHandle& handle, std::uint64_t headerOffset,
                     GWZipLocalFileHeader* header, GWErrorPtr* error, std::uint64_t following = 0,
                     GWData* read = nullptr) {
    // A positioned read: no look at the file's size first.
    GWData bytes(std::size_t(GWZipLocalFileHeader::kLength + following));
    auto got = handle.readDataAtOffset(headerOffset, bytes, error);
    if (!got) {
        return false;
    }
    bytes.resize(*got);
    if (read) {
        *read = bytes;
    }
    if (!operation.readLocalHeaderRecord(header,
                                         std::span(bytes).first(std::min<std::size_t>(
                                             bytes.size(), GWZipLocalFileHeader::kLength)),
                                         error)) {
        GWLog("error reading local record for file %s", file->path().c_str());
        return false;
    }
    return true;
}

// What an entry's decoded data must come to: its declared size and, where
// the directory has one, its CRC-32. A MacBinary member is checked as
// stored, before it is decoded. AE-2 encryption leaves the CRC out (its
// authentication code covers the data), AE-1 keeps it.
GWStreamCheck streamCheckForFile(const GWZipFile& file) {
    GWStreamCheck check;
    check.size = file.storedUncompressedSize();
    const bool isAE2 = file.compressionMethod() == 99 && [&] {
        const GWDictionary info = file.extraInfo();
        const auto version = info.find(kGWZipAESVendorVersionKey);
        return version != info.end() && version->second.isNumber() &&
               version->second.unsignedValue() == 2;
    }();
    if (!isAE2 && file.privateUncompressedChecksumAlgorithm() == GWChecksumAlgorithmCRC32) {
        if (auto crc = file.privateUncompressedChecksum(); crc && crc->size() == 4) {
            check.decodedAlgorithm = GWChecksumAlgorithmCRC32;
            check.decodedDigest = std::move(crc);
        }
    }
    return check;
}

GWErrorPtr sizeMismatchError(const GWZipFile& file, std::uint64_t decoded, bool tooLong) {
    return GWZipEntryError(GWZipArchiveSizeMismatchError, file.path(),
                           "entry %s decodes to %s than its declared %llu bytes%s",
                           file.path().c_str(), tooLong ? "more" : "fewer",
                           (unsigned long long)file.storedUncompressedSize(),
                           tooLong ? "" : GWFormat(" (%llu)", (unsigned long long)decoded).c_str());
}

GWErrorPtr checksumMismatchError(const GWZipFile& file) {
    return GWZipEntryError(GWZipArchiveChecksumMismatchError, file.path(),
                           "entry %s does not match its CRC-32", file.path().c_str());
}

// Why the stream of `file` failed, or none when every byte checked out.
GWErrorPtr streamError(const GWZipFile& file, const GWStreamPipeline& pipeline,
                       const GWErrorPtr& handlerError) {
    const GWStreamOutcome& outcome = pipeline.outcome();
    switch (outcome.end) {
        case GWStreamEnd::stopped:
            // A handler that stops without saying why was stopped by its caller.
            return handlerError ? handlerError : GWCocoaError(GWUserCancelledError);
        case GWStreamEnd::failed:
            return outcome.error ? outcome.error : GWCocoaError(GWFileReadCorruptFileError);
        case GWStreamEnd::tooLong:
        case GWStreamEnd::tooShort:
            return sizeMismatchError(file, outcome.decodedBytes,
                                     outcome.end == GWStreamEnd::tooLong);
        case GWStreamEnd::complete:
            if (pipeline.check().decodedDigest && !outcome.decodedDigestMatches(pipeline.check())) {
                return checksumMismatchError(file);
            }
            return nullptr;
    }
    return nullptr;
}

// An entry without stored bytes decodes to nothing: its declared size and
// CRC-32 must say so too.
GWErrorPtr emptyStreamError(const GWZipFile& file) {
    const GWStreamCheck check = streamCheckForFile(file);
    if (check.size && *check.size != 0) {
        return sizeMismatchError(file, 0, false);
    }
    if (check.decodedDigest && *check.decodedDigest != GWData(4, 0)) {
        return checksumMismatchError(file);
    }
    return nullptr;
}

// A link's text as the file system takes it: up to the first zero byte.
std::string linkTextFromBytes(const GWData& bytes) {
    const auto end = std::find(bytes.begin(), bytes.end(), std::uint8_t(0));
    return std::string(bytes.begin(), end);
}

}  // namespace

void GWZipExtractOperation::unpackFile(const GWZipFilePtr& file,
                                       const GWRemoteFileHandlePtr& handle,
                                       const std::optional<GWURL>& target, ChunkHandler handler,
                                       Completion completion) {
    if (file->isDirectory()) {
        GWErrorPtr error;
        completion(handler({}, true, &error) ? nullptr : error);
        return;
    }
    const bool isSymbolicLink = file->isSymbolicLink();
    auto linkText = std::make_shared<GWData>();
    GWRemoteFileHandlePtr writer;
    if (targetFile_.isValid() && file == file_) {
        writer = GWRemoteFileHandle::initForWritingToDescriptor(targetFile_.get(), *target);
    } else if (!isSymbolicLink) {
        GWErrorPtr error;
        writer = GWRemoteFileHandle::initForWritingToURL(target, &error);
        if (!writer) {
            completion(error);
            return;
        }
    }
    ChunkHandler write = [writer, linkText, handler](std::span<const std::uint8_t> data,
                                                     bool isDone, GWErrorPtr* error) {
        if (!writer) {
            if (linkText->size() + data.size() > kMaximumLinkTextLength) {
                return GWFail(error, GWPOSIXError(ENAMETOOLONG));
            }
            linkText->insert(linkText->end(), data.begin(), data.end());
        } else if (!writer->writeData(data, error)) {
            return false;
        }
        return handler(data, isDone, error);
    };
    auto finishing = [this, file, handle, target, isSymbolicLink, linkText,
                      completion](const GWErrorPtr& error) {
        if (error) {
            completion(error);
            return;
        }
        if (isSymbolicLink) {
            if (!file->symlinkDestination()) {
                file->setSymlinkDestination(linkTextFromBytes(*linkText));
            }
            GWErrorPtr linkError;
            if (target &&
                !createSymbolicLinkAtURL(*target, *file->symlinkDestination(), &linkError)) {
                completion(linkError);
                return;
            }
            completion(nullptr);
            return;
        }
        // Companions describe a file on disk; a stream of the data fork has
        // nothing to apply them to.
        if (!target) {
            completion(nullptr);
        } else if (file->resourceFork()) {
            writeResourceForkForFile(file, handle, *target, completion);
        } else if (file->appleDoubleFile()) {
            applyAppleDoubleMetadataForFile(file, handle, *target, completion);
        } else if (file->isMacBinaryEncoded()) {
            decodeMacBinaryFileAtURL(*target, completion);
        } else {
            completion(nullptr);
        }
    };
    unpackFile(file, handle, std::move(write),
               [writer, finishing = std::move(finishing)](const GWErrorPtr& error) {
                   if (writer) {
                       writer->closeFileAndReturnError(nullptr);
                   }
                   finishing(error);
               });
}

void GWZipExtractOperation::unpackFile(const GWZipFilePtr& file,
                                       const GWRemoteFileHandlePtr& handle, ChunkHandler handler,
                                       Completion completion) {
    const std::uint64_t relativeOffset = file->localHeaderOffset();
    if (relativeOffset > UINT64_MAX - startOffset_) {
        completion(corruptOffsetError(file));
        return;
    }
    const std::uint64_t headerOffset = startOffset_ + relativeOffset;
    GWZipLocalFileHeader header;
    GWErrorPtr error;
    if (file->isDirectory()) {
        if (file->moreInfoAvailableInLocalHeader() &&
            (!readLocalHeader(*this, file, *handle, headerOffset, &header, &error) ||
             !loadExtraInfoFromLocalHeader(header, file, handle, &error))) {
            completion(error);
            return;
        }
        completion(nullptr);
        return;
    }
    // The central directory's size: a local header with a data descriptor has none.
    const std::uint64_t compressedSize = file->compressedSize();
    // Only from a local file: a remote one's reads come from ranges fetched
    // ahead, which a read past the entry's own bytes would upset.
    const bool local = handle->URL() && handle->URL()->isFileURL();
    const std::uint64_t following =
        local && compressedSize <= kSmallEntryLength ? kLocalHeaderSlack + compressedSize : 0;
    GWData head;
    if (!readLocalHeader(*this, file, *handle, headerOffset, &header, &error, following, &head)) {
        completion(error);
        return;
    }
    if (file->moreInfoAvailableInLocalHeader() &&
        !loadExtraInfoFromLocalHeader(header, file, handle, &error)) {
        completion(error);
        return;
    }
    GWErrorPtr decryptError;
    auto decryptor = GWZipDecryptorForFile(*file, header, password_, &decryptError);
    if (decryptError) {
        completion(decryptError);
        return;
    }
    // An encrypted entry always has its header: the decryptor finds it missing.
    if (compressedSize == 0 && !decryptor) {
        completion(emptyStreamError(*file));
        return;
    }
    const std::uint64_t skip =
        GWZipLocalFileHeader::kLength + header.filenameLength + header.extraFieldLength;
    if (headerOffset > UINT64_MAX - skip) {
        completion(corruptOffsetError(file));
        return;
    }
    // A small entry's data came with its header: one read, not two.
    std::optional<GWData> data;
    if (head.size() >= skip && head.size() - skip >= compressedSize) {
        data.emplace(head.begin() + std::ptrdiff_t(skip),
                     head.begin() + std::ptrdiff_t(skip + compressedSize));
    }
    extractFile(file, headerOffset + skip, compressedSize, data, file->dataCompressionMethod(),
                handle, std::move(handler), std::move(completion), std::move(decryptor));
}

void GWZipExtractOperation::extractFile(const GWZipFilePtr& file, std::uint64_t offset,
                                        std::uint64_t length, const std::optional<GWData>& data,
                                        std::uint16_t compressionMethod,
                                        const GWRemoteFileHandlePtr& handle, ChunkHandler handler,
                                        Completion completion,
                                        std::unique_ptr<GWStreamDecryptor> decryptor) {
    GWErrorPtr error;
    auto decompressor = decompressorForFile(file, compressionMethod, &error);
    if (!decompressor) {
        completion(error);
        return;
    }
    GWErrorPtr handlerError;
    GWStreamPipeline pipeline(
        decompressor, streamCheckForFile(*file),
        [&](std::span<const std::uint8_t> piece) { return handler(piece, false, &handlerError); },
        std::move(decryptor));
    if (data) {
        pipeline.feed(*data, true);
    } else {
        const GWByteRange range{offset, length};
        handle->willRead(std::span(&range, 1));
        pipeline.run(*handle, offset, length, [this] { return isCancelled(); });
    }
    if (auto failure = streamError(*file, pipeline, handlerError)) {
        completion(failure);
        return;
    }
    completion(handler({}, true, &handlerError) ? nullptr
               : handlerError                   ? handlerError
                                                : GWCocoaError(GWUserCancelledError));
}

bool GWZipExtractOperation::loadExtraInfoFromLocalHeader(const GWZipLocalFileHeader& header,
                                                         const GWZipFilePtr& file,
                                                         const GWRemoteFileHandlePtr& handle,
                                                         GWErrorPtr* error) {
    // Without a data descriptor the local header's sizes and CRC are the real ones.
    if (!(header.generalPurposeFlags & 0x0008)) {
        const std::uint32_t crc = header.crc32;
        file->setUncompressedChecksum(GWData{std::uint8_t(crc), std::uint8_t(crc >> 8),
                                             std::uint8_t(crc >> 16), std::uint8_t(crc >> 24)});
        file->setUncompressedChecksumAlgorithm(1);
        file->setCompressedSize(header.compressedSize);
        file->setUncompressedSize(header.uncompressedSize);
    }
    const std::uint64_t relativeOffset = file->localHeaderOffset();
    if (relativeOffset > UINT64_MAX - startOffset_ - GWZipLocalFileHeader::kLength) {
        return GWFail(error, corruptOffsetError(file));
    }
    if (!handle->seekToFileOffset(startOffset_ + relativeOffset + GWZipLocalFileHeader::kLength,
                                  error)) {
        return false;
    }
    if (header.filenameLength == 0 && header.extraFieldLength == 0) {
        return true;
    }
    const std::size_t length = std::size_t(header.filenameLength) + header.extraFieldLength;
    auto bytes = handle->readDataOfLength(length, error);
    if (!bytes) {
        return false;
    }
    if (bytes->size() < length) {
        return GWFail(error, GWGenerateError(kGWCocoaErrorDomain, GWFileReadCorruptFileError,
                                             srcURL_, nullptr, {},
                                             "entry %s: the local header's name and extra field "
                                             "run past the end of the file",
                                             file->path().c_str()));
    }
    const std::span<const std::uint8_t> all(*bytes);
    if (header.filenameLength > 0) {
        const auto nameBytes = all.first(header.filenameLength);
        const std::string path(nameBytes.begin(),
                               std::find(nameBytes.begin(), nameBytes.end(), std::uint8_t(0)));
        // A name that is not one component would move the entry elsewhere.
        std::string name(GWZipLastPOSIXPathComponent(path));
        if (GWZipIsSafeFilename(name)) {
            file->setName(std::move(name));
        }
    }
    if (header.extraFieldLength > 0) {
        if (auto info = infoFromExtraFieldData(all.subspan(header.filenameLength), true, nullptr)) {
            file->setExtraInfo(std::move(*info));
        }
    }
    return true;
}

bool GWZipExtractOperation::createSymbolicLinkAtURL(const GWURL& url,
                                                    const std::string& destinationPath,
                                                    GWErrorPtr* error) {
    // Both forms come down to the same call here: the text is stored as it
    // stands, so relative links stay relative.
    return GWCreateSymbolicLinkAtURL(url, destinationPath, error);
}
