#pragma once

#include <optional>
#include <string>
#include <string_view>

#include "GWArchiveSupport/GWArchiveSupport.h"

namespace gwarchive {

// `text` with every control character (C0, DEL and the C1 range in UTF-8)
// written as a backslash and three octal digits, so that nothing read from
// an archive can move the cursor or forge a line on the user's terminal.
std::string printable(std::string_view text);

enum ExitStatus : int { kExitSuccess = 0, kExitFailure = 1, kExitUsage = 2 };

// What went wrong in plain words, with " (domain code)" after it when verbose.
std::string describeError(const GWErrorPtr& error);
// "gwarchive: ARCHIVE[: PATH]: what went wrong" on standard error.
void reportError(const std::string& archive, const std::optional<std::string>& path,
                 const GWErrorPtr& error);
// The same line for a failure that has no library error behind it.
void reportFailure(const std::string& archive, const std::optional<std::string>& path,
                   const std::string& message);

// Says what is wrong with an archive the command still works on; the command
// then ends with kExitFailure however well the rest goes.
void reportDamage(const std::string& archive, const std::string& message);
int exitStatusAfterDamage(int status);

// The library logs only when asked to: its lines are for debugging, not for
// people reading the tool's errors.
void setVerbose(bool verbose);
bool isVerbose();

}  // namespace gwarchive
