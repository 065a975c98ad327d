#pragma once

#include <string>

#include "support/TestSupport.h"

namespace gwtest {

// One run of the built gwarchive binary.
struct ToolRun {
    int status = -1;
    std::string out;
    std::string err;
};

// Runs `gwarchive ARGUMENTS` through the shell (arguments are quoted by the caller).
ToolRun runTool(const std::string& arguments);

// A tree as a sorted list of "path type size/target mode" lines, for comparing
// what two extractors made. Modes and hard links are included; times are not.
std::string describeTree(const std::string& root);

}  // namespace gwtest
