#pragma once

#include <chrono>
#include <cstdint>
#include <list>
#include <memory>
#include <mutex>
#include <optional>
#include <string>

#include "GWBlockCache.h"

// What the handles of one http(s) resource share: the size and entity tag
// the first of them learnt, and the blocks read so far. Extraction opens a
// handle per entry; without this each would ask for the size and fetch the
// same blocks again.
struct GWHTTPResource {
    std::uint64_t size = 0;
    std::string entityTag;  // empty when the server sends none
    std::shared_ptr<GWBlockCache> blocks;
};

// The few resources handles were opened on lately. One not opened for a few
// seconds is asked for again, so a long-lived process sees changes.
class GWRecentHTTPResources {
public:
    static GWRecentHTTPResources& shared();

    std::optional<GWHTTPResource> find(const std::string& address);
    void remember(const std::string& address, GWHTTPResource resource);
    // After the resource was seen to change.
    void forget(const std::string& address);

    static constexpr std::chrono::seconds kFreshness{10};
    static constexpr std::size_t kCapacity = 8;

private:
    struct Entry {
        std::string address;
        GWHTTPResource resource;
        std::chrono::steady_clock::time_point lastOpened;
    };
    std::mutex mutex_;
    std::list<Entry> entries_;  // most recently opened first
};
