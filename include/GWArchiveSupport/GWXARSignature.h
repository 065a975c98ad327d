#pragma once

// A signature of a XAR archive and its certificates.

#include "xar/GWXARSignature.h"
