#include "ToolArchive.h"

#include "FormatAdapters.h"

namespace gwarchive {

const char* entryTypeName(EntryType type) {
    switch (type) {
        case EntryType::file: return "file";
        case EntryType::directory: return "directory";
        case EntryType::symlink: return "symlink";
        case EntryType::hardlink: return "hardlink";
        case EntryType::charDevice: return "char";
        case EntryType::blockDevice: return "block";
        case EntryType::fifo: return "fifo";
        case EntryType::socket: return "socket";
        case EntryType::whiteout: return "whiteout";
        case EntryType::unknown: break;
    }
    return "unknown";
}

EntryType entryTypeFromMode(std::uint32_t mode) {
    switch (mode & 0xF000) {
        case 0x8000: return EntryType::file;
        case 0x4000: return EntryType::directory;
        case 0xA000: return EntryType::symlink;
        case 0x2000: return EntryType::charDevice;
        case 0x6000: return EntryType::blockDevice;
        case 0x1000: return EntryType::fifo;
        case 0xC000: return EntryType::socket;
        case 0xE000: return EntryType::whiteout;
        default: return EntryType::unknown;
    }
}

std::unique_ptr<ToolArchive> ToolArchive::open(const GWURL& url, GWErrorPtr* error) {
    if (GWXARArchive::isXARArchiveAtURL(url))
        return openXARArchive(url, error);
    return openZipArchive(url, error);
}

std::vector<std::size_t> ToolArchive::subtree(std::size_t index) const {
    const auto& all = entries();
    std::vector<std::size_t> indexes{index};
    // Depth-first order keeps a subtree contiguous right after its root.
    std::string prefix = all[index].path + "/";
    for (std::size_t next = index + 1;
         next < all.size() && all[next].path.compare(0, prefix.size(), prefix) == 0; ++next) {
        indexes.push_back(next);
    }
    return indexes;
}

std::optional<std::vector<std::size_t>> ToolArchive::selectPath(const std::string& path) const {
    std::string wanted = path;
    while (wanted.size() > 1 && wanted.back() == '/')
        wanted.pop_back();
    const auto& all = entries();
    for (std::size_t index = 0; index < all.size(); ++index) {
        if (all[index].path == wanted)
            return subtree(index);
    }
    return std::nullopt;
}

}  // namespace gwarchive
