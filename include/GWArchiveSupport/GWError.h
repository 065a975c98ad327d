#pragma once

#include <memory>
#include <optional>
#include <string>
#include <string_view>

#include "GWExport.h"
#include "GWURL.h"
#include "GWValue.h"

// The platform domains the library reports in, beside its own two.
extern GW_EXPORT const char* const kGWCocoaErrorDomain;     // "NSCocoaErrorDomain"
extern GW_EXPORT const char* const kGWPOSIXErrorDomain;     // "NSPOSIXErrorDomain"
extern GW_EXPORT const char* const kGWOSStatusErrorDomain;  // "NSOSStatusErrorDomain"
extern GW_EXPORT const char* const GWSecurityErrorDomain;   // status codes of the security services

// Codes of kGWCocoaErrorDomain.
enum GWCocoaErrorCode : long {
    GWFileReadUnknownError = 256,
    GWFileReadCorruptFileError = 259,
    GWFileReadUnsupportedSchemeError = 262,
    GWFileWriteUnknownError = 512,
    GWFileWriteUnsupportedSchemeError = 518,
    GWUserCancelledError = 3072,
    GWFileIsDirectoryError = -1101,
};

class GWError;
using GWErrorPtr = std::shared_ptr<const GWError>;

// An immutable error: domain and code are the contract, the rest explains.
class GW_EXPORT GWError {
public:
    GWError(std::string domain, long code, std::optional<GWURL> url, GWErrorPtr underlying,
            GWDictionary details, std::string description);

    const std::string& domain() const { return domain_; }
    long code() const { return code_; }
    const std::optional<GWURL>& URL() const { return url_; }
    const GWErrorPtr& underlyingError() const { return underlying_; }
    const GWDictionary& userInfo() const { return details_; }
    const std::string& localizedDescription() const { return description_; }

    bool is(std::string_view domain, long code) const { return domain_ == domain && code_ == code; }
    // The detail under `key` as text, or empty.
    std::string detailString(const std::string& key) const;

private:
    std::string domain_;
    long code_;
    std::optional<GWURL> url_;
    GWErrorPtr underlying_;
    GWDictionary details_;
    std::string description_;
};

// Builds every error of the library. Without a format the description is
// written from domain and code (for POSIX, the system's text for the number).
GW_EXPORT GWErrorPtr GWGenerateError(std::string_view domain, long code,
                                     const std::optional<GWURL>& url, GWErrorPtr underlying,
                                     GWDictionary details);
GW_EXPORT GWErrorPtr GWGenerateError(std::string_view domain, long code,
                                     const std::optional<GWURL>& url, GWErrorPtr underlying,
                                     GWDictionary details, const char* format, ...)
    __attribute__((format(printf, 6, 7)));

// Shorthands for the two platform domains used most.
GW_EXPORT GWErrorPtr GWCocoaError(long code, const std::optional<GWURL>& url = std::nullopt);
GW_EXPORT GWErrorPtr GWPOSIXError(int number, const std::optional<GWURL>& url = std::nullopt);

// Stores `error` where the caller asked for it and returns false, so that a
// failing path reads `return GWFail(error, ...)`.
inline bool GWFail(GWErrorPtr* out, GWErrorPtr error) {
    if (out) {
        *out = std::move(error);
    }
    return false;
}
