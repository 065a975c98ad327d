#pragma once
#include <GWArchiveSupport/GWError.h>
