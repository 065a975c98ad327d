#pragma once

#include <memory>
#include <optional>
#include <string>

#include "GWZipFile.h"
#include "foundation/GWError.h"
#include "foundation/GWStreamPipeline.h"

struct GWZipLocalFileHeader;

// The stage that decrypts an entry's stored bytes (traditional PKWARE
// encryption or WinZip AES), or none without an error for an entry stored in
// the clear. Without a password it fails with
// GWZipArchivePasswordRequiredError; the stage itself reports a wrong
// password when the header arrives and a failed authentication at the end.
// The local header says which check byte the traditional header carries.
std::unique_ptr<GWStreamDecryptor> GWZipDecryptorForFile(const GWZipFile& file,
                                                         const GWZipLocalFileHeader& header,
                                                         const std::optional<std::string>& password,
                                                         GWErrorPtr* error);
