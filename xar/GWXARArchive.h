#pragma once

#include <GWArchiveSupport/GWXARArchive.h>

#include "GWXARHeapStream.h"
#include "GWXARLoadOperation.h"
