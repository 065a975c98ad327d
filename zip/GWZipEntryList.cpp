#include "GWZipEntryList.h"

#include <algorithm>

GWZipEntryList::GWZipEntryList(const GWZipFileArray& files) {
    for (const auto& file : files) {
        append(file);
    }
}

void GWZipEntryList::append(const GWZipFilePtr& file) {
    if (!file || positionOfFile_.count(file.get())) {
        return;
    }
    const std::size_t position = items_.size();
    items_.push_back(file);
    positionOfFile_.emplace(file.get(), position);
    index(file->name(), position);
    ++count_;
}

void GWZipEntryList::index(const std::string& name, std::size_t position) {
    auto& positions = positions_[name];
    positions.insert(std::lower_bound(positions.begin(), positions.end(), position), position);
}

void GWZipEntryList::unindex(const std::string& name, std::size_t position) {
    auto found = positions_.find(name);
    if (found == positions_.end()) {
        return;
    }
    auto& positions = found->second;
    auto at = std::lower_bound(positions.begin(), positions.end(), position);
    if (at != positions.end() && *at == position) {
        positions.erase(at);
    }
    if (positions.empty()) {
        positions_.erase(found);
    }
}

GWZipFilePtr GWZipEntryList::firstNamed(std::string_view name) const {
    auto found = positions_.find(std::string(name));
    if (found == positions_.end() || found->second.empty()) {
        return nullptr;
    }
    return items_[found->second.front()];
}

bool GWZipEntryList::remove(const GWZipFilePtr& file) {
    auto found = file ? positionOfFile_.find(file.get()) : positionOfFile_.end();
    if (found == positionOfFile_.end()) {
        return false;
    }
    const std::size_t position = found->second;
    positionOfFile_.erase(found);
    unindex(file->name(), position);
    items_[position] = nullptr;
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

std::optional<std::size_t> GWZipEntryList::positionOf(const GWZipFile* file) const {
    auto found = positionOfFile_.find(file);
    if (found == positionOfFile_.end()) {
        return std::nullopt;
    }
    return found->second;
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
