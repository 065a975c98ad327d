#include "GWZipExtractOperation.h"

#include "GWZipArchive.h"

#include "foundation/GWFileManager.h"
#include "foundation/GWFileSystem.h"
#include "foundation/GWRemoteFileHandle.h"
#include "foundation/GWRemoteFileHandlePool.h"

GWZipExtractOperationPtr GWZipExtractOperation::make(const GWZipFilePtr& file,
                                                     const GWURL& archiveURL,
                                                     std::uint64_t startOffset, GWErrorPtr* error) {
    if (!file) {
        GWFail(error, GWGenerateError(kGWCocoaErrorDomain, GWFileWriteUnknownError, std::nullopt,
                                      nullptr, {}, "No entry to extract"));
        return nullptr;
    }
    auto operation = GWZipExtractOperationPtr(new GWZipExtractOperation());
    operation->file_ = file;
    operation->srcURL_ = archiveURL;
    operation->startOffset_ = startOffset;
    return operation;
}

GWZipExtractOperationPtr GWZipExtractOperation::initForExtractingFile(
    const GWZipFilePtr& file, const GWURL& archiveURL, std::uint64_t startOffset,
    const GWURL& toURL, bool atomically, ProgressHandler progressHandler, GWErrorPtr* error) {
    auto operation = make(file, archiveURL, startOffset, error);
    if (!operation) {
        return nullptr;
    }
    operation->destURL_ = toURL;
    operation->isAtomic_ = atomically;
    operation->dataHandler_ = [progress = std::move(progressHandler)](
                                  std::optional<std::span<const std::uint8_t>> data, bool,
                                  const GWErrorPtr&) {
        return progress ? progress(data ? data->size() : 0) : true;
    };
    return operation;
}

GWZipExtractOperationPtr GWZipExtractOperation::initForExtractingFile(const GWZipFilePtr& file,
                                                                      const GWURL& archiveURL,
                                                                      std::uint64_t startOffset,
                                                                      DataHandler dataHandler,
                                                                      GWErrorPtr* error) {
    auto operation = make(file, archiveURL, startOffset, error);
    if (operation) {
        operation->dataHandler_ = std::move(dataHandler);
    }
    return operation;
}

namespace {

GWErrorPtr missingArchiveError() {
    return GWGenerateError(kGWCocoaErrorDomain, GWFileWriteUnknownError, std::nullopt, nullptr, {},
                           "No archive to extract from");
}

}  // namespace

GWZipExtractOperationPtr GWZipExtractOperation::initForExtractingFile(
    const GWZipFilePtr& file, const std::shared_ptr<GWZipArchive>& archive, const GWURL& toURL,
    bool atomically, ProgressHandler progressHandler, GWErrorPtr* error) {
    if (!archive) {
        GWFail(error, missingArchiveError());
        return nullptr;
    }
    auto operation = initForExtractingFile(file, archive->URL(), archive->startOffset(), toURL,
                                           atomically, std::move(progressHandler), error);
    if (operation) {
        operation->setPassword(archive->password());
    }
    return operation;
}

GWZipExtractOperationPtr GWZipExtractOperation::initForExtractingFile(
    const GWZipFilePtr& file, const std::shared_ptr<GWZipArchive>& archive, DataHandler dataHandler,
    GWErrorPtr* error) {
    if (!archive) {
        GWFail(error, missingArchiveError());
        return nullptr;
    }
    auto operation = initForExtractingFile(file, archive->URL(), archive->startOffset(),
                                           std::move(dataHandler), error);
    if (operation) {
        operation->setPassword(archive->password());
    }
    return operation;
}

GWErrorPtr GWZipExtractOperation::error() const {
    std::lock_guard lock(errorMutex_);
    return error_;
}

void GWZipExtractOperation::setError(GWErrorPtr error) {
    std::lock_guard lock(errorMutex_);
    error_ = std::move(error);
}

void GWZipExtractOperation::markDone() {
    // The operation's own folder goes with it; a batch keeps its own.
    replacementFolder_.reset();
    targetFile_.reset();
    done_.store(true);
    finish();
}

GWSemaphore& GWZipExtractOperation::creationSemaphore() {
    static GWSemaphore semaphore(1);
    return semaphore;
}

void GWZipExtractOperation::start() {
    const GWOperationPtr keepAlive = shared_from_this();
    if (markExecuting()) {
        main();
    }
}

void GWZipExtractOperation::main() {
    started_.store(true);
    if (isCancelled()) {
        markDone();
        return;
    }
    // The pipeline may end on another thread; its completion keeps the
    // operation alive until then.
    auto self = std::static_pointer_cast<GWZipExtractOperation>(shared_from_this());
    ChunkHandler handler = [this](std::span<const std::uint8_t> data, bool isDone,
                                  GWErrorPtr* error) {
        if (dataHandler_ && !dataHandler_(data, isDone, nullptr)) {
            cancel();
            return GWFail(error, GWCocoaError(GWUserCancelledError));
        }
        return true;
    };
    unpackWithHandler(std::move(handler), [this, self](const GWErrorPtr& error) {
        setError(error);
        if (error && !isCancelled() && dataHandler_) {
            dataHandler_(std::nullopt, true, error);
        }
        markDone();
    });
}

void GWZipExtractOperation::unpackWithHandler(ChunkHandler handler, Completion completion) {
    GWErrorPtr openError;
    auto handle = archiveHandles_ ? archiveHandles_->acquire(&openError)
                                  : GWRemoteFileHandle::initForReadingFromURL(srcURL_, &openError);
    Completion finalStep = [this, handle,
                            completion = std::move(completion)](const GWErrorPtr& error) {
        if (handle && archiveHandles_) {
            archiveHandles_->release(handle);
        } else if (handle) {
            handle->closeFileAndReturnError(nullptr);
        }
        completion(error);
    };
    if (!handle) {
        finalStep(openError);
        return;
    }
    const bool isDirectory = file_->isDirectory();
    const bool isSymbolicLink = file_->isSymbolicLink();
    std::optional<GWURL> target;
    if (destURL_) {
        GWErrorPtr error;
        target = prepareTarget(isDirectory, isSymbolicLink, &error);
        if (!target) {
            finalStep(error);
            return;
        }
    }
    unpackFile(file_, handle, target, std::move(handler),
               [this, target, isDirectory, isSymbolicLink, finalStep](const GWErrorPtr& error) {
                   if (error && target && !isDirectory && !isSymbolicLink) {
                       // Nothing that failed a check may stay on disk as if whole.
                       GWRemoveItemAtURL(*target, nullptr);
                   }
                   GWErrorPtr stepError = error;
                   if (!stepError && destURL_) {
                       if (isDirectory) {
                           if (!defersDirectoryInfo_) {
                               setInfoForDirectory(file_, containmentRootOrParent(), *destURL_,
                                                   &stepError);
                           }
                       } else {
                           // Set through the file still open, before it moves: a
                           // decoded MacBinary member is another file by now.
                           const bool throughDescriptor =
                               targetFile_.isValid() && !file_->isMacBinaryEncoded();
                           GWErrorPtr infoError;
                           if (throughDescriptor) {
                               setInfoForFile(file_, *target, &infoError, targetFile_.get());
                           }
                           if (*target == *destURL_ || moveIntoPlace(*target, &stepError)) {
                               if (!throughDescriptor) {
                                   setInfoForFile(file_, *destURL_, &stepError);
                               }
                           } else if (target) {
                               GWRemoveItemAtURL(*target, nullptr);
                           }
                           if (!stepError) {
                               stepError = infoError;
                           }
                       }
                   }
                   targetFile_.reset();
                   finalStep(stepError);
               });
}
