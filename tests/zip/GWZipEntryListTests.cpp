#include <gtest/gtest.h>

#include <random>

#include "zip/GWZipEntryList.h"

namespace {

GWZipFilePtr entry(const std::string& name) {
    return GWZipFile::initWithName(name, nullptr, 0, 0, std::nullopt, 0, 0, 0, 0100644,
                                   std::nullopt, std::nullopt, 0, 0, 0, {});
}

// The order a plain scan of the list would see.
struct ScanModel {
    std::vector<GWZipFilePtr> items;

    GWZipFilePtr firstNamed(const std::string& name) const {
        for (const auto& item : items) {
            if (item->name() == name) {
                return item;
            }
        }
        return nullptr;
    }
};

// Many names, few distinct, with removals and renames in between: lookups
// must always give what a scan in list order gives.
TEST(GWZipEntryList, LookupsMatchAScanThroughAppendsRemovalsAndRenames) {
    std::mt19937 random(7);
    GWZipEntryList list;
    ScanModel model;
    auto randomName = [&] { return "n" + std::to_string(random() % 300); };
    for (int step = 0; step < 20000; ++step) {
        const unsigned action = random() % 10;
        if (action < 6 || model.items.empty()) {
            auto file = entry(randomName());
            EXPECT_EQ(list.append(file), model.firstNamed(file->name()));
            model.items.push_back(file);
        } else if (action < 8) {
            const std::size_t at = random() % model.items.size();
            EXPECT_TRUE(list.remove(model.items[at]));
            model.items.erase(model.items.begin() + std::ptrdiff_t(at));
        } else {
            list.rename(model.items[random() % model.items.size()], randomName());
        }
        const std::string probe = randomName();
        ASSERT_EQ(list.firstNamed(probe), model.firstNamed(probe)) << "step " << step;
    }
    EXPECT_EQ(list.entries(), model.items);
    EXPECT_FALSE(list.remove(entry("n1")));
    EXPECT_EQ(list.takeEntries(), model.items);
    EXPECT_TRUE(list.empty());
    EXPECT_EQ(list.firstNamed("n1"), nullptr);
}

}  // namespace
