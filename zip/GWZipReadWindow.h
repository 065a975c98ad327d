#pragma once

#include <cstddef>
#include <cstdint>
#include <optional>
#include <span>

#include "foundation/GWError.h"
#include "foundation/GWRemoteFileHandle.h"
#include "foundation/GWValue.h"

// Buffered positioned reads of small records. Local headers of an archive of
// many small members lie close together, so one read serves dozens of them
// instead of a read per header.
class GWZipReadWindow {
public:
    explicit GWZipReadWindow(GWRemoteFileHandle& file, std::size_t windowSize = 64 * 1024)
        : file_(file), windowSize_(windowSize) {}

    // Up to `length` bytes at `offset`, fewer at the end of the file. The span
    // stays valid until the next read.
    std::optional<std::span<const std::uint8_t>> read(std::uint64_t offset, std::size_t length,
                                                      GWErrorPtr* error);

    GWRemoteFileHandle& file() { return file_; }

private:
    GWRemoteFileHandle& file_;
    std::size_t windowSize_;
    GWData window_;  // read into again and again; only its first windowLength_ bytes hold data
    std::size_t windowLength_ = 0;
    std::uint64_t windowOffset_ = 0;
};
