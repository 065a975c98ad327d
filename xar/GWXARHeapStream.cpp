#include "GWXARHeapStream.h"

#include <string>

#include "GWArchiveSupport/GWArchiveConstants.h"
#include "foundation/GWDecompressor.h"
#include "foundation/GWRemoteFileHandle.h"

namespace {

// A digest missing on either side never matches.
bool digestsMatch(const std::optional<GWData>& computed, const std::optional<GWData>& stored) {
    return computed && stored && *computed == *stored;
}

// A few hundred bytes of bzip2 can decode to tens of megabytes; a stream is
// never allowed to grow past the size its table of contents states.
GWErrorPtr oversizedStreamError(std::uint64_t statedSize, const GWURL& url) {
    return GWGenerateError(kGWCocoaErrorDomain, GWFileReadCorruptFileError, url, nullptr, {},
                           "An item of %s decodes to more than the %llu bytes its table of "
                           "contents states.",
                           url.path().c_str(), (unsigned long long)statedSize);
}

GWErrorPtr unsupportedCompressionError(std::uint64_t type, const GWURL& url) {
    const std::string entity =
        type == GWXARCompressionTypeLZMA ? std::string("LZMA") : std::to_string(type);
    return GWGenerateError(kGWXARArchiveErrorDomain, GWXARArchiveUnsupportedCompressionError, url,
                           nullptr, {{kGWXARArchiveUnknownEntityErrorKey, GWValue(entity)}},
                           "The compression \"%s\" of an item in %s cannot be read.",
                           entity.c_str(), url.path().c_str());
}

}  // namespace

std::optional<int> GWXARHeapStream::decompressorAlgorithm(std::uint64_t compressionType) {
    switch (compressionType) {
        case GWXARCompressionTypeNone: return GWDecompressorAlgorithmCopy;
        case GWXARCompressionTypeGZip: return GWDecompressorAlgorithmDeflate;
        case GWXARCompressionTypeBZ2: return GWDecompressorAlgorithmBzip2;
        default: return std::nullopt;
    }
}

void GWXARHeapStream::invokeDataHandler(const GWXARDataHandler& handler,
                                        const GWXARStreamContext& context,
                                        std::optional<std::span<const std::uint8_t>> data,
                                        bool isDone, bool checksumFailed, const GWErrorPtr& error) {
    if (!handler) {
        return;
    }
    if (handler(data, isDone, checksumFailed, error)) {
        return;
    }
    context.setCancelled(true);
    handler(std::nullopt, true, checksumFailed,
            GWCocoaError(GWUserCancelledError, context.archiveURL));
}

void GWXARHeapStream::streamDataReference(const GWXARDataReference& reference,
                                          const GWXARStreamContext& context,
                                          const GWXARDataHandler& handler) {
    const GWURL& url = context.archiveURL;
    GWErrorPtr openError;
    auto handle = GWRemoteFileHandle::initForReadingFromURL(url, &openError);
    if (!handle) {
        invokeDataHandler(handler, context, std::nullopt, true, false, openError);
        return;
    }
    if (context.fileBelongsToArchive && !context.fileBelongsToArchive()) {
        // The one report that does not say isDone; callers rely on it as it is.
        invokeDataHandler(handler, context, std::nullopt, false, false,
                          GWGenerateError(kGWXARArchiveErrorDomain,
                                          GWXARArchiveFileNotInArchiveError, url, nullptr, {}));
        return;
    }
    const auto algorithm = decompressorAlgorithm(reference.compressionType());
    if (!algorithm) {
        invokeDataHandler(handler, context, std::nullopt, true, false,
                          unsupportedCompressionError(reference.compressionType(), url));
        return;
    }

    context.setCancelled(false);
    bool checksumFailed = false;
    std::uint64_t decodedLength = 0;
    bool handleClosed = false;
    auto closeHandle = [&] {
        if (!handleClosed) {
            handle->closeFileAndReturnError(nullptr);
            handleClosed = true;
        }
    };
    GWDecompressor::decompressRemoteFileHandle(
        handle, reference.offset(), reference.compressedSize(), *algorithm,
        int(reference.compressedChecksumType()), int(reference.uncompressedChecksumType()),
        [&](std::span<const std::uint8_t> piece, std::uint64_t, std::uint64_t, bool done,
            const std::optional<GWData>& storedDigest, const std::optional<GWData>& decodedDigest,
            GWErrorPtr error) {
            decodedLength += piece.size();
            if (!error && decodedLength > reference.uncompressedSize()) {
                error = oversizedStreamError(reference.uncompressedSize(), url);
            }
            if (done || error || context.isCancelled()) {
                closeHandle();
            }
            if (context.isCancelled()) {
                return false;
            }
            if (done && !error &&
                (!digestsMatch(storedDigest, reference.compressedChecksum()) ||
                 !digestsMatch(decodedDigest, reference.uncompressedChecksum()))) {
                checksumFailed = true;
            }
            if (error) {
                context.setCancelled(true);
                invokeDataHandler(handler, context, std::nullopt, true, checksumFailed, error);
                return false;
            }
            invokeDataHandler(handler, context, piece, done, checksumFailed, nullptr);
            return true;
        });
    // The decompressor stops calling once told to stop; the handle is ours to close.
    closeHandle();
}
