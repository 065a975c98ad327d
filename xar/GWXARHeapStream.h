#pragma once

#include <cstdint>
#include <functional>
#include <optional>
#include <span>

#include "GWXARDataReference.h"
#include "foundation/GWError.h"
#include "foundation/GWURL.h"

// The archive-wide state one stream reads and sets: the archive's location
// and its shared cancellation flag.
struct GWXARStreamContext {
    GWURL archiveURL;
    std::function<bool()> isCancelled;
    std::function<void(bool)> setCancelled;
    // Asked again once the archive file is open; false ends the stream with
    // the "not in this archive" error.
    std::function<bool()> fileBelongsToArchive;
};

// Streams one stored stream out of a XAR heap: reads the byte range, decodes
// it and checks both stored digests in one pass, handing the decoded pieces
// to a data handler.
class GWXARHeapStream {
public:
    // Reads `reference` from the archive file and reports to `handler`; returns
    // after the handler's last call.
    static void streamDataReference(const GWXARDataReference& reference,
                                    const GWXARStreamContext& context,
                                    const GWXARDataHandler& handler);

    // The one place the data handler is called. A refusal cancels the archive
    // and earns the handler one last call with the user-cancelled error.
    static void invokeDataHandler(const GWXARDataHandler& handler,
                                  const GWXARStreamContext& context,
                                  std::optional<std::span<const std::uint8_t>> data, bool isDone,
                                  bool checksumFailed, const GWErrorPtr& error);

    // The decompressor for a compression type; none for LZMA and unknown types.
    static std::optional<int> decompressorAlgorithm(std::uint64_t compressionType);
};
