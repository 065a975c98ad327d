#pragma once

#include <string>
#include <string_view>
#include <vector>

// Path rules of XAR entry names, and the order entries are listed in.

// The components of a "/"-separated path: a leading "/" is a component of its
// own; repeated and trailing separators give no empty components.
std::vector<std::string> GWXARPathComponents(std::string_view path);

// `base` + "/" + `component`, without doubling a separator; either side may be empty.
std::string GWXARAppendingPathComponent(std::string_view base, std::string_view component);

// Negative, zero or positive as `a` sorts before, with or after `b`: letters
// compare case-insensitively in the current locale, and runs of digits by
// their value (file2 before file10).
int GWXARCompareNames(std::string_view a, std::string_view b);
