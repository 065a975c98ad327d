#include <sys/stat.h>

#include <algorithm>
#include <cerrno>

#include "GWAppleFileDecoder.h"
#include "foundation/GWAppleDouble.h"
#include "foundation/GWExtractPolicy.h"
#include "foundation/GWFileDescriptor.h"
#include "foundation/GWMetadataStore.h"
#include "foundation/GWStringEncoding.h"

namespace {

constexpr std::size_t kForkPieceLength = 64 * 1024;

// Comments come from classic Mac writers in Mac OS Roman and from newer
// ones in UTF-8; text that is valid UTF-8 is taken as such.
std::optional<std::string> commentText(const GWData& bytes) {
    if (GWIsValidUTF8(bytes)) {
        return std::string(bytes.begin(), bytes.end());
    }
    return GWStringFromBytes(bytes, GWStringEncoding::MacOSRoman);
}

bool copyResourceFork(int fd, const GWAppleDoubleContents::Extent& fork, GWMetadataStore& store,
                      GWErrorPtr* error) {
    // The AppleDouble fork replaces the file's own rather than overlaying it.
    if (!store.removeAttribute(kGWResourceForkAttributeName, error)) {
        return false;
    }
    GWData piece(std::size_t(std::min<std::uint64_t>(fork.length, kForkPieceLength)));
    for (std::uint64_t done = 0; done < fork.length;) {
        const auto span = std::span(piece).first(
            std::size_t(std::min<std::uint64_t>(fork.length - done, piece.size())));
        std::size_t got = 0;
        if (!GWReadFully(fd, fork.offset + done, span, got)) {
            return GWFail(error, GWPOSIXError(errno));
        }
        if (got != span.size()) {
            // The file shrank under us after its table was checked.
            return GWFail(error, GWPOSIXError(EINVAL));
        }
        // Entry lengths are 32-bit, so every position fits.
        if (!store.writeResourceFork(span, std::uint32_t(done), error)) {
            return false;
        }
        done += got;
    }
    return true;
}

}  // namespace

bool GWAppleFileDecoder::mergeAppleDoubleFileAtURL(const GWURL& appleDouble, const GWURL& dataFile,
                                                   GWErrorPtr* error, const std::string& entryPath,
                                                   const GWExtractOptions& options) const {
    if (!appleDouble.isFileURL() || !dataFile.isFileURL()) {
        return GWFail(error, GWPOSIXError(EINVAL));
    }
    const auto file = GWFileDescriptor::open(appleDouble.path().c_str(), O_RDONLY);
    if (!file.isValid()) {
        return GWFail(error, GWPOSIXError(errno));
    }
    const std::string dataPath = dataFile.path();
    struct stat dataInfo {};
    if (::lstat(dataPath.c_str(), &dataInfo) != 0) {
        return GWFail(error, GWPOSIXError(errno));
    }
    // Everything is read and checked before the data file is touched, so a
    // malformed file changes nothing.
    GWAppleDoubleContents contents;
    if (!GWReadAppleDouble(file.get(), contents, error)) {
        return false;
    }
    GWMetadataStore store(dataPath);
    for (const auto& attribute : contents.attributes) {
        // A name that reads as another Linux namespace (security.capability,
        // trusted.*, system.posix_acl_access) would reach past the file's
        // user metadata.
        if (!GWMayExtractAttribute(GWLinuxAttributeName(attribute.name),
                                   entryPath.empty() ? dataPath : entryPath, options)) {
            continue;
        }
        if (!store.setAttribute(attribute.name, attribute.value, error)) {
            return false;
        }
    }
    const auto& finderInfo = contents.finderInfo;
    if (finderInfo &&
        std::any_of(finderInfo->begin(), finderInfo->end(), [](auto b) { return b; })) {
        if (!store.setAttribute(kGWFinderInfoAttributeName, *finderInfo, error)) {
            return false;
        }
    }
    if (contents.comment && !contents.comment->empty()) {
        const auto text = commentText(*contents.comment);
        const auto* bytes = reinterpret_cast<const std::uint8_t*>(text ? text->data() : nullptr);
        if (text &&
            !store.setAttribute(kGWCommentAttributeName, std::span(bytes, text->size()), error)) {
            return false;
        }
    }
    if (contents.resourceFork && contents.resourceFork->length > 0) {
        return copyResourceFork(file.get(), *contents.resourceFork, store, error);
    }
    return true;
}
