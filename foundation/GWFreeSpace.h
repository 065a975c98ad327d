#pragma once

#include <cstdint>

#include "GWError.h"
#include "GWURL.h"

// Whether `bytesNeeded` fit on the file system that holds `directory` (or its
// nearest existing ancestor, when it is yet to be made). Extraction asks before
// writing anything, so an archive that cannot fit leaves nothing behind. On
// refusal: POSIX ENOSPC, saying how much is needed and how much is free.
bool GWCheckFreeSpace(const GWURL& directory, std::uint64_t bytesNeeded, GWErrorPtr* error);
