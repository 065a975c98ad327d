#pragma once

#include <cstdint>
#include <string>

#include "foundation/GWError.h"

// An error of kGWZipArchiveErrorDomain naming the offending number (a
// compression method, a header ID, a version) under
// kGWZipArchiveUnknownEntityErrorKey.
GWErrorPtr GWZipUnknownEntityError(long code, std::uint64_t entity, const char* format, ...)
    __attribute__((format(printf, 3, 4)));

// An error of kGWZipArchiveErrorDomain about one entry, whose path goes
// under kGWZipArchiveUnknownEntityErrorKey.
GWErrorPtr GWZipEntryError(long code, const std::string& path, const char* format, ...)
    __attribute__((format(printf, 3, 4)));

// An error as the log shows it: domain, code and description.
std::string GWZipErrorLogDescription(const GWErrorPtr& error);
