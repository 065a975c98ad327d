#include "XarTestSupport.h"

#include <sstream>

#include "foundation/GWByteReader.h"
#include "foundation/GWDecompressor.h"
#include "xar/GWXARPaths.h"

namespace gwtest {

std::unique_ptr<XarTOC> readXarTOC(const GWData& archive, std::string* problem) {
    auto failed = [&](const std::string& why) -> std::unique_ptr<XarTOC> {
        if (problem) {
            *problem = why;
        }
        return nullptr;
    };
    GWByteReader reader(archive);
    const std::string magic = reader.string(4);
    auto toc = std::make_unique<XarTOC>();
    toc->headerSize = reader.u16be();
    const std::uint16_t version = reader.u16be();
    const std::uint64_t compressedLength = reader.u64be();
    const std::uint64_t uncompressedLength = reader.u64be();
    toc->checksumAlgorithm = reader.u32be();
    if (!reader.ok() || magic != "xar!" || version != 1 || toc->headerSize < 28) {
        return failed("bad header");
    }
    GWByteReader stored = reader.slice(toc->headerSize, std::size_t(compressedLength));
    if (!stored.ok()) {
        return failed("TOC outside the file");
    }
    GWErrorPtr error;
    auto plain = GWDecompressor::decompressedDataFromData(stored.rest(), &error);
    if (!plain || plain->size() != uncompressedLength) {
        return failed("TOC does not inflate to its length");
    }
    toc->heapStart = toc->headerSize + compressedLength;
    auto result = toc->document.load_buffer(plain->data(), plain->size(),
                                            GWXARLoadOperation::kTOCParseOptions);
    if (!result) {
        return failed(std::string("XML: ") + result.description());
    }
    return toc;
}

ParsedEntries parseEntries(const std::string& fileElements, std::uint64_t heapStart) {
    ParsedEntries parsed;
    pugi::xml_document document;
    const std::string text = "<xar><toc>" + fileElements + "</toc></xar>";
    if (!document.load_string(text.c_str(), GWXARLoadOperation::kTOCParseOptions)) {
        parsed.error = GWCocoaError(GWFileReadCorruptFileError);
        return parsed;
    }
    parsed.operation = GWXARLoadOperation::initWithArchive(nullptr, false);
    parsed.operation->setHeapStart(heapStart);
    parsed.files =
        parsed.operation->filesFromTOCElement(document.child("xar").child("toc"), &parsed.error);
    return parsed;
}

GWXARFilePtr entryAtPath(const GWXARFileArray& files, const std::string& path) {
    const GWXARFileArray* level = &files;
    GWXARFilePtr found;
    for (const auto& component : GWXARPathComponents(path)) {
        found = nullptr;
        for (const auto& file : *level) {
            if (file->name() == component) {
                found = file;
                break;
            }
        }
        if (!found) {
            return nullptr;
        }
        level = &found->children();
    }
    return found;
}

std::vector<std::string> namesOf(const GWXARFileArray& files) {
    std::vector<std::string> names;
    for (const auto& file : files) {
        names.push_back(file->name().value_or("(none)"));
    }
    return names;
}

}  // namespace gwtest
