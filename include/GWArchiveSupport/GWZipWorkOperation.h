#pragma once

// The ZIP record parsing shared by loading and extraction.

#include "zip/GWZipWorkOperation.h"
