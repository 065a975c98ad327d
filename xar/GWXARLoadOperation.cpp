#include "GWXARLoadOperation.h"

#include <sstream>

#include "GWArchiveSupport/GWArchiveConstants.h"
#include "GWXARArchive.h"

namespace {

// What each code of the XAR domain means, for error descriptions.
const char* xarErrorText(long code) {
    switch (code) {
        case GWXARArchiveSkippedEntryError: return "The entry is skipped";
        case GWXARArchiveNotXARFileError: return "The file is not a XAR archive";
        case GWXARArchiveUnsupportedVersionError: return "Unsupported XAR version";
        case GWXARArchiveFileNotInArchiveError: return "The entry does not belong to this archive";
        case GWXARArchiveNoSuchExtendedAttributeError: return "No extended attribute of that name";
        case GWXARArchiveInvalidTOCChecksumError:
            return "The table of contents checksum is missing or does not match";
        case GWXARArchiveInvalidSignatureError: return "The signature does not verify";
        case GWXARArchiveUntrustedCertificateError: return "The certificate is not trusted";
        case GWXARArchiveUnknownFlagError: return "Unknown file flag";
        case GWXARArchiveUnsupportedFileTypeError: return "The entry's type cannot be extracted";
        case GWXARArchiveUnknownChecksumError: return "Unknown checksum algorithm";
        case GWXARArchiveUnsupportedCompressionError: return "Unsupported compression";
        case GWXARArchiveUnknownSignatureStyleError: return "Unknown signature style";
        case GWXARArchiveHardLinkTargetNotFoundError: return "Hard link target not found";
        case GWXARArchiveMissingElementError: return "Required element missing";
        case GWXARArchiveMissingAttributeError: return "Required attribute missing";
        case GWXARArchiveMissingCertificateError: return "The signature has no certificates";
        case GWXARArchiveMalformedValueError: return "Malformed value";
        default: return nullptr;
    }
}

std::string xmlText(const pugi::xml_node& node) {
    std::ostringstream stream;
    node.print(stream, "", pugi::format_raw);
    return stream.str();
}

}  // namespace

GWXARLoadOperationPtr GWXARLoadOperation::initWithArchive(
    const std::shared_ptr<GWXARArchive>& archive, bool failOnInvalidSignature) {
    auto operation = std::make_shared<GWXARLoadOperation>();
    operation->archive_ = archive;
    operation->failOnInvalidSignature_ = failOnInvalidSignature;
    if (archive && archive->ref()) {
        operation->archiveURL_ = archive->URL();
    }
    return operation;
}

GWErrorPtr GWXARLoadOperation::errorWithDomain(std::string_view domain, long code,
                                               const std::optional<std::string>& unknownEntity,
                                               const pugi::xml_node& node) const {
    GWDictionary details;
    if (unknownEntity) {
        details[kGWXARArchiveUnknownEntityErrorKey] = *unknownEntity;
    }
    if (node) {
        details[kGWXARArchiveAffectedXMLNodeErrorKey] = xmlText(node);
    }
    const char* text = domain == kGWXARArchiveErrorDomain ? xarErrorText(code) : nullptr;
    if (!text) {
        return GWGenerateError(domain, code, archiveURL_, nullptr, std::move(details));
    }
    // Name the offending value and where it was found, so the message stands alone.
    std::string description = text;
    if (unknownEntity) {
        description += ": \"" + *unknownEntity + "\"";
    }
    if (node) {
        description += std::string(" in <") + node.name() + ">";
    }
    if (archiveURL_ && !archiveURL_->isEmpty()) {
        description +=
            " (" +
            (archiveURL_->isFileURL() ? archiveURL_->path() : archiveURL_->absoluteString()) + ")";
    }
    return GWGenerateError(domain, code, archiveURL_, nullptr, std::move(details), "%s",
                           description.c_str());
}

GWErrorPtr GWXARLoadOperation::errorWithCode(long code,
                                             const std::optional<std::string>& unknownEntity,
                                             const pugi::xml_node& node) const {
    return errorWithDomain(kGWXARArchiveErrorDomain, code, unknownEntity, node);
}

GWErrorPtr GWXARLoadOperation::cancelledError() const {
    return GWGenerateError(kGWCocoaErrorDomain, GWUserCancelledError, archiveURL_, nullptr, {});
}

bool GWXARLoadOperation::chargeTOCMemory(std::uint64_t bytes, GWErrorPtr* error) {
    if (bytes > kMaxTOCMemory - tocMemoryUsed_) {
        return GWFail(error, GWGenerateError(kGWCocoaErrorDomain, GWFileReadCorruptFileError,
                                             archiveURL_, nullptr, {},
                                             "The XAR table of contents describes more entries "
                                             "than fit in the %llu MiB allowed for them",
                                             (unsigned long long)(kMaxTOCMemory >> 20)));
    }
    tocMemoryUsed_ += bytes;
    return true;
}
