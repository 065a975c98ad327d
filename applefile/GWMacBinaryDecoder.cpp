#include <sys/stat.h>

#include <algorithm>
#include <array>
#include <cerrno>

#include "GWAppleFileDecoder.h"
#include "GWMacBinaryHeader.h"
#include "foundation/GWConversions.h"
#include "foundation/GWDate.h"
#include "foundation/GWFileDescriptor.h"
#include "foundation/GWFileInfo.h"
#include "foundation/GWMetadataStore.h"
#include "foundation/GWStringEncoding.h"

namespace {

constexpr std::size_t kPieceLength = 10240;

// Forks are padded to a multiple of 128 bytes. A length that already is one
// is followed by a full 128 bytes of skip here; files this decoder has always
// accepted depend on it.
constexpr std::uint64_t paddingAfter(std::uint64_t length) {
    return 128 - length % 128;
}

// A new empty file, made under a temporary name and renamed into place.
bool writeEmptyFileAtomically(const std::string& path, const GWURL& url, GWErrorPtr* error) {
    const auto slash = path.rfind('/');
    const std::string temporary =
        path.substr(0, slash + 1) + ".gw-" + GWUniqueID() + "-" + path.substr(slash + 1);
    auto file = GWFileDescriptor::open(temporary.c_str(), O_WRONLY | O_CREAT | O_EXCL, 0666);
    if (!file.isValid()) {
        return GWFail(error, GWPOSIXError(errno, url));
    }
    file.reset();
    if (::rename(temporary.c_str(), path.c_str()) != 0) {
        const int number = errno;
        ::unlink(temporary.c_str());
        return GWFail(error, GWPOSIXError(number, url));
    }
    return true;
}

// Reads one piece of a fork; a piece that is not there in full cannot be read.
bool readPiece(int fd, std::uint64_t offset, std::span<std::uint8_t> piece, GWErrorPtr* error) {
    std::size_t got = 0;
    if (!GWReadFully(fd, offset, piece, got) || got != piece.size()) {
        return GWFail(error, GWCocoaError(GWFileReadUnknownError));
    }
    return true;
}

}  // namespace

bool GWAppleFileDecoder::decodeMacBinaryFileAtURL(const GWURL& from, const std::optional<GWURL>& to,
                                                  GWErrorPtr* error) const {
    if (!to || to->isEmpty()) {
        return GWFail(error, GWPOSIXError(EINVAL));
    }
    if (!to->isFileURL()) {
        return GWFail(error, GWCocoaError(GWFileWriteUnsupportedSchemeError, *to));
    }
    if (!from.isFileURL()) {
        return GWFail(error, GWCocoaError(GWFileReadUnsupportedSchemeError, from));
    }
    const std::string source = from.path();
    const std::string destination = to->path();

    struct stat sourceInfo {};
    if (::stat(source.c_str(), &sourceInfo) != 0) {
        return GWFail(error, GWPOSIXError(errno, from));
    }
    // Like the platform's file-size value, which a folder does not have.
    const std::uint64_t sourceSize = S_ISREG(sourceInfo.st_mode) ? sourceInfo.st_size : 0;

    struct stat destinationInfo {};
    if (::stat(destination.c_str(), &destinationInfo) == 0 && S_ISDIR(destinationInfo.st_mode)) {
        return GWFail(error, GWCocoaError(GWFileIsDirectoryError, *to));
    }
    if (::lstat(destination.c_str(), &destinationInfo) == 0) {
        // The old item's side file goes with it, or its metadata would cling to the new file.
        if (::unlink(destination.c_str()) != 0) {
            return GWFail(error, GWPOSIXError(errno, *to));
        }
        if (!GWMetadataStore::removeMetadata(destination, error)) {
            return false;
        }
    } else if (errno != ENOENT) {
        return GWFail(error, GWPOSIXError(errno, *to));
    }
    if (!writeEmptyFileAtomically(destination, *to, error)) {
        return false;
    }
    if (sourceSize < kGWMacBinaryHeaderLength) {
        return GWFail(error, GWCocoaError(GWFileReadCorruptFileError, from));
    }

    const auto input = GWFileDescriptor::open(source.c_str(), O_RDONLY);
    if (!input.isValid()) {
        return GWFail(error, GWPOSIXError(errno, from));
    }
    const auto output = GWFileDescriptor::open(destination.c_str(), O_WRONLY);
    if (!output.isValid()) {
        return GWFail(error, GWPOSIXError(errno, *to));
    }

    std::array<std::uint8_t, kGWMacBinaryHeaderLength> headerBytes{};
    std::size_t got = 0;
    if (!GWReadFully(input.get(), 0, headerBytes, got)) {
        return GWFail(error, GWPOSIXError(errno, from));
    }
    if (got < headerBytes.size()) {
        return GWFail(error, GWCocoaError(GWFileReadCorruptFileError, from));
    }
    GWMacBinaryHeader header;
    if (!GWParseMacBinaryHeader(headerBytes, from, header, error)) {
        return false;
    }
    std::uint64_t offset = kGWMacBinaryHeaderLength + header.secondaryHeaderLength;

    GWData piece(kPieceLength);
    if (header.dataForkLength != 0) {
        for (std::uint64_t done = 0; done < header.dataForkLength;) {
            const auto span = std::span(piece).first(
                std::size_t(std::min<std::uint64_t>(kPieceLength, header.dataForkLength - done)));
            if (!readPiece(input.get(), offset + done, span, error)) {
                return false;
            }
            if (!GWWriteFully(output.get(), done, span)) {
                return GWFail(error, GWPOSIXError(errno, *to));
            }
            done += span.size();
        }
        offset += header.dataForkLength + paddingAfter(header.dataForkLength);
    }

    if (header.resourceForkLength != 0) {
        struct stat existing {};
        if (::stat(destination.c_str(), &existing) != 0) {
            auto created = GWFileDescriptor::open(destination.c_str(), O_WRONLY | O_CREAT, 0666);
            if (!created.isValid()) {
                return GWFail(error, GWPOSIXError(errno, *to));
            }
        }
        GWMetadataStore store(output.get(), destination);
        for (std::uint32_t position = 0; position < header.resourceForkLength;) {
            const auto span = std::span(piece).first(std::size_t(
                std::min<std::uint64_t>(kPieceLength, header.resourceForkLength - position)));
            if (!readPiece(input.get(), offset + position, span, error) ||
                !store.writeResourceFork(span, position, error)) {
                return false;
            }
            position += std::uint32_t(span.size());
        }
        offset += header.resourceForkLength + paddingAfter(header.resourceForkLength);
    }

    std::optional<std::string> comment;
    if (header.commentLength != 0) {
        // Bounded by what the source still holds, not by the length field alone.
        GWData bytes(std::size_t(std::min<std::uint64_t>(
            header.commentLength, offset < sourceSize ? sourceSize - offset : 0)));
        if (!GWReadFully(input.get(), offset, bytes, got)) {
            return GWFail(error, GWPOSIXError(errno, from));
        }
        bytes.resize(got);
        comment = GWStringFromBytes(bytes, GWStringEncoding::MacOSRoman);
    }

    auto info = GWFileInfo::initWithURL(*to, error);
    if (!info) {
        return false;
    }
    const GWDate reference = GWDate::gregorianDateWithYear(1904, 1, 1, 0, 0, 0);
    info->setCreatorCode(header.creatorCode);
    info->setTypeCode(header.typeCode);
    info->setFinderFlags(header.finderFlags);
    info->setExtendedFinderFlags(header.extendedFinderFlags);
    info->setLocation((std::uint32_t(header.horizontalPosition) << 16) | header.verticalPosition);
    info->setCreationDate(reference.dateByAddingTimeInterval(header.creationDate));
    info->setModificationDate(reference.dateByAddingTimeInterval(header.modificationDate));
    if (!info->applyToURL(*to, error)) {
        return false;
    }
    if (comment && !comment->empty()) {
        GWSetSpotlightComments(*comment, *to, nullptr);
    }
    return true;
}
