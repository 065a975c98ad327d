#include "GWXARArchive.h"

#include "foundation/GWRemoteFileHandle.h"

bool GWXARArchive::isXARArchiveAtURL(const GWURL& url) {
    auto handle = GWRemoteFileHandle::initForReadingFromURL(url, nullptr);
    if (!handle) {
        return false;
    }
    auto magic = handle->readDataOfLength(4, nullptr);
    handle->closeFileAndReturnError(nullptr);
    static const GWData kMagic = {'x', 'a', 'r', '!'};
    return magic && *magic == kMagic;
}

GWXARArchivePtr GWXARArchive::init() {
    auto archive = std::make_shared<GWXARArchive>();
    archive->operationQueue_ = std::make_shared<GWOperationQueue>();
    return archive;
}

GWXARArchivePtr GWXARArchive::initWithURL(const GWURL& url, bool failOnInvalidSignature,
                                          GWErrorPtr* error) {
    return initWithURL(url, failOnInvalidSignature, nullptr, error);
}

GWXARArchivePtr GWXARArchive::initWithURL(const GWURL& url, bool failOnInvalidSignature,
                                          const GWXARTrustPtr& trust, GWErrorPtr* error) {
    auto archive = init();
    archive->ref_ = GWRef::initWithURL(url);
    if (!archive->ref_) {
        return nullptr;
    }
    auto operation = GWXARLoadOperation::initWithArchive(archive, failOnInvalidSignature);
    operation->setTrust(trust);
    operation->start();
    if (!operation->files()) {
        GWFail(error, operation->error());
        return nullptr;
    }
    archive->takeResultsOfLoad(*operation);
    return archive;
}

GWXARArchivePtr GWXARArchive::initWithURL(const GWURL& url, bool failOnInvalidSignature,
                                          const GWOperationQueuePtr& loadingQueue,
                                          GWXARLoadOperationPtr* loadOperation,
                                          CompletionHandler completionHandler,
                                          const GWXARTrustPtr& trust) {
    auto archive = init();
    const GWOperationQueuePtr queue = loadingQueue ? loadingQueue : archive->operationQueue_;
    archive->ref_ = GWRef::initWithURL(url);
    if (!archive->ref_) {
        // Success-shaped on purpose: callers have always been told (false, none) here.
        if (completionHandler) {
            queue->addOperationWithBlock(
                [handler = std::move(completionHandler)] { handler(false, nullptr); });
        }
        return nullptr;
    }

    auto operation = GWXARLoadOperation::initWithArchive(archive, failOnInvalidSignature);
    operation->setTrust(trust);
    // Weak: the operation owns this block, and the block must not own it back.
    std::weak_ptr<GWXARLoadOperation> weakOperation = operation;
    operation->setCompletionBlock([weakOperation, archive, handler = std::move(completionHandler)] {
        auto finished = weakOperation.lock();
        if (!finished) {
            return;
        }
        // An operation cancelled before it started never ran main().
        GWErrorPtr failure = finished->error();
        if (!failure && !finished->files()) {
            failure = finished->cancelledError();
        }
        if (failure) {
            if (handler) {
                handler(!(finished->checksumIsValid() && finished->signatureIsValid()), failure);
            }
            return;
        }
        archive->takeResultsOfLoad(*finished);
        if (handler) {
            handler(!archive->signatureIsValid(), nullptr);
        }
    });
    if (loadOperation) {
        *loadOperation = operation;
    }
    queue->addOperation(operation);
    return archive;
}

void GWXARArchive::takeResultsOfLoad(const GWXARLoadOperation& operation) {
    setFiles(operation.files().value_or(GWXARFileArray{}));
    setSubdocuments(operation.subdocuments());
    setTOCChecksum(operation.tocChecksum());
    setChecksumIsValid(operation.checksumIsValid());
    setChecksumValidationError(operation.checksumValidationError());
    setSignatures(operation.signatures().value_or(GWXARSignatureArray{}));
    setPrivateSignatureIsValid(operation.signatureIsValid());
    setPrivateSignatureValidationError(operation.signatureError());
}

GWRefPtr GWXARArchive::ref() const {
    std::lock_guard<std::mutex> lock(mutex_);
    return ref_;
}

GWURL GWXARArchive::URL() const {
    auto reference = ref();
    return reference ? reference->URL() : GWURL();
}

GWXARFileArray GWXARArchive::files() const {
    std::lock_guard<std::mutex> lock(mutex_);
    return files_;
}

void GWXARArchive::setFiles(GWXARFileArray files) {
    std::lock_guard<std::mutex> lock(mutex_);
    files_ = std::move(files);
}

GWXARSubdocuments GWXARArchive::subdocuments() const {
    std::lock_guard<std::mutex> lock(mutex_);
    return subdocuments_;
}

void GWXARArchive::setSubdocuments(GWXARSubdocuments subdocuments) {
    std::lock_guard<std::mutex> lock(mutex_);
    subdocuments_ = std::move(subdocuments);
}

GWData GWXARArchive::tocChecksum() const {
    std::lock_guard<std::mutex> lock(mutex_);
    return tocChecksum_;
}

void GWXARArchive::setTOCChecksum(GWData checksum) {
    std::lock_guard<std::mutex> lock(mutex_);
    tocChecksum_ = std::move(checksum);
}

GWErrorPtr GWXARArchive::checksumValidationError() const {
    std::lock_guard<std::mutex> lock(mutex_);
    return checksumValidationError_;
}

void GWXARArchive::setChecksumValidationError(GWErrorPtr error) {
    std::lock_guard<std::mutex> lock(mutex_);
    checksumValidationError_ = std::move(error);
}

GWXARSignatureArray GWXARArchive::signatures() const {
    std::lock_guard<std::mutex> lock(mutex_);
    return signatures_;
}

void GWXARArchive::setSignatures(GWXARSignatureArray signatures) {
    std::lock_guard<std::mutex> lock(mutex_);
    signatures_ = std::move(signatures);
}

GWErrorPtr GWXARArchive::privateSignatureValidationError() const {
    std::lock_guard<std::mutex> lock(mutex_);
    return privateSignatureValidationError_;
}

void GWXARArchive::setPrivateSignatureValidationError(GWErrorPtr error) {
    std::lock_guard<std::mutex> lock(mutex_);
    privateSignatureValidationError_ = std::move(error);
}

GWErrorPtr GWXARArchive::signatureValidationError() const {
    std::lock_guard<std::mutex> lock(mutex_);
    return privateSignatureValidationError_ ? privateSignatureValidationError_
                                            : checksumValidationError_;
}

GWXARSignatureVerdict GWXARArchive::signatureVerdict() const {
    const GWXARSignaturePtr deciding = GWXARDecidingSignature(signatures());
    if (!deciding) {
        return GWXARSignatureVerdictNone;
    }
    if (!checksumIsValid()) {
        return GWXARSignatureVerdictInvalid;
    }
    // Archives kept before verdicts were recorded have only the flag.
    if (deciding->verdict() == GWXARSignatureVerdictNone) {
        return privateSignatureIsValid() ? GWXARSignatureVerdictValid
                                         : GWXARSignatureVerdictInvalid;
    }
    return deciding->verdict();
}

std::string GWXARArchive::signatureVerdictReason() const {
    const GWXARSignaturePtr deciding = GWXARDecidingSignature(signatures());
    if (deciding && !checksumIsValid()) {
        return "the checksum does not match the table of contents";
    }
    return deciding ? deciding->verdictReason() : "";
}

GWOperationQueuePtr GWXARArchive::operationQueue() const {
    std::lock_guard<std::mutex> lock(mutex_);
    return operationQueue_;
}
