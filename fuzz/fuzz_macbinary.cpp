// Decodes the input as a MacBinary file into a scratch file, forks and
// Finder information included.

#include <cstddef>
#include <cstdint>

#include "FuzzSupport.h"
#include "applefile/GWAppleFileDecoder.h"

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    static const bool ready = (gwfuzz::silenceLog(), true);
    (void)ready;
    const std::string& scratch = gwfuzz::scratchDirectory();
    static const GWURL output = GWURL::fileURLWithPath(scratch + "/decoded");
    const GWURL input = gwfuzz::urlWithContents({data, size});
    GWErrorPtr error;
    (void)GWAppleFileDecoder::sharedInstance()->decodeMacBinaryFileAtURL(input, output, &error);
    gwfuzz::emptyDirectory(scratch);
    return 0;
}
