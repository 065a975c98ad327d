#include "GWAppleFileDecoder.h"

const std::shared_ptr<GWAppleFileDecoder>& GWAppleFileDecoder::sharedInstance() {
    // A function-local static is initialised once, under the language's own guard.
    static const std::shared_ptr<GWAppleFileDecoder> instance(new GWAppleFileDecoder());
    return instance;
}
