#pragma once
#include <GWArchiveSupport/GWAppleFileDecoder.h>
