#pragma once

#include <cstdint>
#include <map>
#include <optional>
#include <string>
#include <vector>

#include "foundation/GWError.h"
#include "support/TestSupport.h"
#include "support/XarBuilder.h"
#include "xar/GWXARArchive.h"

namespace gwtest {

// A "file" element: id, name, type text ("file", "directory", ...), octal
// mode, and whatever else the test adds inside it.
std::string xarFileElement(int id, const std::string& name, const std::string& type,
                           const std::string& mode, const std::string& inner = "");

// Writes the archive into `directory` and opens it; fails the test when it
// does not open.
GWXARArchivePtr openBuiltXar(const XarBuilder& xar, const TemporaryDirectory& directory,
                             const std::string& name = "test.xar");

// One item of an extracted tree, as lstat and the file system describe it.
struct TreeItem {
    mode_t mode = 0;
    uid_t owner = 0;
    gid_t group = 0;
    std::int64_t modificationSeconds = 0;
    dev_t device = 0;
    ino_t inode = 0;
    std::string linkText;
    GWData digest;                             // SHA-1 of a regular file's bytes
    std::map<std::string, GWData> attributes;  // user.* extended attributes
};

// Every item below `root`, by path relative to it ("" is the root itself).
std::map<std::string, TreeItem> snapshotTree(const std::string& root);

}  // namespace gwtest
