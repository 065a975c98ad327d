#pragma once

#include "support/XarSigning.h"

namespace gwtest {

// The signing material of this test process, made once.
XarSigning& sharedSigning();

}  // namespace gwtest
