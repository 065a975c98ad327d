#pragma once

#include <sys/stat.h>

#include <array>
#include <cstdint>
#include <memory>
#include <optional>
#include <string>

#include "GWDate.h"
#include "GWError.h"
#include "GWURL.h"

// The Finder and POSIX information of one file, read from a location and
// written back in one step. Only what was set is written: dates with
// utimensat (links are not followed), the Finder information into the 32-byte
// "com.apple.FinderInfo" attribute through the metadata store (fields not set
// are kept), owner and group with lchown, the mode with chmod (not for links).
// Creation and backup dates cannot be set on Linux; they are kept here only.
class GWFileInfo {
public:
    static std::shared_ptr<GWFileInfo> initWithURL(const GWURL& url, GWErrorPtr* error);
    // The item open at `fd`, for one being made: its Finder information is not
    // read (it reads as zeros), which saves the lookups of a new file's
    // attributes and side file. `url` names it in errors.
    static std::shared_ptr<GWFileInfo> initWithDescriptor(int fd, const GWURL& url,
                                                          GWErrorPtr* error);

    // None where the file system records no creation date.
    const std::optional<GWDate>& creationDate() const { return creationDate_; }
    const GWDate& modificationDate() const { return modificationDate_; }
    const std::optional<GWDate>& backupDate() const { return backupDate_; }
    const GWDate& accessDate() const { return accessDate_; }
    void setCreationDate(const GWDate& date) { creationDate_ = date; }
    void setModificationDate(const GWDate& date);
    void setBackupDate(const GWDate& date) { backupDate_ = date; }
    void setAccessDate(const GWDate& date);

    std::uint32_t typeCode() const { return finderField(kTypeOffset, 4); }
    std::uint32_t creatorCode() const { return finderField(kCreatorOffset, 4); }
    std::uint16_t finderFlags() const { return std::uint16_t(finderField(kFlagsOffset, 2)); }
    // Vertical position in the low 16 bits, horizontal in the high 16 bits.
    std::uint32_t location() const;
    std::uint16_t extendedFinderFlags() const {
        return std::uint16_t(finderField(kExtendedFlagsOffset, 2));
    }
    std::uint32_t putAwayFolderID() const { return finderField(kPutAwayFolderOffset, 4); }
    void setTypeCode(std::uint32_t code) { setFinderField(kTypeOffset, 4, code); }
    void setCreatorCode(std::uint32_t code) { setFinderField(kCreatorOffset, 4, code); }
    void setFinderFlags(std::uint16_t flags) { setFinderField(kFlagsOffset, 2, flags); }
    void setLocation(std::uint32_t location);
    void setExtendedFinderFlags(std::uint16_t flags) {
        setFinderField(kExtendedFlagsOffset, 2, flags);
    }
    void setPutAwayFolderID(std::uint32_t folderID) {
        setFinderField(kPutAwayFolderOffset, 4, folderID);
    }

    std::uint32_t ownerID() const { return ownerID_; }
    std::uint32_t groupID() const { return groupID_; }
    // Permission bits with set-id and sticky bits (07777).
    std::uint32_t permissionsMode() const { return permissionsMode_; }
    void setOwnerID(std::uint32_t owner);
    void setGroupID(std::uint32_t group);
    void setPermissionsMode(std::uint32_t mode);

    // Writes everything that was set. Every part is attempted; the first
    // failure is reported.
    bool applyToURL(const GWURL& url, GWErrorPtr* error) const;
    // The same through an open descriptor of the item, which no later rename
    // or link can redirect; `url` only names it in errors.
    bool applyToDescriptor(int fd, const GWURL& url, GWErrorPtr* error) const;

private:
    void setStatus(const struct statx& info);

    // Offsets in the big-endian Finder information.
    static constexpr std::size_t kTypeOffset = 0;
    static constexpr std::size_t kCreatorOffset = 4;
    static constexpr std::size_t kFlagsOffset = 8;
    static constexpr std::size_t kVerticalOffset = 10;
    static constexpr std::size_t kHorizontalOffset = 12;
    static constexpr std::size_t kExtendedFlagsOffset = 24;
    static constexpr std::size_t kPutAwayFolderOffset = 28;

    std::uint32_t finderField(std::size_t offset, std::size_t width) const;
    void setFinderField(std::size_t offset, std::size_t width, std::uint32_t value);
    // `fd` is -1 when the item is reached by its path.
    bool applyFinderInfo(int fd, const std::string& path, GWErrorPtr* error) const;
    bool apply(int fd, const GWURL& url, GWErrorPtr* error) const;

    std::optional<GWDate> creationDate_;
    GWDate modificationDate_;
    std::optional<GWDate> backupDate_;
    GWDate accessDate_;
    bool modificationDateSet_ = false;
    bool accessDateSet_ = false;

    std::array<std::uint8_t, 32> finderInfo_{};
    // Which bytes of the Finder information were set, so that applying keeps the others.
    std::array<bool, 32> finderInfoSet_{};

    std::uint32_t ownerID_ = 0;
    std::uint32_t groupID_ = 0;
    std::uint32_t permissionsMode_ = 0;
    bool ownerSet_ = false;
    bool groupSet_ = false;
    bool modeSet_ = false;
};

// Sets the Finder comment of the file at `url` (the freedesktop
// "user.xdg.comment" attribute, through the metadata store). An empty comment
// removes it.
bool GWSetSpotlightComments(const std::string& comment, const GWURL& url, GWErrorPtr* error);
