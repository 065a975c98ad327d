#pragma once

#include "GWExport.h"

// Version and the constants of the library's own error domains.

extern GW_EXPORT const double GWArchiveSupportVersionNumber;
extern GW_EXPORT const char* const GWArchiveSupportVersionString;

extern GW_EXPORT const char* const kGWZipArchiveErrorDomain;
extern GW_EXPORT const char* const kGWZipArchiveUnknownEntityErrorKey;

extern GW_EXPORT const char* const kGWXARArchiveErrorDomain;
extern GW_EXPORT const char* const kGWXARArchiveUnknownEntityErrorKey;
extern GW_EXPORT const char* const kGWXARArchiveAffectedXMLNodeErrorKey;

// Codes of kGWZipArchiveErrorDomain.
enum GWZipArchiveErrorCode : long {
    GWZipArchiveUnsupportedCompressionMethodError = 1,
    GWZipArchiveUnknownExtraFieldError = 2,
    GWZipArchiveUnknownExtraFieldVersionError = 3,
    // An entry that would be written, linked or removed outside the directory
    // the caller named: through a symbolic link, or by a name that climbs out.
    // kGWZipArchiveUnknownEntityErrorKey holds the entry's path.
    GWZipArchiveEntryOutsideDestinationError = 4,
    // The decoded data does not match the entry's stored CRC-32. Nothing of
    // it is left on disk. kGWZipArchiveUnknownEntityErrorKey holds the path.
    GWZipArchiveChecksumMismatchError = 5,
    // The entry decodes to more or fewer bytes than its declared size;
    // decoding stops at the declared size. The detail holds the path.
    GWZipArchiveSizeMismatchError = 6,
    // The entry's data overlaps another entry's (several records sharing one
    // local header, or ranges that cross): the shape of a zip bomb, refused
    // when the archive is opened. The detail holds the path.
    GWZipArchiveOverlappingEntriesError = 7,
    // The entry is encrypted and no password was given. Nothing of it is
    // written. The detail holds the path.
    GWZipArchivePasswordRequiredError = 8,
    // The password does not open the entry: the check byte of its
    // encryption header or its AES password verifier does not match. A wrong
    // password passes the one-byte check once in 256 times and then fails as
    // damaged data. The detail holds the path.
    GWZipArchiveWrongPasswordError = 9,
    // An AES entry's data does not match its authentication code: changed
    // after it was encrypted, or a wrong password that passed the verifier.
    // Nothing of it is left on disk. The detail holds the path.
    GWZipArchiveAuthenticationFailedError = 10,
};

// Codes of kGWXARArchiveErrorDomain. 0, 8, 9 and 18 are never raised.
enum GWXARArchiveErrorCode : long {
    GWXARArchiveSkippedEntryError = -1,  // internal: an entry that is dropped, never reported
    GWXARArchiveNotXARFileError = 1,
    GWXARArchiveUnsupportedVersionError = 2,
    GWXARArchiveFileNotInArchiveError = 3,
    GWXARArchiveNoSuchExtendedAttributeError = 4,
    GWXARArchiveInvalidTOCChecksumError = 5,
    GWXARArchiveInvalidSignatureError = 6,
    GWXARArchiveUntrustedCertificateError = 7,
    GWXARArchiveUnknownFlagError = 10,
    GWXARArchiveUnsupportedFileTypeError = 11,
    GWXARArchiveUnknownChecksumError = 12,
    GWXARArchiveUnsupportedCompressionError = 13,
    GWXARArchiveUnknownSignatureStyleError = 14,
    GWXARArchiveHardLinkTargetNotFoundError = 15,
    GWXARArchiveMissingElementError = 16,
    GWXARArchiveMissingAttributeError = 17,
    GWXARArchiveMissingCertificateError = 19,
    GWXARArchiveMalformedValueError = 20,
    // An item that would be created, linked or changed outside the destination
    // the caller named: a name with ".." or "/", or a hard link or path leading
    // through a symbolic link to elsewhere. kGWXARArchiveUnknownEntityErrorKey
    // holds the item's path.
    GWXARArchiveEntryOutsideDestinationError = 21,
    // A character or block device asked for (GWExtractOptions::createDevices),
    // refused without the privileges to create device nodes on purpose.
    // kGWXARArchiveUnknownEntityErrorKey holds the item's path.
    GWXARArchiveDeviceNotPermittedError = 22,
    // A stored stream decodes to more or fewer bytes than its <size> element
    // says; decoding stops at that size. The detail holds the size.
    GWXARArchiveSizeMismatchError = 23,
};
