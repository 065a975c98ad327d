#pragma once

#include <cstddef>
#include <functional>
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

    // Returns the entry that was first of that name before, if any.
    GWZipFilePtr append(const GWZipFilePtr& file);
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
    struct NameHash {
        using is_transparent = void;
        std::size_t operator()(std::string_view name) const {
            return std::hash<std::string_view>()(name);
        }
    };
    // Positions of one name, ascending. Duplicate names are rare, so the
    // first position needs no allocation of its own.
    struct Positions {
        std::size_t first = 0;
        std::vector<std::size_t> more;
    };

    // The name's first position before this one was added, if any.
    std::optional<std::size_t> index(const std::string& name, std::size_t position);
    void unindex(const std::string& name, std::size_t position);

    GWZipFileArray items_;  // null where an entry was removed
    std::unordered_map<std::string, Positions, NameHash, std::equal_to<>> positions_;
    // Built on the first removal or rename: most lists never need it.
    mutable std::unordered_map<const GWZipFile*, std::size_t> positionOfFile_;
    mutable bool positionOfFileBuilt_ = false;
    std::size_t count_ = 0;
};
