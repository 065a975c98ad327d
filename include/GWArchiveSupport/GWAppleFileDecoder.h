#pragma once

// Decoders of the single-file Mac encodings: MacBinary and AppleDouble.

#include "applefile/GWAppleFileDecoder.h"
