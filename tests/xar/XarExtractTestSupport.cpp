#include "XarExtractTestSupport.h"

#include <gtest/gtest.h>

#include <dirent.h>
#include <sys/stat.h>
#include <sys/xattr.h>
#include <unistd.h>

#include "foundation/GWChecksum.h"

namespace gwtest {

std::string xarFileElement(int id, const std::string& name, const std::string& type,
                           const std::string& mode, const std::string& inner) {
    return "<file id=\"" + std::to_string(id) + "\"><name>" + name + "</name><type>" + type +
           "</type><mode>" + mode + "</mode>" + inner + "</file>";
}

GWXARArchivePtr openBuiltXar(const XarBuilder& xar, const TemporaryDirectory& directory,
                             const std::string& name) {
    xar.write(directory.file(name));
    GWErrorPtr error;
    auto archive = GWXARArchive::initWithURL(directory.url(name), false, &error);
    EXPECT_TRUE(archive) << (error ? error->localizedDescription() : "no error");
    return archive;
}

namespace {

std::map<std::string, GWData> userAttributes(const std::string& path) {
    std::map<std::string, GWData> attributes;
    std::vector<char> names(65536);
    const ssize_t length = llistxattr(path.c_str(), names.data(), names.size());
    for (ssize_t at = 0; at < length;) {
        const std::string name(names.data() + at);
        at += ssize_t(name.size()) + 1;
        if (name.rfind("user.", 0) != 0) {
            continue;
        }
        GWData value(65536);
        const ssize_t size = lgetxattr(path.c_str(), name.c_str(), value.data(), value.size());
        value.resize(size < 0 ? 0 : std::size_t(size));
        attributes[name] = value;
    }
    return attributes;
}

void walk(const std::string& root, const std::string& relative,
          std::map<std::string, TreeItem>& tree) {
    const std::string path = relative.empty() ? root : root + "/" + relative;
    struct stat info;
    if (lstat(path.c_str(), &info) != 0) {
        return;
    }
    TreeItem item;
    item.mode = info.st_mode;
    item.owner = info.st_uid;
    item.group = info.st_gid;
    item.modificationSeconds = info.st_mtim.tv_sec;
    item.inode = info.st_ino;
    if (S_ISCHR(info.st_mode) || S_ISBLK(info.st_mode)) {
        item.device = info.st_rdev;
    }
    if (S_ISLNK(info.st_mode)) {
        std::vector<char> text(4096);
        const ssize_t length = readlink(path.c_str(), text.data(), text.size());
        item.linkText.assign(text.data(), length < 0 ? 0 : std::size_t(length));
    } else {
        item.attributes = userAttributes(path);
    }
    if (S_ISREG(info.st_mode)) {
        item.digest = GWChecksum::checksumAtURL(GWURL::fileURLWithPath(path),
                                                GWChecksumAlgorithmSHA1, nullptr)
                          .value_or(GWData());
    }
    tree[relative] = item;
    if (!S_ISDIR(info.st_mode)) {
        return;
    }
    DIR* directory = opendir(path.c_str());
    if (!directory) {
        return;
    }
    std::vector<std::string> names;
    while (const dirent* entry = readdir(directory)) {
        const std::string name = entry->d_name;
        if (name != "." && name != "..") {
            names.push_back(name);
        }
    }
    closedir(directory);
    for (const auto& name : names) {
        walk(root, relative.empty() ? name : relative + "/" + name, tree);
    }
}

}  // namespace

std::map<std::string, TreeItem> snapshotTree(const std::string& root) {
    std::map<std::string, TreeItem> tree;
    walk(root, "", tree);
    return tree;
}

}  // namespace gwtest
