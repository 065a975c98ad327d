// Where extracted items go. Every path the extraction makes or links to is
// computed here, so that names from the archive cannot reach outside the item.

#include <limits.h>
#include <stdlib.h>
#include <sys/stat.h>

#include <filesystem>

#include "GWArchiveSupport/GWArchiveConstants.h"
#include "GWXARExtractOperation.h"
#include "foundation/GWContainment.h"

namespace {

bool isInside(const std::string& path, const std::string& root) {
    return path == root || (path.size() > root.size() && path.compare(0, root.size(), root) == 0 &&
                            path[root.size()] == '/');
}

std::optional<std::string> realPath(const std::string& path) {
    char resolved[PATH_MAX];
    if (!::realpath(path.c_str(), resolved)) {
        return std::nullopt;
    }
    return std::string(resolved);
}

GWErrorPtr outsideError(const GWURL& url, const GWXARFile& file, const char* what) {
    const std::string path = file.path();
    return GWGenerateError(kGWXARArchiveErrorDomain, GWXARArchiveEntryOutsideDestinationError, url,
                           nullptr, {{kGWXARArchiveUnknownEntityErrorKey, GWValue(path)}},
                           "%s %s would reach outside the destination.", what, path.c_str());
}

}  // namespace

std::optional<GWURL> GWXARExtractOperation::childURL(const GWURL& directory, const GWXARFile& child,
                                                     GWErrorPtr* error) const {
    const std::string name = child.name().value_or("");
    if (!GWIsPlainPathComponent(name)) {
        GWFail(error, outsideError(directory, child, "The name of"));
        return std::nullopt;
    }
    return directory.URLByAppendingPathComponent(name);
}

std::optional<std::string> GWXARExtractOperation::hardLinkTargetPath(const GWXARFile& link,
                                                                     const GWURL& linkURL,
                                                                     GWErrorPtr* refusal) const {
    const auto relative = link.hardlinkPath();
    if (!relative || !temporaryItemURL_) {
        return std::nullopt;
    }
    const std::string candidate = linkURL.URLByDeletingLastPathComponent().path() + "/" + *relative;
    // Symbolic links made by the archive could lead a lexically inside path
    // elsewhere; only where the path really ends counts.
    const auto root = realPath(temporaryItemURL_->path());
    const auto target = realPath(candidate);
    if (!root || !target || !isInside(*target, *root)) {
        // Climbing above the item by name is how links of an inner item
        // look (they become copies); arriving elsewhere by a link is not.
        const auto lexical = std::filesystem::path(candidate).lexically_normal().string();
        if (root && target && isInside(lexical, *root)) {
            GWFail(refusal, outsideError(linkURL, link, "The hard link"));
        }
        return std::nullopt;
    }
    struct stat info;
    if (::lstat(target->c_str(), &info) != 0 || !S_ISREG(info.st_mode)) {
        return std::nullopt;
    }
    return target;
}
