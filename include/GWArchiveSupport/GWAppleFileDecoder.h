#pragma once

#include <memory>
#include <optional>
#include <string>

#include "GWError.h"
#include "GWExport.h"
#include "GWExtractOptions.h"
#include "GWURL.h"

// Turns the single-file encodings of classic Mac files back into files with
// their forks and Finder information. Stateless; one shared instance.
class GW_EXPORT GWAppleFileDecoder {
public:
    static const std::shared_ptr<GWAppleFileDecoder>& sharedInstance();

    // Decodes the MacBinary I, II or III file at `from` into a file at `to`:
    // data fork, resource fork, Finder information, dates and comment. On
    // failure the destination may hold a partial file.
    bool decodeMacBinaryFileAtURL(const GWURL& from, const std::optional<GWURL>& to,
                                  GWErrorPtr* error) const;

    // Applies the AppleDouble file at `appleDouble` (Finder information,
    // extended attributes, resource fork, comment) to `dataFile`, whose
    // contents stay as they are. The AppleDouble file is left alone. Failures
    // are POSIX errors without a location: EINVAL for a malformed file.
    // Attributes outside "user." follow `options`; `entryPath` names the
    // file in notes of what was left out.
    bool mergeAppleDoubleFileAtURL(const GWURL& appleDouble, const GWURL& dataFile,
                                   GWErrorPtr* error, const std::string& entryPath = {},
                                   const GWExtractOptions& options = {}) const;

private:
    GWAppleFileDecoder() = default;
};
