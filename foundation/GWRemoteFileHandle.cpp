#include "GWRemoteFileHandle.h"

#include <algorithm>
#include <cerrno>

#include "GWFileHandleBackend.h"

namespace {

std::unique_ptr<GWFileHandleBackend> openBackend(const GWURL& url, bool forWriting,
                                                 GWErrorPtr* error) {
    if (url.isFileURL()) {
        return GWOpenLocalFileBackend(url, forWriting, error);
    }
    const bool remote = url.scheme() == "http" || url.scheme() == "https";
    if (remote && !forWriting) {
        return GWOpenHTTPFileBackend(url, error);
    }
    GWFail(error, GWGenerateError(kGWCocoaErrorDomain,
                                  forWriting ? GWFileWriteUnsupportedSchemeError
                                             : GWFileReadUnsupportedSchemeError,
                                  url, nullptr, {},
                                  remote ? "Remote locations cannot be %s: %s"
                                         : "Not a file location, cannot be %s: %s",
                                  forWriting ? "written" : "read", url.absoluteString().c_str()));
    return nullptr;
}

}  // namespace

GWRemoteFileHandle::GWRemoteFileHandle(std::unique_ptr<GWFileHandleBackend> backend)
    : backend_(std::move(backend)) {}

GWRemoteFileHandle::~GWRemoteFileHandle() {
    if (backend_) {
        backend_->close(nullptr);
    }
}

std::shared_ptr<GWRemoteFileHandle> GWRemoteFileHandle::initForReadingFromURL(const GWURL& url,
                                                                              GWErrorPtr* error) {
    auto backend = openBackend(url, false, error);
    if (!backend) {
        return nullptr;
    }
    auto handle = std::make_shared<GWRemoteFileHandle>(std::move(backend));
    handle->url_ = url;
    return handle;
}

std::shared_ptr<GWRemoteFileHandle> GWRemoteFileHandle::initForWritingToURL(
    const std::optional<GWURL>& url, GWErrorPtr* error) {
    if (!url || url->isEmpty()) {
        return std::make_shared<GWRemoteFileHandle>(GWMakeDiscardingBackend());
    }
    auto backend = openBackend(*url, true, error);
    if (!backend) {
        return nullptr;
    }
    auto handle = std::make_shared<GWRemoteFileHandle>(std::move(backend));
    handle->url_ = url;
    return handle;
}

std::shared_ptr<GWRemoteFileHandle> GWRemoteFileHandle::initForWritingToDescriptor(
    int fd, const GWURL& url) {
    auto handle =
        std::make_shared<GWRemoteFileHandle>(GWMakeLocalFileBackendForDescriptor(fd, url));
    handle->url_ = url;
    return handle;
}

std::uint64_t GWRemoteFileHandle::fileSize() const {
    return backend_->size();
}

bool GWRemoteFileHandle::isSeekable() const {
    return backend_->isSeekable();
}

std::optional<GWData> GWRemoteFileHandle::readDataOfLength(std::uint64_t length,
                                                           GWErrorPtr* error) {
    if (closed_) {
        GWFail(error, GWPOSIXError(EBADF, url_));
        return std::nullopt;
    }
    // The length is a wish, not a promise: never allocate past the file's end.
    const std::uint64_t size = backend_->size();
    const std::uint64_t available = position_ < size ? size - position_ : 0;
    GWData data(std::size_t(std::min(length, available)));
    std::size_t got = 0;
    if (!backend_->readAt(position_, data, got, error)) {
        return std::nullopt;
    }
    data.resize(got);
    position_ += got;
    return data;
}

std::optional<std::size_t> GWRemoteFileHandle::readDataAtOffset(std::uint64_t offset,
                                                                std::span<std::uint8_t> into,
                                                                GWErrorPtr* error) {
    if (closed_) {
        GWFail(error, GWPOSIXError(EBADF, url_));
        return std::nullopt;
    }
    std::size_t got = 0;
    if (!backend_->readAt(offset, into, got, error)) {
        return std::nullopt;
    }
    position_ = offset + got;
    return got;
}

bool GWRemoteFileHandle::seekToFileOffset(std::uint64_t offset, GWErrorPtr*) {
    position_ = offset;
    return true;
}

void GWRemoteFileHandle::readDataAtOffset(std::uint64_t offset, std::uint64_t length,
                                          std::uint64_t maxBufferSize, const ReadHandler& handler) {
    if (closed_) {
        handler(*this, {}, true, GWPOSIXError(EBADF, url_));
        return;
    }
    const std::uint64_t pieceLimit = maxBufferSize == UINT64_MAX || maxBufferSize == 0
                                         ? kDefaultPieceSize
                                         : std::min<std::uint64_t>(maxBufferSize, 64 << 20);
    if (length > UINT64_MAX - offset) {
        handler(*this, {}, true,
                GWGenerateError(kGWCocoaErrorDomain, GWFileReadCorruptFileError, url_, nullptr, {},
                                "The range at offset %llu of length %llu lies past any file",
                                (unsigned long long)offset, (unsigned long long)length));
        return;
    }
    GWData buffer(std::size_t(std::min(pieceLimit, length)));
    std::uint64_t done = 0;
    do {
        const std::size_t want = std::size_t(std::min<std::uint64_t>(pieceLimit, length - done));
        std::size_t got = 0;
        GWErrorPtr error;
        if (!backend_->readAt(offset + done, std::span(buffer.data(), want), got, &error)) {
            handler(*this, {}, true, error);
            return;
        }
        if (got < want) {
            handler(
                *this, {}, true,
                GWGenerateError(kGWCocoaErrorDomain, GWFileReadCorruptFileError, url_, nullptr, {},
                                "Unexpected end of file at offset %llu while reading "
                                "[%llu, %llu)",
                                (unsigned long long)(offset + done + got),
                                (unsigned long long)offset, (unsigned long long)(offset + length)));
            return;
        }
        done += got;
        position_ = offset + done;
        if (!handler(*this, std::span(buffer.data(), got), done == length, nullptr)) {
            return;
        }
    } while (done < length);
}

void GWRemoteFileHandle::willRead(std::span<const GWByteRange> ranges) {
    if (!closed_) {
        backend_->willRead(ranges);
    }
}

bool GWRemoteFileHandle::writeData(std::span<const std::uint8_t> bytes, GWErrorPtr* error) {
    if (closed_) {
        return GWFail(error, GWPOSIXError(EBADF, url_));
    }
    if (!backend_->writeAt(position_, bytes, error)) {
        return false;
    }
    position_ += bytes.size();
    return true;
}

bool GWRemoteFileHandle::closeFileAndReturnError(GWErrorPtr* error) {
    closed_ = true;
    return backend_->close(error);
}
