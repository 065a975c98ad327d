#pragma once
#include <GWArchiveSupport/GWXARExtractOperation.h>
