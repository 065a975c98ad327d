#pragma once

#include <cstddef>
#include <string>
#include <string_view>
#include <vector>

namespace gwarchive {

// The entry paths of a whole archive in one buffer: 200,000 short strings
// would otherwise be 200,000 allocations.
class PathTable {
public:
    static constexpr std::size_t kNoParent = static_cast<std::size_t>(-1);

    void reserve(std::size_t count, std::size_t textBytes) {
        ends_.reserve(count);
        text_.reserve(textBytes);
    }
    std::string_view operator[](std::size_t index) const {
        const std::size_t start = index == 0 ? 0 : ends_[index - 1];
        return std::string_view(text_).substr(start, ends_[index] - start);
    }

    // Appends the parent's path joined to `name` as the library joins paths,
    // and returns the new path's index.
    std::size_t add(std::size_t parent, std::string_view name) {
        if (parent != kNoParent) {
            const std::size_t start = parent == 0 ? 0 : ends_[parent - 1];
            const std::size_t length = ends_[parent] - start;
            text_.append(text_, start, length);
            if (length != 0 && text_.back() != '/' && !name.empty())
                text_ += '/';
        }
        text_ += name;
        ends_.push_back(text_.size());
        return ends_.size() - 1;
    }

private:
    std::string text_;
    std::vector<std::size_t> ends_;
};

}  // namespace gwarchive
