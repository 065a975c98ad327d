// Finding entries by path, and re-linking a tree to its archive and its hard-link targets.

#include <unordered_set>

#include "GWXARArchive.h"
#include "GWXARPaths.h"

namespace {

GWXARFilePtr firstNamed(const GWXARFileArray& level, const std::string& name) {
    for (const auto& file : level) {
        if (file && file->name() == name) {
            return file;
        }
    }
    return nullptr;
}

}  // namespace

GWXARFilePtr GWXARArchive::fileWithPath(const std::string& path) const {
    auto found = filesWithPaths({path});
    return found.empty() ? nullptr : found.front();
}

GWXARFileArray GWXARArchive::filesWithPaths(const std::vector<std::string>& paths) const {
    const GWXARFileArray top = files();
    GWXARFileArray result;
    std::unordered_set<const GWXARFile*> listed;
    for (const auto& path : paths) {
        const std::vector<std::string> components = GWXARPathComponents(path);
        const GWXARFileArray* level = &top;
        GWXARFilePtr match;
        for (std::size_t index = 0; index < components.size(); ++index) {
            GWXARFilePtr found = firstNamed(*level, components[index]);
            if (!found) {
                // Lenient by design: a component that matches nothing is skipped.
                continue;
            }
            if (index + 1 == components.size()) {
                match = std::move(found);
                break;
            }
            level = &found->children();
        }
        if (!match) {
            continue;
        }
        bool covered = false;
        for (auto entry = match; entry && !covered; entry = entry->parent()) {
            covered = listed.contains(entry.get());
        }
        if (!covered) {
            listed.insert(match.get());
            result.push_back(std::move(match));
        }
    }
    return result;
}

void GWXARArchive::setArchiveReferencesInFiles(const GWXARFileArray& files,
                                               const GWXARArchivePtr& archive) {
    for (const auto& file : files) {
        if (!file) {
            continue;
        }
        file->setArchive(archive);
        setArchiveReferencesInFiles(file->children(), archive);
    }
}

void GWXARArchive::fixHardLinksInFiles(const GWXARFileArray& files) {
    IDDictionary dictionary;
    populateIDDictionary(dictionary, files);
    fixHardLinksInFiles(files, dictionary);
}

void GWXARArchive::populateIDDictionary(IDDictionary& dictionary, const GWXARFileArray& files) {
    for (const auto& file : files) {
        if (!file) {
            continue;
        }
        if (const auto& itemID = file->itemID()) {
            dictionary[*itemID] = file;
        }
        populateIDDictionary(dictionary, file->children());
    }
}

void GWXARArchive::fixHardLinksInFiles(const GWXARFileArray& files,
                                       const IDDictionary& dictionary) {
    for (const auto& file : files) {
        if (!file) {
            continue;
        }
        if (const auto& targetID = file->hardlinkDestinationID()) {
            auto target = dictionary.find(*targetID);
            file->setHardlinkDestination(target == dictionary.end() ? nullptr : target->second);
        } else {
            fixHardLinksInFiles(file->children(), dictionary);
        }
    }
}
