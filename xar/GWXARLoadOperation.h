#pragma once

#include <pugixml.hpp>

#include <GWArchiveSupport/GWXARLoadOperation.h>

#include "foundation/GWRemoteFileHandle.h"

static_assert(GWXARLoadOperation::kTOCParseOptions ==
              (pugi::parse_default | pugi::parse_ws_pcdata_single));
