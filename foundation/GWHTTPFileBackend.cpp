#include <cerrno>
#include <mutex>

#include "GWFileHandleBackend.h"
#include "GWHTTPRangeReader.h"
#include "GWRecentHTTPResources.h"

namespace {

// Small enough that opening an archive and reading one member stays within a
// few blocks of what it needs, large enough that neighbouring records share a
// round trip. The blocks of a resource are shared by all its handles.
constexpr std::size_t kBlockSize = 32 * 1024;
constexpr std::size_t kBlockCount = 16;

class HTTPFileBackend final : public GWFileHandleBackend {
public:
    HTTPFileBackend(std::unique_ptr<GWHTTPRangeReader> reader, std::shared_ptr<GWBlockCache> blocks,
                    std::string address)
        : reader_(std::move(reader)), blocks_(std::move(blocks)), address_(std::move(address)) {}

    bool readAt(std::uint64_t offset, std::span<std::uint8_t> into, std::size_t& got,
                GWErrorPtr* error) override {
        // Read-ahead may come from another thread than the handle's user.
        std::lock_guard lock(mutex_);
        got = 0;
        if (!reader_) {
            return GWFail(error, GWPOSIXError(EBADF));
        }
        auto fetch = [this](std::uint64_t from, std::span<std::uint8_t> bytes,
                            GWErrorPtr* failure) { return reader_->fetch(from, bytes, failure); };
        GWErrorPtr failure;
        if (!blocks_->read(offset, into, reader_->size(), fetch, got, &failure)) {
            // What other handles know of it no longer holds.
            if (failure && failure->is(kGWPOSIXErrorDomain, ESTALE)) {
                GWRecentHTTPResources::shared().forget(address_);
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

    bool close(GWErrorPtr*) override {
        std::lock_guard lock(mutex_);
        reader_.reset();
        return true;
    }

private:
    mutable std::mutex mutex_;
    std::unique_ptr<GWHTTPRangeReader> reader_;
    std::shared_ptr<GWBlockCache> blocks_;
    std::string address_;
};

}  // namespace

std::unique_ptr<GWFileHandleBackend> GWOpenHTTPFileBackend(const GWURL& url, GWErrorPtr* error) {
    const std::string address = url.absoluteString();
    auto& recent = GWRecentHTTPResources::shared();
    if (auto known = recent.find(address)) {
        auto reader = GWHTTPRangeReader::attach(url, known->size, known->entityTag, error);
        if (!reader) {
            return nullptr;
        }
        return std::make_unique<HTTPFileBackend>(std::move(reader), known->blocks, address);
    }
    GWData firstBlock;
    auto reader = GWHTTPRangeReader::open(url, kBlockSize, firstBlock, error);
    if (!reader) {
        return nullptr;
    }
    auto blocks = std::make_shared<GWBlockCache>(kBlockSize, kBlockCount);
    blocks->store(0, firstBlock, reader->size());
    recent.remember(address, {reader->size(), reader->entityTag(), blocks});
    return std::make_unique<HTTPFileBackend>(std::move(reader), std::move(blocks), address);
}
