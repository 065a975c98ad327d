#pragma once

#include <functional>
#include <ostream>
#include <string>
#include <vector>

#include "foundation/GWValue.h"

namespace gwtest {

// An archive that tries to write, link or change something outside the
// folder it is extracted into: "out" inside a parent folder (see
// ContainmentSandbox) whose absolute path the builder is given.
struct HostileArchive {
    std::string name;
    std::function<GWData(const std::string& parent)> build;
    // The entry extraction must refuse, by the end of its path; empty when
    // the archive's names are made harmless before extraction instead.
    std::string refusedPath;
};

// Test output names the case rather than dumping its bytes.
inline void PrintTo(const HostileArchive& archive, std::ostream* out) {
    *out << archive.name;
}

const std::vector<HostileArchive>& hostileZipArchives();
const std::vector<HostileArchive>& hostileXARArchives();

}  // namespace gwtest
