#include <cerrno>
#include <mutex>

#include "GWBlockCache.h"
#include "GWFileHandleBackend.h"
#include "GWHTTPRangeReader.h"

namespace {

// Small enough that opening an archive and reading one member stays within a
// few blocks of what it needs, large enough that neighbouring records share a
// round trip.
constexpr std::size_t kBlockSize = 32 * 1024;
constexpr std::size_t kBlockCount = 8;

class HTTPFileBackend final : public GWFileHandleBackend {
public:
    HTTPFileBackend(std::unique_ptr<GWHTTPRangeReader> reader, const GWData& firstBlock)
        : reader_(std::move(reader)), cache_(kBlockSize, kBlockCount) {
        cache_.store(0, firstBlock, reader_->size());
    }

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
        return cache_.read(offset, into, reader_->size(), fetch, got, error);
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
    GWBlockCache cache_;
};

}  // namespace

std::unique_ptr<GWFileHandleBackend> GWOpenHTTPFileBackend(const GWURL& url, GWErrorPtr* error) {
    GWData firstBlock;
    auto reader = GWHTTPRangeReader::open(url, kBlockSize, firstBlock, error);
    if (!reader) {
        return nullptr;
    }
    return std::make_unique<HTTPFileBackend>(std::move(reader), firstBlock);
}
