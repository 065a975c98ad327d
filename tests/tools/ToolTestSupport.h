#pragma once

#include <string>
#include <vector>

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

// Runs gwarchive with `arguments` as its own process, without a shell, and
// reports the most memory it held resident (KiB, from wait4). The kernel
// counts the forked image up to exec too, so this is an upper bound: the
// larger of the tool's peak and the test binary's footprint when it forked.
// Standard output is discarded.
struct MeasuredToolRun {
    int status = -1;
    std::string err;
    long maxResidentKiB = 0;
};
MeasuredToolRun runToolMeasured(const std::vector<std::string>& arguments);

// A tree as a sorted list of "path type size/target mode" lines, for comparing
// what two extractors made. Modes and hard links are included; times are not.
std::string describeTree(const std::string& root);

}  // namespace gwtest
