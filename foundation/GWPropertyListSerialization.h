#pragma once

#include <optional>
#include <string_view>

#include "GWError.h"
#include "GWValue.h"

class GWPropertyListSerialization {
public:
    // Standard base64 to bytes. Spaces and line breaks may appear anywhere;
    // any other stray character, or bad padding, is Cocoa error 259.
    static std::optional<GWData> dataWithBase64String(std::string_view text, GWErrorPtr* error);
};
