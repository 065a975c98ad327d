#pragma once

#include <cstddef>
#include <cstdint>
#include <span>
#include <string>

#include "foundation/GWURL.h"

// What every fuzz target shares: the input as a file the library can open,
// a quiet log and a private scratch folder.
namespace gwfuzz {

// Discards the library's log lines; call once per process.
void silenceLog();

// The input as the only contents of an in-memory file, reached through
// /proc/self/fd so the library opens it like any other path. The same file
// is rewritten on every call.
GWURL urlWithContents(std::span<const std::uint8_t> bytes);

// A folder of this process's own, removed when the process exits.
const std::string& scratchDirectory();

// Removes everything below `path` (which itself stays).
void emptyDirectory(const std::string& path);

}  // namespace gwfuzz
