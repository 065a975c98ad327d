// The archive's read path for stored streams, and its extract-to-disk entry points.

#include <atomic>

#include "GWArchiveSupport/GWArchiveConstants.h"
#include "GWXARArchive.h"
#include "GWXARExtractOperation.h"

namespace {

// Longer chains of hard links only come from a damaged or hostile tree.
constexpr std::size_t kMaxHardLinkChain = 256;

GWErrorPtr notInArchiveError(const GWURL& url) {
    return GWGenerateError(kGWXARArchiveErrorDomain, GWXARArchiveFileNotInArchiveError, url,
                           nullptr, {}, "The item does not belong to the archive %s.",
                           url.path().c_str());
}

}  // namespace

void GWXARArchive::invokeDataHandler(const GWXARDataHandler& handler, const GWOperationQueuePtr&,
                                     std::optional<std::span<const std::uint8_t>> data, bool isDone,
                                     bool checksumFailed, const GWErrorPtr& error) {
    const auto self = shared_from_this();
    GWXARHeapStream::invokeDataHandler(
        handler,
        {URL(), [self] { return self->isCancelled(); },
         [self](bool cancelled) { self->setIsCancelled(cancelled); }, nullptr},
        data, isDone, checksumFailed, error);
}

void GWXARArchive::extractDataForkOfFile(const GWXARFilePtr& file, const GWOperationQueuePtr& queue,
                                         const GWXARDataHandler& handler) {
    extractDataReference(file ? file->dataFork() : nullptr, file, queue, handler);
}

void GWXARArchive::extractExtendedAttribute(const std::string& name, const GWXARFilePtr& file,
                                            const GWOperationQueuePtr& queue,
                                            const GWXARDataHandler& handler) {
    if (file) {
        for (const auto& attribute : file->extendedAttributes()) {
            if (attribute && attribute->name() == name) {
                extractDataReference(attribute, file, queue, handler);
                return;
            }
        }
    }
    invokeDataHandler(
        handler, queue, std::nullopt, true, false,
        GWGenerateError(kGWXARArchiveErrorDomain, GWXARArchiveNoSuchExtendedAttributeError, URL(),
                        nullptr, {{kGWXARArchiveUnknownEntityErrorKey, GWValue(name)}},
                        "The item has no extended attribute \"%s\".", name.c_str()));
}

void GWXARArchive::extractDataReference(const GWXARDataReferencePtr& reference,
                                        const GWXARFilePtr& file, const GWOperationQueuePtr&,
                                        const GWXARDataHandler& handler) {
    const auto self = shared_from_this();
    streamDataReference(reference, file, handler,
                        {URL(), [self] { return self->isCancelled(); },
                         [self](bool cancelled) { self->setIsCancelled(cancelled); }, nullptr},
                        true);
}

void GWXARArchive::extractDataReference(const GWXARDataReferencePtr& reference,
                                        const GWXARFilePtr& file, const GWXARDataHandler& handler,
                                        std::function<bool()> isCancelled) {
    auto stopped = std::make_shared<std::atomic<bool>>(false);
    streamDataReference(
        reference, file, handler,
        {URL(),
         [stopped, isCancelled] { return stopped->load() || (isCancelled && isCancelled()); },
         [stopped](bool cancelled) { stopped->store(cancelled); }, nullptr},
        !reference);
}

void GWXARArchive::streamDataReference(const GWXARDataReferencePtr& reference,
                                       const GWXARFilePtr& file, const GWXARDataHandler& handler,
                                       GWXARStreamContext context, bool resolveItem) {
    const auto self = shared_from_this();
    const GWURL url = URL();
    auto report = [&](std::optional<std::span<const std::uint8_t>> data, const GWErrorPtr& error) {
        GWXARHeapStream::invokeDataHandler(handler, context, data, true, false, error);
    };
    if (!file || file->archive() != self) {
        report(std::nullopt, notInArchiveError(url));
        return;
    }
    // Follow hard links to the item that holds the data. Each step is a
    // weak link to another entry; a cycle is a corrupt tree, not a hang.
    GWXARFilePtr item = file;
    for (std::size_t hops = 0; resolveItem; ++hops) {
        const auto type = item->type();
        if (type == GWXARFileTypeRegular) {
            break;
        }
        if (type == GWXARFileTypeDirectory) {
            report(std::nullopt, GWPOSIXError(EISDIR, url));
            return;
        }
        if (type == GWXARFileTypeSymbolicLink) {
            const std::string text = item->symlinkDestination().value_or("");
            report(std::span(reinterpret_cast<const std::uint8_t*>(text.data()), text.size()),
                   nullptr);
            return;
        }
        if (type != GWXARFileTypeHardLink || hops >= kMaxHardLinkChain) {
            report(std::nullopt, GWPOSIXError(EINVAL, url));
            return;
        }
        item = item->hardlinkDestination();
    }
    const GWXARDataReferencePtr stream = reference ? reference : item->dataFork();
    if (!stream) {
        // Writers leave the data out of empty files.
        report(std::span<const std::uint8_t>(), nullptr);
        return;
    }
    context.fileBelongsToArchive = [self, item] { return item->archive() == self; };
    GWXARHeapStream::streamDataReference(*stream, context, handler);
}

bool GWXARArchive::extractFile(const GWXARFilePtr& file, const GWURL& url, bool* checksumIsInvalid,
                               GWErrorPtr* error, const GWExtractOptions& options) {
    auto operation = GWXARExtractOperation::initWithFile(file, url, shared_from_this());
    operation->setOptions(options);
    operation->start();
    if (checksumIsInvalid) {
        *checksumIsInvalid = operation->checksumIsInvalid();
    }
    if (auto failure = operation->error()) {
        return GWFail(error, std::move(failure));
    }
    return true;
}

void GWXARArchive::extractFile(const GWXARFilePtr& file, const GWURL& url,
                               const GWOperationQueuePtr& queue,
                               std::shared_ptr<GWXARExtractOperation>* operation,
                               ExtractionCompletionHandler completionHandler,
                               const GWExtractOptions& options) {
    auto extraction = GWXARExtractOperation::initWithFile(file, url, shared_from_this());
    extraction->setOptions(options);
    std::weak_ptr<GWXARExtractOperation> weakExtraction = extraction;
    extraction->setCompletionBlock([weakExtraction, completionHandler] {
        auto finished = weakExtraction.lock();
        if (completionHandler && finished) {
            completionHandler(finished->checksumIsInvalid(), finished->error());
        }
    });
    if (operation) {
        *operation = extraction;
    }
    const GWOperationQueuePtr target = queue ? queue : operationQueue();
    if (target) {
        target->addOperation(extraction);
    }
}
