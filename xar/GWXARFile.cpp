#include "GWXARFile.h"

#include <algorithm>

#include "GWXARDescribing.h"
#include "GWXARPaths.h"
#include "foundation/GWFormat.h"

GWXARFilePtr GWXARFile::initWithArchive(const std::shared_ptr<GWXARArchive>& archive) {
    auto file = std::make_shared<GWXARFile>();
    file->archive_ = archive;
    return file;
}

void GWXARFile::storeACL(std::optional<GWACL>& slot, const GWACL* acl) {
    // Copy first: storing an entry's own ACL into the same slot must not free it.
    std::optional<GWACL> copy = acl ? acl->copy() : std::nullopt;
    slot = std::move(copy);
}

void GWXARFile::addExtendedAttribute(GWXARDataReferencePtr attribute) {
    extendedAttributes_.push_back(std::move(attribute));
}

void GWXARFile::setChildren(GWXARFileArray children) {
    for (const auto& child : children) {
        if (child) {
            child->parent_ = weak_from_this();
        }
    }
    children_ = sortedByName(std::move(children));
}

void GWXARFile::appendChildrenUnsorted(const GWXARFileArray& children) {
    for (const auto& child : children) {
        if (child) {
            child->parent_ = weak_from_this();
        }
        children_.push_back(child);
    }
}

GWXARFileArray GWXARFile::sortedByName(GWXARFileArray files) {
    std::stable_sort(files.begin(), files.end(), [](const GWXARFilePtr& a, const GWXARFilePtr& b) {
        const std::string_view x = a && a->name_ ? std::string_view(*a->name_) : "";
        const std::string_view y = b && b->name_ ? std::string_view(*b->name_) : "";
        return GWXARCompareNames(x, y) < 0;
    });
    return files;
}

std::shared_ptr<GWXARArchive> GWXARFile::archive() const {
    if (auto archive = archive_.lock()) {
        return archive;
    }
    for (auto ancestor = parent(); ancestor; ancestor = ancestor->parent()) {
        if (auto archive = ancestor->archive_.lock()) {
            return archive;
        }
    }
    return nullptr;
}

GWXARFileType GWXARFile::type() const {
    switch (permissionsMode_ & 0xF000) {
        case 0x8000:
            return hardlinkDestination_.expired() ? GWXARFileTypeRegular : GWXARFileTypeHardLink;
        case 0x4000: return GWXARFileTypeDirectory;
        case 0xA000: return GWXARFileTypeSymbolicLink;
        case 0x2000: return GWXARFileTypeCharacterSpecial;
        case 0x6000: return GWXARFileTypeBlockSpecial;
        case 0x1000: return GWXARFileTypeFIFO;
        case 0xC000: return GWXARFileTypeSocket;
        case 0xE000: return GWXARFileTypeWhiteout;
        default: return GWXARFileTypeUnknown;
    }
}

std::string GWXARFile::stringFromFileType(GWXARFileType type) {
    switch (type) {
        case GWXARFileTypeRegular: return "regular";
        case GWXARFileTypeDirectory: return "directory";
        case GWXARFileTypeSymbolicLink: return "symbolic link";
        case GWXARFileTypeHardLink: return "hard link";
        case GWXARFileTypeCharacterSpecial: return "character special";
        case GWXARFileTypeBlockSpecial: return "block special";
        case GWXARFileTypeFIFO: return "FIFO";
        case GWXARFileTypeSocket: return "socket";
        case GWXARFileTypeWhiteout: return "whiteout";
        default: return "unknown";
    }
}

std::string GWXARFile::path() const {
    // Walked without recursion: names from here up, then joined from the top.
    std::vector<std::string_view> names;
    names.push_back(name_ ? std::string_view(*name_) : "");
    std::vector<GWXARFilePtr> ancestors;
    for (auto ancestor = parent(); ancestor; ancestor = ancestor->parent()) {
        names.push_back(ancestor->name_ ? std::string_view(*ancestor->name_) : "");
        ancestors.push_back(ancestor);
    }
    std::string result(names.back());
    for (auto it = names.rbegin() + 1; it != names.rend(); ++it) {
        result = GWXARAppendingPathComponent(result, *it);
    }
    return result;
}

std::optional<std::string> GWXARFile::hardlinkPath() const {
    auto target = hardlinkDestination();
    if (!target) {
        return std::nullopt;
    }
    auto parentEntry = parent();
    if (!parentEntry) {
        return target->path();
    }
    // One ".." per component of the directory's path climbs to the top level.
    const std::size_t depth = GWXARPathComponents(parentEntry->path()).size();
    std::string prefix = "..";
    for (std::size_t i = 1; i < depth; ++i) {
        prefix += "/..";
    }
    return GWXARAppendingPathComponent(prefix, target->path());
}

std::string GWXARFile::description() const {
    using namespace GWXARDescribing;
    auto aclText = [](const GWACL* acl) {
        std::optional<std::string> text = acl ? acl->text() : std::nullopt;
        return text ? *text : std::string("(null)");
    };
    auto parentEntry = parent();
    auto target = hardlinkDestination();
    std::string text = GWFormat(
        "<%s %s\nname=%s\nparent=%s %s\ntype=%s\nmode=%o\nownerID=%lu\ngroupOwnerID=%lu\n"
        "ownerName=%s\ngroupOwnerName=%s\ncreationDate=%s\nmodificationDate=%s\naccessDate=%s\n"
        "statusChangeDate=%s\nposixFlags=%u\ndefaultACL='%s'\naccessACL='%s'\nextendedACL='%s'\n"
        "inode=%llu\ndeviceNumber=%lu\nsymlinkDestination='%s'\nhardlinkDestination=%s %s\n"
        "deviceMajorNumber=%lu\ndeviceMinorNumber=%lu\ndataFork=%s",
        className().c_str(), pointerText(this).c_str(), objectText(name_).c_str(),
        pointerText(parentEntry.get()).c_str(),
        objectText(parentEntry ? parentEntry->name_ : std::nullopt).c_str(),
        stringFromFileType(type()).c_str(), unsigned(permissionsMode_), (unsigned long)ownerID_,
        (unsigned long)groupOwnerID_, objectText(ownerName_).c_str(),
        objectText(groupOwnerName_).c_str(), objectText(creationDate_).c_str(),
        objectText(modificationDate_).c_str(), objectText(accessDate_).c_str(),
        objectText(attributeModificationDate_).c_str(), posixFlags_, aclText(defaultACL()).c_str(),
        aclText(accessACL()).c_str(), aclText(extendedACL()).c_str(), (unsigned long long)inode_,
        (unsigned long)std::uint32_t(deviceNumber_), objectText(symlinkDestination_).c_str(),
        pointerText(target.get()).c_str(),
        objectText(target ? target->name_ : std::nullopt).c_str(),
        (unsigned long)deviceMajorNumber_, (unsigned long)deviceMinorNumber_,
        dataFork_ ? dataFork_->description().c_str() : "(null)");

    auto appendList = [&text](const char* opening, const auto& elements) {
        if (elements.empty()) {
            return;
        }
        text += opening;
        for (std::size_t i = 0; i < elements.size(); ++i) {
            const std::string element = elements[i] ? elements[i]->description() : "(null)";
            text += "\n\t" + indented(element);
            if (i + 1 < elements.size()) {
                text += ",";
            }
        }
        text += "\n}";
    };
    appendList("\nextendedAttributes={", extendedAttributes_);
    appendList("\nchildren={", children_);
    return indented(text) + "\n>";
}
