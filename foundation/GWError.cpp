#include "GWError.h"

#include <cstdarg>
#include <cstring>

#include "GWArchiveSupport/GWArchiveConstants.h"
#include "GWFormat.h"

const char* const kGWCocoaErrorDomain = "NSCocoaErrorDomain";
const char* const kGWPOSIXErrorDomain = "NSPOSIXErrorDomain";
const char* const kGWOSStatusErrorDomain = "NSOSStatusErrorDomain";
const char* const GWSecurityErrorDomain = "GWSecurityErrorDomain";

namespace {

std::string cocoaText(long code) {
    switch (code) {
        case GWFileReadUnknownError: return "The file could not be read";
        case GWFileReadCorruptFileError: return "The file is corrupt or in an unreadable format";
        case GWFileReadUnsupportedSchemeError: return "The location is not a readable file";
        case GWFileWriteUnknownError: return "The file could not be written";
        case GWFileWriteUnsupportedSchemeError: return "The destination is not a file location";
        case GWUserCancelledError: return "The operation was cancelled";
        case GWFileIsDirectoryError: return "The destination is a folder";
        default: return "Cocoa error " + std::to_string(code);
    }
}

std::string zipText(long code) {
    switch (code) {
        case GWZipArchiveUnsupportedCompressionMethodError: return "Unsupported compression method";
        case GWZipArchiveUnknownExtraFieldError: return "Unknown extra field";
        case GWZipArchiveUnknownExtraFieldVersionError: return "Unknown extra field version";
        default: return "ZIP archive error " + std::to_string(code);
    }
}

std::string defaultDescription(std::string_view domain, long code,
                               const std::optional<GWURL>& url) {
    std::string text;
    if (domain == kGWPOSIXErrorDomain) {
        text = std::strerror(int(code));
    } else if (domain == kGWCocoaErrorDomain) {
        text = cocoaText(code);
    } else if (domain == kGWZipArchiveErrorDomain) {
        text = zipText(code);
    } else {
        text = std::string(domain) + " error " + std::to_string(code);
    }
    if (url && !url->isEmpty()) {
        text += " (" + (url->isFileURL() ? url->path() : url->absoluteString()) + ")";
    }
    return text;
}

}  // namespace

GWError::GWError(std::string domain, long code, std::optional<GWURL> url, GWErrorPtr underlying,
                 GWDictionary details, std::string description)
    : domain_(std::move(domain)),
      code_(code),
      url_(std::move(url)),
      underlying_(std::move(underlying)),
      details_(std::move(details)),
      description_(std::move(description)) {}

std::string GWError::detailString(const std::string& key) const {
    const GWValue* value = GWDictionaryValue(details_, key);
    return value ? value->description() : std::string();
}

GWErrorPtr GWGenerateError(std::string_view domain, long code, const std::optional<GWURL>& url,
                           GWErrorPtr underlying, GWDictionary details) {
    std::string description = defaultDescription(domain, code, url);
    return std::make_shared<const GWError>(std::string(domain), code, url, std::move(underlying),
                                           std::move(details), std::move(description));
}

GWErrorPtr GWGenerateError(std::string_view domain, long code, const std::optional<GWURL>& url,
                           GWErrorPtr underlying, GWDictionary details, const char* format, ...) {
    va_list arguments;
    va_start(arguments, format);
    std::string description = GWFormatV(format, arguments);
    va_end(arguments);
    return std::make_shared<const GWError>(std::string(domain), code, url, std::move(underlying),
                                           std::move(details), std::move(description));
}

GWErrorPtr GWCocoaError(long code, const std::optional<GWURL>& url) {
    return GWGenerateError(kGWCocoaErrorDomain, code, url, nullptr, {});
}

GWErrorPtr GWPOSIXError(int number, const std::optional<GWURL>& url) {
    return GWGenerateError(kGWPOSIXErrorDomain, number, url, nullptr, {});
}
