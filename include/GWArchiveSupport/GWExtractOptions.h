#pragma once

#include <cstddef>
#include <functional>
#include <optional>
#include <string>

#include "GWError.h"
#include "GWExport.h"

// What an extraction of either format does about items already on disk and
// about entries that fail. The defaults are what the calls without options do.
struct GW_EXPORT GWExtractOptions {
    // Whether an entry may replace an item already at its destination; none:
    // what the mode does (an atomic move never replaces, writing in place
    // does). An existing directory is merged into either way: a directory
    // entry never removes what is there.
    std::optional<bool> replaceExisting;
    // Whether the other entries go on after one fails; otherwise the first
    // failure cancels the rest.
    bool continueAfterFailure = false;
    // Told of each entry that fails, with its path in the archive, as it happens.
    std::function<void(const std::string& entryPath, const GWErrorPtr& error)> entryFailed;
    // Told of each entry once it is written, with its path in the archive.
    std::function<void(const std::string& entryPath)> entryWritten;
    // Leading components of the entries' paths not recreated below the
    // destination; an entry named with no more components than this fails.
    std::size_t strippedComponents = 0;

    // What an archive may grant on disk. Each is off by default: archives
    // from strangers are unpacked as root too, and none of these should come
    // from one unasked. Owner and group are restored only for root either way.
    // Set-user-ID, set-group-ID and sticky bits; otherwise dropped.
    bool keepSetIDBits = false;
    // Character and block devices; otherwise left out with a note.
    bool createDevices = false;
    // Extended attributes outside "user." ("trusted.", "security.",
    // "system."); otherwise left out with a note. ACLs come from their own
    // elements either way.
    bool privilegedAttributes = false;
    // Immutable and append-only inode flags; otherwise not set (nodump is).
    bool keepPinningFlags = false;
    // Told of each device or attribute left out for want of its switch, with
    // the entry's path in the archive and what was left out.
    std::function<void(const std::string& entryPath, const std::string& what)> withheld;

    // --- Encryption ---------------------------------------------------------
    // What opens encrypted entries; none: the archive's own (ZIP), else they
    // fail as needing a password. Formats without encryption ignore it.
    std::optional<std::string> password;
};
