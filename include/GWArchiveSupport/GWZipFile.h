#pragma once

#include <cstdint>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>
#include <unordered_map>
#include <vector>

#include "GWCoder.h"
#include "GWDate.h"
#include "GWExport.h"
#include "GWValue.h"
#include "GWZipExtraInfoKeys.h"

class GWZipFile;
using GWZipFilePtr = std::shared_ptr<GWZipFile>;
using GWZipFileArray = std::vector<GWZipFilePtr>;
// A directory's contents as callers see them: an immutable snapshot that later
// changes to the directory never touch.
using GWZipFileArrayPtr = std::shared_ptr<const GWZipFileArray>;

// One node of a ZIP archive's tree: a file, a directory or a symbolic link,
// with its place in the archive, its POSIX attributes and the "extra info"
// its extra fields carried. A node owns its children and its Mac companions
// (resource-fork and AppleDouble entries); the parent link is weak, so a tree
// is owned from its roots. Create nodes with initWithName.
//
// Extraction refreshes an entry from its local header while other threads
// may read it; the fields it touches are therefore guarded and returned by
// value. Tree building (children, companions, parent) is single-threaded.
class GW_EXPORT GWZipFile : public GWCoding {
public:
    static constexpr const char* kClassName = "GWZipFile";

    // The designated initialiser. `checksum` and `checksumAlgorithm` become
    // the private checksum fields; `extraInfo` is stored without the renaming
    // that setExtraInfo does.
    static GWZipFilePtr initWithName(
        std::string name, const GWZipFilePtr& parent, std::uint64_t compressedSize,
        std::uint64_t uncompressedSize, std::optional<GWData> checksum,
        std::uint64_t checksumAlgorithm, std::uint32_t owner, std::uint32_t groupOwner,
        std::uint16_t permissionsMode, std::optional<GWDate> modificationDate,
        std::optional<std::string> symlinkDestination, std::uint64_t localHeaderOffset,
        std::uint16_t generalPurposeFlags, std::uint16_t compressionMethod, GWDictionary extraInfo);

    GWZipFile() = default;
    GWZipFile(const GWZipFile&) = delete;
    GWZipFile& operator=(const GWZipFile&) = delete;
    // Tears deep trees down without recursion.
    ~GWZipFile() override;

    // --- Stored properties ----------------------------------------------------

    // POSIX mode bits including the file-type bits.
    std::uint16_t permissionsMode() const { return permissionsMode_; }
    std::uint16_t generalPurposeFlags() const { return generalPurposeFlags_; }
    void setGeneralPurposeFlags(std::uint16_t flags) { generalPurposeFlags_ = flags; }
    std::uint16_t compressionMethod() const { return compressionMethod_; }
    void setCompressionMethod(std::uint16_t method) { compressionMethod_ = method; }
    std::uint32_t owner() const { return owner_; }
    std::uint32_t groupOwner() const { return groupOwner_; }
    // The date of the central directory record (see modificationDate()).
    std::optional<GWDate> storedModificationDate() const {
        return hasModificationDate_ ? std::optional<GWDate>(modificationDate_) : std::nullopt;
    }
    // This entry's own size, without its companions (see uncompressedSize()).
    std::uint64_t storedUncompressedSize() const;
    void setUncompressedSize(std::uint64_t size);
    // The last path component.
    std::string name() const;
    void setName(std::string name);
    std::uint64_t compressedSize() const;
    void setCompressedSize(std::uint64_t size);
    std::optional<std::string> symlinkDestination() const;
    void setSymlinkDestination(std::optional<std::string> destination);
    const GWZipFilePtr& resourceFork() const;
    void setResourceFork(GWZipFilePtr file);
    const GWZipFilePtr& appleDoubleFile() const;
    void setAppleDoubleFile(GWZipFilePtr file);
    // The containing directory; none for a root entry.
    GWZipFilePtr parent() const { return parent_.lock(); }
    void setParent(const GWZipFilePtr& parent) { parent_ = parent; }
    // Relative to the start of the ZIP data, which may follow a prefix.
    std::uint64_t localHeaderOffset() const { return localHeaderOffset_; }
    void setLocalHeaderOffset(std::uint64_t offset) { localHeaderOffset_ = offset; }
    std::optional<GWData> privateUncompressedChecksum() const;
    void setPrivateUncompressedChecksum(std::optional<GWData> checksum);
    // A GWChecksum algorithm number.
    std::uint64_t privateUncompressedChecksumAlgorithm() const;
    void setPrivateUncompressedChecksumAlgorithm(std::uint64_t algorithm);
    GWDictionary extraInfo() const;
    // Renames the entry when the dictionary names it (filenameFromExtraInfo),
    // then stores it.
    void setExtraInfo(GWDictionary extraInfo);

    // --- Children -------------------------------------------------------------

    // Null for a leaf. The snapshot stays as it is when the directory changes.
    GWZipFileArrayPtr children() const {
        return structure_ ? GWZipFileArrayPtr(structure_->children) : nullptr;
    }
    // Replaces the children whole; std::nullopt makes the entry a leaf. Does
    // not touch the children's parent links.
    void setChildren(std::optional<GWZipFileArray> children);
    // The first child of that exact name (the order of `children` decides).
    GWZipFilePtr childNamed(std::string_view name) const;
    // Appends; the child's parent link is the caller's to set.
    void addChild(const GWZipFilePtr& child);
    // Removes every occurrence of that very object.
    void removeChild(const GWZipFilePtr& child);

    // --- Derived properties ---------------------------------------------------

    // The parent's path with the name appended.
    std::string path() const;
    // The stored size plus the sizes of the companions, which count theirs.
    std::uint64_t uncompressedSize() const;
    bool isDirectory() const { return (permissionsMode_ & 0xF000) == 0x4000; }
    bool isSymbolicLink() const { return (permissionsMode_ & 0xF000) == 0xA000; }
    // "fold" / "MACS" for a directory, else the extra info's codes.
    std::optional<std::string> type() const;
    std::optional<std::string> creator() const;
    std::uint32_t typeCode() const;
    std::uint32_t creatorCode() const;
    std::int16_t iconLocationV() const;
    std::int16_t iconLocationH() const;
    // A UTC-sourced date wins over a local-time one.
    std::optional<GWDate> creationDate() const;
    std::optional<GWDate> modificationDate() const;
    std::optional<GWDate> backupDate() const;
    std::optional<GWDate> accessDate() const;
    std::uint16_t finderFlags() const;
    std::uint16_t extendedFinderFlags() const;
    std::uint8_t versionNumber() const;
    std::uint8_t accessRights() const;
    // Deliberately narrowed to 16 bits.
    std::uint16_t putAwayFolderID() const;
    std::optional<std::string> comment() const;
    bool isMacBinaryEncoded() const;
    // General-purpose flag bit 0: the data is encrypted, traditionally or
    // (method 99) with WinZip AES.
    bool isEncrypted() const { return (generalPurposeFlags_ & 0x0001) != 0; }
    // The method the data is compressed with: for an AES entry the one its
    // 0x9901 block names (99 when it has none), else compressionMethod().
    std::uint16_t dataCompressionMethod() const;
    bool moreInfoAvailableInLocalHeader() const;
    // The stored CRC of a MacBinary entry covers the MacBinary stream, not the
    // data fork extraction produces, so such an entry reports no checksum.
    std::optional<GWData> uncompressedChecksum() const;
    std::uint64_t uncompressedChecksumAlgorithm() const;
    void setUncompressedChecksum(std::optional<GWData> checksum) {
        setPrivateUncompressedChecksum(std::move(checksum));
    }
    void setUncompressedChecksumAlgorithm(std::uint64_t algorithm) {
        setPrivateUncompressedChecksumAlgorithm(algorithm);
    }

    // The name the dictionary gives an entry of this kind, or none.
    std::optional<std::string> filenameFromExtraInfo(const GWDictionary& extraInfo) const;

    // --- Tree lookup and building ---------------------------------------------

    // Components without empty ones and "."; ".." drops the last kept one.
    static std::vector<std::string> standardizedComponentsForPath(std::string_view path);
    static GWZipFilePtr fileNamed(std::string_view name, const GWZipFileArray& files);
    // Finds the node at the path; with `create`, missing directories on the
    // way (the last component included) are made as implicit directories and
    // added to their parent or to `rootFiles`.
    static GWZipFilePtr fileWithPath(std::string_view path, GWZipFileArray& rootFiles, bool create);
    static GWZipFilePtr fileWithPathComponents(const std::vector<std::string>& components,
                                               GWZipFileArray& rootFiles, bool create);
    // The first component is looked up in `files` and made in `parent` (or
    // appended to `files` without one); the rest below.
    static GWZipFilePtr fileWithPathComponents(const std::vector<std::string>& components,
                                               const GWZipFilePtr& parent, GWZipFileArray& files,
                                               bool create);

    // --- Persistence and copying ----------------------------------------------

    std::string className() const override { return kClassName; }
    // Writes nothing to a non-keyed coder; never writes the parent.
    void encodeWithCoder(GWCoder& coder) const override;
    // None from a non-keyed coder. The children's parent links point at the
    // new node; the node itself has none.
    static GWZipFilePtr initWithCoder(GWCoder& coder);
    // A deep copy (children and companions too) with the children's parent
    // links rebuilt; the copy itself is detached.
    GWZipFilePtr copy() const;

protected:
    // Reads names without the state lock while a tree is being built.
    friend class GWZipEntryList;

    // The plain new instance copy() fills; a subclass answers its own class.
    virtual GWZipFilePtr newInstance() const;

private:
    // Copies the stored fields, not children or companions.
    void copyFieldsTo(GWZipFile& target) const;
    static GWZipFilePtr makeImplicitDirectory(const std::string& name, const GWZipFilePtr& parent);
    // Position of the first child of that name, through the name index.
    std::optional<std::size_t> indexOfChildNamed(std::string_view name) const;

    // Extraction refreshes the name, sizes, checksum, link target and extra
    // info from the local header on a worker thread while other threads may
    // read the entry, so those fields are read and written under this lock
    // and handed out as copies. The lock is one of a shared stripe: archives
    // hold hundreds of thousands of entries, and no accessor holds it while
    // taking another entry's.
    std::mutex& stateMutex() const;
    // The extra info, or an empty one; under the state lock.
    const GWDictionary& storedExtraInfo() const;

    // What few entries carry and extraction may replace; under the state lock.
    struct Extras {
        std::optional<std::string> symlinkDestination;
        GWDictionary extraInfo;
        GWData longChecksum;                      // one longer than fits inline
        std::uint64_t longChecksumAlgorithm = 0;  // one wider than fits inline
    };
    Extras& extras();
    // The checksum, or none; under the state lock.
    std::optional<GWData> storedChecksum() const;
    void storeChecksum(std::optional<GWData> checksum);
    std::uint64_t storedChecksumAlgorithm() const;
    void storeChecksumAlgorithm(std::uint64_t algorithm);

    // Name -> position of its first occurrence in the children, rebuilt when
    // the children are replaced or any entry anywhere is renamed. Lookups may
    // run on several threads over a finished tree, hence the lock.
    struct NameIndex {
        std::mutex mutex;
        std::unordered_map<std::string, std::size_t> first;
        std::uint64_t childrenGeneration = 0;
        std::uint64_t renameEpoch = 0;
        bool valid = false;
    };
    // Children and companions are set while a tree is built, on one thread;
    // few entries have either, and an archive of 200,000 entries pays for
    // every byte a node carries.
    struct Structure {
        GWZipFilePtr resourceFork;
        GWZipFilePtr appleDoubleFile;
        // Copy-on-write: appended to in place while no snapshot is out.
        std::shared_ptr<GWZipFileArray> children;
        std::uint64_t childrenGeneration = 0;
        // Made by the first lookup (under the state lock).
        std::unique_ptr<NameIndex> index;
    };
    Structure& structure();
    // Only directories with children ever need one.
    NameIndex& nameIndex() const;

    // checksumState_: a CRC-32 is kept inline; longer checksums (decoded
    // from a coder) in the extras, as are algorithm numbers beyond 32 bits.
    static constexpr std::size_t kInlineChecksumCapacity = 4;
    static constexpr std::uint8_t kNoChecksum = 0xFF;
    static constexpr std::uint8_t kLongChecksum = 0xFE;
    static constexpr std::uint32_t kLongChecksumAlgorithm = UINT32_MAX;

    std::uint16_t permissionsMode_ = 0;
    std::uint16_t generalPurposeFlags_ = 0;
    std::uint16_t compressionMethod_ = 0;
    std::uint8_t checksumState_ = kNoChecksum;  // else the inline length
    bool hasModificationDate_ = false;
    std::uint32_t owner_ = 0;
    std::uint32_t groupOwner_ = 0;
    std::uint8_t checksumBytes_[kInlineChecksumCapacity] = {};
    std::uint32_t checksumAlgorithm_ = 0;
    GWDate modificationDate_;
    std::uint64_t uncompressedSize_ = 0;
    std::uint64_t compressedSize_ = 0;
    std::uint64_t localHeaderOffset_ = 0;
    std::string name_;
    std::weak_ptr<GWZipFile> parent_;
    std::unique_ptr<Extras> extras_;  // null: none of them
    std::unique_ptr<Structure> structure_;
};
