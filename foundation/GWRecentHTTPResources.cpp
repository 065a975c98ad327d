#include "GWRecentHTTPResources.h"

#include <algorithm>

GWRecentHTTPResources& GWRecentHTTPResources::shared() {
    static GWRecentHTTPResources resources;
    return resources;
}

std::optional<GWHTTPResource> GWRecentHTTPResources::find(const std::string& address) {
    std::lock_guard lock(mutex_);
    const auto now = std::chrono::steady_clock::now();
    entries_.remove_if([now](const Entry& entry) { return now - entry.lastOpened > kFreshness; });
    auto found = std::find_if(entries_.begin(), entries_.end(),
                              [&](const Entry& entry) { return entry.address == address; });
    if (found == entries_.end()) {
        return std::nullopt;
    }
    found->lastOpened = now;
    entries_.splice(entries_.begin(), entries_, found);
    return found->resource;
}

void GWRecentHTTPResources::remember(const std::string& address, GWHTTPResource resource) {
    std::lock_guard lock(mutex_);
    entries_.remove_if([&](const Entry& entry) { return entry.address == address; });
    entries_.push_front({address, std::move(resource), std::chrono::steady_clock::now()});
    while (entries_.size() > kCapacity) {
        entries_.pop_back();
    }
}

void GWRecentHTTPResources::forget(const std::string& address) {
    std::lock_guard lock(mutex_);
    entries_.remove_if([&](const Entry& entry) { return entry.address == address; });
}
