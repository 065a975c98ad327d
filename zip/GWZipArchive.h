#pragma once

#include <GWArchiveSupport/GWZipArchive.h>

#include "GWZipExtractOperation.h"
#include "GWZipLoadOperation.h"
