#pragma once

// A ZIP archive: opening, lookup, persistence and copying.

#include "zip/GWZipArchive.h"
