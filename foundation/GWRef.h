#pragma once
#include <GWArchiveSupport/GWRef.h>
