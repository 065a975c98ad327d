#pragma once

#include <memory>

#include "ToolArchive.h"

namespace gwarchive {

std::unique_ptr<ToolArchive> openZipArchive(const GWURL& url, GWErrorPtr* error);
std::unique_ptr<ToolArchive> openXARArchive(const GWURL& url, GWErrorPtr* error);

}  // namespace gwarchive
