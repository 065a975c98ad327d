#pragma once
#include <GWArchiveSupport/GWZipExtraInfoKeys.h>
