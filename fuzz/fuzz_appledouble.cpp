// Merges the input, read as an AppleDouble file, into a fresh scratch file.

#include <fcntl.h>
#include <unistd.h>

#include <cstddef>
#include <cstdint>

#include "FuzzSupport.h"
#include "applefile/GWAppleFileDecoder.h"

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    static const bool ready = (gwfuzz::silenceLog(), true);
    (void)ready;
    const std::string& scratch = gwfuzz::scratchDirectory();
    const std::string target = scratch + "/target";
    const int fd = ::open(target.c_str(), O_WRONLY | O_CREAT | O_TRUNC, 0644);
    if (fd >= 0) {
        ::close(fd);
    }
    const GWURL input = gwfuzz::urlWithContents({data, size});
    GWErrorPtr error;
    (void)GWAppleFileDecoder::sharedInstance()->mergeAppleDoubleFileAtURL(
        input, GWURL::fileURLWithPath(target), &error);
    gwfuzz::emptyDirectory(scratch);
    return 0;
}
