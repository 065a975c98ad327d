#pragma once

#include <GWArchiveSupport/GWZipWorkOperation.h>

#include "foundation/GWDecompressor.h"
