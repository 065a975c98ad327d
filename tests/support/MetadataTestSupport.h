#pragma once

#include <cstddef>
#include <optional>
#include <string>

#include "foundation/GWMetadataStore.h"

namespace gwtest {

// The raw value of a Linux extended attribute (not following links), or none.
std::optional<GWData> rawAttribute(const std::string& path, const std::string& linuxName);
// Whether the file system holding `directory` keeps user extended attributes.
bool userAttributesSupported(const std::string& directory);
bool fileExists(const std::string& path);

// Makes the metadata store refuse attribute values longer than `limit` for
// the lifetime of the object, as a file system short of room would.
class ScopedAttributeLimit {
public:
    explicit ScopedAttributeLimit(std::size_t limit) {
        GWMetadataStore::setAttributeSizeLimitForTesting(limit);
    }
    ~ScopedAttributeLimit() { GWMetadataStore::setAttributeSizeLimitForTesting(std::nullopt); }
    ScopedAttributeLimit(const ScopedAttributeLimit&) = delete;
    ScopedAttributeLimit& operator=(const ScopedAttributeLimit&) = delete;
};

}  // namespace gwtest
