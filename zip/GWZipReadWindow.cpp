#include "GWZipReadWindow.h"

#include <algorithm>

std::optional<std::span<const std::uint8_t>> GWZipReadWindow::read(std::uint64_t offset,
                                                                   std::size_t length,
                                                                   GWErrorPtr* error) {
    const bool inside = offset >= windowOffset_ && offset - windowOffset_ <= window_.size() &&
                        window_.size() - (offset - windowOffset_) >= length;
    if (!inside) {
        if (!file_.seekToFileOffset(offset, error)) {
            return std::nullopt;
        }
        auto data = file_.readDataOfLength(std::max(length, windowSize_), error);
        if (!data) {
            return std::nullopt;
        }
        window_ = std::move(*data);
        windowOffset_ = offset;
    }
    const std::size_t start = std::size_t(offset - windowOffset_);
    const std::size_t available = window_.size() - std::min(start, window_.size());
    return std::span<const std::uint8_t>(window_).subspan(std::min(start, window_.size()),
                                                          std::min(length, available));
}
