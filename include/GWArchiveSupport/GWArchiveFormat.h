#pragma once

#include "GWExport.h"
#include "GWURL.h"

// What kind of archive a file is, judged from its first bytes (and, for a
// local ZIP that starts with other data, its end record).
enum GWArchiveFormat : int {
    GWArchiveFormatUnknown = 0,
    GWArchiveFormatZip = 1,
    // A Windows executable that carries a ZIP after its code.
    GWArchiveFormatSelfExtractingZip = 2,
    GWArchiveFormatXAR = 3,
};

// The format of the file at `url`, local or remote. A file that cannot be
// read is unknown: callers who must tell a missing file apart check first.
GW_EXPORT GWArchiveFormat GWArchiveFormatAtURL(const GWURL& url);
// "zip", "zip (self-extracting)", "xar" or "unknown".
GW_EXPORT const char* GWArchiveFormatName(GWArchiveFormat format);
