#pragma once

#include <span>
#include <string>

#include "foundation/GWCoder.h"

namespace gwtest {

// A non-keyed coder that counts every attempt to write to it.
class WriteCountingCoder : public GWCoder {
public:
    int writes = 0;

protected:
    void writeValue(const std::string&, const GWValue&) override { ++writes; }
    void writeObject(const std::string&, const GWCoding&) override { ++writes; }
    void writeObjects(const std::string&, std::span<const GWCoding* const>) override { ++writes; }
};

}  // namespace gwtest
