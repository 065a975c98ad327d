#include <algorithm>

#include "GWArchiveSupport/GWArchiveConstants.h"
#include "GWZipExtractDestination.h"
#include "GWZipExtractOperation.h"
#include "foundation/GWContainment.h"
#include "foundation/GWConversions.h"
#include "foundation/GWFileManager.h"

std::optional<GWURL> GWZipExtractOperation::prepareTarget(bool isDirectory, bool isSymbolicLink,
                                                          GWErrorPtr* error) {
    // Concurrent operations would otherwise race while making the same parent
    // directories. A failure below leaves the semaphore taken, so that every
    // later extraction in the process waits: deliberate, kept as it is.
    creationSemaphore().wait();
    // Checked under the semaphore, so that no other preparation of the batch
    // changes the path meanwhile. A refusal is not a preparation failure: the
    // semaphore is released and the rest of the process goes on.
    const GWURL root =
        containmentRoot_ ? *containmentRoot_ : destURL_->URLByDeletingLastPathComponent();
    if (auto refusal = containmentErrorForFile(file_, root, *destURL_)) {
        creationSemaphore().signal();
        GWFail(error, std::move(refusal));
        return std::nullopt;
    }
    GWURL target = *destURL_;
    if (isAtomic_) {
        // The final move needs the destination's directory, which no other
        // operation makes when the entry is extracted on its own.
        const GWURL parent = target.URLByDeletingLastPathComponent();
        if (!GWItemExistsAtURL(parent) && !GWCreateDirectoryAtURL(parent, true, error)) {
            return std::nullopt;
        }
        GWURL existing = target;
        while (!GWItemExistsAtURL(existing) && existing.path() != "/") {
            existing = existing.URLByDeletingLastPathComponent();
        }
        auto directory = GWItemReplacementDirectoryForURL(existing, error);
        if (!directory) {
            return std::nullopt;
        }
        target = directory->URLByAppendingPathComponent(GWUniqueID());
    }
    if (GWItemExistsAtURL(target) && !GWRemoveItemAtURL(target, error)) {
        return std::nullopt;
    }
    if (isDirectory) {
        if (!GWCreateDirectoryAtURL(target, true, error)) {
            return std::nullopt;
        }
    } else {
        const GWURL parent = target.URLByDeletingLastPathComponent();
        if (!GWItemExistsAtURL(parent) && !GWCreateDirectoryAtURL(parent, true, error)) {
            return std::nullopt;
        }
        if (!isSymbolicLink && !GWCreateEmptyFileAtomicallyAtURL(target, error)) {
            return std::nullopt;
        }
    }
    creationSemaphore().signal();
    return target;
}

GWURL GWZipExtractTemporaryURL(const GWURL& target) {
    return target.URLByDeletingLastPathComponent().URLByAppendingPathComponent(
        std::string(".") + GWZipExtractOperation::kBundleIdentifier + ".temp." + GWUniqueID());
}

GWURL GWZipEntryDestinationURL(const GWURL& base, std::string_view relativePath) {
    GWURL destination = base;
    std::size_t start = 0;
    while (start <= relativePath.size()) {
        std::size_t end = relativePath.find('/', start);
        if (end == std::string_view::npos) {
            end = relativePath.size();
        }
        if (end > start) {
            destination =
                destination.URLByAppendingPathComponent(relativePath.substr(start, end - start));
        }
        start = end + 1;
    }
    return destination;
}

GWErrorPtr GWZipExtractOperation::containmentErrorForFile(const GWZipFilePtr& file,
                                                          const GWURL& root,
                                                          const GWURL& destination) {
    const auto relative = GWRelativePathBelow(root, destination);
    bool contained = relative && GWIsContainedDestination(root, destination);
    if (contained && file) {
        // The entry's own ancestors down to `root`: one per separator.
        auto levels = std::count(relative->begin(), relative->end(), '/');
        for (auto ancestor = file->parent(); contained && ancestor && levels > 0;
             ancestor = ancestor->parent(), --levels) {
            contained = !ancestor->isSymbolicLink();
        }
    }
    if (contained) {
        return nullptr;
    }
    const std::string path = file ? file->path() : destination.path();
    return GWGenerateError(
        kGWZipArchiveErrorDomain, GWZipArchiveEntryOutsideDestinationError, destination, nullptr,
        {{kGWZipArchiveUnknownEntityErrorKey, GWValue(path)}},
        "entry %s would be written outside %s", path.c_str(), root.path().c_str());
}
