#include "ZipListingSupport.h"

#include <ctime>
#include <ostream>
#include <regex>
#include <sstream>
#include <vector>

#include "support/TestSupport.h"

namespace gwtest {

namespace {

std::string zipinfoModeString(std::uint16_t mode) {
    std::string text(10, '-');
    switch (mode & 0170000) {
        case 0040000: text[0] = 'd'; break;
        case 0120000: text[0] = 'l'; break;
        case 0100000: text[0] = '-'; break;
        default: text[0] = '?'; break;
    }
    const char* letters = "rwxrwxrwx";
    for (int bit = 0; bit < 9; ++bit) {
        if (mode & (0400 >> bit)) {
            text[1 + bit] = letters[bit];
        }
    }
    return text;
}

std::string zipinfoTimeString(const GWDate& date) {
    const std::time_t seconds = std::time_t(date.wholeSeconds());
    std::tm local{};
    localtime_r(&seconds, &local);
    char buffer[32];
    std::strftime(buffer, sizeof buffer, "%Y%m%d.%H%M%S", &local);
    return buffer;
}

}  // namespace

Listing listingOfTree(const GWZipFileArray& roots) {
    Listing listing;
    std::vector<GWZipFilePtr> pending(roots.rbegin(), roots.rend());
    while (!pending.empty()) {
        GWZipFilePtr node = pending.back();
        pending.pop_back();
        ListedEntry entry;
        entry.mode = zipinfoModeString(node->permissionsMode());
        entry.size = node->storedUncompressedSize();
        entry.time = zipinfoTimeString(node->modificationDate().value_or(GWDate()));
        listing[node->path() + (node->isDirectory() ? "/" : "")] = entry;
        if (auto children = node->children()) {
            pending.insert(pending.end(), children->rbegin(), children->rend());
        }
    }
    return listing;
}

Listing zipinfoListing(const std::string& archivePath) {
    Listing listing;
    CommandResult result = runCommand("zipinfo -T " + shellQuote(archivePath));
    if (result.status != 0) {
        return listing;
    }
    static const std::regex line(
        R"(^([-dl?][-rwxsStT]{9})\s+\S+\s+\S+\s+(\d+)\s+\S+\s+\S+\s+(\d{8}\.\d{6})\s(.*)$)");
    std::istringstream lines(result.output);
    std::string text;
    while (std::getline(lines, text)) {
        std::smatch match;
        if (std::regex_match(text, match, line)) {
            listing[match[4]] = ListedEntry{match[1], std::stoull(match[2]), match[3]};
        }
    }
    return listing;
}

std::ostream& operator<<(std::ostream& stream, const ListedEntry& entry) {
    return stream << entry.mode << " " << entry.size << " " << entry.time;
}

}  // namespace gwtest
