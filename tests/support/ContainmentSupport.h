#pragma once

#include <map>
#include <string>

#include "support/TestSupport.h"

namespace gwtest {

// A parent folder holding a canary file and a fresh, empty extraction
// folder "out": what hostile archives try to reach.
class ContainmentSandbox {
public:
    ContainmentSandbox();

    const std::string& parent() const { return parent_.path(); }
    std::string out() const { return parent_.file("out"); }
    GWURL outURL() const { return parent_.url("out"); }
    std::string canary() const { return parent_.file("canary"); }

    // The parent folder and every item in it outside "out" as "type size hash
    // mtime" (a link's target instead of its contents), by relative path.
    std::map<std::string, std::string> outside() const;

    static constexpr const char* kCanaryText = "canary: must stay as it is";

private:
    TemporaryDirectory parent_;
};

}  // namespace gwtest
