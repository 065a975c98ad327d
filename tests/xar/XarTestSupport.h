#pragma once

#include <memory>
#include <optional>
#include <string>
#include <vector>

#include <pugixml.hpp>

#include "foundation/GWError.h"
#include "xar/GWXARLoadOperation.h"

namespace gwtest {

// A XAR file's table of contents read the plain way: header through
// GWByteReader, TOC inflated and parsed. Null (with `problem`) when the bytes
// are not a well-formed archive.
struct XarTOC {
    std::uint16_t headerSize = 0;
    std::uint64_t heapStart = 0;
    std::uint32_t checksumAlgorithm = 0;
    pugi::xml_document document;

    pugi::xml_node toc() const { return document.child("xar").child("toc"); }
};
std::unique_ptr<XarTOC> readXarTOC(const GWData& archive, std::string* problem = nullptr);

// What the entry parser made of some "file" elements.
struct ParsedEntries {
    GWXARLoadOperationPtr operation;
    std::optional<GWXARFileArray> files;
    GWErrorPtr error;
};
// Parses `fileElements` wrapped in <xar><toc>; the operation's heap starts at `heapStart`.
ParsedEntries parseEntries(const std::string& fileElements, std::uint64_t heapStart = 0);

// The entry at a "/"-separated path below `files`, or null.
GWXARFilePtr entryAtPath(const GWXARFileArray& files, const std::string& path);
std::vector<std::string> namesOf(const GWXARFileArray& files);

}  // namespace gwtest
