#include "GWZipFile.h"

#include <algorithm>
#include <atomic>

#include "GWZipNames.h"
#include "foundation/GWConversions.h"

namespace {

// Bumped by every rename of any entry, so that name indexes notice renames of
// children even when the child does not know the directory holding it.
std::atomic<std::uint64_t> gRenameEpoch{1};

const GWValue* infoValue(const GWDictionary& info, const char* key) {
    return GWDictionaryValue(info, key);
}

std::optional<std::string> stringInfo(const GWDictionary& info, const char* key) {
    const GWValue* value = infoValue(info, key);
    if (value && value->string()) {
        return *value->string();
    }
    return std::nullopt;
}

std::optional<GWDate> dateInfo(const GWDictionary& info, const char* key) {
    const GWValue* value = infoValue(info, key);
    if (value && value->date()) {
        return *value->date();
    }
    return std::nullopt;
}

// The number's bits; 0 when absent or not a number.
std::uint64_t numberInfo(const GWDictionary& info, const char* key) {
    const GWValue* value = infoValue(info, key);
    return value && value->isNumber() ? value->unsignedValue() : 0;
}

bool boolInfo(const GWDictionary& info, const char* key) {
    const GWValue* value = infoValue(info, key);
    return value && value->boolValue();
}

std::optional<GWDate> preferredDate(const GWDictionary& info, const char* utcKey,
                                    const char* localKey) {
    if (auto date = dateInfo(info, utcKey)) {
        return date;
    }
    return dateInfo(info, localKey);
}

}  // namespace

GWZipFilePtr GWZipFile::initWithName(
    std::string name, const GWZipFilePtr& parent, std::uint64_t compressedSize,
    std::uint64_t uncompressedSize, std::optional<GWData> checksum, std::uint64_t checksumAlgorithm,
    std::uint32_t owner, std::uint32_t groupOwner, std::uint16_t permissionsMode,
    std::optional<GWDate> modificationDate, std::optional<std::string> symlinkDestination,
    std::uint64_t localHeaderOffset, std::uint16_t generalPurposeFlags,
    std::uint16_t compressionMethod, GWDictionary extraInfo) {
    auto file = std::make_shared<GWZipFile>();
    file->name_ = std::move(name);
    file->parent_ = parent;
    file->compressedSize_ = compressedSize;
    file->uncompressedSize_ = uncompressedSize;
    file->storeChecksum(std::move(checksum));
    file->storeChecksumAlgorithm(checksumAlgorithm);
    file->owner_ = owner;
    file->groupOwner_ = groupOwner;
    file->permissionsMode_ = permissionsMode;
    file->hasModificationDate_ = modificationDate.has_value();
    file->modificationDate_ = modificationDate.value_or(GWDate());
    if (symlinkDestination) {
        file->extras().symlinkDestination = std::move(symlinkDestination);
    }
    file->localHeaderOffset_ = localHeaderOffset;
    file->generalPurposeFlags_ = generalPurposeFlags;
    file->compressionMethod_ = compressionMethod;
    if (!extraInfo.empty()) {
        file->extras().extraInfo = std::move(extraInfo);
    }
    return file;
}

GWZipFile::~GWZipFile() {
    // A path of thousands of components is a chain of thousands of nodes;
    // releasing it recursively could exhaust a worker thread's stack.
    std::vector<GWZipFilePtr> pending;
    auto detach = [&pending](GWZipFile& node) {
        if (!node.structure_) {
            return;
        }
        Structure& structure = *node.structure_;
        if (structure.children && structure.children.use_count() == 1) {
            for (auto& child : *structure.children) {
                pending.push_back(std::move(child));
            }
        }
        structure.children.reset();
        pending.push_back(std::move(structure.resourceFork));
        pending.push_back(std::move(structure.appleDoubleFile));
    };
    detach(*this);
    while (!pending.empty()) {
        GWZipFilePtr node = std::move(pending.back());
        pending.pop_back();
        if (node && node.use_count() == 1) {
            detach(*node);
        }
    }
}

// --- Storage -----------------------------------------------------------------

std::mutex& GWZipFile::stateMutex() const {
    static std::mutex stripes[64];
    return stripes[(reinterpret_cast<std::uintptr_t>(this) / alignof(GWZipFile)) % 64];
}

const GWDictionary& GWZipFile::storedExtraInfo() const {
    static const GWDictionary kEmpty;
    return extras_ ? extras_->extraInfo : kEmpty;
}

GWZipFile::Extras& GWZipFile::extras() {
    if (!extras_) {
        extras_ = std::make_unique<Extras>();
    }
    return *extras_;
}

std::optional<GWData> GWZipFile::storedChecksum() const {
    switch (checksumState_) {
        case kNoChecksum: return std::nullopt;
        case kLongChecksum: return extras_->longChecksum;
        default: return GWData(checksumBytes_, checksumBytes_ + checksumState_);
    }
}

std::uint64_t GWZipFile::storedChecksumAlgorithm() const {
    return checksumAlgorithm_ == kLongChecksumAlgorithm ? extras_->longChecksumAlgorithm
                                                        : checksumAlgorithm_;
}

void GWZipFile::storeChecksumAlgorithm(std::uint64_t algorithm) {
    if (algorithm >= kLongChecksumAlgorithm) {
        extras().longChecksumAlgorithm = algorithm;
        checksumAlgorithm_ = kLongChecksumAlgorithm;
    } else {
        checksumAlgorithm_ = std::uint32_t(algorithm);
    }
}

void GWZipFile::storeChecksum(std::optional<GWData> checksum) {
    if (checksumState_ == kLongChecksum && extras_) {
        extras_->longChecksum = GWData();
    }
    if (!checksum) {
        checksumState_ = kNoChecksum;
    } else if (checksum->size() > kInlineChecksumCapacity) {
        extras().longChecksum = std::move(*checksum);
        checksumState_ = kLongChecksum;
    } else {
        std::copy(checksum->begin(), checksum->end(), checksumBytes_);
        checksumState_ = std::uint8_t(checksum->size());
    }
}

GWZipFile::Structure& GWZipFile::structure() {
    if (!structure_) {
        structure_ = std::make_unique<Structure>();
    }
    return *structure_;
}

namespace {
const GWZipFilePtr kNoFile;
}

const GWZipFilePtr& GWZipFile::resourceFork() const {
    return structure_ ? structure_->resourceFork : kNoFile;
}

void GWZipFile::setResourceFork(GWZipFilePtr file) {
    if (file || structure_) {
        structure().resourceFork = std::move(file);
    }
}

const GWZipFilePtr& GWZipFile::appleDoubleFile() const {
    return structure_ ? structure_->appleDoubleFile : kNoFile;
}

void GWZipFile::setAppleDoubleFile(GWZipFilePtr file) {
    if (file || structure_) {
        structure().appleDoubleFile = std::move(file);
    }
}

// --- Fields under the state lock ----------------------------------------------

std::uint64_t GWZipFile::storedUncompressedSize() const {
    std::lock_guard lock(stateMutex());
    return uncompressedSize_;
}

void GWZipFile::setUncompressedSize(std::uint64_t size) {
    std::lock_guard lock(stateMutex());
    uncompressedSize_ = size;
}

std::string GWZipFile::name() const {
    std::lock_guard lock(stateMutex());
    return name_;
}

void GWZipFile::setName(std::string name) {
    std::lock_guard lock(stateMutex());
    if (name != name_) {
        name_ = std::move(name);
        gRenameEpoch.fetch_add(1, std::memory_order_relaxed);
    }
}

std::uint64_t GWZipFile::compressedSize() const {
    std::lock_guard lock(stateMutex());
    return compressedSize_;
}

void GWZipFile::setCompressedSize(std::uint64_t size) {
    std::lock_guard lock(stateMutex());
    compressedSize_ = size;
}

std::optional<std::string> GWZipFile::symlinkDestination() const {
    std::lock_guard lock(stateMutex());
    return extras_ ? extras_->symlinkDestination : std::nullopt;
}

void GWZipFile::setSymlinkDestination(std::optional<std::string> destination) {
    std::lock_guard lock(stateMutex());
    if (destination || extras_) {
        extras().symlinkDestination.swap(destination);
    }
}

std::optional<GWData> GWZipFile::privateUncompressedChecksum() const {
    std::lock_guard lock(stateMutex());
    return storedChecksum();
}

void GWZipFile::setPrivateUncompressedChecksum(std::optional<GWData> checksum) {
    std::lock_guard lock(stateMutex());
    storeChecksum(std::move(checksum));
}

std::uint64_t GWZipFile::privateUncompressedChecksumAlgorithm() const {
    std::lock_guard lock(stateMutex());
    return storedChecksumAlgorithm();
}

void GWZipFile::setPrivateUncompressedChecksumAlgorithm(std::uint64_t algorithm) {
    std::lock_guard lock(stateMutex());
    storeChecksumAlgorithm(algorithm);
}

GWDictionary GWZipFile::extraInfo() const {
    std::lock_guard lock(stateMutex());
    return storedExtraInfo();
}

void GWZipFile::setExtraInfo(GWDictionary extraInfo) {
    auto filename = filenameFromExtraInfo(extraInfo);
    std::lock_guard lock(stateMutex());
    if (filename && *filename != name_) {
        name_ = std::move(*filename);
        gRenameEpoch.fetch_add(1, std::memory_order_relaxed);
    }
    if (!extraInfo.empty() || extras_) {
        extras().extraInfo.swap(extraInfo);
    }
}

std::optional<std::string> GWZipFile::filenameFromExtraInfo(const GWDictionary& extraInfo) const {
    if (boolInfo(extraInfo, kGWZipDontChangeFilenameKey)) {
        return std::nullopt;
    }
    std::optional<std::string> candidate;
    if (auto filename = stringInfo(extraInfo, kGWZipFilenameKey)) {
        candidate = GWZipFilenameFromMacName(*filename);
    } else if (auto posixPath = stringInfo(extraInfo, kGWZipPOSIXPathKey)) {
        candidate = GWZipLastPOSIXPathComponent(*posixPath);
    } else if (auto hfsPath = stringInfo(extraInfo, kGWZipHFSPathKey)) {
        candidate = GWZipLastHFSPathComponent(*hfsPath);
    }
    // A name that is not one path component would move the entry elsewhere
    // on extraction; the archive's own name is kept instead.
    if (candidate && !GWZipIsSafeFilename(*candidate)) {
        return std::nullopt;
    }
    return candidate;
}

// --- Children ------------------------------------------------------------------

void GWZipFile::setChildren(std::optional<GWZipFileArray> children) {
    if (!children && !structure_) {
        return;
    }
    Structure& structure = this->structure();
    structure.children =
        children ? std::make_shared<GWZipFileArray>(std::move(*children)) : nullptr;
    ++structure.childrenGeneration;
}

void GWZipFile::addChild(const GWZipFilePtr& child) {
    Structure& structure = this->structure();
    auto& children = structure.children;
    if (!children) {
        children = std::make_shared<GWZipFileArray>(1, child);
        ++structure.childrenGeneration;
        return;
    }
    if (children.use_count() > 1) {
        // A caller holds a snapshot: it must not see the append.
        auto copy = std::make_shared<GWZipFileArray>();
        copy->reserve(children->size() + 1);
        *copy = *children;
        copy->push_back(child);
        children = std::move(copy);
        ++structure.childrenGeneration;
        return;
    }
    children->push_back(child);
    NameIndex& index = nameIndex();
    std::lock_guard lock(index.mutex);
    if (index.valid && index.childrenGeneration == structure.childrenGeneration && child) {
        index.first.emplace(child->name(), children->size() - 1);
    }
}

GWZipFile::NameIndex& GWZipFile::nameIndex() const {
    // Callers have children, hence the structure.
    std::lock_guard lock(stateMutex());
    if (!structure_->index) {
        structure_->index = std::make_unique<NameIndex>();
    }
    return *structure_->index;
}

void GWZipFile::removeChild(const GWZipFilePtr& child) {
    if (!structure_ || !structure_->children) {
        return;
    }
    auto& children = structure_->children;
    auto remaining = std::make_shared<GWZipFileArray>();
    remaining->reserve(children->size());
    for (const auto& existing : *children) {
        if (existing != child) {
            remaining->push_back(existing);
        }
    }
    children = std::move(remaining);
    ++structure_->childrenGeneration;
}

std::optional<std::size_t> GWZipFile::indexOfChildNamed(std::string_view name) const {
    if (!structure_ || !structure_->children) {
        return std::nullopt;
    }
    const GWZipFileArray& children = *structure_->children;
    const std::uint64_t generation = structure_->childrenGeneration;
    NameIndex& index = nameIndex();
    std::lock_guard lock(index.mutex);
    const std::uint64_t epoch = gRenameEpoch.load(std::memory_order_relaxed);
    if (!index.valid || index.childrenGeneration != generation || index.renameEpoch != epoch) {
        index.first.clear();
        index.first.reserve(children.size());
        for (std::size_t i = 0; i < children.size(); ++i) {
            if (const auto& child = children[i]) {
                index.first.emplace(child->name(), i);
            }
        }
        index.childrenGeneration = generation;
        index.renameEpoch = epoch;
        index.valid = true;
    }
    auto found = index.first.find(std::string(name));
    if (found == index.first.end()) {
        return std::nullopt;
    }
    return found->second;
}

GWZipFilePtr GWZipFile::childNamed(std::string_view name) const {
    auto position = indexOfChildNamed(name);
    return position ? (*structure_->children)[*position] : nullptr;
}

// --- Derived properties ----------------------------------------------------------

std::string GWZipFile::path() const {
    std::vector<std::string> names{name()};
    for (auto ancestor = parent(); ancestor; ancestor = ancestor->parent()) {
        names.push_back(ancestor->name());
    }
    std::string path;
    for (auto it = names.rbegin(); it != names.rend(); ++it) {
        if (!path.empty() && path.back() != '/' && !it->empty()) {
            path += '/';
        }
        path += *it;
    }
    return path;
}

std::uint64_t GWZipFile::uncompressedSize() const {
    std::uint64_t total = storedUncompressedSize();
    std::vector<const GWZipFile*> pending{resourceFork().get(), appleDoubleFile().get()};
    while (!pending.empty()) {
        const GWZipFile* companion = pending.back();
        pending.pop_back();
        if (companion) {
            total += companion->storedUncompressedSize();
            pending.push_back(companion->resourceFork().get());
            pending.push_back(companion->appleDoubleFile().get());
        }
    }
    return total;
}

std::optional<std::string> GWZipFile::type() const {
    std::lock_guard lock(stateMutex());
    return isDirectory() ? std::optional<std::string>("fold")
                         : stringInfo(storedExtraInfo(), kGWZipTypeCodeKey);
}

std::optional<std::string> GWZipFile::creator() const {
    std::lock_guard lock(stateMutex());
    return isDirectory() ? std::optional<std::string>("MACS")
                         : stringInfo(storedExtraInfo(), kGWZipCreatorCodeKey);
}

std::uint32_t GWZipFile::typeCode() const {
    auto code = type();
    return code ? GWFourCharCode(*code) : 0;
}

std::uint32_t GWZipFile::creatorCode() const {
    auto code = creator();
    return code ? GWFourCharCode(*code) : 0;
}

std::int16_t GWZipFile::iconLocationV() const {
    std::lock_guard lock(stateMutex());
    return std::int16_t(numberInfo(storedExtraInfo(), kGWZipVerticalIconLocationKey));
}

std::int16_t GWZipFile::iconLocationH() const {
    std::lock_guard lock(stateMutex());
    return std::int16_t(numberInfo(storedExtraInfo(), kGWZipHorizontalIconLocationKey));
}

std::optional<GWDate> GWZipFile::creationDate() const {
    std::lock_guard lock(stateMutex());
    return preferredDate(storedExtraInfo(), kGWZipUTCCreationDateKey, kGWZipCreationDateKey);
}

std::optional<GWDate> GWZipFile::modificationDate() const {
    std::lock_guard lock(stateMutex());
    if (auto date = preferredDate(storedExtraInfo(), kGWZipUTCModificationDateKey,
                                  kGWZipModificationDateKey)) {
        return date;
    }
    return hasModificationDate_ ? std::optional<GWDate>(modificationDate_) : std::nullopt;
}

std::optional<GWDate> GWZipFile::backupDate() const {
    std::lock_guard lock(stateMutex());
    return preferredDate(storedExtraInfo(), kGWZipUTCBackupDateKey, kGWZipBackupDateKey);
}

std::optional<GWDate> GWZipFile::accessDate() const {
    std::lock_guard lock(stateMutex());
    return preferredDate(storedExtraInfo(), kGWZipUTCAccessDateKey, kGWZipAccessDateKey);
}

std::uint16_t GWZipFile::finderFlags() const {
    std::lock_guard lock(stateMutex());
    return std::uint16_t(numberInfo(storedExtraInfo(), kGWZipFinderFlagsKey));
}

std::uint16_t GWZipFile::extendedFinderFlags() const {
    std::lock_guard lock(stateMutex());
    return std::uint16_t(numberInfo(storedExtraInfo(), kGWZipExtendedFinderFlagsKey));
}

std::uint8_t GWZipFile::versionNumber() const {
    std::lock_guard lock(stateMutex());
    return std::uint8_t(numberInfo(storedExtraInfo(), kGWZipVersionNumberKey));
}

std::uint8_t GWZipFile::accessRights() const {
    std::lock_guard lock(stateMutex());
    return std::uint8_t(numberInfo(storedExtraInfo(), kGWZipAccessRightsKey));
}

std::uint16_t GWZipFile::putAwayFolderID() const {
    std::lock_guard lock(stateMutex());
    return std::uint16_t(numberInfo(storedExtraInfo(), kGWZipPutAwayFolderKey));
}

std::optional<std::string> GWZipFile::comment() const {
    std::lock_guard lock(stateMutex());
    return stringInfo(storedExtraInfo(), kGWZipCommentKey);
}

bool GWZipFile::isMacBinaryEncoded() const {
    std::lock_guard lock(stateMutex());
    return !isDirectory() && boolInfo(storedExtraInfo(), kGWZipIsMacBinaryEncodedKey);
}

std::uint16_t GWZipFile::dataCompressionMethod() const {
    if (compressionMethod_ != 99) {
        return compressionMethod_;
    }
    std::lock_guard lock(stateMutex());
    const GWDictionary& info = storedExtraInfo();
    return info.count(kGWZipAESCompressionMethodKey) == 0
               ? compressionMethod_
               : std::uint16_t(numberInfo(info, kGWZipAESCompressionMethodKey));
}

bool GWZipFile::moreInfoAvailableInLocalHeader() const {
    std::lock_guard lock(stateMutex());
    return boolInfo(storedExtraInfo(), kGWZipMoreInfoAvailableInLocalHeaderKey);
}

std::optional<GWData> GWZipFile::uncompressedChecksum() const {
    const bool macBinary = isMacBinaryEncoded();
    std::lock_guard lock(stateMutex());
    return macBinary ? std::nullopt : storedChecksum();
}

std::uint64_t GWZipFile::uncompressedChecksumAlgorithm() const {
    const bool macBinary = isMacBinaryEncoded();
    std::lock_guard lock(stateMutex());
    return macBinary ? 0 : storedChecksumAlgorithm();
}
