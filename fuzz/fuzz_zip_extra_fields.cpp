// The extra-field decoder alone: the first byte says whether the block list
// comes from a local header, the rest is the list.

#include <cstddef>
#include <cstdint>

#include "FuzzSupport.h"
#include "zip/GWZipWorkOperation.h"

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    static const bool ready = (gwfuzz::silenceLog(), true);
    (void)ready;
    if (size == 0) {
        return 0;
    }
    static const auto decoder = std::make_shared<GWZipWorkOperation>();
    GWErrorPtr error;
    (void)decoder->infoFromExtraFieldData({data + 1, size - 1}, (data[0] & 1) != 0, &error);
    return 0;
}
