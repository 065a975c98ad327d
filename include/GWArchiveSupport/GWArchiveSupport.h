#pragma once

// Umbrella header: everything a caller of the library needs.

#include "GWAppleFileDecoder.h"
#include "GWArchiveConstants.h"
#include "GWXARArchive.h"
#include "GWXARDataReference.h"
#include "GWXARExtractOperation.h"
#include "GWXARFile.h"
#include "GWXARSignature.h"
#include "GWXARTrust.h"
#include "GWZipArchive.h"
#include "GWZipExtractOperation.h"
#include "GWZipFile.h"
#include "GWZipLoadOperation.h"
#include "GWZipWorkOperation.h"
#include "foundation/GWFoundation.h"
