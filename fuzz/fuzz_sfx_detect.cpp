// Self-extractor detection, and the plain ZIP check beside it.

#include <cstddef>
#include <cstdint>

#include "FuzzSupport.h"
#include "zip/GWZipArchive.h"

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    static const bool ready = (gwfuzz::silenceLog(), true);
    (void)ready;
    const GWURL url = gwfuzz::urlWithContents({data, size});
    (void)GWZipArchive::isSelfExtractingZipArchiveAtURL(url);
    (void)GWZipArchive::isZipArchiveAtURL(url);
    return 0;
}
