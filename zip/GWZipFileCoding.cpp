// Keyed persistence and deep copying of ZIP entries.

#include "GWZipFile.h"

namespace {

const char* const kNameKey = "Name";
const char* const kChildrenKey = "Children";
const char* const kCompressedSizeKey = "CompressedSize";
const char* const kUncompressedSizeKey = "UncompressedSize";
const char* const kUncompressedChecksumKey = "UncompressedChecksum";
const char* const kUncompressedChecksumAlgorithmKey = "UncompressedChecksumAlgorithm";
const char* const kOwnerKey = "Owner";
const char* const kGroupOwnerKey = "GroupOwner";
const char* const kPermissionsModeKey = "PermissionsMode";
const char* const kModificationDateKey = "ModificationDate";
const char* const kSymlinkDestinationKey = "SymlinkDestination";
const char* const kResourceForkKey = "ResourceFork";
const char* const kAppleDoubleFileKey = "AppleDoubleFile";
const char* const kLocalHeaderOffsetKey = "LocalHeaderOffset";
const char* const kGeneralPurposeFlagsKey = "GeneralPurposeFlags";
const char* const kCompressionMethodKey = "CompressionMethod";
const char* const kExtraInfoKey = "ExtraInfo";

}  // namespace

void GWZipFile::encodeWithCoder(GWCoder& coder) const {
    if (!coder.allowsKeyedCoding()) {
        return;
    }
    std::unique_lock lock(stateMutex());
    coder.encodeValue(GWValue(name_), kNameKey);
    lock.unlock();
    if (auto children = this->children()) {
        coder.encodeArrayOfObjects(*children, kChildrenKey);
    }
    lock.lock();
    coder.encodeUInt64(compressedSize_, kCompressedSizeKey);
    coder.encodeUInt64(uncompressedSize_, kUncompressedSizeKey);
    coder.encodeValue(storedChecksum(), kUncompressedChecksumKey);
    coder.encodeInteger(std::int64_t(storedChecksumAlgorithm()), kUncompressedChecksumAlgorithmKey);
    const auto symlinkDestination =
        extras_ ? extras_->symlinkDestination : std::optional<std::string>();
    const GWDictionary extraInfo = storedExtraInfo();
    lock.unlock();
    coder.encodeInt32(std::int32_t(owner_), kOwnerKey);
    coder.encodeInt32(std::int32_t(groupOwner_), kGroupOwnerKey);
    coder.encodeInteger(permissionsMode_, kPermissionsModeKey);
    coder.encodeValue(storedModificationDate(), kModificationDateKey);
    coder.encodeValue(symlinkDestination, kSymlinkDestinationKey);
    coder.encodeObject(resourceFork(), kResourceForkKey);
    coder.encodeObject(appleDoubleFile(), kAppleDoubleFileKey);
    coder.encodeUInt64(localHeaderOffset_, kLocalHeaderOffsetKey);
    coder.encodeInt32(generalPurposeFlags_, kGeneralPurposeFlagsKey);
    coder.encodeInt32(compressionMethod_, kCompressionMethodKey);
    coder.encodeValue(GWValue(extraInfo), kExtraInfoKey);
}

GWZipFilePtr GWZipFile::initWithCoder(GWCoder& coder) {
    if (!coder.allowsKeyedCoding()) {
        return nullptr;
    }
    auto children = coder.decodeArrayOfObjectsOfClass<GWZipFile>(kChildrenKey);
    auto file = initWithName(
        coder.decodeString(kNameKey).value_or(std::string()), nullptr,
        coder.decodeUInt64(kCompressedSizeKey), coder.decodeUInt64(kUncompressedSizeKey),
        coder.decodeData(kUncompressedChecksumKey),
        std::uint64_t(coder.decodeInteger(kUncompressedChecksumAlgorithmKey)),
        std::uint32_t(coder.decodeInt32(kOwnerKey)),
        std::uint32_t(coder.decodeInt32(kGroupOwnerKey)),
        std::uint16_t(coder.decodeInteger(kPermissionsModeKey)),
        coder.decodeDate(kModificationDateKey), coder.decodeString(kSymlinkDestinationKey),
        coder.decodeUInt64(kLocalHeaderOffsetKey),
        std::uint16_t(coder.decodeInt32(kGeneralPurposeFlagsKey)),
        std::uint16_t(coder.decodeInt32(kCompressionMethodKey)),
        coder.decodeDictionary(kExtraInfoKey).value_or(GWDictionary()));
    file->setChildren(std::move(children));
    file->setResourceFork(coder.decodeObjectOfClass<GWZipFile>(kResourceForkKey));
    file->setAppleDoubleFile(coder.decodeObjectOfClass<GWZipFile>(kAppleDoubleFileKey));
    if (auto children = file->children()) {
        for (const auto& child : *children) {
            child->parent_ = file;
        }
    }
    return file;
}

GWZipFilePtr GWZipFile::newInstance() const {
    return std::make_shared<GWZipFile>();
}

void GWZipFile::copyFieldsTo(GWZipFile& target) const {
    // One lock at a time: both entries may share a stripe.
    std::unique_lock lock(stateMutex());
    std::string name = name_;
    const std::uint64_t compressedSize = compressedSize_;
    const std::uint64_t uncompressedSize = uncompressedSize_;
    std::optional<std::string> symlinkDestination;
    GWDictionary extraInfo;
    if (extras_) {
        symlinkDestination = extras_->symlinkDestination;
        extraInfo = extras_->extraInfo;
    }
    std::optional<GWData> checksum = storedChecksum();
    const std::uint64_t checksumAlgorithm = storedChecksumAlgorithm();
    lock.unlock();

    std::lock_guard targetLock(target.stateMutex());
    target.permissionsMode_ = permissionsMode_;
    target.generalPurposeFlags_ = generalPurposeFlags_;
    target.compressionMethod_ = compressionMethod_;
    target.owner_ = owner_;
    target.groupOwner_ = groupOwner_;
    target.hasModificationDate_ = hasModificationDate_;
    target.modificationDate_ = modificationDate_;
    target.uncompressedSize_ = uncompressedSize;
    target.name_ = std::move(name);
    target.compressedSize_ = compressedSize;
    target.extras_.reset();
    target.checksumState_ = kNoChecksum;
    if (symlinkDestination || !extraInfo.empty()) {
        target.extras().symlinkDestination = std::move(symlinkDestination);
        target.extras().extraInfo = std::move(extraInfo);
    }
    target.localHeaderOffset_ = localHeaderOffset_;
    target.storeChecksum(std::move(checksum));
    target.storeChecksumAlgorithm(checksumAlgorithm);
}

GWZipFilePtr GWZipFile::copy() const {
    auto shallowCopy = [](const GWZipFile& source) {
        GWZipFilePtr target = source.newInstance();
        source.copyFieldsTo(*target);
        return target;
    };
    GWZipFilePtr root = shallowCopy(*this);
    // A work list instead of recursion: trees may be very deep.
    std::vector<std::pair<const GWZipFile*, GWZipFilePtr>> pending{{this, root}};
    while (!pending.empty()) {
        auto [source, target] = std::move(pending.back());
        pending.pop_back();
        if (const GWZipFilePtr& fork = source->resourceFork()) {
            target->setResourceFork(shallowCopy(*fork));
            pending.emplace_back(fork.get(), target->resourceFork());
        }
        if (const GWZipFilePtr& appleDouble = source->appleDoubleFile()) {
            target->setAppleDoubleFile(shallowCopy(*appleDouble));
            pending.emplace_back(appleDouble.get(), target->appleDoubleFile());
        }
        const GWZipFileArrayPtr sourceChildren = source->children();
        if (!sourceChildren) {
            continue;
        }
        auto children = std::make_shared<GWZipFileArray>();
        children->reserve(sourceChildren->size());
        for (const auto& child : *sourceChildren) {
            GWZipFilePtr childCopy;
            if (child) {
                childCopy = shallowCopy(*child);
                childCopy->parent_ = target;
                pending.emplace_back(child.get(), childCopy);
            }
            children->push_back(std::move(childCopy));
        }
        Structure& structure = target->structure();
        structure.children = std::move(children);
        ++structure.childrenGeneration;
    }
    return root;
}
