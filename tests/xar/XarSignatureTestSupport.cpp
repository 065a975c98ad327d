#include "XarSignatureTestSupport.h"

namespace gwtest {

XarSigning& sharedSigning() {
    static XarSigning signing;
    return signing;
}

}  // namespace gwtest
