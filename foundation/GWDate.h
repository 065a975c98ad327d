#pragma once
#include <GWArchiveSupport/GWDate.h>
