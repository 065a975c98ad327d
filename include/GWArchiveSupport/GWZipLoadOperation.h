#pragma once

// The operation that reads a ZIP file's central directory into an entry tree.

#include "zip/GWZipLoadOperation.h"
