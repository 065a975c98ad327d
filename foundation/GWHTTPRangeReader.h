#pragma once

#include <curl/curl.h>

#include <cstdint>
#include <memory>
#include <span>
#include <string>

#include "GWError.h"
#include "GWURL.h"

// How long a remote read may wait: for the connection, and for the next byte
// of a response once it has begun. Process-wide; tools and tests may shorten
// them before opening handles.
struct GWHTTPTimeouts {
    long connectSeconds = 30;
    long stallSeconds = 30;
};
void GWSetHTTPTimeouts(const GWHTTPTimeouts& timeouts);
GWHTTPTimeouts GWCurrentHTTPTimeouts();

// Ranged GET requests for one http(s) resource over one kept-alive
// connection. Every response is checked against the range asked for: a
// server that ignores ranges, a body cut short or a resource whose size
// changed is an error, never data. The errors are those documented with
// GWRemoteFileHandle.
class GWHTTPRangeReader {
public:
    // Opens the resource with a request for its first `probeLength` bytes,
    // which learns the size and proves range support. `probe` receives what
    // came back (fewer bytes only for a shorter resource).
    static std::unique_ptr<GWHTTPRangeReader> open(const GWURL& url, std::size_t probeLength,
                                                   GWData& probe, GWErrorPtr* error);
    // A reader for a resource another reader opened: no request until the
    // first fetch, which checks that size and entity tag still hold.
    static std::unique_ptr<GWHTTPRangeReader> attach(const GWURL& url, std::uint64_t size,
                                                     std::string entityTag, GWErrorPtr* error);
    ~GWHTTPRangeReader();
    GWHTTPRangeReader(const GWHTTPRangeReader&) = delete;
    GWHTTPRangeReader& operator=(const GWHTTPRangeReader&) = delete;

    // Exactly into.size() bytes at `offset`, which must lie inside the resource.
    bool fetch(std::uint64_t offset, std::span<std::uint8_t> into, GWErrorPtr* error);
    std::uint64_t size() const { return size_; }
    // The server's validator of this version of the resource, or empty.
    const std::string& entityTag() const { return entityTag_; }

private:
    struct Transfer;
    explicit GWHTTPRangeReader(GWURL url);
    bool perform(Transfer& transfer, GWErrorPtr* error);
    static bool isEmptyResourceAnswer(CURL* curl, CURLcode code, const Transfer& transfer);
    GWErrorPtr failure(int number, const Transfer& transfer, const std::string& reason) const;

    GWURL url_;
    std::string address_;
    struct EasyDeleter {
        void operator()(CURL* curl) const { curl_easy_cleanup(curl); }
    };
    std::unique_ptr<CURL, EasyDeleter> curl_;  // kept for its connection
    std::uint64_t size_ = 0;
    std::string entityTag_;
};
