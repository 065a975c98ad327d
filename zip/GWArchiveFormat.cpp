#include <GWArchiveSupport/GWArchiveFormat.h>

#include "xar/GWXARArchive.h"
#include "zip/GWZipArchive.h"

GWArchiveFormat GWArchiveFormatAtURL(const GWURL& url) {
    // A XAR header is unambiguous; a self-extractor is also a ZIP, so it is
    // asked about before the plain ZIP test that would accept it too.
    if (GWXARArchive::isXARArchiveAtURL(url))
        return GWArchiveFormatXAR;
    if (GWZipArchive::isSelfExtractingZipArchiveAtURL(url))
        return GWArchiveFormatSelfExtractingZip;
    if (GWZipArchive::isZipArchiveAtURL(url))
        return GWArchiveFormatZip;
    return GWArchiveFormatUnknown;
}

const char* GWArchiveFormatName(GWArchiveFormat format) {
    switch (format) {
        case GWArchiveFormatZip: return "zip";
        case GWArchiveFormatSelfExtractingZip: return "zip (self-extracting)";
        case GWArchiveFormatXAR: return "xar";
        case GWArchiveFormatUnknown: break;
    }
    return "unknown";
}
