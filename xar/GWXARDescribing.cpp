#include "GWXARDescribing.h"

#include "foundation/GWFormat.h"

namespace GWXARDescribing {

namespace {
const char* const kNull = "(null)";
}

std::string objectText(const std::optional<std::string>& text) {
    return text ? *text : kNull;
}

std::string objectText(const std::optional<GWData>& bytes) {
    return bytes ? GWValue(*bytes).description() : kNull;
}

std::string objectText(const std::optional<GWDate>& date) {
    return date ? GWValue(*date).description() : kNull;
}

std::string pointerText(const void* pointer) {
    return pointer ? GWFormat("%p", pointer) : std::string("0x0");
}

std::string indented(std::string_view text) {
    std::string result;
    result.reserve(text.size());
    for (char c : text) {
        result += c;
        if (c == '\n') {
            result += '\t';
        }
    }
    return result;
}

}  // namespace GWXARDescribing
