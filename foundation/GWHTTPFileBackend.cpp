#include <algorithm>
#include <cerrno>
#include <mutex>

#include "GWFileHandleBackend.h"
#include "GWHTTPRangeReader.h"
#include "GWLog.h"
#include "GWRecentHTTPResources.h"

namespace {

// Small enough that opening an archive and reading one member stays within a
// few blocks of what it needs, large enough that neighbouring records share a
// round trip. The blocks of a resource are shared by all its handles.
constexpr std::size_t kBlockSize = 32 * 1024;
constexpr std::size_t kBlockCount = 16;
// A large read (a central directory, a table of contents, a piece of an
// entry) is one request, up to this much.
constexpr std::size_t kLargestRequest = 16 << 20;

class HTTPFileBackend final : public GWFileHandleBackend {
public:
    HTTPFileBackend(std::unique_ptr<GWHTTPRangeReader> reader, const GWHTTPResource& resource,
                    std::string address)
        : reader_(std::move(reader)),
          blocks_(resource.blocks),
          connectionFailure_(resource.connectionFailure),
          prefetcher_(resource.prefetcher),
          address_(std::move(address)) {}

    bool readAt(std::uint64_t offset, std::span<std::uint8_t> into, std::size_t& got,
                GWErrorPtr* error) override {
        // Read-ahead may come from another thread than the handle's user.
        std::lock_guard lock(mutex_);
        got = 0;
        if (!reader_) {
            return GWFail(error, GWPOSIXError(EBADF));
        }
        {
            std::lock_guard failed(connectionFailure_->mutex);
            if (connectionFailure_->error) {
                return GWFail(error, connectionFailure_->error);
            }
        }
        const std::uint64_t size = reader_->size();
        const std::size_t length =
            offset < size ? std::size_t(std::min<std::uint64_t>(into.size(), size - offset)) : 0;
        GWErrorPtr failure;
        if (length > 0 && prefetcher_->take(offset, into.first(length), &failure)) {
            got = length;
            return true;
        }
        auto fetch = [this](std::uint64_t from, std::span<std::uint8_t> bytes,
                            GWErrorPtr* failure) {
            for (std::size_t done = 0; done < bytes.size(); done += kLargestRequest) {
                const auto piece =
                    bytes.subspan(done, std::min(kLargestRequest, bytes.size() - done));
                if (!reader_->fetch(from + done, piece, failure)) {
                    return false;
                }
            }
            return true;
        };
        if (failure || !blocks_->read(offset, into, reader_->size(), fetch, got, &failure)) {
            // What other handles know of it no longer holds.
            if (failure && failure->is(kGWPOSIXErrorDomain, ESTALE)) {
                GWRecentHTTPResources::shared().forget(address_);
            }
            if (GWHTTPRangeReader::isConnectionFailure(failure)) {
                std::lock_guard failed(connectionFailure_->mutex);
                connectionFailure_->error = failure;
            }
            return GWFail(error, failure);
        }
        return true;
    }

    bool writeAt(std::uint64_t, std::span<const std::uint8_t>, GWErrorPtr* error) override {
        return GWFail(error, GWPOSIXError(EBADF));
    }

    std::uint64_t size() const override {
        std::lock_guard lock(mutex_);
        return reader_ ? reader_->size() : 0;
    }

    bool isSeekable() const override { return true; }

    void willRead(std::span<const GWByteRange> ranges) override { prefetcher_->willRead(ranges); }

    bool close(GWErrorPtr*) override {
        std::lock_guard lock(mutex_);
        reader_.reset();
        return true;
    }

private:
    mutable std::mutex mutex_;
    std::unique_ptr<GWHTTPRangeReader> reader_;
    std::shared_ptr<GWBlockCache> blocks_;
    std::shared_ptr<GWHTTPConnectionFailure> connectionFailure_;
    std::shared_ptr<GWHTTPPrefetcher> prefetcher_;
    std::string address_;
};

}  // namespace

std::unique_ptr<GWFileHandleBackend> GWOpenHTTPFileBackend(const GWURL& url, GWErrorPtr* error) {
    const std::string address = url.absoluteString();
    auto& recent = GWRecentHTTPResources::shared();
    if (auto known = recent.find(address)) {
        auto reader = GWHTTPRangeReader::attach(url, known->identity, known->connections, error);
        if (!reader) {
            return nullptr;
        }
        return std::make_unique<HTTPFileBackend>(std::move(reader), *known, address);
    }
    GWData firstBlock;
    auto connections = std::make_shared<GWHTTPConnectionPool>();
    auto reader = GWHTTPRangeReader::open(url, kBlockSize, firstBlock, connections, error);
    if (!reader) {
        return nullptr;
    }
    if (reader->identity().validator.empty() && reader->size() > 0) {
        GWLog(
            "%s has neither a strong entity tag nor a modification date: a change of the file "
            "while it is read is noticed only when its size changes",
            GWRedactedURLString(address).c_str());
    }
    auto prefetcher = std::make_shared<GWHTTPPrefetcher>(
        reader->size(), [url, identity = reader->identity(), connections] {
            return GWHTTPRangeReader::attach(url, identity, connections, nullptr);
        });
    prefetcher->observe(reader->lastTiming());
    GWHTTPResource resource{
        reader->identity(), std::make_shared<GWBlockCache>(kBlockSize, kBlockCount),
        std::make_shared<GWHTTPConnectionFailure>(), connections, std::move(prefetcher)};
    resource.blocks->store(0, firstBlock, reader->size());
    recent.remember(address, resource);
    return std::make_unique<HTTPFileBackend>(std::move(reader), resource, address);
}
