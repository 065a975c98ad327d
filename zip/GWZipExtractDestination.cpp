#include "GWZipExtractDestination.h"
#include "GWZipExtractOperation.h"
#include "foundation/GWConversions.h"
#include "foundation/GWFileManager.h"

std::optional<GWURL> GWZipExtractOperation::prepareTarget(bool isDirectory, bool isSymbolicLink,
                                                          GWErrorPtr* error) {
    // Concurrent operations would otherwise race while making the same parent
    // directories. A failure below leaves the semaphore taken, so that every
    // later extraction in the process waits: deliberate, kept as it is.
    creationSemaphore().wait();
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

GWURL GWZipExtractTemporaryURL() {
    return GWURL::fileURLWithPath(GWTemporaryDirectoryPath() + "/" +
                                  GWZipExtractOperation::kBundleIdentifier + ".temp." +
                                  GWUniqueID());
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
