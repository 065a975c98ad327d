#pragma once

#include <cstdint>
#include <optional>
#include <string>

#include "GWError.h"
#include "GWURL.h"

// The file-manager services extraction needs, on file URLs. Failures are
// POSIX errors carrying the system's number and the location concerned;
// a URL that is not a file URL gives Cocoa error 518. Links are never
// followed: an existing link counts as an item of its own.

// Whether anything (a dangling link included) is at the location.
bool GWItemExistsAtURL(const GWURL& url);

// Removes the item, and everything below it when it is a directory. Removing
// nothing fails with ENOENT.
bool GWRemoveItemAtURL(const GWURL& url, GWErrorPtr* error);

// Creates the directory, and with `intermediates` every missing ancestor; an
// existing directory is then no failure.
bool GWCreateDirectoryAtURL(const GWURL& url, bool intermediates, GWErrorPtr* error);

// Writes an empty regular file in one step: written beside the location and
// renamed over it, so nobody sees it half made.
bool GWCreateEmptyFileAtomicallyAtURL(const GWURL& url, GWErrorPtr* error);

bool GWCreateSymbolicLinkAtURL(const GWURL& url, const std::string& destinationPath,
                               GWErrorPtr* error);

// Moves an item, failing with EEXIST when something is at the destination
// (GWMoveItemNoReplace). An AppleDouble side file holding the item's refused
// metadata moves with it.
bool GWMoveItemAtURL(const GWURL& from, const GWURL& to, GWErrorPtr* error);

// $TMPDIR, or /tmp when it is unset or empty.
std::string GWTemporaryDirectoryPath();

// The running process's user and group, asked of the system once: archives
// of many entries take them as the default owner of each.
std::uint32_t GWProcessUserID();
std::uint32_t GWProcessGroupID();
