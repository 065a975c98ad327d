#include "JsonWriter.h"

#include <cstdio>

namespace gwarchive {

namespace {

// Length of the valid UTF-8 sequence at `index`, or 0 when it is not one.
std::size_t utf8SequenceLength(std::string_view text, std::size_t index) {
    const auto byte = [&](std::size_t at) { return static_cast<unsigned char>(text[at]); };
    unsigned char lead = byte(index);
    std::size_t length;
    std::uint32_t codePoint;
    if (lead < 0x80)
        return 1;
    if (lead >= 0xC2 && lead <= 0xDF) {
        length = 2;
        codePoint = lead & 0x1F;
    } else if (lead >= 0xE0 && lead <= 0xEF) {
        length = 3;
        codePoint = lead & 0x0F;
    } else if (lead >= 0xF0 && lead <= 0xF4) {
        length = 4;
        codePoint = lead & 0x07;
    } else {
        return 0;
    }
    if (index + length > text.size())
        return 0;
    for (std::size_t offset = 1; offset < length; ++offset) {
        unsigned char next = byte(index + offset);
        if ((next & 0xC0) != 0x80)
            return 0;
        codePoint = (codePoint << 6) | (next & 0x3F);
    }
    bool overlong = (length == 3 && codePoint < 0x800) || (length == 4 && codePoint < 0x10000);
    bool surrogate = codePoint >= 0xD800 && codePoint <= 0xDFFF;
    if (overlong || surrogate || codePoint > 0x10FFFF)
        return 0;
    return length;
}

}  // namespace

std::string JsonWriter::quoted(std::string_view text) {
    std::string out = "\"";
    for (std::size_t index = 0; index < text.size();) {
        unsigned char c = static_cast<unsigned char>(text[index]);
        std::size_t length = utf8SequenceLength(text, index);
        if (length == 0) {
            out += "\\ufffd";
            ++index;
            continue;
        }
        if (length > 1) {
            out.append(text.substr(index, length));
            index += length;
            continue;
        }
        switch (c) {
            case '"': out += "\\\""; break;
            case '\\': out += "\\\\"; break;
            case '\n': out += "\\n"; break;
            case '\r': out += "\\r"; break;
            case '\t': out += "\\t"; break;
            default:
                if (c < 0x20 || c == 0x7F) {
                    char escaped[8];
                    std::snprintf(escaped, sizeof escaped, "\\u%04x", c);
                    out += escaped;
                } else {
                    out += static_cast<char>(c);
                }
        }
        ++index;
    }
    out += '"';
    return out;
}

void JsonWriter::separate() {
    if (afterKey_) {
        afterKey_ = false;
        return;
    }
    if (!hasMembers_.empty()) {
        if (hasMembers_.back())
            out_ += ',';
        hasMembers_.back() = true;
    }
}

void JsonWriter::beginObject() {
    separate();
    out_ += '{';
    hasMembers_.push_back(false);
}

void JsonWriter::endObject() {
    hasMembers_.pop_back();
    out_ += '}';
}

void JsonWriter::beginArray() {
    separate();
    out_ += '[';
    hasMembers_.push_back(false);
}

void JsonWriter::endArray() {
    hasMembers_.pop_back();
    out_ += ']';
}

void JsonWriter::key(std::string_view name) {
    separate();
    out_ += quoted(name);
    out_ += ':';
    afterKey_ = true;
}

void JsonWriter::value(std::string_view text) {
    separate();
    out_ += quoted(text);
}

void JsonWriter::value(bool flag) {
    separate();
    out_ += flag ? "true" : "false";
}

void JsonWriter::value(std::int64_t number) {
    separate();
    out_ += std::to_string(number);
}

void JsonWriter::value(std::uint64_t number) {
    separate();
    out_ += std::to_string(number);
}

void JsonWriter::null() {
    separate();
    out_ += "null";
}

}  // namespace gwarchive
