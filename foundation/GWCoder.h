#pragma once
#include <GWArchiveSupport/GWCoder.h>
