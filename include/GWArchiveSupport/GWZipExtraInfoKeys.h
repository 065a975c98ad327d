#pragma once

// Keys of a ZIP entry's extra-info dictionary: what its extra fields said
// about it. Keys that begin with "UTC" hold dates whose source was in UTC;
// the plain date keys come from local-time (classic Mac) sources.

// Zip64 extended information.
inline constexpr const char* kGWZipLocalHeaderOffsetKey = "LocalHeaderOffset";
inline constexpr const char* kGWZipCompressedSizeKey = "CompressedSize";
inline constexpr const char* kGWZipUncompressedSizeKey = "UncompressedSize";

// Dates (GWDate values).
inline constexpr const char* kGWZipUTCModificationDateKey = "UTCModificationDate";
inline constexpr const char* kGWZipUTCAccessDateKey = "UTCAccessDate";
inline constexpr const char* kGWZipUTCCreationDateKey = "UTCCreationDate";
inline constexpr const char* kGWZipUTCBackupDateKey = "UTCBackupDate";
inline constexpr const char* kGWZipCreationDateKey = "CreationDate";
inline constexpr const char* kGWZipModificationDateKey = "ModificationDate";
inline constexpr const char* kGWZipBackupDateKey = "BackupDate";
inline constexpr const char* kGWZipAccessDateKey = "AccessDate";

// POSIX information.
inline constexpr const char* kGWZipUserIDKey = "UserID";
inline constexpr const char* kGWZipGroupIDKey = "GroupID";
inline constexpr const char* kGWZipPermissionsModeKey = "PermissionsMode";
inline constexpr const char* kGWZipSymbolicLinkFilenameKey = "SymbolicLinkFilename";
inline constexpr const char* kGWZipCRC32Key = "CRC32";

// The central field abbreviates a richer one in the local header.
inline constexpr const char* kGWZipMoreInfoAvailableInLocalHeaderKey =
    "MoreInfoAvailableInLocalHeader";

// WinZip AES encryption (numbers): the vendor version (1: AE-1, whose CRC is
// checked; 2: AE-2, whose CRC is left 0), the key strength (1, 2, 3: 128,
// 192, 256 bits) and the compression method under the encryption.
inline constexpr const char* kGWZipAESVendorVersionKey = "AESVendorVersion";
inline constexpr const char* kGWZipAESStrengthKey = "AESStrength";
inline constexpr const char* kGWZipAESCompressionMethodKey = "AESCompressionMethod";

// Finder information.
inline constexpr const char* kGWZipTypeCodeKey = "TypeCode";        // 4-character string
inline constexpr const char* kGWZipCreatorCodeKey = "CreatorCode";  // 4-character string
inline constexpr const char* kGWZipFinderFlagsKey = "FinderFlags";
inline constexpr const char* kGWZipExtendedFinderFlagsKey = "ExtendedFinderFlags";
inline constexpr const char* kGWZipVerticalIconLocationKey = "VerticalIconLocation";
inline constexpr const char* kGWZipHorizontalIconLocationKey = "HorizontalIconLocation";
inline constexpr const char* kGWZipFolderContainingFileKey = "FolderContainingFile";
inline constexpr const char* kGWZipIconIDKey = "FXInfo.fdIconID";
inline constexpr const char* kGWZipScriptKey = "FXInfo.fdScript";
inline constexpr const char* kGWZipExtendedFlagsKey = "FXInfo.fdXFlags";
inline constexpr const char* kGWZipCommentIDKey = "FXInfo.fdComment";
inline constexpr const char* kGWZipPutAwayFolderKey = "FXInfo.fdPutAway";
inline constexpr const char* kGWZipVersionNumberKey = "VersionNumber";
inline constexpr const char* kGWZipAccessRightsKey = "AccessRights";

// Names and comments (strings).
inline constexpr const char* kGWZipHFSPathKey = "HFSPath";
inline constexpr const char* kGWZipPOSIXPathKey = "POSIXPath";
inline constexpr const char* kGWZipFilenameKey = "Filename";
inline constexpr const char* kGWZipDontChangeFilenameKey = "DontChangeFilename";
inline constexpr const char* kGWZipCommentKey = "Comment";

// How the entry's data is to be treated (booleans).
inline constexpr const char* kGWZipIsResourceForkKey = "IsResourceFork";
inline constexpr const char* kGWZipIsMacBinaryEncodedKey = "IsMacBinaryEncoded";
inline constexpr const char* kGWZipAutomaticallyOpenKey = "AutomaticallyOpen";
