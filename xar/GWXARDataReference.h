#pragma once
#include <GWArchiveSupport/GWXARDataReference.h>
