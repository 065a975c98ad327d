#include "GWZipReadWindow.h"

#include <algorithm>

std::optional<std::span<const std::uint8_t>> GWZipReadWindow::read(std::uint64_t offset,
                                                                   std::size_t length,
                                                                   GWErrorPtr* error) {
    const bool inside = offset >= windowOffset_ && offset - windowOffset_ <= windowLength_ &&
                        windowLength_ - (offset - windowOffset_) >= length;
    if (!inside) {
        // Never more than the file holds, whatever a length field claims.
        const std::uint64_t size = file_.fileSize();
        const std::uint64_t available = offset < size ? size - offset : 0;
        const auto wanted =
            std::size_t(std::min<std::uint64_t>(available, std::max(length, windowSize_)));
        if (window_.size() < wanted) {
            window_.resize(wanted);
        }
        auto got = file_.readDataAtOffset(offset, std::span(window_).first(wanted), error);
        if (!got) {
            return std::nullopt;
        }
        windowLength_ = *got;
        windowOffset_ = offset;
    }
    const std::size_t start = std::min(std::size_t(offset - windowOffset_), windowLength_);
    return std::span<const std::uint8_t>(window_).subspan(start,
                                                          std::min(length, windowLength_ - start));
}
