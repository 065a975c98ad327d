#pragma once
#include <GWArchiveSupport/GWURL.h>
