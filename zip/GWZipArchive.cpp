#include "GWZipArchive.h"

namespace {

GWErrorPtr cancelledError(const GWURL& url) {
    return GWGenerateError(kGWCocoaErrorDomain, GWUserCancelledError, url, nullptr, {},
                           "Opening the archive was cancelled");
}

// A load that failed without saying why (a name no encoding decodes) still
// owes the caller an error.
GWErrorPtr loadError(const GWZipLoadOperation& operation) {
    if (auto error = operation.error()) {
        return error;
    }
    if (!operation.files()) {
        return GWGenerateError(kGWCocoaErrorDomain, GWFileReadCorruptFileError, operation.URL(),
                               nullptr, {}, "The archive's central directory could not be read");
    }
    return nullptr;
}

// Splits a path as the platform's pathComponents does: a leading "/" is a
// component, empty components are dropped.
std::vector<std::string> pathComponents(const std::string& path) {
    std::vector<std::string> components;
    if (!path.empty() && path.front() == '/') {
        components.emplace_back("/");
    }
    std::size_t start = 0;
    while (start < path.size()) {
        std::size_t end = path.find('/', start);
        if (end == std::string::npos) {
            end = path.size();
        }
        if (end > start) {
            components.push_back(path.substr(start, end - start));
        }
        start = end + 1;
    }
    return components;
}

}  // namespace

GWZipArchivePtr GWZipArchive::make() {
    return GWZipArchivePtr(new GWZipArchive());
}

bool GWZipArchive::isZipArchiveAtURL(const GWURL& url) {
    return GWZipLoadOperation::isZipArchiveAtURL(url);
}

bool GWZipArchive::isSelfExtractingZipArchiveAtURL(const GWURL& url) {
    return GWZipLoadOperation::isSelfExtractingZipArchiveAtURL(url);
}

GWZipArchivePtr GWZipArchive::initWithURL(const GWURL& url, GWZipLoadOperationPtr* loadOperation,
                                          GWErrorPtr* error) {
    auto ref = GWRef::initWithURL(url);
    if (!ref) {
        GWFail(error, GWGenerateError(kGWCocoaErrorDomain, GWFileReadUnsupportedSchemeError, url,
                                      nullptr, {}, "Not a location an archive can be read from: %s",
                                      url.absoluteString().c_str()));
        return nullptr;
    }
    auto archive = make();
    archive->ref_ = std::move(ref);
    if (loadOperation) {
        *loadOperation = GWZipLoadOperation::initWithURL(url);
    }
    return archive;
}

GWZipArchivePtr GWZipArchive::initWithURL(const GWURL& url, GWErrorPtr* error) {
    return initWithURL(url, std::string(), error);
}

GWZipArchivePtr GWZipArchive::initWithURL(const GWURL& url, const std::string& filenameEncoding,
                                          GWErrorPtr* error) {
    GWZipLoadOperationPtr operation;
    auto archive = initWithURL(url, &operation, error);
    if (!archive) {
        return nullptr;
    }
    operation->setFilenameEncoding(filenameEncoding);
    operation->start();
    operation->waitUntilFinished();
    if (operation->isCancelled()) {
        GWFail(error, cancelledError(url));
        return nullptr;
    }
    if (auto failure = loadError(*operation)) {
        GWFail(error, failure);
        return nullptr;
    }
    archive->setFiles(operation->files().value_or(GWZipFileArray()));
    archive->startOffset_ = operation->startOffset();
    archive->recoveredEntryCount_ = operation->recoveredEntryCount();
    archive->compressedSize_ = operation->compressedSize();
    return archive;
}

GWZipArchivePtr GWZipArchive::initWithURL(const GWURL& url, const GWOperationQueuePtr& loadingQueue,
                                          GWZipLoadOperationPtr* loadOperation,
                                          CompletionHandler completionHandler) {
    GWOperationQueuePtr queue = loadingQueue ? loadingQueue : std::make_shared<GWOperationQueue>();
    GWZipLoadOperationPtr operation;
    GWErrorPtr error;
    auto archive = initWithURL(url, &operation, &error);
    if (!archive) {
        if (completionHandler) {
            queue->addOperationWithBlock([completionHandler, error] { completionHandler(error); });
        }
        return nullptr;
    }
    std::weak_ptr<GWZipLoadOperation> weakOperation = operation;
    operation->setCompletionBlock([weakOperation, archive, completionHandler, queue, url] {
        auto finished = weakOperation.lock();
        GWErrorPtr result;
        if (!finished || finished->isCancelled()) {
            result = cancelledError(url);
        } else if (auto failure = loadError(*finished)) {
            result = failure;
        } else {
            archive->setFiles(finished->files().value_or(GWZipFileArray()));
            archive->startOffset_ = finished->startOffset();
            archive->recoveredEntryCount_ = finished->recoveredEntryCount();
            archive->compressedSize_ = finished->compressedSize();
        }
        if (completionHandler) {
            queue->addOperationWithBlock(
                [completionHandler, result] { completionHandler(result); });
        }
    });
    queue->addOperation(operation);
    if (loadOperation) {
        *loadOperation = operation;
    }
    return archive;
}

GWURL GWZipArchive::URL() const {
    return ref_ ? ref_->URL() : GWURL();
}

GWZipFileArray GWZipArchive::files() const {
    std::lock_guard lock(filesMutex_);
    return files_;
}

void GWZipArchive::setFiles(GWZipFileArray files) {
    std::lock_guard lock(filesMutex_);
    files_ = std::move(files);
    rootIndex_.clear();
    rootIndexValid_ = false;
}

GWZipFilePtr GWZipArchive::fileWithPathComponents(
    const std::vector<std::string>& components) const {
    GWZipFilePtr directory;  // none: the roots
    for (std::size_t i = 0; i < components.size(); ++i) {
        GWZipFilePtr match;
        if (directory) {
            match = directory->childNamed(components[i]);
        } else {
            std::lock_guard lock(filesMutex_);
            if (!rootIndexValid_) {
                rootIndex_.reserve(files_.size());
                for (std::size_t position = 0; position < files_.size(); ++position) {
                    if (files_[position]) {
                        rootIndex_.emplace(files_[position]->name(), position);
                    }
                }
                rootIndexValid_ = true;
            }
            auto found = rootIndex_.find(components[i]);
            // A root renamed since the index was built is found by a scan.
            if (found != rootIndex_.end() && files_[found->second]->name() == components[i]) {
                match = files_[found->second];
            } else {
                match = GWZipFile::fileNamed(components[i], files_);
            }
        }
        if (!match) {
            continue;  // passed over: the next component is tried at the same level
        }
        if (i + 1 == components.size()) {
            return match;
        }
        directory = match;
        if (!directory->children()) {
            // A leaf: nothing below can match.
            return nullptr;
        }
    }
    return nullptr;
}

GWZipFileArray GWZipArchive::filesWithPaths(const std::vector<std::string>& paths) const {
    GWZipFileArray found;
    for (const auto& path : paths) {
        if (auto file = fileWithPathComponents(pathComponents(path))) {
            found.push_back(std::move(file));
        }
    }
    return found;
}

GWZipFilePtr GWZipArchive::fileWithPath(const std::string& path) const {
    auto found = filesWithPaths({path});
    return found.empty() ? nullptr : found.front();
}
