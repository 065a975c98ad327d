// Keyed persistence and copying of XAR entries.

#include "GWXARFile.h"

namespace {

const char* const kNameKey = "Name";
const char* const kPermissionsModeKey = "PermissionsMode";
const char* const kOwnerIDKey = "OwnerID";
const char* const kGroupOwnerIDKey = "GroupOwnerID";
const char* const kOwnerNameKey = "OwnerName";
const char* const kGroupOwnerNameKey = "GroupOwnerName";
const char* const kCreationDateKey = "CreationDate";
const char* const kModificationDateKey = "ModificationDate";
const char* const kAccessDateKey = "AccessDate";
const char* const kAttributeModificationDateKey = "AttributeModificationDate";
const char* const kPOSIXFlagsKey = "POSIXFlags";
const char* const kDefaultACLKey = "DefaultACL";
const char* const kAccessACLKey = "AccessACL";
const char* const kExtendedACLKey = "ExtendedACL";
const char* const kInodeKey = "Inode";
const char* const kDeviceNumberKey = "DeviceNumber";
const char* const kSymlinkDestinationKey = "SymlinkDestination";
const char* const kItemIDKey = "ItemID";
const char* const kHardlinkDestinationIDKey = "HardlinkDestinationID";
const char* const kHardlinkPathKey = "HardlinkPath";
const char* const kDeviceMajorNumberKey = "DeviceMajorNumber";
const char* const kDeviceMinorNumberKey = "DeviceMinorNumber";
const char* const kDataForkKey = "DataFork";
const char* const kExtendedAttributesKey = "ExtendedAttributes";
const char* const kChildrenKey = "Children";

// An ACL that cannot be converted is left out rather than failing the archive.
void encodeACL(GWCoder& coder, const GWACL* acl, const char* key) {
    if (!acl) {
        return;
    }
    if (auto bytes = GWXARFile::dataFromACL(*acl, nullptr)) {
        coder.encodeValue(GWValue(std::move(*bytes)), key);
    }
}

std::optional<GWACL> decodeACL(GWCoder& coder, const char* key) {
    auto bytes = coder.decodeData(key);
    return bytes ? GWXARFile::aclFromData(*bytes, nullptr) : std::nullopt;
}

}  // namespace

void GWXARFile::encodeWithCoder(GWCoder& coder) const {
    if (!coder.allowsKeyedCoding()) {
        return;
    }
    coder.encodeValue(name_, kNameKey);
    coder.encodeInt32(permissionsMode_, kPermissionsModeKey);
    coder.encodeInt32(std::int32_t(ownerID_), kOwnerIDKey);
    coder.encodeInt32(std::int32_t(groupOwnerID_), kGroupOwnerIDKey);
    coder.encodeValue(ownerName_, kOwnerNameKey);
    coder.encodeValue(groupOwnerName_, kGroupOwnerNameKey);
    coder.encodeValue(creationDate_, kCreationDateKey);
    coder.encodeValue(modificationDate_, kModificationDateKey);
    coder.encodeValue(accessDate_, kAccessDateKey);
    coder.encodeValue(attributeModificationDate_, kAttributeModificationDateKey);
    coder.encodeInt32(std::int32_t(posixFlags_), kPOSIXFlagsKey);
    encodeACL(coder, defaultACL(), kDefaultACLKey);
    encodeACL(coder, accessACL(), kAccessACLKey);
    encodeACL(coder, extendedACL(), kExtendedACLKey);
    coder.encodeInt64(std::int64_t(inode_), kInodeKey);
    coder.encodeInt32(deviceNumber_, kDeviceNumberKey);
    coder.encodeValue(symlinkDestination_, kSymlinkDestinationKey);
    coder.encodeValue(itemID_, kItemIDKey);
    // The resolved target's identifier, not the one recorded: what the
    // archive can resolve again after decoding.
    auto target = hardlinkDestination();
    coder.encodeValue(target ? target->itemID_ : std::nullopt, kHardlinkDestinationIDKey);
    coder.encodeValue(hardlinkPath(), kHardlinkPathKey);
    coder.encodeInteger(std::int64_t(deviceMajorNumber_), kDeviceMajorNumberKey);
    coder.encodeInteger(std::int64_t(deviceMinorNumber_), kDeviceMinorNumberKey);
    coder.encodeObject(dataFork_, kDataForkKey);
    if (!extendedAttributes_.empty()) {
        coder.encodeArrayOfObjects(extendedAttributes_, kExtendedAttributesKey);
    }
    if (!children_.empty()) {
        coder.encodeArrayOfObjects(children_, kChildrenKey);
    }
}

GWXARFilePtr GWXARFile::initWithCoder(GWCoder& coder) {
    if (!coder.allowsKeyedCoding()) {
        return nullptr;
    }
    auto file = std::make_shared<GWXARFile>();
    file->name_ = coder.decodeString(kNameKey);
    file->permissionsMode_ = std::uint16_t(coder.decodeInt32(kPermissionsModeKey));
    file->ownerID_ = std::uint32_t(coder.decodeInt32(kOwnerIDKey));
    file->groupOwnerID_ = std::uint32_t(coder.decodeInt32(kGroupOwnerIDKey));
    file->ownerName_ = coder.decodeString(kOwnerNameKey);
    file->groupOwnerName_ = coder.decodeString(kGroupOwnerNameKey);
    file->creationDate_ = coder.decodeDate(kCreationDateKey);
    file->modificationDate_ = coder.decodeDate(kModificationDateKey);
    file->accessDate_ = coder.decodeDate(kAccessDateKey);
    file->attributeModificationDate_ = coder.decodeDate(kAttributeModificationDateKey);
    file->posixFlags_ = std::uint32_t(coder.decodeInt32(kPOSIXFlagsKey));
    file->defaultACL_ = decodeACL(coder, kDefaultACLKey);
    file->accessACL_ = decodeACL(coder, kAccessACLKey);
    file->extendedACL_ = decodeACL(coder, kExtendedACLKey);
    file->inode_ = coder.decodeUInt64(kInodeKey);
    file->deviceNumber_ = coder.decodeInt32(kDeviceNumberKey);
    file->symlinkDestination_ = coder.decodeString(kSymlinkDestinationKey);
    file->itemID_ = coder.decodeString(kItemIDKey);
    file->hardlinkDestinationID_ = coder.decodeString(kHardlinkDestinationIDKey);
    file->deviceMajorNumber_ = coder.decodeUInt64(kDeviceMajorNumberKey);
    file->deviceMinorNumber_ = coder.decodeUInt64(kDeviceMinorNumberKey);
    file->dataFork_ = coder.decodeObjectOfClass<GWXARDataReference>(kDataForkKey);
    file->extendedAttributes_ =
        coder.decodeArrayOfObjectsOfClass<GWXARDataReference>(kExtendedAttributesKey)
            .value_or(GWXARDataReferenceArray{});
    // Stored in the order written; only the parent links are restored.
    file->children_ =
        coder.decodeArrayOfObjectsOfClass<GWXARFile>(kChildrenKey).value_or(GWXARFileArray{});
    for (const auto& child : file->children_) {
        child->parent_ = file;
    }
    return file;
}

GWXARFilePtr GWXARFile::newInstance() const {
    return std::make_shared<GWXARFile>();
}

GWXARFilePtr GWXARFile::copy() const {
    auto file = newInstance();
    file->name_ = name_;
    file->permissionsMode_ = permissionsMode_;
    file->ownerID_ = ownerID_;
    file->groupOwnerID_ = groupOwnerID_;
    file->ownerName_ = ownerName_;
    file->groupOwnerName_ = groupOwnerName_;
    file->creationDate_ = creationDate_;
    file->modificationDate_ = modificationDate_;
    file->accessDate_ = accessDate_;
    file->attributeModificationDate_ = attributeModificationDate_;
    file->posixFlags_ = posixFlags_;
    file->setDefaultACL(defaultACL());
    file->setAccessACL(accessACL());
    file->setExtendedACL(extendedACL());
    file->inode_ = inode_;
    file->deviceNumber_ = deviceNumber_;
    file->symlinkDestination_ = symlinkDestination_;
    file->itemID_ = itemID_;
    file->hardlinkDestinationID_ = hardlinkDestinationID_;
    file->deviceMajorNumber_ = deviceMajorNumber_;
    file->deviceMinorNumber_ = deviceMinorNumber_;
    file->dataFork_ = dataFork_ ? dataFork_->copy() : nullptr;
    // References are values too: the copy gets its own, so editing one side
    // never shows through on the other.
    file->extendedAttributes_.reserve(extendedAttributes_.size());
    for (const auto& attribute : extendedAttributes_) {
        file->extendedAttributes_.push_back(attribute ? attribute->copy() : nullptr);
    }
    // The copied children keep the source as their parent until the owner
    // re-links the tree; assigned directly, in the source's order.
    file->children_.reserve(children_.size());
    const auto source = std::const_pointer_cast<GWXARFile>(weak_from_this().lock());
    for (const auto& child : children_) {
        if (!child) {
            continue;
        }
        auto childCopy = child->copy();
        childCopy->parent_ = source;
        file->children_.push_back(std::move(childCopy));
    }
    return file;
}

std::optional<GWData> GWXARFile::dataFromACL(const GWACL& acl, GWErrorPtr* error) {
    return acl.externalData(error);
}

std::optional<GWACL> GWXARFile::aclFromData(std::span<const std::uint8_t> bytes,
                                            GWErrorPtr* error) {
    return GWACL::fromExternalData(bytes, error);
}
