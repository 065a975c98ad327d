#pragma once

#include <span>
#include <string>
#include <vector>

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

// Records the keys written to it, in order, and the plain values under them.
class RecordingCoder : public GWCoder {
public:
    explicit RecordingCoder(bool keyed) : keyed_(keyed) {}
    bool allowsKeyedCoding() const override { return keyed_; }
    std::vector<std::string> keys;
    GWDictionary values;

protected:
    void writeValue(const std::string& key, const GWValue& value) override {
        keys.push_back(key);
        values[key] = value;
    }
    void writeObject(const std::string& key, const GWCoding&) override { keys.push_back(key); }
    void writeObjects(const std::string& key, std::span<const GWCoding* const>) override {
        keys.push_back(key);
    }

private:
    bool keyed_;
};

}  // namespace gwtest
