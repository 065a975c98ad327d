#pragma once

#include <cstddef>
#include <optional>
#include <string>
#include <string_view>
#include <unordered_map>
#include <vector>

#include "GWZipFile.h"

// Siblings of a tree under construction. Loading appends, looks up the first
// entry of a name, removes and renames entries of huge directories; doing that
// on the entries' own children arrays would cost O(N) per step, so the loader
// keeps the order here and hands each directory its array once.
class GWZipEntryList {
public:
    GWZipEntryList() = default;
    explicit GWZipEntryList(const GWZipFileArray& files);

    void append(const GWZipFilePtr& file);
    // The first entry of that exact name in list order, as a scan would find.
    GWZipFilePtr firstNamed(std::string_view name) const;
    // Removes that very entry; false when it is not in the list.
    bool remove(const GWZipFilePtr& file);
    // Renames the entry (setName) and keeps the lookup in step.
    void rename(const GWZipFilePtr& file, std::string name);
    // Where the entry stands among all ever appended; none when absent.
    std::optional<std::size_t> positionOf(const GWZipFile* file) const;

    // The entries in order.
    GWZipFileArray entries() const;
    bool empty() const { return count_ == 0; }

private:
    void index(const std::string& name, std::size_t position);
    void unindex(const std::string& name, std::size_t position);

    GWZipFileArray items_;  // null where an entry was removed
    // Positions of each name, ascending; duplicates are rare, so short.
    std::unordered_map<std::string, std::vector<std::size_t>> positions_;
    std::unordered_map<const GWZipFile*, std::size_t> positionOfFile_;
    std::size_t count_ = 0;
};
