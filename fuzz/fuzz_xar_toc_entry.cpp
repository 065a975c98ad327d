// The table-of-contents entry parser alone: the input is the body of the
// "toc" element, parsed as the loader parses it and turned into entries.

#include <cstddef>
#include <cstdint>
#include <string>

#include <pugixml.hpp>

#include "FuzzSupport.h"
#include "xar/GWXARLoadOperation.h"

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    static const bool ready = (gwfuzz::silenceLog(), true);
    (void)ready;
    const std::string text =
        "<xar><toc>" + std::string(reinterpret_cast<const char*>(data), size) + "</toc></xar>";
    pugi::xml_document document;
    if (!document.load_buffer(text.data(), text.size(), GWXARLoadOperation::kTOCParseOptions)) {
        return 0;
    }
    auto operation = GWXARLoadOperation::initWithArchive(nullptr, false);
    GWErrorPtr error;
    (void)operation->filesFromTOCElement(document.child("xar").child("toc"), &error);
    return 0;
}
