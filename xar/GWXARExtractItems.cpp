// Creating each kind of item on disk, and streaming data forks into files.

#include <fcntl.h>
#include <sys/stat.h>
#include <sys/sysmacros.h>
#include <unistd.h>

#include <atomic>
#include <unordered_map>

#include "GWArchiveSupport/GWArchiveConstants.h"
#include "GWXARArchive.h"
#include "GWXARExtractOperation.h"
#include "foundation/GWChecksum.h"
#include "foundation/GWContainment.h"
#include "foundation/GWDispatch.h"
#include "foundation/GWExtractPolicy.h"
#include "foundation/GWFileDescriptor.h"

bool GWXARExtractOperation::extractRegularFile(const GWXARFilePtr& file, const GWURL& url,
                                               GWErrorPtr* error) {
    // O_EXCL and O_NOFOLLOW: the private directory holds nothing we did not
    // make. Ordinary permissions until the archived ones are applied.
    auto fd = GWFileDescriptor::open(url.path().c_str(),
                                     O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW | O_TRUNC, 0644);
    if (!fd.isValid()) {
        return GWFail(error, GWPOSIXError(errno, url));
    }
    if (!writeDataForkOfFile(file, fd.get(), url, error)) {
        return false;
    }
    if (::close(fd.release()) != 0) {
        return GWFail(error, GWPOSIXError(errno, url));
    }
    return true;
}

bool GWXARExtractOperation::writeDataForkOfFile(const GWXARFilePtr& file, int fd, const GWURL& url,
                                                GWErrorPtr* error) {
    auto archive = archive_.lock();
    if (!archive) {
        return false;
    }
    auto semaphore = std::make_shared<GWSemaphore>(0);
    // Shared with the handler, which the reading machinery may outlive us with.
    struct State {
        std::atomic<bool> stop{false};
        std::atomic<bool> ended{false};
        std::mutex mutex;
        GWErrorPtr error;
        std::uint64_t written = 0;
    };
    auto state = std::make_shared<State>();
    auto weakSelf = std::weak_ptr<GWXARExtractOperation>(
        std::static_pointer_cast<GWXARExtractOperation>(shared_from_this()));
    auto end = [state, semaphore] {
        if (!state->ended.exchange(true)) {
            semaphore->signal();
        }
    };
    auto fail = [state, end](GWErrorPtr failure) {
        state->stop.store(true);
        {
            std::lock_guard lock(state->mutex);
            if (!state->error) {
                state->error = std::move(failure);
            }
        }
        end();
        return false;
    };
    archive->extractDataReference(
        file->dataFork(), file,
        [state, end, weakSelf, fail, fd, url](std::optional<std::span<const std::uint8_t>> data,
                                              bool isDone, bool checksumFailed,
                                              const GWErrorPtr& streamError) {
            if (state->stop.load()) {
                return false;
            }
            if (checksumFailed) {
                if (auto self = weakSelf.lock()) {
                    self->markChecksumInvalid();
                }
            }
            if (streamError) {
                return fail(streamError);
            }
            if (data && !data->empty()) {
                if (!GWWriteFully(fd, state->written, *data)) {
                    return fail(GWPOSIXError(errno, url));
                }
                state->written += data->size();
            }
            if (isDone) {
                end();
            }
            return true;
        },
        [weakSelf] {
            auto self = weakSelf.lock();
            return !self || self->isCancelled();
        });
    // This extraction was cancelled: the stream stopped without its last
    // call, and nothing else will come.
    if (!state->ended.load()) {
        fail(cancelledError());
    }
    semaphore->wait();
    std::lock_guard lock(state->mutex);
    if (state->error) {
        return GWFail(error, state->error);
    }
    return true;
}

bool GWXARExtractOperation::extractDirectory(const GWXARFilePtr& file, const GWURL& url,
                                             GWErrorPtr* error) {
    // Ordinary permissions until the archived ones are applied after the
    // subtree, so that a metadata step that fails leaves a usable folder.
    if (::mkdir(url.path().c_str(), 0755) != 0) {
        return GWFail(error, GWPOSIXError(errno, url));
    }
    std::vector<DeferredHardLink> hardLinks;
    if (!extractChildrenOfDirectory(file, url, hardLinks, error)) {
        return false;
    }
    // Links find their targets on disk: the files written so far must be there.
    if (!hardLinks.empty()) {
        finishWorkers();
    }
    for (const auto& link : hardLinks) {
        if (isCancelled()) {
            return GWFail(error, cancelledError());
        }
        extractEntry(link.file, link.url, link.order);
    }
    return true;
}

bool GWXARExtractOperation::extractChildrenOfDirectory(const GWXARFilePtr& directory,
                                                       const GWURL& url,
                                                       std::vector<DeferredHardLink>& hardLinks,
                                                       GWErrorPtr* error) {
    // Of several children with one name the last wins, as it would had
    // each been written over the one before.
    std::unordered_map<std::string, std::size_t> lastWithName;
    const auto& children = directory->children();
    for (std::size_t index = 0; index < children.size(); ++index) {
        lastWithName[children[index]->name().value_or("")] = index;
    }
    for (std::size_t index = 0; index < children.size(); ++index) {
        const GWXARFilePtr& child = children[index];
        if (isCancelled()) {
            return GWFail(error, cancelledError());
        }
        if (lastWithName[child->name().value_or("")] != index) {
            continue;
        }
        const std::size_t order = nextOrder_++;
        GWErrorPtr refusal;
        auto destination = childURL(url, *child, &refusal);
        if (!destination) {
            recordFailure(order, child, url, refusal);
            continue;
        }
        // Hard links come after everything else in the directory, so that
        // targets among the siblings and their subtrees exist.
        if (child->type() == GWXARFileTypeHardLink) {
            hardLinks.push_back({child, *destination, order});
        } else if (child->type() == GWXARFileTypeRegular) {
            extractFileOnWorker(child, *destination, order);
        } else {
            extractEntry(child, *destination, order);
        }
    }
    return !isCancelled() || GWFail(error, cancelledError());
}

bool GWXARExtractOperation::extractSymbolicLink(const GWXARFilePtr& file, const GWURL& url,
                                                GWErrorPtr* error) {
    if (!url.isFileURL()) {
        return GWFail(error, GWCocoaError(GWFileWriteUnsupportedSchemeError, url));
    }
    const std::string text = file->symlinkDestination().value_or("");
    if (::symlink(text.c_str(), url.path().c_str()) != 0) {
        return GWFail(error, GWPOSIXError(errno, url));
    }
    return true;
}

bool GWXARExtractOperation::extractHardLink(const GWXARFilePtr& file, const GWURL& url,
                                            GWErrorPtr* error) {
    // Link only to a file proven to hold the link's own data; anything less
    // becomes an independent copy of the target.
    const auto& fork = file->dataFork();
    if (fork && fork->uncompressedChecksum()) {
        GWErrorPtr refusal;
        const auto target = hardLinkTargetPath(*file, url, &refusal);
        if (refusal) {
            return GWFail(error, refusal);
        }
        if (target) {
            const auto digest = GWChecksum::checksumAtURL(
                GWURL::fileURLWithPath(*target), int(fork->uncompressedChecksumType()), nullptr);
            if (digest && *digest == *fork->uncompressedChecksum() &&
                ::link(target->c_str(), url.path().c_str()) == 0) {
                return true;
            }
        }
    }
    auto destination = file->hardlinkDestination();
    if (!destination) {
        return GWFail(error, GWCocoaError(GWFileWriteUnknownError, url));
    }
    return extractRegularFile(destination, url, error);
}

bool GWXARExtractOperation::extractDevice(const GWXARFilePtr& file, const GWURL& url,
                                          GWErrorPtr* error) {
    // A device node opens whatever it names, so only a caller privileged to
    // make one on purpose gets it.
    if (!GWMayCreateDeviceNodes()) {
        const std::string path = file->path();
        return GWFail(error, GWGenerateError(kGWXARArchiveErrorDomain,
                                             GWXARArchiveDeviceNotPermittedError, url, nullptr,
                                             {{kGWXARArchiveUnknownEntityErrorKey, GWValue(path)}},
                                             "%s is a device, which only a privileged user "
                                             "may extract.",
                                             path.c_str()));
    }
    const dev_t device = ::makedev(static_cast<unsigned int>(file->deviceMajorNumber()),
                                   static_cast<unsigned int>(file->deviceMinorNumber()));
    const mode_t mode = (file->permissionsMode() & S_IFMT) |
                        GWExtractedPermissions(file->permissionsMode(), options_);
    if (::mknod(url.path().c_str(), mode, device) != 0) {
        return GWFail(error, GWPOSIXError(errno, url));
    }
    return true;
}

bool GWXARExtractOperation::extractFIFO(const GWXARFilePtr& file, const GWURL& url,
                                        GWErrorPtr* error) {
    if (::mkfifo(url.path().c_str(), GWExtractedPermissions(file->permissionsMode(), options_)) !=
        0) {
        return GWFail(error, GWPOSIXError(errno, url));
    }
    return true;
}
