#pragma once

#include <string_view>

#include "foundation/GWURL.h"

// Where an extracted entry goes: `base` with the "/"-separated components of
// `relativePath` appended (empty components dropped). Every destination of a
// batch is computed here, so that rules about where entries may be written
// live in one place.
GWURL GWZipEntryDestinationURL(const GWURL& base, std::string_view relativePath);
