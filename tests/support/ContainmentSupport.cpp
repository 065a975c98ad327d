#include "support/ContainmentSupport.h"

#include <sys/stat.h>
#include <unistd.h>

#include <filesystem>
#include <functional>

namespace gwtest {

ContainmentSandbox::ContainmentSandbox() {
    writeFile(canary(), bytesOf(kCanaryText));
    std::filesystem::create_directory(parent_.file("sub"));
    writeFile(parent_.file("sub/kept"), bytesOf("kept"));
    std::filesystem::create_directory(out());
}

std::map<std::string, std::string> ContainmentSandbox::outside() const {
    std::map<std::string, std::string> items;
    const std::filesystem::path root(parent());
    // The parent itself too: a link to ".." is the way to reach it.
    struct stat self {};
    ::lstat(parent().c_str(), &self);
    items["."] = std::to_string(self.st_mode) + " " + std::to_string(self.st_mtim.tv_sec) + "." +
                 std::to_string(self.st_mtim.tv_nsec);
    auto it = std::filesystem::recursive_directory_iterator(root);
    for (; it != std::filesystem::recursive_directory_iterator(); ++it) {
        const std::string relative = it->path().lexically_relative(root).string();
        if (relative == "out") {
            it.disable_recursion_pending();
            continue;
        }
        struct stat info {};
        ::lstat(it->path().c_str(), &info);
        std::string line = std::to_string(info.st_mode) + " " + std::to_string(info.st_nlink) +
                           " " + std::to_string(info.st_size) + " " +
                           std::to_string(info.st_mtim.tv_sec) + "." +
                           std::to_string(info.st_mtim.tv_nsec);
        if (S_ISLNK(info.st_mode)) {
            line += " -> " + std::filesystem::read_symlink(it->path()).string();
        } else if (S_ISREG(info.st_mode)) {
            const GWData bytes = readFile(it->path().string());
            line += " " + std::to_string(
                              std::hash<std::string>()(std::string(bytes.begin(), bytes.end())));
        }
        items[relative] = line;
    }
    return items;
}

}  // namespace gwtest
