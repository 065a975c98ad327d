#include <algorithm>
#include <cerrno>
#include <cstring>

#include "GWZipExtractOperation.h"
#include "GWZipNames.h"
#include "foundation/GWFileManager.h"
#include "foundation/GWLog.h"
#include "foundation/GWRemoteFileHandle.h"

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
        completion(nullptr);
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
    if (!data && !handle->seekToFileOffset(offset, &error)) {
        completion(error);
        return;
    }
    // A handler that stops without saying why was stopped by its caller.
    auto stopError = [](GWErrorPtr error) {
        return error ? error : GWCocoaError(GWUserCancelledError);
    };
    auto pass = [&](std::span<const std::uint8_t> output, bool isDone) {
        GWErrorPtr handlerError;
        if (!handler(output, isDone, &handlerError)) {
            completion(stopError(handlerError));
            return false;
        }
        return true;
    };
    auto decode = [&](std::span<const std::uint8_t> input, bool isFinal) {
        bool passed = true;
        GWErrorPtr decodeError;
        if (decompressor->decompressStreamWithInputData(
                input, isFinal,
                [&](std::span<const std::uint8_t> output) { return passed = pass(output, false); },
                &decodeError)) {
            return true;
        }
        if (passed) {
            completion(decodeError ? decodeError
                                   : GWCocoaError(GWFileReadCorruptFileError, srcURL_));
        }
        return false;
    };
    auto read = [&](GWRemoteFileHandle&, std::span<const std::uint8_t> chunk, bool isFinal,
                    const GWErrorPtr& readError) {
        if (isCancelled()) {
            completion(GWCocoaError(GWUserCancelledError));
            return false;
        }
        if (readError) {
            completion(readError);
            return false;
        }
        if (!chunk.empty() && !decode(chunk, isFinal)) {
            return false;
        }
        if (isFinal) {
            if (!pass({}, true)) {
                return false;
            }
            completion(nullptr);
        }
        return true;
    };
    if (data) {
        read(*handle, *data, true, nullptr);
        return;
    }
    handle->readDataAtOffset(offset, length, UINT64_MAX, read);
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
