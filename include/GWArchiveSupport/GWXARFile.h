#pragma once

#include <cstdint>
#include <memory>
#include <optional>
#include <span>
#include <string>
#include <vector>

#include "GWACL.h"
#include "GWCoder.h"
#include "GWDate.h"
#include "GWError.h"
#include "GWExport.h"
#include "GWXARDataReference.h"

class GWXARArchive;
class GWXARFile;
using GWXARFilePtr = std::shared_ptr<GWXARFile>;
using GWXARFileArray = std::vector<GWXARFilePtr>;

// The kind of an entry, from the file-type bits of its mode.
enum GWXARFileType : int {
    GWXARFileTypeUnknown = 0,
    GWXARFileTypeRegular = 1,
    GWXARFileTypeDirectory = 2,
    GWXARFileTypeSymbolicLink = 3,
    GWXARFileTypeHardLink = 4,  // a regular mode whose hard-link target is resolved
    GWXARFileTypeCharacterSpecial = 5,
    GWXARFileTypeBlockSpecial = 6,
    GWXARFileTypeFIFO = 7,
    GWXARFileTypeSocket = 8,
    GWXARFileTypeWhiteout = 9,
};

// One item of a XAR archive's table of contents. Entries own their children,
// data fork and extended-attribute references; the links to the parent, the
// archive and a hard-link target are weak. A plain value: it never reads the
// archive file. Create entries with initWithArchive (shared ownership is
// what lets children and copies point back at an entry).
class GW_EXPORT GWXARFile : public GWCoding, public std::enable_shared_from_this<GWXARFile> {
public:
    static constexpr const char* kClassName = "GWXARFile";

    // Everything else starts zero or none.
    static GWXARFilePtr initWithArchive(const std::shared_ptr<GWXARArchive>& archive);
    GWXARFile() = default;
    GWXARFile(const GWXARFile&) = delete;
    GWXARFile& operator=(const GWXARFile&) = delete;

    // --- Stored properties ----------------------------------------------------

    // The last path component of the item.
    const std::optional<std::string>& name() const { return name_; }
    void setName(std::optional<std::string> name) { name_ = std::move(name); }
    // File-type bits (0170000) and permission bits.
    std::uint16_t permissionsMode() const { return permissionsMode_; }
    void setPermissionsMode(std::uint16_t mode) { permissionsMode_ = mode; }
    std::uint32_t ownerID() const { return ownerID_; }
    void setOwnerID(std::uint32_t owner) { ownerID_ = owner; }
    std::uint32_t groupOwnerID() const { return groupOwnerID_; }
    void setGroupOwnerID(std::uint32_t group) { groupOwnerID_ = group; }
    const std::optional<std::string>& ownerName() const { return ownerName_; }
    void setOwnerName(std::optional<std::string> name) { ownerName_ = std::move(name); }
    const std::optional<std::string>& groupOwnerName() const { return groupOwnerName_; }
    void setGroupOwnerName(std::optional<std::string> name) { groupOwnerName_ = std::move(name); }
    const std::optional<GWDate>& creationDate() const { return creationDate_; }
    void setCreationDate(std::optional<GWDate> date) { creationDate_ = date; }
    const std::optional<GWDate>& modificationDate() const { return modificationDate_; }
    void setModificationDate(std::optional<GWDate> date) { modificationDate_ = date; }
    const std::optional<GWDate>& accessDate() const { return accessDate_; }
    void setAccessDate(std::optional<GWDate> date) { accessDate_ = date; }
    // The status change time (ctime).
    const std::optional<GWDate>& attributeModificationDate() const {
        return attributeModificationDate_;
    }
    void setAttributeModificationDate(std::optional<GWDate> date) {
        attributeModificationDate_ = date;
    }
    // BSD file flags, as chflags takes them.
    std::uint32_t posixFlags() const { return posixFlags_; }
    void setPosixFlags(std::uint32_t flags) { posixFlags_ = flags; }

    // Each ACL slot owns its ACL. The getters lend it (null for none); the
    // setters store a copy (acl_dup) of what they are given, or clear the
    // slot for null, and release what the slot held.
    const GWACL* defaultACL() const { return optionalPointer(defaultACL_); }
    void setDefaultACL(const GWACL* acl) { storeACL(defaultACL_, acl); }
    const GWACL* accessACL() const { return optionalPointer(accessACL_); }
    void setAccessACL(const GWACL* acl) { storeACL(accessACL_, acl); }
    // The extended (NFSv4-style) ACL; from Macs usually in their own text form.
    const GWACL* extendedACL() const { return optionalPointer(extendedACL_); }
    void setExtendedACL(const GWACL* acl) { storeACL(extendedACL_, acl); }

    std::uint64_t inode() const { return inode_; }
    void setInode(std::uint64_t inode) { inode_ = inode; }
    std::int32_t deviceNumber() const { return deviceNumber_; }
    void setDeviceNumber(std::int32_t number) { deviceNumber_ = number; }
    const std::optional<std::string>& symlinkDestination() const { return symlinkDestination_; }
    void setSymlinkDestination(std::optional<std::string> destination) {
        symlinkDestination_ = std::move(destination);
    }
    // The archive's identifier of this item, by which hard links name their target.
    const std::optional<std::string>& itemID() const { return itemID_; }
    void setItemID(std::optional<std::string> itemID) { itemID_ = std::move(itemID); }
    // For a hard link: the itemID of its target.
    const std::optional<std::string>& hardlinkDestinationID() const {
        return hardlinkDestinationID_;
    }
    void setHardlinkDestinationID(std::optional<std::string> itemID) {
        hardlinkDestinationID_ = std::move(itemID);
    }
    // The resolved target (weak).
    GWXARFilePtr hardlinkDestination() const { return hardlinkDestination_.lock(); }
    void setHardlinkDestination(const GWXARFilePtr& destination) {
        hardlinkDestination_ = destination;
    }
    std::uint64_t deviceMajorNumber() const { return deviceMajorNumber_; }
    void setDeviceMajorNumber(std::uint64_t number) { deviceMajorNumber_ = number; }
    std::uint64_t deviceMinorNumber() const { return deviceMinorNumber_; }
    void setDeviceMinorNumber(std::uint64_t number) { deviceMinorNumber_ = number; }
    const GWXARDataReferencePtr& dataFork() const { return dataFork_; }
    void setDataFork(GWXARDataReferencePtr dataFork) { dataFork_ = std::move(dataFork); }
    // In archive order; each reference's name is the attribute's name.
    const GWXARDataReferenceArray& extendedAttributes() const { return extendedAttributes_; }
    void setExtendedAttributes(GWXARDataReferenceArray attributes) {
        extendedAttributes_ = std::move(attributes);
    }
    void addExtendedAttribute(GWXARDataReferencePtr attribute);

    // The containing directory entry (weak); none for a top-level item.
    GWXARFilePtr parent() const { return parent_.lock(); }
    void setParent(const GWXARFilePtr& parent) { parent_ = parent; }
    // Directory contents, in name order.
    const GWXARFileArray& children() const { return children_; }
    // Makes this entry the parent of every element, then keeps them sorted by
    // name (case-insensitive, digit runs by value; equal names keep their order).
    void setChildren(GWXARFileArray children);
    // The archive set on this entry, or else its parent's (normally only
    // top-level entries carry it).
    std::shared_ptr<GWXARArchive> archive() const;
    void setArchive(const std::shared_ptr<GWXARArchive>& archive) { archive_ = archive; }

    // --- Derived values -------------------------------------------------------

    GWXARFileType type() const;
    // The parent's path with the name appended; the name alone at the top.
    std::string path() const;
    // The link target's path relative to this entry's directory, or none
    // without a resolved target.
    std::optional<std::string> hardlinkPath() const;

    std::string description() const;
    // "regular", "hard link", ... as description prints them.
    static std::string stringFromFileType(GWXARFileType type);
    // Sorted the way setChildren sorts.
    static GWXARFileArray sortedByName(GWXARFileArray files);

    // --- Persistence and copying ----------------------------------------------

    std::string className() const override { return kClassName; }
    // Writes nothing to a non-keyed coder. The archive and the hard-link
    // target are not written; the target's itemID is.
    void encodeWithCoder(GWCoder& coder) const override;
    // None from a non-keyed coder. The owning archive restores the archive
    // link and the hard-link targets afterwards.
    static GWXARFilePtr initWithCoder(GWCoder& coder);

    // A deep copy without archive and hard-link target. The copies of the
    // children name this entry, the source, as their parent; that is intended.
    GWXARFilePtr copy() const;

    // An ACL in its persistent byte form, and back. Failures are POSIX errors.
    static std::optional<GWData> dataFromACL(const GWACL& acl, GWErrorPtr* error);
    static std::optional<GWACL> aclFromData(std::span<const std::uint8_t> bytes, GWErrorPtr* error);

protected:
    // The plain new instance copy() fills: a subclass answers its own class.
    virtual GWXARFilePtr newInstance() const;

private:
    friend class GWXARLoadOperation;

    // For the table-of-contents parser only: hands children to an entry that
    // is still being built, whose children are assigned whole afterwards.
    void appendChildrenUnsorted(const GWXARFileArray& children);

    static const GWACL* optionalPointer(const std::optional<GWACL>& acl) {
        return acl ? &*acl : nullptr;
    }
    static void storeACL(std::optional<GWACL>& slot, const GWACL* acl);

    std::optional<std::string> name_;
    std::uint16_t permissionsMode_ = 0;
    std::uint32_t ownerID_ = 0;
    std::uint32_t groupOwnerID_ = 0;
    std::optional<std::string> ownerName_;
    std::optional<std::string> groupOwnerName_;
    std::optional<GWDate> creationDate_;
    std::optional<GWDate> modificationDate_;
    std::optional<GWDate> accessDate_;
    std::optional<GWDate> attributeModificationDate_;
    std::uint32_t posixFlags_ = 0;
    std::optional<GWACL> defaultACL_;
    std::optional<GWACL> accessACL_;
    std::optional<GWACL> extendedACL_;
    std::uint64_t inode_ = 0;
    std::int32_t deviceNumber_ = 0;
    std::optional<std::string> symlinkDestination_;
    std::optional<std::string> itemID_;
    std::optional<std::string> hardlinkDestinationID_;
    std::weak_ptr<GWXARFile> hardlinkDestination_;
    std::uint64_t deviceMajorNumber_ = 0;
    std::uint64_t deviceMinorNumber_ = 0;
    GWXARDataReferencePtr dataFork_;
    GWXARDataReferenceArray extendedAttributes_;
    std::weak_ptr<GWXARFile> parent_;
    GWXARFileArray children_;
    std::weak_ptr<GWXARArchive> archive_;
};
