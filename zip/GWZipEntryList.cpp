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
    auto previous = index(file->name(), position);
    return previous ? items_[*previous] : nullptr;
}

std::optional<std::size_t> GWZipEntryList::index(const std::string& name, std::size_t position) {
    auto [found, inserted] = positions_.try_emplace(name);
    Positions& positions = found->second;
    if (inserted) {
        positions.first = position;
        return std::nullopt;
    }
    const std::size_t previousFirst = positions.first;
    if (position < positions.first) {
        std::swap(position, positions.first);
    }
    positions.more.insert(std::lower_bound(positions.more.begin(), positions.more.end(), position),
                          position);
    return previousFirst;
}

void GWZipEntryList::unindex(const std::string& name, std::size_t position) {
    auto found = positions_.find(name);
    if (found == positions_.end()) {
        return;
    }
    Positions& positions = found->second;
    if (positions.first == position) {
        if (positions.more.empty()) {
            positions_.erase(found);
            return;
        }
        positions.first = positions.more.front();
        positions.more.erase(positions.more.begin());
        return;
    }
    auto at = std::lower_bound(positions.more.begin(), positions.more.end(), position);
    if (at != positions.more.end() && *at == position) {
        positions.more.erase(at);
    }
}

GWZipFilePtr GWZipEntryList::firstNamed(std::string_view name) const {
    auto found = positions_.find(name);
    return found == positions_.end() ? nullptr : items_[found->second.first];
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
    unindex(file->name(), *position);
    items_[*position] = nullptr;
    --count_;
    return true;
}

void GWZipEntryList::rename(const GWZipFilePtr& file, std::string name) {
    auto position = positionOf(file.get());
    if (position) {
        unindex(file->name(), *position);
    }
    file->setName(std::move(name));
    if (position) {
        index(file->name(), *position);
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
