#pragma once

// The trust anchors XAR signing chains must reach: the system's and the caller's.

#include "xar/GWXARTrust.h"
