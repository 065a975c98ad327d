#pragma once

// A XAR archive: opening, entry lookup, persistence.

#include "xar/GWXARArchive.h"
