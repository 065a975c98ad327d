#pragma once

#include <functional>
#include <optional>
#include <string>

#include "GWError.h"

// What an extraction of either format does about items already on disk and
// about entries that fail. The defaults are what the calls without options do.
struct GWExtractOptions {
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
};
