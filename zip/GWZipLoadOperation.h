#pragma once

#include <GWArchiveSupport/GWZipLoadOperation.h>

#include "GWZipEntryList.h"
#include "GWZipEntryPipe.h"
#include "GWZipReadWindow.h"
#include "GWZipRecords.h"
#include "GWZipTreeBuilder.h"
#include "GWZipWorkOperation.h"
#include "foundation/GWRemoteFileHandle.h"
