#pragma once

#include <curl/curl.h>

#include <cstdint>
#include <memory>
#include <mutex>
#include <span>
#include <string>
#include <string_view>
#include <vector>

#include "GWError.h"
#include "GWURL.h"

// The address with any "user:password@" replaced by "***@", for messages.
std::string GWRedactedURLString(std::string_view address);

// How long a remote read may take. Process-wide; tools and tests may shorten
// them before opening handles.
struct GWHTTPTimeouts {
    long connectSeconds = 15;
    // A transfer slower than lowSpeedBytes per second for this long ends.
    long stallSeconds = 30;
    long lowSpeedBytes = 1024;
    // Every request must end within deadlineSeconds plus one second per
    // deadlineBytesPerSecond bytes it asked for.
    long deadlineSeconds = 60;
    long deadlineBytesPerSecond = 16 * 1024;
    // Back-off before the first retry of a 429, a 503 or a reset connection;
    // it doubles for each further one. Retry-After is honoured up to retryAfterLimitSeconds.
    long retryMilliseconds = 250;
    long retryAfterLimitSeconds = 10;
    int retries = 3;
};
void GWSetHTTPTimeouts(const GWHTTPTimeouts& timeouts);
GWHTTPTimeouts GWCurrentHTTPTimeouts();
// Applies "connect=S,stall=S,deadline=S,retry=MS,retries=N" (any subset) to
// `timeouts`; false for anything else.
bool GWParseHTTPTimeouts(std::string_view text, GWHTTPTimeouts& timeouts);

// Which version of a resource a reader reads: fixed by its first response.
struct GWHTTPIdentity {
    std::string address;  // after redirects; every later request goes there
    std::uint64_t size = 0;
    std::string validator;  // a strong entity tag, or else Last-Modified; empty when neither
    bool validatorIsEntityTag = false;
};

// Idle easy handles of one resource, each with its kept-alive connection:
// a reader made for every entry of an archive reuses one instead of
// connecting again. Only readers of the resource whose identity they
// learnt share them, so a connection never outlives the checks its
// address passed.
struct GWHTTPConnectionPool {
    struct EasyDeleter {
        void operator()(CURL* curl) const { curl_easy_cleanup(curl); }
    };
    using Easy = std::unique_ptr<CURL, EasyDeleter>;
    Easy take();
    void give(Easy easy);

private:
    std::mutex mutex_;
    std::vector<Easy> idle_;
};

// How long the last request took: to its first byte, and to its end.
struct GWHTTPTiming {
    double firstByteSeconds = 0;
    double totalSeconds = 0;
    std::uint64_t bytes = 0;
};

// Ranged GET requests for one http(s) resource over one kept-alive
// connection. Every response is checked against the range asked for and the
// identity the first response fixed: a server that ignores ranges, a body
// cut short or a resource that changed is an error, never data. The errors
// are those documented with GWRemoteFileHandle.
class GWHTTPRangeReader {
public:
    // Opens the resource with a request for its first `probeLength` bytes,
    // which learns its identity and proves range support. `probe` receives
    // what came back (fewer bytes only for a shorter resource).
    static std::unique_ptr<GWHTTPRangeReader> open(const GWURL& url, std::size_t probeLength,
                                                   GWData& probe,
                                                   std::shared_ptr<GWHTTPConnectionPool> pool,
                                                   GWErrorPtr* error);
    // A reader for a resource another reader opened: no request until the
    // first fetch, which checks that the identity still holds.
    static std::unique_ptr<GWHTTPRangeReader> attach(const GWURL& url, GWHTTPIdentity identity,
                                                     std::shared_ptr<GWHTTPConnectionPool> pool,
                                                     GWErrorPtr* error);
    ~GWHTTPRangeReader();
    GWHTTPRangeReader(const GWHTTPRangeReader&) = delete;
    GWHTTPRangeReader& operator=(const GWHTTPRangeReader&) = delete;

    // Exactly into.size() bytes at `offset`, which must lie inside the resource.
    bool fetch(std::uint64_t offset, std::span<std::uint8_t> into, GWErrorPtr* error);
    std::uint64_t size() const { return identity_.size; }
    const GWHTTPIdentity& identity() const { return identity_; }
    const GWHTTPTiming& lastTiming() const { return timing_; }

    // Failures of the connection itself, which a later request would only repeat.
    static bool isConnectionFailure(const GWErrorPtr& error);

private:
    struct Transfer;
    GWHTTPRangeReader(GWURL url, std::shared_ptr<GWHTTPConnectionPool> pool);
    bool perform(Transfer& transfer, GWErrorPtr* error);
    CURLcode performOnce(const std::string& address, Transfer& transfer);
    bool nextHop(const std::string& from, Transfer& transfer, std::string& next, GWErrorPtr* error);
    static bool isEmptyResourceAnswer(CURL* curl, CURLcode code, const Transfer& transfer);
    GWErrorPtr failure(int number, const Transfer& transfer, const std::string& reason) const;

    GWURL url_;
    std::string shownAddress_;  // without credentials
    std::shared_ptr<GWHTTPConnectionPool> pool_;
    GWHTTPConnectionPool::Easy curl_;  // kept for its connection
    GWHTTPIdentity identity_;
    GWHTTPTiming timing_;
    int originClass_ = -1;  // the address class of the host first asked, once known
};
