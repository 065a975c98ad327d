#pragma once

#include <string>

#include "GWArchiveSupport/GWArchiveSupport.h"

namespace gwarchive {

// A path operand as a file URL, made absolute against the working directory.
GWURL localURL(const std::string& path);
// An archive operand: an http, https or file URL as written, "-" standard
// input, anything else a path.
GWURL archiveURL(const std::string& operand);

}  // namespace gwarchive
