#pragma once

// A stored stream of a XAR entry: its data fork or an extended attribute.

#include "xar/GWXARDataReference.h"
