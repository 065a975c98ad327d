// Keyed persistence and copying of ZIP archives.

#include "GWZipArchive.h"

namespace {

const char* const kRefKey = "GWRef";
const char* const kFilesKey = "Files";
const char* const kStartOffsetKey = "StartOffset";

}  // namespace

void GWZipArchive::encodeWithCoder(GWCoder& coder) const {
    if (!coder.allowsKeyedCoding()) {
        return;
    }
    coder.encodeObject(ref_, kRefKey);
    coder.encodeArrayOfObjects(files(), kFilesKey);
    coder.encodeInt64(std::int64_t(startOffset_), kStartOffsetKey);
}

GWZipArchivePtr GWZipArchive::initWithCoder(GWCoder& coder) {
    auto archive = make();
    archive->ref_ = coder.decodeObjectOfClass<GWRef>(kRefKey);
    archive->setFiles(
        coder.decodeArrayOfObjectsOfClass<GWZipFile>(kFilesKey).value_or(GWZipFileArray()));
    archive->startOffset_ = std::uint64_t(coder.decodeInt64(kStartOffsetKey));
    return archive;
}

GWZipArchivePtr GWZipArchive::copy() const {
    auto archive = make();
    archive->ref_ = ref_ ? ref_->copy() : nullptr;
    archive->startOffset_ = startOffset_;
    GWZipFileArray roots;
    for (const auto& root : files()) {
        roots.push_back(root ? root->copy() : nullptr);
    }
    archive->setFiles(std::move(roots));
    return archive;
}
