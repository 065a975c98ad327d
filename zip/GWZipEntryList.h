#pragma once

#include <cstddef>
#include <cstdint>
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
    // The entries in order, leaving the list empty; no copy when nothing
    // was removed.
    GWZipFileArray takeEntries();
    bool empty() const { return count_ == 0; }

private:
    static constexpr std::size_t kNoPosition = SIZE_MAX;
    // Open addressing with linear probing: a slot holds a name's hash and
    // the position of its first entry; the name itself is read from that
    // entry, so an index of 200,000 names costs no allocation per name.
    // Positions fit 32 bits: four billion entries would need a terabyte.
    static constexpr std::uint32_t kEmptySlot = UINT32_MAX;
    struct Slot {
        std::uint32_t hash = 0;
        std::uint32_t position = kEmptySlot;
    };

    static std::uint32_t hashOf(std::string_view name) {
        return std::uint32_t(std::hash<std::string_view>()(name));
    }
    std::string_view nameAt(std::size_t position) const;
    // The slot of that name, or kNoPosition.
    std::size_t findSlot(std::string_view name, std::uint32_t hash) const;
    void insertSlot(Slot slot);
    void eraseSlot(std::size_t slot);
    void growSlots();

    // The name's first position before this one was added, if any.
    std::optional<std::size_t> index(const std::string& name, std::size_t position);
    void unindex(const std::string& name, std::size_t position);

    GWZipFileArray items_;  // null where an entry was removed
    std::vector<Slot> slots_;
    std::size_t usedSlots_ = 0;
    // Positions of a name after its first, ascending; duplicates are rare.
    std::unordered_map<std::string, std::vector<std::size_t>> laterPositions_;
    // Built on the first removal or rename: most lists never need it.
    mutable std::unordered_map<const GWZipFile*, std::size_t> positionOfFile_;
    mutable bool positionOfFileBuilt_ = false;
    std::size_t count_ = 0;
};
