#pragma once
#include <GWArchiveSupport/GWOperation.h>
