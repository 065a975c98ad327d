#pragma once

#include <chrono>
#include <cstdint>
#include <list>
#include <memory>
#include <mutex>
#include <optional>
#include <string>

#include "GWBlockCache.h"
#include "GWHTTPPrefetcher.h"
#include "GWHTTPRangeReader.h"

// A failure of the connection that every handle of a resource would meet
// again, kept so that the next ones fail at once instead of waiting as long.
struct GWHTTPConnectionFailure {
    std::mutex mutex;
    GWErrorPtr error;
};

// What the handles of one http(s) resource share: the identity the first of
// them learnt, the blocks read so far, idle connections and what is fetched
// ahead of them. Extraction opens a handle per
// entry; without this each would ask for the size and fetch the same blocks
// again, and could meet another version of the file.
struct GWHTTPResource {
    GWHTTPIdentity identity;
    std::shared_ptr<GWBlockCache> blocks;
    std::shared_ptr<GWHTTPConnectionFailure> connectionFailure;
    std::shared_ptr<GWHTTPConnectionPool> connections;
    std::shared_ptr<GWHTTPPrefetcher> prefetcher;
};

// The few resources handles were opened on lately. One not opened for a few
// seconds is asked for again, so a long-lived process sees changes, unless
// it is pinned: then every handle reads the version the first one saw.
class GWRecentHTTPResources {
public:
    static GWRecentHTTPResources& shared();

    std::optional<GWHTTPResource> find(const std::string& address);
    void remember(const std::string& address, GWHTTPResource resource);
    // After the resource was seen to change; a pinned one is kept, so that
    // its handles go on failing rather than read the new version.
    void forget(const std::string& address);
    // Keeps what the address's handles learn (or have learnt) until the
    // token goes. A tool pins the archive it reads for the whole run.
    std::shared_ptr<void> pin(const std::string& address);

    static constexpr std::chrono::seconds kFreshness{10};
    static constexpr std::size_t kCapacity = 8;

private:
    struct Entry {
        std::string address;
        GWHTTPResource resource;
        std::chrono::steady_clock::time_point lastOpened;
    };
    bool pinned(const std::string& address) const;
    std::list<std::string> pins_;
    std::mutex mutex_;
    std::list<Entry> entries_;  // most recently opened first
};
