#pragma once

#include <string>
#include <string_view>
#include <unordered_map>
#include <vector>

#include "GWZipEntryList.h"
#include "GWZipFile.h"

// A directory the loader makes for a path component no entry names.
GWZipFilePtr GWZipMakeImplicitDirectory(const std::string& name, const GWZipFilePtr& parent);

// The entry tree while the central directory is walked. Children are kept in
// GWZipEntryLists and given to their directories once, by finish(), so that
// neither lookups nor the replacement of implicit directories cost O(N).
class GWZipTreeBuilder {
public:
    // Lookup as GWZipFile::fileWithPathComponents does it: the first entry of
    // each name, making missing directories (0o40755) when `create` is set.
    GWZipFilePtr fileWithPathComponents(const std::vector<std::string>& components, bool create);

    GWZipFilePtr childNamed(const GWZipFilePtr& parent, std::string_view name) const;
    // Appends to the parent's children, or to the roots without a parent, and
    // sets the child's parent link. Returns the entry that was the first of
    // the child's name there before.
    GWZipFilePtr addChild(const GWZipFilePtr& parent, const GWZipFilePtr& child);
    void removeChild(const GWZipFilePtr& parent, const GWZipFilePtr& child);
    // Moves the children of `from` to `to`, re-parenting them.
    void moveChildren(const GWZipFilePtr& from, const GWZipFilePtr& to);

    // Hands every directory its children and returns the roots. The builder
    // is empty afterwards.
    GWZipFileArray finish();

private:
    struct Children {
        GWZipFilePtr owner;  // keeps the key alive
        GWZipEntryList list;
    };

    GWZipEntryList roots_;
    std::unordered_map<const GWZipFile*, Children> children_;
};
