#pragma once
#include <GWArchiveSupport/GWXARSignature.h>
