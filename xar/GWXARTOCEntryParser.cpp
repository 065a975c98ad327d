// Table-of-contents "file" elements to GWXARFile trees.

#include <string_view>

#include "GWArchiveSupport/GWArchiveConstants.h"
#include "GWXARLoadOperation.h"
#include "GWXARNumberScanning.h"
#include "GWXARPaths.h"
#include "foundation/GWLog.h"

namespace {

bool isSkippedEntry(const GWErrorPtr& error) {
    return error && error->is(kGWXARArchiveErrorDomain, GWXARArchiveSkippedEntryError);
}

// The file-type bits each "type" text stands for.
std::optional<std::uint16_t> fileTypeBits(std::string_view type) {
    static const std::pair<std::string_view, std::uint16_t> kTypes[] = {
        {"file", 0100000},          {"hardlink", 0100000},  {"character special", 0020000},
        {"block special", 0060000}, {"directory", 0040000}, {"symlink", 0120000},
        {"fifo", 0010000},          {"socket", 0140000},    {"whiteout", 0160000},
    };
    for (const auto& [name, bits] : kTypes) {
        if (name == type) {
            return bits;
        }
    }
    return std::nullopt;
}

// Adds to `bytes` what the full paths of `file` and everything below it
// take, and returns how many entries that is. Every name counts once per
// entry below it, so long names deep down cost what a listing will pay.
std::uint64_t addPathBytes(const GWXARFile& file, std::uint64_t& bytes) {
    std::uint64_t entries = 1;
    for (const auto& child : file.children()) {
        entries += addPathBytes(*child, bytes);
    }
    bytes += (file.name() ? file.name()->size() + 1 : 1) * entries;
    return entries;
}

}  // namespace

std::optional<GWXARFileArray> GWXARLoadOperation::filesFromTOCElement(const pugi::xml_node& toc,
                                                                      GWErrorPtr* error) {
    GWXARFileArray files;
    for (const pugi::xml_node& element : toc.children("file")) {
        if (isCancelled()) {
            GWFail(error, cancelledError());
            return std::nullopt;
        }
        GWErrorPtr failure;
        GWXARFilePtr file = fileWithXMLElement(element, nullptr, 1, &failure);
        if (!file) {
            if (isSkippedEntry(failure)) {
                continue;
            }
            GWFail(error, failure);
            return std::nullopt;
        }
        // A top-level "." stands for the archive's root: its children are the top level.
        if (file->name() == ".") {
            for (const auto& child : file->children()) {
                child->setParent(nullptr);
                files.push_back(child);
            }
        } else {
            files.push_back(std::move(file));
        }
    }
    if (!resolveHardLinks(error)) {
        return std::nullopt;
    }
    std::uint64_t pathBytes = 0;
    for (const auto& file : files) {
        addPathBytes(*file, pathBytes);
    }
    if (!chargeTOCMemory(pathBytes, error)) {
        return std::nullopt;
    }
    return GWXARFile::sortedByName(std::move(files));
}

GWXARFilePtr GWXARLoadOperation::fileWithXMLElement(const pugi::xml_node& element,
                                                    const GWXARFilePtr& parent, GWErrorPtr* error) {
    std::size_t depth = 1;
    for (auto ancestor = parent; ancestor && depth <= kMaxFileNestingDepth;
         ancestor = ancestor->parent()) {
        ++depth;
    }
    return fileWithXMLElement(element, parent, depth, error);
}

GWXARFilePtr GWXARLoadOperation::fileWithXMLElement(const pugi::xml_node& element,
                                                    const GWXARFilePtr& parent, std::size_t depth,
                                                    GWErrorPtr* error) {
    // Failures below may carry no error object on purpose; `failure` passes
    // exactly what they left, none included.
    GWErrorPtr failure;
    auto fail = [&]() -> GWXARFilePtr {
        GWFail(error, failure);
        return nullptr;
    };
    if (depth > kMaxFileNestingDepth) {
        failure =
            errorWithDomain(kGWCocoaErrorDomain, GWFileReadCorruptFileError, std::nullopt, element);
        return fail();
    }
    if (!chargeTOCMemory(kEntryMemoryCharge, &failure)) {
        return fail();
    }

    auto file = GWXARFile::initWithArchive(archive_);
    file->setParent(parent);
    for (const pugi::xml_attribute& attribute : element.attributes()) {
        if (isCancelled()) {
            failure = cancelledError();
            return fail();
        }
        if (!applyAttribute(attribute, file, &failure)) {
            return fail();
        }
    }

    bool sawMode = false;
    GWXARFileArray children;
    for (const pugi::xml_node& child : element.children()) {
        if (isCancelled()) {
            failure = cancelledError();
            return fail();
        }
        if (child.type() != pugi::node_element) {
            continue;
        }
        if (std::string_view(child.name()) == "file") {
            GWErrorPtr childFailure;
            if (auto childFile = fileWithXMLElement(child, file, depth + 1, &childFailure)) {
                children.push_back(std::move(childFile));
            } else if (!isSkippedEntry(childFailure)) {
                failure = childFailure;
                return fail();
            }
            continue;
        }
        if (std::string_view(child.name()) == "mode") {
            sawMode = true;
        }
        if (!applyProperty(child, file, &failure)) {
            return fail();
        }
    }

    if (!sawMode) {
        const std::uint16_t permissions = file->type() == GWXARFileTypeDirectory ? 0755 : 0644;
        file->setPermissionsMode(permissions | (file->permissionsMode() & 0170000));
    }
    file->setChildren(std::move(children));
    if (!fileIsValid(*file, element, &failure)) {
        return fail();
    }
    return file;
}

bool GWXARLoadOperation::fileIsValid(GWXARFile& file, const pugi::xml_node& element,
                                     GWErrorPtr* error) {
    const std::optional<std::string> givenName = file.name();
    std::string name = givenName.value_or("");
    auto components = GWXARPathComponents(name);
    if (components.size() >= 2) {
        name = components.back();
        file.setName(name);
    }
    if (name != "." && name != ".." && !name.empty()) {
        return true;
    }
    auto parent = file.parent();
    if (!parent) {
        file.setName(".");
        return true;
    }
    // The receiving entry is still being built and gets its children assigned
    // whole afterwards, so what is handed over here is lost with it: entries
    // below a nested "." or ".." vanish. That is the intended outcome.
    GWXARFilePtr receiver = parent;
    if (name == "..") {
        if (auto grandparent = parent->parent()) {
            receiver = grandparent;
        }
    }
    receiver->appendChildrenUnsorted(file.children());
    return GWFail(error, errorWithCode(GWXARArchiveSkippedEntryError, givenName, element));
}

bool GWXARLoadOperation::applyAttribute(const pugi::xml_attribute& attribute,
                                        const GWXARFilePtr& file, GWErrorPtr* error) {
    if (std::string_view(attribute.name()) == "id") {
        std::string itemID = attribute.value();
        if (itemID.empty()) {
            // Deliberately no error object: the load reports a general read error.
            return GWFail(error, nullptr);
        }
        identifiers_[itemID] = file;
        file->setItemID(std::move(itemID));
        return true;
    }
    GWLog("unhandled attribute %s=\"%s\"", attribute.name(), attribute.value());
    return true;
}

bool GWXARLoadOperation::applyProperty(const pugi::xml_node& property, const GWXARFilePtr& file,
                                       GWErrorPtr* error) {
    auto text = textContentOfElement(property, error);
    if (!text) {
        return false;
    }
    const std::string_view name = property.name();
    if (name == "name") {
        file->setName(*text);
    } else if (name == "data") {
        auto dataFork = fileReferenceFromElement(property, error);
        if (!dataFork) {
            return false;
        }
        file->setDataFork(std::move(dataFork));
    } else if (name == "type") {
        return applyTypeProperty(property, *text, file, error);
    } else if (name == "device") {
        std::uint64_t major = 0, minor = 0;
        if (!parseDeviceProperty(property, &major, &minor, error)) {
            return false;
        }
        file->setDeviceMajorNumber(major);
        file->setDeviceMinorNumber(minor);
    } else if (name == "link") {
        file->setSymlinkDestination(*text);
    } else if (name == "inode") {
        file->setInode(GWXARScanUnsigned(*text).value_or(0));
    } else if (name == "deviceno") {
        file->setDeviceNumber(static_cast<std::int32_t>(GWXARScanSigned(*text).value_or(0)));
    } else if (name == "mode") {
        const auto mode = GWXARScanOctal(*text).value_or(0);
        file->setPermissionsMode(
            std::uint16_t((mode & 07777) | (file->permissionsMode() & 0170000)));
    } else if (name == "uid") {
        file->setOwnerID(static_cast<std::uint32_t>(GWXARScanUnsigned(*text).value_or(0)));
    } else if (name == "gid") {
        file->setGroupOwnerID(static_cast<std::uint32_t>(GWXARScanUnsigned(*text).value_or(0)));
    } else if (name == "user") {
        file->setOwnerName(*text);
    } else if (name == "group") {
        file->setGroupOwnerName(*text);
    } else if (name == "atime" || name == "mtime" || name == "ctime") {
        auto date = dateFromTimeString(*text, error);
        if (!date) {
            return false;
        }
        if (name == "atime") {
            file->setAccessDate(date);
        } else if (name == "mtime") {
            file->setModificationDate(date);
        } else {
            file->setAttributeModificationDate(date);
        }
    } else if (name == "FinderCreateTime") {
        auto date = creationDateFromProperty(property, error);
        if (!date) {
            return false;
        }
        file->setCreationDate(date);
    } else if (name == "flags") {
        std::uint32_t flags = 0;
        if (!getPOSIXFlags(&flags, property, error)) {
            return false;
        }
        file->setPosixFlags(flags);
    } else if (name == "ea") {
        auto attributes = extendedAttributesFromElement(property, error);
        if (!attributes) {
            return false;
        }
        for (auto& attribute : *attributes) {
            file->addExtendedAttribute(std::move(attribute));
        }
    } else if (name == "acl") {
        return addACLsFromElement(property, *file, error);
    } else if (name != "contents" && name != "content") {
        GWLog("unhandled property %s", property.name());
    }
    return true;
}

bool GWXARLoadOperation::applyTypeProperty(const pugi::xml_node& property, const std::string& text,
                                           const GWXARFilePtr& file, GWErrorPtr* error) {
    if (!setType(text, *file, property, error)) {
        return false;
    }
    if (text != "hardlink") {
        return true;
    }
    const pugi::xml_attribute link = property.attribute("link");
    if (!link) {
        return GWFail(error, errorWithCode(GWXARArchiveMissingAttributeError, "link", property));
    }
    // "original" marks the entry the other links point at.
    if (std::string_view(link.value()) != "original") {
        recordHardLink(file, link.value());
    }
    return true;
}

bool GWXARLoadOperation::setType(std::string_view type, GWXARFile& file, const pugi::xml_node& node,
                                 GWErrorPtr* error) {
    auto bits = fileTypeBits(type);
    if (!bits) {
        return GWFail(error,
                      errorWithCode(GWXARArchiveMalformedValueError, std::string(type), node));
    }
    file.setPermissionsMode(std::uint16_t((file.permissionsMode() & 07777) | *bits));
    return true;
}

void GWXARLoadOperation::recordHardLink(const GWXARFilePtr& file, std::string targetID) {
    file->setHardlinkDestinationID(targetID);
    auto [it, inserted] = hardLinkIndex_.try_emplace(file.get(), hardLinks_.size());
    if (inserted) {
        hardLinks_.emplace_back(file, std::move(targetID));
    } else {
        hardLinks_[it->second] = {file, std::move(targetID)};
    }
}

bool GWXARLoadOperation::resolveHardLinks(GWErrorPtr* error) {
    for (const auto& [link, targetID] : hardLinks_) {
        auto file = link.lock();
        if (!file) {
            continue;
        }
        auto target = identifiers_.find(targetID);
        if (target == identifiers_.end()) {
            return GWFail(error, errorWithCode(GWXARArchiveHardLinkTargetNotFoundError, targetID,
                                               pugi::xml_node()));
        }
        file->setHardlinkDestination(target->second);
    }
    return true;
}
