#pragma once

#include <cstdint>
#include <memory>
#include <span>

#include "GWError.h"
#include "GWHTTPPrefetcher.h"
#include "GWURL.h"

// Where a GWRemoteFileHandle's bytes live: a local file, nowhere (discarding
// writes), or a remote server.
class GWFileHandleBackend {
public:
    virtual ~GWFileHandleBackend() = default;

    // Reads up to into.size() bytes at `offset`; `got` < into.size() only at
    // the end of the file.
    virtual bool readAt(std::uint64_t offset, std::span<std::uint8_t> into, std::size_t& got,
                        GWErrorPtr* error) = 0;
    virtual bool writeAt(std::uint64_t offset, std::span<const std::uint8_t> bytes,
                         GWErrorPtr* error) = 0;
    virtual std::uint64_t size() const = 0;
    virtual bool isSeekable() const = 0;
    virtual bool close(GWErrorPtr* error) = 0;
    // The ranges about to be read, for a backend that gains by fetching ahead.
    virtual void willRead(std::span<const GWByteRange>) {}
};

std::unique_ptr<GWFileHandleBackend> GWOpenLocalFileBackend(const GWURL& url, bool forWriting,
                                                            GWErrorPtr* error);
// Reads and writes a regular file the caller has open and goes on owning.
std::unique_ptr<GWFileHandleBackend> GWMakeLocalFileBackendForDescriptor(int fd, const GWURL& url);
std::unique_ptr<GWFileHandleBackend> GWMakeDiscardingBackend();
// Reads an http or https resource with range requests; never writes.
std::unique_ptr<GWFileHandleBackend> GWOpenHTTPFileBackend(const GWURL& url, GWErrorPtr* error);
