#pragma once

// Version and the constants of the library's own error domains.

extern const double GWArchiveSupportVersionNumber;
extern const char* const GWArchiveSupportVersionString;

extern const char* const kGWZipArchiveErrorDomain;
extern const char* const kGWZipArchiveUnknownEntityErrorKey;

extern const char* const kGWXARArchiveErrorDomain;
extern const char* const kGWXARArchiveUnknownEntityErrorKey;
extern const char* const kGWXARArchiveAffectedXMLNodeErrorKey;

// Codes of kGWZipArchiveErrorDomain.
enum GWZipArchiveErrorCode : long {
    GWZipArchiveUnsupportedCompressionMethodError = 1,
    GWZipArchiveUnknownExtraFieldError = 2,
    GWZipArchiveUnknownExtraFieldVersionError = 3,
};
