// Where extracted items go. Every path the extraction makes or links to is
// computed here, so that names from the archive cannot reach outside the item.

#include <limits.h>
#include <stdlib.h>
#include <sys/stat.h>

#include <string_view>
#include <vector>

#include "GWArchiveSupport/GWArchiveConstants.h"
#include "GWXARExtractOperation.h"

namespace {

// Names may carry anything after base64 decoding; only a plain component may
// be created.
bool isPlainComponent(std::string_view name) {
    return !name.empty() && name != "." && name != ".." &&
           name.find_first_of(std::string_view("/\0", 2)) == std::string_view::npos;
}

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

}  // namespace

std::optional<GWURL> GWXARExtractOperation::childURL(const GWURL& directory, const GWXARFile& child,
                                                     GWErrorPtr* error) const {
    const std::string name = child.name().value_or("");
    if (!isPlainComponent(name)) {
        GWFail(error,
               GWGenerateError(kGWXARArchiveErrorDomain, GWXARArchiveMalformedValueError, directory,
                               nullptr, {{kGWXARArchiveUnknownEntityErrorKey, GWValue(name)}},
                               "The name of an item in %s is not a single path component.",
                               directory.path().c_str()));
        return std::nullopt;
    }
    return directory.URLByAppendingPathComponent(name);
}

std::optional<std::string> GWXARExtractOperation::hardLinkTargetPath(const GWXARFile& link,
                                                                     const GWURL& linkURL) const {
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
        return std::nullopt;
    }
    struct stat info;
    if (::lstat(target->c_str(), &info) != 0 || !S_ISREG(info.st_mode)) {
        return std::nullopt;
    }
    return target;
}
