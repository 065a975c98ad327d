#pragma once

#include <memory>
#include <string>

#include "GWError.h"

// A fresh private directory on the file system of a destination, where an
// item is built before one rename moves it into place. Removed, with whatever
// is still in it, when the object goes.
class GWItemReplacementDirectory {
public:
    // In $TMPDIR (default /tmp) when that is on the device of the nearest
    // existing ancestor of `destinationPath`; otherwise a hidden
    // ".gwarchive-XXXXXX" in that ancestor.
    static std::unique_ptr<GWItemReplacementDirectory> createForDestination(
        const std::string& destinationPath, GWErrorPtr* error);

    ~GWItemReplacementDirectory();
    GWItemReplacementDirectory(const GWItemReplacementDirectory&) = delete;
    GWItemReplacementDirectory& operator=(const GWItemReplacementDirectory&) = delete;

    const std::string& path() const { return path_; }

private:
    explicit GWItemReplacementDirectory(std::string path) : path_(std::move(path)) {}

    std::string path_;
};

// The nearest ancestor of `path` (or `path` itself) that exists.
std::string GWNearestExistingAncestor(const std::string& path);

// Moves an item, failing with EEXIST when something is already at `to`.
// POSIX errors name `to`.
bool GWMoveItemNoReplace(const std::string& from, const std::string& to, GWErrorPtr* error);

// Removes an item and everything below it without following symbolic links.
// Immutable and append-only flags, which would pin the tree, are cleared first.
bool GWRemoveItemRecursively(const std::string& path, GWErrorPtr* error);
