#include <algorithm>
#include <cerrno>
#include <cstring>

#include "GWArchiveSupport/GWArchiveConstants.h"
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

// Reads and parses the 30 fixed bytes of the entry's local header.
bool readLocalHeader(const GWZipWorkOperation& operation, const GWZipFilePtr& file,
                     GWRemoteFileHandle& handle, std::uint64_t headerOffset,
                     GWZipLocalFileHeader* header, GWErrorPtr* error) {
    if (!handle.seekToFileOffset(headerOffset, error)) {
        return false;
    }
    auto bytes = handle.readDataOfLength(GWZipLocalFileHeader::kLength, error);
    if (!bytes) {
        return false;
    }
    if (!operation.readLocalHeaderRecord(header, *bytes, error)) {
        GWLog("error reading local record for file %s", file->path().c_str());
        return false;
    }
    return true;
}

// What an entry's decoded data must come to: its declared size and, where
// the directory has one, its CRC-32. A MacBinary member is checked as
// stored, before it is decoded.
GWStreamCheck streamCheckForFile(const GWZipFile& file) {
    GWStreamCheck check;
    check.size = file.storedUncompressedSize();
    if (file.privateUncompressedChecksumAlgorithm() == GWChecksumAlgorithmCRC32) {
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
    if (!isSymbolicLink) {
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
    if (!readLocalHeader(*this, file, *handle, headerOffset, &header, &error)) {
        completion(error);
        return;
    }
    // The central directory's size: a local header with a data descriptor has none.
    const std::uint64_t compressedSize = file->compressedSize();
    if (file->moreInfoAvailableInLocalHeader() &&
        !loadExtraInfoFromLocalHeader(header, file, handle, &error)) {
        completion(error);
        return;
    }
    if (compressedSize == 0) {
        completion(emptyStreamError(*file));
        return;
    }
    const std::uint64_t skip =
        GWZipLocalFileHeader::kLength + header.filenameLength + header.extraFieldLength;
    if (headerOffset > UINT64_MAX - skip) {
        completion(corruptOffsetError(file));
        return;
    }
    extractFile(file, headerOffset + skip, compressedSize, std::nullopt, file->compressionMethod(),
                handle, std::move(handler), std::move(completion));
}

void GWZipExtractOperation::extractFile(const GWZipFilePtr& file, std::uint64_t offset,
                                        std::uint64_t length, const std::optional<GWData>& data,
                                        std::uint16_t compressionMethod,
                                        const GWRemoteFileHandlePtr& handle, ChunkHandler handler,
                                        Completion completion) {
    GWErrorPtr error;
    auto decompressor = decompressorForFile(file, compressionMethod, &error);
    if (!decompressor) {
        completion(error);
        return;
    }
    GWErrorPtr handlerError;
    GWStreamPipeline pipeline(
        decompressor, streamCheckForFile(*file),
        [&](std::span<const std::uint8_t> piece) { return handler(piece, false, &handlerError); });
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
