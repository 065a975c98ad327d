// Path lookup in an entry tree, and the implicit directories it makes.

#include "GWZipFile.h"
#include "foundation/GWFileManager.h"

std::vector<std::string> GWZipFile::standardizedComponentsForPath(std::string_view path) {
    std::vector<std::string> components;
    std::size_t start = 0;
    while (start <= path.size()) {
        std::size_t end = path.find('/', start);
        if (end == std::string_view::npos) {
            end = path.size();
        }
        const std::string_view component = path.substr(start, end - start);
        if (component == "..") {
            if (!components.empty()) {
                components.pop_back();
            }
        } else if (!component.empty() && component != ".") {
            components.emplace_back(component);
        }
        start = end + 1;
    }
    return components;
}

GWZipFilePtr GWZipFile::fileNamed(std::string_view name, const GWZipFileArray& files) {
    for (const auto& file : files) {
        if (file && file->name() == name) {
            return file;
        }
    }
    return nullptr;
}

GWZipFilePtr GWZipFile::fileWithPath(std::string_view path, GWZipFileArray& rootFiles,
                                     bool create) {
    return fileWithPathComponents(standardizedComponentsForPath(path), rootFiles, create);
}

GWZipFilePtr GWZipFile::fileWithPathComponents(const std::vector<std::string>& components,
                                               GWZipFileArray& rootFiles, bool create) {
    return fileWithPathComponents(components, nullptr, rootFiles, create);
}

GWZipFilePtr GWZipFile::makeImplicitDirectory(const std::string& name, const GWZipFilePtr& parent) {
    return initWithName(name, parent, 0, 0, std::nullopt, 0, GWProcessUserID(), GWProcessGroupID(),
                        040755, GWDate::now(), std::nullopt, 0, 0, 0, {});
}

GWZipFilePtr GWZipFile::fileWithPathComponents(const std::vector<std::string>& components,
                                               const GWZipFilePtr& parent, GWZipFileArray& files,
                                               bool create) {
    if (components.empty()) {
        return nullptr;
    }
    GWZipFilePtr current = fileNamed(components.front(), files);
    if (!current && create) {
        current = makeImplicitDirectory(components.front(), parent);
        if (parent) {
            parent->addChild(current);
        } else {
            files.push_back(current);
        }
    }
    // Below the first level the lookup goes through each directory's name
    // index: the same first match as a scan of its children, without copying
    // them for every entry a loader adds.
    for (std::size_t i = 1; i < components.size() && current; ++i) {
        GWZipFilePtr next = current->childNamed(components[i]);
        if (!next && create) {
            next = makeImplicitDirectory(components[i], current);
            current->addChild(next);
        }
        current = std::move(next);
    }
    return current;
}
