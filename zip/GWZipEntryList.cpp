#include "GWZipEntryList.h"

#include <algorithm>

GWZipEntryList::GWZipEntryList(const GWZipFileArray& files) {
    items_.reserve(files.size());
    for (const auto& file : files) {
        append(file);
    }
}

GWZipFilePtr GWZipEntryList::append(const GWZipFilePtr& file) {
    if (!file) {
        return nullptr;
    }
    if (positionOfFileBuilt_) {
        if (positionOfFile_.count(file.get())) {
            return nullptr;
        }
        positionOfFile_.emplace(file.get(), items_.size());
    }
    const std::size_t position = items_.size();
    items_.push_back(file);
    ++count_;
    auto previous = index(file->name_, position);
    return previous ? items_[*previous] : nullptr;
}

std::string_view GWZipEntryList::nameAt(std::size_t position) const {
    // Lists live while a tree is built, on one thread: no rename races this.
    return items_[position]->name_;
}

std::size_t GWZipEntryList::findSlot(std::string_view name, std::uint32_t hash) const {
    if (slots_.empty()) {
        return kNoPosition;
    }
    const std::size_t mask = slots_.size() - 1;
    for (std::size_t slot = hash & mask;; slot = (slot + 1) & mask) {
        const Slot& candidate = slots_[slot];
        if (candidate.position == kEmptySlot) {
            return kNoPosition;
        }
        if (candidate.hash == hash && nameAt(candidate.position) == name) {
            return slot;
        }
    }
}

void GWZipEntryList::insertSlot(Slot slot) {
    if ((usedSlots_ + 1) * 4 > slots_.size() * 3) {
        growSlots();
    }
    const std::size_t mask = slots_.size() - 1;
    std::size_t at = slot.hash & mask;
    while (slots_[at].position != kEmptySlot) {
        at = (at + 1) & mask;
    }
    slots_[at] = slot;
    ++usedSlots_;
}

void GWZipEntryList::growSlots() {
    std::vector<Slot> old = std::move(slots_);
    slots_.assign(old.empty() ? 16 : old.size() * 2, Slot());
    usedSlots_ = 0;
    for (const Slot& slot : old) {
        if (slot.position != kEmptySlot) {
            insertSlot(slot);
        }
    }
}

void GWZipEntryList::eraseSlot(std::size_t slot) {
    // Backward shift: later members of the probe run move up so that no
    // lookup stops early at the hole.
    const std::size_t mask = slots_.size() - 1;
    std::size_t hole = slot;
    for (std::size_t next = (hole + 1) & mask; slots_[next].position != kEmptySlot;
         next = (next + 1) & mask) {
        const std::size_t home = slots_[next].hash & mask;
        const bool reachable =
            hole <= next ? (home <= hole || home > next) : (home <= hole && home > next);
        if (reachable) {
            slots_[hole] = slots_[next];
            hole = next;
        }
    }
    slots_[hole] = Slot();
    --usedSlots_;
}

std::optional<std::size_t> GWZipEntryList::index(const std::string& name, std::size_t position) {
    const std::uint32_t hash = hashOf(name);
    const std::size_t slot = findSlot(name, hash);
    if (slot == kNoPosition) {
        insertSlot({hash, std::uint32_t(position)});
        return std::nullopt;
    }
    const std::size_t previousFirst = slots_[slot].position;
    if (position < previousFirst) {
        slots_[slot].position = std::uint32_t(position);
        position = previousFirst;
    }
    auto& later = laterPositions_[name];
    later.insert(std::lower_bound(later.begin(), later.end(), position), position);
    return previousFirst;
}

void GWZipEntryList::unindex(const std::string& name, std::size_t position) {
    const std::size_t slot = findSlot(name, hashOf(name));
    if (slot == kNoPosition) {
        return;
    }
    auto later = laterPositions_.find(name);
    if (slots_[slot].position == position) {
        if (later == laterPositions_.end()) {
            eraseSlot(slot);
            return;
        }
        slots_[slot].position = std::uint32_t(later->second.front());
        later->second.erase(later->second.begin());
    } else if (later != laterPositions_.end()) {
        auto at = std::lower_bound(later->second.begin(), later->second.end(), position);
        if (at != later->second.end() && *at == position) {
            later->second.erase(at);
        }
    }
    if (later != laterPositions_.end() && later->second.empty()) {
        laterPositions_.erase(later);
    }
}

GWZipFilePtr GWZipEntryList::firstNamed(std::string_view name) const {
    const std::size_t slot = findSlot(name, hashOf(name));
    return slot == kNoPosition ? nullptr : items_[slots_[slot].position];
}

std::optional<std::size_t> GWZipEntryList::positionOf(const GWZipFile* file) const {
    if (!positionOfFileBuilt_) {
        positionOfFile_.reserve(items_.size());
        for (std::size_t position = 0; position < items_.size(); ++position) {
            if (items_[position]) {
                positionOfFile_.emplace(items_[position].get(), position);
            }
        }
        positionOfFileBuilt_ = true;
    }
    auto found = positionOfFile_.find(file);
    if (found == positionOfFile_.end()) {
        return std::nullopt;
    }
    return found->second;
}

bool GWZipEntryList::remove(const GWZipFilePtr& file) {
    auto position = file ? positionOf(file.get()) : std::nullopt;
    if (!position) {
        return false;
    }
    positionOfFile_.erase(file.get());
    unindex(file->name_, *position);
    items_[*position] = nullptr;
    --count_;
    return true;
}

void GWZipEntryList::rename(const GWZipFilePtr& file, std::string name) {
    auto position = positionOf(file.get());
    if (position) {
        unindex(file->name_, *position);
    }
    file->setName(std::move(name));
    if (position) {
        index(file->name_, *position);
    }
}

GWZipFileArray GWZipEntryList::entries() const {
    GWZipFileArray live;
    live.reserve(count_);
    for (const auto& item : items_) {
        if (item) {
            live.push_back(item);
        }
    }
    return live;
}

GWZipFileArray GWZipEntryList::takeEntries() {
    GWZipFileArray live = count_ == items_.size() ? std::move(items_) : entries();
    *this = GWZipEntryList();
    return live;
}
