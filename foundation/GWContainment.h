#pragma once

#include <optional>
#include <string>
#include <string_view>

#include "GWURL.h"

// Rules that keep an extraction inside the directory its caller named,
// whatever names and links the archive holds.
//
// The rule for links: an extraction never creates anything beneath a
// symbolic link, whoever made it. Every item strictly between the named
// directory and a destination must be a real directory (or not exist yet);
// the destination itself may be replaced, since removing or renaming over a
// link never follows it.

// Whether `name` can be created as one item of a directory: not empty, not
// "." or "..", without "/" or NUL.
bool GWIsPlainPathComponent(std::string_view name);

// The "/"-separated components of `destination` below `root`; none when
// `destination` does not lie lexically below `root` or a component is not
// plain.
std::optional<std::string> GWRelativePathBelow(const GWURL& root, const GWURL& destination);

// Whether `destination` lies below `root` and every existing item strictly
// between the two is a real directory, so that nothing made at `destination`
// can land elsewhere.
bool GWIsContainedDestination(const GWURL& root, const GWURL& destination);

// Whether device nodes may be created: only with the privileges to make them
// on purpose. Tests override the answer; none restores the process's own.
bool GWMayCreateDeviceNodes();
void GWOverrideMayCreateDeviceNodes(std::optional<bool> allowed);
