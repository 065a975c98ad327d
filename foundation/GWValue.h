#pragma once
#include <GWArchiveSupport/GWValue.h>
