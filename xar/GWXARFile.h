#pragma once
#include <GWArchiveSupport/GWXARFile.h>
