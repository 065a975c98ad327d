#pragma once

// The support layer every archive subsystem builds on.

#include "GWBinaryPropertyList.h"
#include "GWByteReader.h"
#include "GWChecksum.h"
#include "GWCoder.h"
#include "GWConversions.h"
#include "GWDate.h"
#include "GWDispatch.h"
#include "GWError.h"
#include "GWFileManager.h"
#include "GWLog.h"
#include "GWOperation.h"
#include "GWOperationQueue.h"
#include "GWRef.h"
#include "GWURL.h"
#include "GWValue.h"
