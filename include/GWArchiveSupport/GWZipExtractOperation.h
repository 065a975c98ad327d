#pragma once

// Extraction of one ZIP entry to disk or to a data handler.

#include "zip/GWZipExtractOperation.h"
