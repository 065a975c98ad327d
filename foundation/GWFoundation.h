#pragma once

// The support layer every archive subsystem builds on.

#include "GWByteReader.h"
#include "GWDate.h"
#include "GWDispatch.h"
#include "GWError.h"
#include "GWLog.h"
#include "GWOperation.h"
#include "GWOperationQueue.h"
#include "GWURL.h"
#include "GWValue.h"
