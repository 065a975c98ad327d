#pragma once
#include <GWArchiveSupport/GWXARTrust.h>
