#pragma once
#include <GWArchiveSupport/GWExtractOptions.h>
