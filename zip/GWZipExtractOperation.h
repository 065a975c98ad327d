#pragma once

#include <GWArchiveSupport/GWZipExtractOperation.h>

#include "GWZipWorkOperation.h"
#include "foundation/GWDispatch.h"
#include "foundation/GWFileDescriptor.h"
