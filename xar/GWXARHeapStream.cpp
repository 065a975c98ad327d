#include "GWXARHeapStream.h"

#include <string>

#include "GWArchiveSupport/GWArchiveConstants.h"
#include "foundation/GWDecompressor.h"
#include "foundation/GWRemoteFileHandle.h"
#include "foundation/GWStreamPipeline.h"

namespace {

// A few hundred bytes of bzip2 can decode to tens of megabytes; a stream is
// never allowed to grow past the size its table of contents states.
GWErrorPtr sizeMismatchError(std::uint64_t statedSize, GWStreamEnd end, const GWURL& url) {
    return GWGenerateError(kGWXARArchiveErrorDomain, GWXARArchiveSizeMismatchError, url, nullptr,
                           {{kGWXARArchiveUnknownEntityErrorKey, GWValue(statedSize)}},
                           "An item of %s decodes to %s than the %llu bytes its table of "
                           "contents states.",
                           url.path().c_str(), end == GWStreamEnd::tooLong ? "more" : "fewer",
                           (unsigned long long)statedSize);
}

GWErrorPtr unsupportedCompressionError(std::uint64_t type, const GWURL& url) {
    const std::string entity = std::to_string(type);
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
        // Writers label xz data "x-lzma" as well; the decoder tells the two forms apart.
        case GWXARCompressionTypeLZMA:
        case GWXARCompressionTypeXZ: return GWDecompressorAlgorithmXZ;
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
    auto decoder = GWDecompressor::initForStreamingWithAlgorithm(*algorithm, &openError);
    if (!decoder) {
        invokeDataHandler(handler, context, std::nullopt, true, false, openError);
        return;
    }
    GWStreamCheck check{reference.uncompressedSize(), int(reference.compressedChecksumType()),
                        reference.compressedChecksum(), int(reference.uncompressedChecksumType()),
                        reference.uncompressedChecksum()};
    GWStreamPipeline pipeline(decoder, check, [&](std::span<const std::uint8_t> piece) {
        if (context.isCancelled()) {
            return false;
        }
        invokeDataHandler(handler, context, piece, false, false, nullptr);
        return !context.isCancelled();
    });
    const GWStreamOutcome& outcome =
        pipeline.run(*handle, reference.offset(), reference.compressedSize(), context.isCancelled);
    handle->closeFileAndReturnError(nullptr);
    if (context.isCancelled() || outcome.end == GWStreamEnd::stopped) {
        return;  // whoever cancelled has had the handler's last call
    }
    GWErrorPtr error = outcome.error;
    if (outcome.end == GWStreamEnd::tooLong || outcome.end == GWStreamEnd::tooShort) {
        error = sizeMismatchError(reference.uncompressedSize(), outcome.end, url);
    }
    const bool checksumFailed =
        outcome.end == GWStreamEnd::complete &&
        !(outcome.storedDigestMatches(check) && outcome.decodedDigestMatches(check));
    if (error) {
        context.setCancelled(true);
        invokeDataHandler(handler, context, std::nullopt, true, false, error);
        return;
    }
    invokeDataHandler(handler, context, std::span<const std::uint8_t>(), true, checksumFailed,
                      nullptr);
}
