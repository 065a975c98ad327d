#pragma once
#include <GWArchiveSupport/GWZipFile.h>
