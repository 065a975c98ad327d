#pragma once

#include <functional>
#include <string>

// The library's log: one line per call, to standard error unless a sink is set.
void GWLog(const char* format, ...) __attribute__((format(printf, 1, 2)));

using GWLogSink = std::function<void(const std::string& line)>;
// Replaces the sink (none restores standard error) and returns the previous one.
GWLogSink GWSetLogSink(GWLogSink sink);
