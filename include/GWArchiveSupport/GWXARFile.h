#pragma once

// An item of a XAR archive's table of contents.

#include "xar/GWXARFile.h"
