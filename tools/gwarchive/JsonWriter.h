#pragma once

#include <cstdint>
#include <string>
#include <string_view>
#include <vector>

namespace gwarchive {

// Writes one JSON document into a string, keeping track of commas and
// nesting so callers only say what comes next. Strings that are not valid
// UTF-8 (names in archives can be anything) get U+FFFD for each bad byte, so
// the output always parses.
class JsonWriter {
public:
    void beginObject();
    void endObject();
    void beginArray();
    void endArray();
    // Only inside an object, before its value.
    void key(std::string_view name);

    void value(std::string_view text);
    void value(const char* text) { value(std::string_view(text)); }
    void value(bool flag);
    void value(std::int64_t number);
    void value(std::uint64_t number);
    void value(int number) { value(static_cast<std::int64_t>(number)); }
    void value(unsigned number) { value(static_cast<std::uint64_t>(number)); }
    void null();

    const std::string& text() const { return out_; }

    static std::string quoted(std::string_view text);

private:
    void separate();

    std::string out_;
    // One entry per open container: whether something was written in it yet.
    std::vector<bool> hasMembers_;
    bool afterKey_ = false;
};

}  // namespace gwarchive
