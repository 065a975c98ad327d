#include "GWRecentHTTPResources.h"

#include <algorithm>

GWRecentHTTPResources& GWRecentHTTPResources::shared() {
    // Never destroyed: pins held in static storage may outlive any static here.
    static auto* resources = new GWRecentHTTPResources;
    return *resources;
}

std::optional<GWHTTPResource> GWRecentHTTPResources::find(const std::string& address) {
    std::lock_guard lock(mutex_);
    const auto now = std::chrono::steady_clock::now();
    // A connection failure is repeated at once only within a pinned run; anyone
    // else may try again.
    entries_.remove_if([&](const Entry& entry) {
        if (pinned(entry.address)) {
            return false;
        }
        std::lock_guard failed(entry.resource.connectionFailure->mutex);
        return now - entry.lastOpened > kFreshness || entry.resource.connectionFailure->error;
    });
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
    for (auto entry = entries_.end(); entries_.size() > kCapacity && entry != entries_.begin();) {
        --entry;
        if (!pinned(entry->address)) {
            entry = entries_.erase(entry);
        }
    }
}

void GWRecentHTTPResources::forget(const std::string& address) {
    std::lock_guard lock(mutex_);
    if (!pinned(address)) {
        entries_.remove_if([&](const Entry& entry) { return entry.address == address; });
    }
}

bool GWRecentHTTPResources::pinned(const std::string& address) const {
    return std::find(pins_.begin(), pins_.end(), address) != pins_.end();
}

std::shared_ptr<void> GWRecentHTTPResources::pin(const std::string& address) {
    std::lock_guard lock(mutex_);
    pins_.push_front(address);
    auto position = pins_.begin();
    return std::shared_ptr<void>(this, [this, position](void*) {
        std::lock_guard lock(mutex_);
        pins_.erase(position);
    });
}
