#pragma once

// The operation that extracts a XAR item, with its subtree, to disk.

#include "xar/GWXARExtractOperation.h"
