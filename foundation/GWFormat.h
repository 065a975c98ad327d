#pragma once

#include <cstdarg>
#include <string>

// printf-style formatting into a string.
std::string GWFormatV(const char* format, va_list arguments);
std::string GWFormat(const char* format, ...) __attribute__((format(printf, 1, 2)));
