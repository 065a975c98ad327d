// Attaching Mac metadata companions ("__MACOSX/._name" AppleDouble files,
// resource forks under "XtraStuf.mac" or "Re$0urce.Fk", and "…r" / "…d"
// pairs) to the entries they describe.

#include <algorithm>
#include <unordered_set>

#include "GWZipLoadOperation.h"
#include "foundation/GWFileManager.h"

namespace {

const char* const kAppleDoubleFolderName = "__MACOSX";
const char* const kAppleDoublePrefix = "._";
const char* const kResourceForkFolderNames[] = {"XtraStuf.mac", "Re$0urce.Fk"};

bool isMarkedResourceFork(const GWZipFile& file) {
    const GWDictionary info = file.extraInfo();
    const GWValue* value = GWDictionaryValue(info, kGWZipIsResourceForkKey);
    return value && value->boolValue();
}

// One folder being walked: a copy of its children, and the companions that
// leave it. The folder's array is rebuilt once when the walk leaves it: one
// removal at a time would cost O(N) each in a huge "__MACOSX".
struct FolderWalk {
    GWZipFilePtr folder;
    GWZipFileArray children;
    std::size_t next = 0;
    std::unordered_set<const GWZipFile*> removed;

    explicit FolderWalk(GWZipFilePtr walked) : folder(std::move(walked)) {
        if (auto current = folder->children()) {
            children = *current;
        }
    }

    void finish() {
        if (removed.empty()) {
            return;
        }
        GWZipFileArray kept;
        if (auto current = folder->children()) {
            kept.reserve(current->size());
            for (const auto& child : *current) {
                if (!removed.count(child.get())) {
                    kept.push_back(child);
                }
            }
        }
        folder->setChildren(std::move(kept));
        removed.clear();
    }
};

}  // namespace

GWZipFilePtr GWZipLoadOperation::fileWithName(std::string_view name, const GWZipEntryList& array,
                                              const GWZipFilePtr& parent) {
    return parent ? parent->childNamed(name) : array.firstNamed(name);
}

bool GWZipLoadOperation::setUpMetadataItemsForFiles(GWZipFileArray& files, GWErrorPtr* error) {
    // Most archives have nothing to pair; they need no index of their roots.
    const bool anyCandidate = std::any_of(files.begin(), files.end(), [](const GWZipFilePtr& file) {
        if (!file) {
            return false;
        }
        const std::string& name = file->name();
        return name == kAppleDoubleFolderName || name == kResourceForkFolderNames[0] ||
               name == kResourceForkFolderNames[1] ||
               (!name.empty() && name.back() == 'r' && isMarkedResourceFork(*file));
    });
    if (!anyCandidate) {
        if (isCancelled()) {
            return GWFail(error, cancelledError());
        }
        return true;
    }
    GWZipEntryList roots(files);
    GWZipFilePtr appleDoubleFolder = roots.firstNamed(kAppleDoubleFolderName);
    GWZipFilePtr resourceForkFolder;
    for (const char* name : kResourceForkFolderNames) {
        GWZipFilePtr candidate = roots.firstNamed(name);
        if (candidate && (!resourceForkFolder || *roots.positionOf(candidate.get()) <
                                                     *roots.positionOf(resourceForkFolder.get()))) {
            resourceForkFolder = candidate;
        }
    }
    bool succeeded = true;
    if (appleDoubleFolder) {
        succeeded = makeMetadataItemsForItem(appleDoubleFolder, roots, appleDoubleFolder,
                                             kAppleDoublePrefix, true, error);
        if (succeeded) {
            roots.remove(appleDoubleFolder);
        }
    }
    if (succeeded && resourceForkFolder) {
        succeeded = makeMetadataItemsForItem(resourceForkFolder, roots, resourceForkFolder, "",
                                             false, error);
        if (succeeded) {
            roots.remove(resourceForkFolder);
        }
    }
    if (succeeded) {
        succeeded = joinParallelMetadataFiles(roots, nullptr, error);
    }
    files = roots.entries();
    return succeeded;
}

GWZipFilePtr GWZipLoadOperation::metadataTarget(const std::vector<std::string>& components,
                                                GWZipEntryList& rootFiles) const {
    auto lookup = [&rootFiles, &components](std::size_t count, bool create) -> GWZipFilePtr {
        GWZipFilePtr current;
        for (std::size_t i = 0; i < count; ++i) {
            GWZipFilePtr next =
                current ? current->childNamed(components[i]) : rootFiles.firstNamed(components[i]);
            if (!next && create) {
                next = GWZipMakeImplicitDirectory(components[i], current);
                if (current) {
                    current->addChild(next);
                } else {
                    rootFiles.append(next);
                }
            }
            if (!next) {
                return nullptr;
            }
            current = std::move(next);
        }
        return current;
    };
    if (GWZipFilePtr existing = lookup(components.size(), false)) {
        return existing;
    }
    // A companion without its entry still shows up, as an empty file.
    GWZipFilePtr directory = lookup(components.size() - 1, true);
    auto placeholder = GWZipFile::initWithName(components.back(), directory, 0, 0, std::nullopt, 0,
                                               GWProcessUserID(), GWProcessGroupID(), 0100644,
                                               GWDate::now(), std::nullopt, 0, 0, 0, {});
    if (directory) {
        directory->addChild(placeholder);
    } else {
        rootFiles.append(placeholder);
    }
    return placeholder;
}

bool GWZipLoadOperation::makeMetadataItemsForItem(const GWZipFilePtr& item,
                                                  GWZipEntryList& rootFiles,
                                                  const GWZipFilePtr& metadataRoot,
                                                  const std::string& prefix, bool isAppleDouble,
                                                  GWErrorPtr* error) {
    // A work list instead of recursion: the folder may be nested very deeply.
    std::vector<FolderWalk> walks;
    walks.emplace_back(item);
    while (!walks.empty()) {
        FolderWalk& walk = walks.back();
        if (walk.next == walk.children.size()) {
            walk.finish();
            walks.pop_back();
            continue;
        }
        if (isCancelled()) {
            for (auto& unfinished : walks) {
                unfinished.finish();
            }
            return GWFail(error, cancelledError());
        }
        GWZipFilePtr child = walk.children[walk.next++];
        if (!child) {
            continue;
        }
        if (child->isDirectory()) {
            walks.emplace_back(child);
            continue;
        }
        const std::string& name = child->name();
        if (!prefix.empty() && name.compare(0, prefix.size(), prefix) != 0) {
            continue;
        }
        std::vector<std::string> components;
        bool reachedRoot = false;
        for (auto ancestor = child->parent(); ancestor; ancestor = ancestor->parent()) {
            if (ancestor == metadataRoot) {
                reachedRoot = true;
                break;
            }
            components.push_back(ancestor->name());
        }
        if (!reachedRoot) {
            continue;
        }
        std::reverse(components.begin(), components.end());
        components.push_back(name.substr(prefix.size()));
        GWZipFilePtr target = metadataTarget(components, rootFiles);
        if (isAppleDouble) {
            target->setAppleDoubleFile(child);
        } else {
            target->setResourceFork(child);
        }
        walk.removed.insert(child.get());
    }
    return true;
}

bool GWZipLoadOperation::joinParallelMetadataFiles(GWZipEntryList& files,
                                                   const GWZipFilePtr& parent, GWErrorPtr* error) {
    // Only the given level is visited; nested folders keep their pairs apart.
    const GWZipFileArray snapshot = files.entries();
    for (const auto& entry : snapshot) {
        if (isCancelled()) {
            return GWFail(error, cancelledError());
        }
        if (!entry || !isMarkedResourceFork(*entry)) {
            continue;
        }
        const std::string& name = entry->name();
        if (name.empty() || name.back() != 'r') {
            continue;
        }
        const std::string base = name.substr(0, name.size() - 1);
        GWZipFilePtr data = fileWithName(base + "d", files, parent);
        if (data) {
            if (parent) {
                data->setName(base);
            } else {
                files.rename(data, base);
            }
        } else {
            data = fileWithName(base, files, parent);
        }
        if (!data) {
            continue;
        }
        data->setResourceFork(entry);
        if (parent) {
            parent->removeChild(entry);
        } else {
            files.remove(entry);
        }
    }
    return true;
}
