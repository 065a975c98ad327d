// Finding entries by path and re-linking trees to their archive and hard-link targets.

#include <gtest/gtest.h>

#include "XarTestSupport.h"
#include "xar/GWXARArchive.h"

namespace {

GWXARFilePtr entry(const std::string& name, const std::string& itemID,
                   GWXARFileArray children = {}) {
    auto file = GWXARFile::initWithArchive(nullptr);
    file->setName(name);
    file->setItemID(itemID);
    file->setPermissionsMode(children.empty() ? 0100644 : 0040755);
    file->setChildren(std::move(children));
    return file;
}

GWXARFilePtr hardLink(const std::string& name, const std::string& itemID,
                      const std::string& targetID) {
    auto file = entry(name, itemID);
    file->setHardlinkDestinationID(targetID);
    return file;
}

// a/{b, c/{d}}, e
GWXARArchivePtr sampleArchive() {
    auto archive = GWXARArchive::init();
    archive->setFiles(
        {entry("a", "1", {entry("b", "2"), entry("c", "3", {entry("d", "4")})}), entry("e", "5")});
    return archive;
}

std::vector<std::string> pathsOf(const GWXARFileArray& files) {
    std::vector<std::string> paths;
    for (const auto& file : files) {
        paths.push_back(file->path());
    }
    return paths;
}

// Components that match nothing are skipped, but the last must match, and
// each is looked for only at the level reached.
TEST(GWXARArchiveLookup, FindsEntriesByPath) {
    auto archive = sampleArchive();
    const std::pair<const char*, const char*> cases[] = {
        {"a/c/d", "a/c/d"}, {"e", "e"},         {"/e", "e"},          {"a//c/d/", "a/c/d"},
        {"a/zzz/b", "a/b"}, {"x/y/a/c", "a/c"}, {"", nullptr},        {"/", nullptr},
        {"zzz", nullptr},   {"A/B", nullptr},   {"a/b/zzz", nullptr}, {"d", nullptr}};
    for (const auto& [path, found] : cases) {
        auto entry = archive->fileWithPath(path);
        EXPECT_EQ(entry ? entry->path() : "(none)", found ? found : "(none)") << path;
    }
}

TEST(GWXARArchiveLookup, LaterPathsUnderAnEarlierOneAddNothing) {
    auto archive = sampleArchive();
    EXPECT_EQ(pathsOf(archive->filesWithPaths({"a/b", "a"})),
              (std::vector<std::string>{"a/b", "a"}));
    EXPECT_EQ(pathsOf(archive->filesWithPaths({"a", "a/b", "a/c/d"})),
              (std::vector<std::string>{"a"}));
    EXPECT_EQ(pathsOf(archive->filesWithPaths({"e", "missing", "e", "a/c", "a/c/d"})),
              (std::vector<std::string>{"e", "a/c"}));
    EXPECT_TRUE(archive->filesWithPaths({}).empty());
}

TEST(GWXARArchiveLookup, TheFirstOfEqualNamesWins) {
    auto archive = GWXARArchive::init();
    auto first = entry("same", "1", {entry("x", "2")});
    auto second = entry("same", "3", {entry("y", "4")});
    archive->setFiles({first, second});
    EXPECT_EQ(archive->fileWithPath("same"), first);
    EXPECT_FALSE(archive->fileWithPath("same/y"));
}

TEST(GWXARArchiveLinks, IDDictionaryIsDepthFirstAndTheLaterEntryWins) {
    auto first = entry("a", "1", {entry("b", "dup")});
    auto later = entry("c", "dup");
    auto unnamed = GWXARFile::initWithArchive(nullptr);  // no itemID: left out
    GWXARArchive::IDDictionary dictionary;
    GWXARArchive::populateIDDictionary(dictionary, {first, later, unnamed});
    EXPECT_EQ(dictionary.size(), 2u);
    EXPECT_EQ(dictionary.at("1"), first);
    EXPECT_EQ(dictionary.at("dup"), later);
}

TEST(GWXARArchiveLinks, HardLinksResolveAnywhereInTheTree) {
    auto target = entry("target", "7");
    auto link = hardLink("link", "8", "7");
    auto dangling = hardLink("dangling", "9", "404");
    // A hard link is not descended into, so this child's link stays unresolved.
    auto hiddenLink = hardLink("hidden", "11", "7");
    auto linkWithChild = hardLink("odd", "10", "7");
    linkWithChild->setChildren({hiddenLink});
    GWXARFileArray files = {entry("deep", "1", {entry("deeper", "2", {target})}),
                            entry("dir", "3", {link}), dangling, linkWithChild};
    GWXARArchive::fixHardLinksInFiles(files);
    EXPECT_EQ(link->hardlinkDestination(), target);
    EXPECT_EQ(link->type(), GWXARFileTypeHardLink);
    EXPECT_EQ(linkWithChild->hardlinkDestination(), target);
    EXPECT_FALSE(hiddenLink->hardlinkDestination());
    EXPECT_FALSE(dangling->hardlinkDestination());
    EXPECT_EQ(dangling->type(), GWXARFileTypeRegular);
}

}  // namespace
