#pragma once

#include <optional>
#include <string>
#include <string_view>

#include "foundation/GWDate.h"
#include "foundation/GWValue.h"

// How descriptions of XAR objects render their fields: absent values read
// "(null)" and a null pointer "0x0", as the platform's format does.
namespace GWXARDescribing {

std::string objectText(const std::optional<std::string>& text);
std::string objectText(const std::optional<GWData>& bytes);
std::string objectText(const std::optional<GWDate>& date);
std::string pointerText(const void* pointer);
// Every "\n" becomes "\n\t", which nests a description one level deeper.
std::string indented(std::string_view text);

}  // namespace GWXARDescribing
