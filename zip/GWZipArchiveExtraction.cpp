#include <algorithm>
#include <cerrno>
#include <mutex>
#include <thread>

#include "GWZipArchive.h"
#include "GWZipExtractDestination.h"
#include "foundation/GWDispatch.h"
#include "foundation/GWFileSystem.h"
#include "foundation/GWFreeSpace.h"
#include "foundation/GWRemoteFileHandle.h"
#include "foundation/GWRemoteFileHandlePool.h"

namespace {

// What the operations of one batch share: the replacement folder, the first
// error, and the lock that serialises their completion steps.
struct BatchState {
    GWErrorPtr firstError;
    std::vector<std::weak_ptr<GWZipExtractOperation>> operations;
    // In tree order, parents first; their metadata comes last, deepest first.
    std::vector<GWZipExtractOperationPtr> directories;
    std::shared_ptr<GWReplacementFolder> folder;
    std::shared_ptr<GWRemoteFileHandle> fetchingAhead;  // keeps what it fetched until the end
    bool continueAfterFailure = false;
    std::function<void(const std::string&, const GWErrorPtr&)> entryFailed;
    std::function<void(const std::string&)> entryWritten;

    void finished(GWZipExtractOperation& operation) {
        GWErrorPtr error = operation.error();
        // Most entries succeed; workers would otherwise queue on the lock.
        if (!error && !operation.isCancelled()) {
            if (entryWritten) {
                entryWritten(operation.file()->path());
            }
            return;
        }
        std::lock_guard guard(mutex);
        if (!error && !firstError) {
            error = GWCocoaError(GWUserCancelledError);
        }
        if (!error) {
            return;
        }
        // Entries cancelled because another failed are not failures of their own.
        const bool knockOn = cancelling && error->is(kGWCocoaErrorDomain, GWUserCancelledError);
        if (!knockOn && entryFailed) {
            entryFailed(operation.file()->path(), error);
        }
        if (!firstError) {
            firstError = error;
        }
        if (!continueAfterFailure && !cancelling) {
            cancelling = true;
            for (const auto& weak : operations) {
                if (auto other = weak.lock()) {
                    other->cancel();
                }
            }
        }
    }

    void applyDirectoryInfo() {
        for (auto it = directories.rbegin(); it != directories.rend(); ++it) {
            const GWZipExtractOperation& operation = **it;
            if (operation.error() || operation.isCancelled() || !operation.destURL()) {
                continue;
            }
            GWErrorPtr error;
            const GWURL root = operation.containmentRoot().value_or(
                operation.destURL()->URLByDeletingLastPathComponent());
            if (!(*it)->setInfoForDirectory(operation.file(), root, *operation.destURL(), &error)) {
                // The directory and its contents are there; a refused date or
                // mode is reported without undoing them.
                std::lock_guard guard(mutex);
                if (entryFailed) {
                    entryFailed(operation.file()->path(), error);
                }
                if (!firstError) {
                    firstError = error;
                }
            }
        }
        directories.clear();
    }

private:
    std::mutex mutex;
    bool cancelling = false;
};

// What a batch will write: each regular entry's data and its companions'.
std::uint64_t declaredSize(const std::vector<GWZipExtractOperationPtr>& operations) {
    std::uint64_t total = 0;
    for (const auto& operation : operations) {
        const GWZipFilePtr& file = operation->file();
        if (!file->isDirectory()) {
            const std::uint64_t size = file->uncompressedSize();
            total = size > UINT64_MAX - total ? UINT64_MAX : total + size;
        }
    }
    return total;
}

// A remote archive's entries are fetched ahead, in file order and adjacent
// ones together, instead of a round trip for each entry's reads.
std::shared_ptr<GWRemoteFileHandle> fetchAhead(
    const GWURL& url, std::uint64_t start,
    const std::vector<GWZipExtractOperationPtr>& operations) {
    if (url.scheme() != "http" && url.scheme() != "https") {
        return nullptr;
    }
    auto handle = GWRemoteFileHandle::initForReadingFromURL(url, nullptr);
    if (!handle) {
        return nullptr;  // each entry meets the failure in its own terms
    }
    // The local header's name and extra field are known only once it is
    // read; they are rarely longer than this. A longer one's bytes are read
    // when needed.
    constexpr std::uint64_t kHeaderAllowance = GWZipLocalFileHeader::kLength + 1024;
    std::vector<GWByteRange> ranges;
    for (const auto& operation : operations) {
        const GWZipFilePtr& file = operation->file();
        const std::uint64_t header = file->localHeaderOffset();
        if (!file->isDirectory() && header <= UINT64_MAX - start) {
            const std::uint64_t data = file->compressedSize();
            ranges.push_back({start + header, data > UINT64_MAX - kHeaderAllowance
                                                  ? UINT64_MAX
                                                  : data + kHeaderAllowance});
        }
    }
    handle->willRead(ranges);
    return handle;
}

GWOperationQueuePtr extractionQueue() {
    auto queue = std::make_shared<GWOperationQueue>();
    const unsigned processors = std::max(1u, std::thread::hardware_concurrency());
    queue->setMaxConcurrentOperationCount(long(processors) * 2);
    return queue;
}

}  // namespace

bool GWZipArchive::extractFile(const GWZipFilePtr& file, const GWURL& directory, bool atomically,
                               ProgressHandler progressHandler, GWErrorPtr* error) {
    return extractFiles(GWZipFileArray{file}, directory, atomically, std::move(progressHandler),
                        error);
}

bool GWZipArchive::extractFiles(const GWZipFileArray& files, const GWURL& directory,
                                bool atomically, ProgressHandler progressHandler, GWErrorPtr* error,
                                const GWExtractOptions& options) {
    struct Result {
        GWSemaphore done{0};
        std::mutex mutex;
        GWErrorPtr error;
        bool set = false;
    };
    auto result = std::make_shared<Result>();
    extractFiles(
        files, directory, atomically, nullptr, std::move(progressHandler),
        [result](const GWErrorPtr& batchError) {
            {
                std::lock_guard lock(result->mutex);
                if (!result->set) {
                    result->error = batchError;
                    result->set = true;
                }
            }
            result->done.signal();
        },
        options);
    result->done.wait();
    std::lock_guard lock(result->mutex);
    if (result->error) {
        return GWFail(error, result->error);
    }
    return true;
}

void GWZipArchive::extractFile(const GWZipFilePtr& file, const GWURL& directory, bool atomically,
                               const GWOperationQueuePtr& queue, ProgressHandler progressHandler,
                               CompletionHandler completionHandler) {
    extractFiles(GWZipFileArray{file}, directory, atomically, queue, std::move(progressHandler),
                 std::move(completionHandler));
}

void GWZipArchive::extractFiles(const GWZipFileArray& files, const GWURL& directory,
                                bool atomically, const GWOperationQueuePtr& queue,
                                ProgressHandler progressHandler,
                                CompletionHandler completionHandler,
                                const GWExtractOptions& options) {
    const GWOperationQueuePtr runQueue = queue ? queue : extractionQueue();
    auto finishEarly = [&](GWErrorPtr error) {
        if (completionHandler) {
            runQueue->addOperationWithBlock(
                [error, completion = std::move(completionHandler)] { completion(error); });
        }
    };
    GWErrorPtr error;
    auto operations = operationsToExtractFiles(files, directory, atomically,
                                               std::move(progressHandler), &error, options);
    if (!operations) {
        finishEarly(error);
        return;
    }
    // Refused before anything is written: a hostile archive fills no disk.
    if (!GWCheckFreeSpace(directory, declaredSize(*operations), &error)) {
        finishEarly(error);
        return;
    }
    auto state = std::make_shared<BatchState>();
    state->fetchingAhead = fetchAhead(URL(), startOffset(), *operations);
    state->continueAfterFailure = options.continueAfterFailure;
    state->entryFailed = options.entryFailed;
    state->entryWritten = options.entryWritten;
    const bool buildsFiles = std::any_of(operations->begin(), operations->end(),
                                         [](const auto& op) { return !op->file()->isDirectory(); });
    if (atomically && buildsFiles) {
        state->folder = GWReplacementFolder::createForDestination(directory.path(), &error);
        if (!state->folder) {
            finishEarly(error);
            return;
        }
    }
    auto handles = std::make_shared<GWRemoteFileHandlePool>(URL());
    auto directories = std::make_shared<GWDirectoryCache>(directory.path());
    for (const auto& operation : *operations) {
        state->operations.push_back(operation);
        operation->setArchiveHandles(handles);
        operation->setDirectoryCache(directories);
        operation->setReplacementFolder(state->folder);
        operation->setDefersDirectoryInfo(true);
        if (operation->file()->isDirectory()) {
            state->directories.push_back(operation);
        }
    }
    auto finalOperation = std::make_shared<GWBlockOperation>();
    std::vector<GWOperationPtr> queued;
    queued.reserve(operations->size());
    for (const auto& operation : *operations) {
        std::weak_ptr<GWZipExtractOperation> weakOperation = operation;
        operation->setCompletionBlock([weakOperation, state] {
            if (auto finished = weakOperation.lock()) {
                state->finished(*finished);
            }
        });
        finalOperation->addDependency(operation);
        queued.push_back(operation);
    }
    runQueue->addOperations(queued, false);
    finalOperation->addExecutionBlock(
        [runQueue, state, completion = std::move(completionHandler)]() mutable {
            state->applyDirectoryInfo();
            state->folder.reset();
            state->fetchingAhead.reset();
            if (completion) {
                runQueue->addOperationWithBlock(
                    [state, completion = std::move(completion)] { completion(state->firstError); });
            }
        });
    runQueue->addOperation(finalOperation);
}

std::optional<std::vector<GWZipExtractOperationPtr>> GWZipArchive::operationsToExtractFiles(
    const GWZipFileArray& files, const GWURL& directory, bool atomically,
    ProgressHandler progressHandler, GWErrorPtr* error, const GWExtractOptions& options) {
    std::vector<GWZipExtractOperationPtr> operations;
    for (const auto& file : files) {
        if (!file) {
            GWFail(error, GWCocoaError(GWFileWriteUnknownError));
            return std::nullopt;
        }
        std::string path = file->path();
        for (std::size_t stripped = 0; stripped < options.strippedComponents; ++stripped) {
            const std::size_t slash = path.find('/');
            if (slash == std::string::npos) {
                GWFail(error, GWPOSIXError(EINVAL));
                return std::nullopt;
            }
            path.erase(0, slash + 1);
        }
        auto more = operationsToExtractFile(file, GWZipEntryDestinationURL(directory, path),
                                            atomically, progressHandler, error, options);
        if (!more) {
            return std::nullopt;
        }
        for (const auto& operation : *more) {
            operation->setContainmentRoot(directory);
        }
        operations.insert(operations.end(), more->begin(), more->end());
    }
    return operations;
}

std::optional<std::vector<GWZipExtractOperationPtr>> GWZipArchive::operationsToExtractFile(
    const GWZipFilePtr& file, const GWURL& destination, bool atomically,
    ProgressHandler progressHandler, GWErrorPtr* error, const GWExtractOptions& options) {
    // Built with a work list, not recursion: a tree may be thousands deep.
    // Each operation depends on its directory's, and through it on every
    // ancestor's; a directory comes before its descendants in the list.
    struct Pending {
        GWZipFilePtr file;
        GWURL destination;
        GWZipExtractOperationPtr directoryOperation;
    };
    std::vector<GWZipExtractOperationPtr> operations;
    std::vector<Pending> pending{{file, destination, nullptr}};
    const GWURL archiveURL = URL();
    // The caller named the entry's own destination: nothing of its subtree
    // may land outside the directory that holds it.
    const GWURL root = destination.URLByDeletingLastPathComponent();
    const auto shared = std::make_shared<const GWExtractOptions>(options);
    while (!pending.empty()) {
        Pending next = std::move(pending.back());
        pending.pop_back();
        auto operation = GWZipExtractOperation::initForExtractingFile(
            next.file, archiveURL, startOffset(), next.destination, atomically, progressHandler,
            error);
        if (!operation) {
            return std::nullopt;
        }
        operation->setContainmentRoot(root);
        operation->setReplacesExistingItems(options.replaceExisting);
        operation->setExtractOptions(shared);
        operation->setPassword(options.password ? options.password : password_);
        if (next.directoryOperation) {
            operation->addDependency(next.directoryOperation);
        }
        operations.push_back(operation);
        // Entries below a link are extracted too, to be refused by name
        // rather than lost without a word.
        if (auto children = next.file->children()) {
            // Reversed onto the stack, so children come out in order.
            for (auto it = children->rbegin(); it != children->rend(); ++it) {
                if (*it) {
                    pending.push_back({*it,
                                       GWZipEntryDestinationURL(next.destination, (*it)->name()),
                                       operation});
                }
            }
        }
    }
    return operations;
}

void GWZipArchive::extractDataForkOfFile(const GWZipFilePtr& file, const GWOperationQueuePtr& queue,
                                         DataHandler handler) {
    const GWOperationQueuePtr runQueue = queue ? queue : std::make_shared<GWOperationQueue>();
    GWErrorPtr error;
    auto operation =
        GWZipExtractOperation::initForExtractingFile(file, URL(), startOffset(), handler, &error);
    if (operation) {
        operation->setPassword(password_);
        runQueue->addOperation(operation);
    } else if (handler) {
        runQueue->addOperationWithBlock([handler, error] { handler(std::nullopt, true, error); });
    }
}
