#include "GWExtractPolicy.h"

#include <linux/fs.h>
#include <sys/stat.h>

#include "GWLog.h"

namespace {

void noteWithheld(const GWExtractOptions& options, const std::string& entryPath,
                  const std::string& what) {
    GWLog("%s: %s", entryPath.c_str(), what.c_str());
    if (options.withheld) {
        options.withheld(entryPath, what);
    }
}

}  // namespace

std::uint32_t GWExtractedPermissions(std::uint32_t mode, const GWExtractOptions& options) {
    const std::uint32_t kept = options.keepSetIDBits ? 07777 : 0777;
    return mode & kept;
}

int GWExtractedInodeFlags(int flags, const GWExtractOptions& options) {
    return options.keepPinningFlags ? flags : flags & ~(FS_IMMUTABLE_FL | FS_APPEND_FL);
}

bool GWMayExtractAttribute(std::string_view linuxName, const std::string& entryPath,
                           const GWExtractOptions& options) {
    if (linuxName.starts_with("user.") || options.privilegedAttributes) {
        return true;
    }
    noteWithheld(options, entryPath,
                 "extended attribute \"" + std::string(linuxName) +
                     "\" not written (outside the user namespace)");
    return false;
}

bool GWMayExtractDevice(const std::string& entryPath, const GWExtractOptions& options) {
    if (options.createDevices) {
        return true;
    }
    noteWithheld(options, entryPath, "device not created");
    return false;
}
