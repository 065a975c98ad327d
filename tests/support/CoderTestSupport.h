#pragma once

#include <span>
#include <string>
#include <vector>

#include "foundation/GWCoder.h"

namespace gwtest {

// Records the keys written to it, in order, and the plain values under them;
// non-keyed by default, where classes must write nothing at all.
class RecordingCoder : public GWCoder {
public:
    explicit RecordingCoder(bool keyed = false) : keyed_(keyed) {}
    bool allowsKeyedCoding() const override { return keyed_; }
    std::vector<std::string> keys;
    GWDictionary values;
    int writes = 0;

protected:
    void writeValue(const std::string& key, const GWValue& value) override {
        record(key);
        values[key] = value;
    }
    void writeObject(const std::string& key, const GWCoding&) override { record(key); }
    void writeObjects(const std::string& key, std::span<const GWCoding* const>) override {
        record(key);
    }

private:
    void record(const std::string& key) {
        keys.push_back(key);
        ++writes;
    }
    bool keyed_;
};

using WriteCountingCoder = RecordingCoder;

}  // namespace gwtest
