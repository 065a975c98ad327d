#pragma once

#include <cstdint>
#include <string>
#include <string_view>

#include "GWExtractOptions.h"

// What an extraction of either format may grant on disk, decided here once
// from the switches of GWExtractOptions.

// The permission bits (07777) to apply for an archived mode.
std::uint32_t GWExtractedPermissions(std::uint32_t mode, const GWExtractOptions& options);
// Linux inode flags (FS_*_FL) to set for those an archive asks for.
int GWExtractedInodeFlags(int flags, const GWExtractOptions& options);
// Whether the attribute with this Linux name may be written; one that may
// not is logged and told to the options' withheld handler for `entryPath`.
bool GWMayExtractAttribute(std::string_view linuxName, const std::string& entryPath,
                           const GWExtractOptions& options);
// Whether the device entry at `entryPath` is to be made; when it is not, the
// same note is given.
bool GWMayExtractDevice(const std::string& entryPath, const GWExtractOptions& options);
