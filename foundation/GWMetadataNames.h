#pragma once

#include <string>
#include <string_view>

// Mac attribute names and their Linux counterparts. A Mac attribute N is kept
// as "user.N"; a name that already carries a Linux namespace stays as it is.
inline constexpr std::string_view kGWResourceForkAttributeName = "com.apple.ResourceFork";
inline constexpr std::string_view kGWFinderInfoAttributeName = "com.apple.FinderInfo";
// The freedesktop convention for a file's comment, as a Mac name ("user.xdg.comment" on Linux).
inline constexpr std::string_view kGWCommentAttributeName = "xdg.comment";

std::string GWLinuxAttributeName(std::string_view name);
// The inverse: "user.N" gives N; names in other namespaces stay as they are.
std::string GWMacAttributeName(std::string_view linuxName);
