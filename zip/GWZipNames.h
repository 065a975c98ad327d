#pragma once

#include <optional>
#include <string>
#include <string_view>

// How names found in extra fields become entry names.

// A classic Mac name may hold "/", which the Mac shows as ":" to POSIX callers.
std::string GWZipFilenameFromMacName(std::string_view name);
// The last component of a "/"-separated path, trailing slashes ignored: a
// view into `path`.
std::string_view GWZipLastPOSIXPathComponent(std::string_view path);
// The last component of an HFS path ("Disk:Folder:File", a folder may end in
// ":"), as the POSIX name of that item.
std::string GWZipLastHFSPathComponent(std::string_view path);
// True for a single path component: not empty, not "." or "..", no "/" or NUL.
bool GWZipIsSafeFilename(std::string_view name);
