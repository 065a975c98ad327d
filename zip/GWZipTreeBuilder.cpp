#include "GWZipTreeBuilder.h"

#include "foundation/GWFileManager.h"

GWZipFilePtr GWZipMakeImplicitDirectory(const std::string& name, const GWZipFilePtr& parent) {
    return GWZipFile::initWithName(name, parent, 0, 0, std::nullopt, 0, GWProcessUserID(),
                                   GWProcessGroupID(), 040755, GWDate::now(), std::nullopt, 0, 0, 0,
                                   {});
}

GWZipFilePtr GWZipTreeBuilder::childNamed(const GWZipFilePtr& parent, std::string_view name) const {
    if (!parent) {
        return roots_.firstNamed(name);
    }
    auto found = children_.find(parent.get());
    return found == children_.end() ? nullptr : found->second.list.firstNamed(name);
}

GWZipFilePtr GWZipTreeBuilder::addChild(const GWZipFilePtr& parent, const GWZipFilePtr& child) {
    child->setParent(parent);
    if (!parent) {
        return roots_.append(child);
    }
    auto& children = children_[parent.get()];
    children.owner = parent;
    return children.list.append(child);
}

void GWZipTreeBuilder::removeChild(const GWZipFilePtr& parent, const GWZipFilePtr& child) {
    if (!parent) {
        roots_.remove(child);
        return;
    }
    auto found = children_.find(parent.get());
    if (found != children_.end()) {
        found->second.list.remove(child);
    }
}

void GWZipTreeBuilder::moveChildren(const GWZipFilePtr& from, const GWZipFilePtr& to) {
    auto found = children_.find(from.get());
    if (found == children_.end()) {
        return;
    }
    GWZipEntryList list = std::move(found->second.list);
    children_.erase(found);
    for (const auto& child : list.entries()) {
        child->setParent(to);
    }
    auto& target = children_[to.get()];
    target.owner = to;
    if (target.list.empty()) {
        target.list = std::move(list);
    } else {
        for (const auto& child : list.entries()) {
            target.list.append(child);
        }
    }
}

GWZipFilePtr GWZipTreeBuilder::fileWithPathComponents(const std::vector<std::string>& components,
                                                      bool create) {
    GWZipFilePtr current;
    for (std::size_t i = 0; i < components.size(); ++i) {
        GWZipFilePtr next = childNamed(current, components[i]);
        if (!next) {
            if (!create) {
                return nullptr;
            }
            next = GWZipMakeImplicitDirectory(components[i], current);
            addChild(current, next);
        }
        current = std::move(next);
    }
    return current;
}

GWZipFileArray GWZipTreeBuilder::finish() {
    for (auto& [key, children] : children_) {
        children.owner->setChildren(children.list.takeEntries());
    }
    children_.clear();
    return roots_.takeEntries();
}
