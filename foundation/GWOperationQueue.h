#pragma once
#include <GWArchiveSupport/GWOperationQueue.h>
