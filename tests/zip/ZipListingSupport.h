#pragma once

#include <cstdint>
#include <map>
#include <string>

#include "zip/GWZipArchive.h"

namespace gwtest {

// One entry as zipinfo -T shows it.
struct ListedEntry {
    std::string mode;  // "-rw-r--r--"
    std::uint64_t size = 0;
    std::string time;  // "yyyymmdd.hhmmss", local time

    friend bool operator==(const ListedEntry&, const ListedEntry&) = default;
};
// Path (directories end in "/") -> entry.
using Listing = std::map<std::string, ListedEntry>;

// Every node below the roots, companions not included.
Listing listingOfTree(const GWZipFileArray& roots);
// What zipinfo -T says; empty when it fails.
Listing zipinfoListing(const std::string& archivePath);

std::ostream& operator<<(std::ostream& stream, const ListedEntry& entry);

}  // namespace gwtest
