#include "GWLog.h"

#include <cstdarg>
#include <cstdio>
#include <mutex>

#include "GWFormat.h"

namespace {

std::mutex& sinkMutex() {
    static std::mutex mutex;
    return mutex;
}

GWLogSink& currentSink() {
    static GWLogSink sink;
    return sink;
}

}  // namespace

std::string GWFormatV(const char* format, va_list arguments) {
    va_list copy;
    va_copy(copy, arguments);
    const int length = std::vsnprintf(nullptr, 0, format, copy);
    va_end(copy);
    if (length <= 0) {
        return std::string();
    }
    std::string text(std::size_t(length) + 1, '\0');
    std::vsnprintf(text.data(), text.size(), format, arguments);
    text.resize(std::size_t(length));
    return text;
}

std::string GWFormat(const char* format, ...) {
    va_list arguments;
    va_start(arguments, format);
    std::string text = GWFormatV(format, arguments);
    va_end(arguments);
    return text;
}

void GWLog(const char* format, ...) {
    va_list arguments;
    va_start(arguments, format);
    const std::string line = GWFormatV(format, arguments);
    va_end(arguments);
    std::lock_guard<std::mutex> lock(sinkMutex());
    if (currentSink()) {
        currentSink()(line);
    } else {
        std::fprintf(stderr, "%s\n", line.c_str());
    }
}

GWLogSink GWSetLogSink(GWLogSink sink) {
    std::lock_guard<std::mutex> lock(sinkMutex());
    GWLogSink previous = std::move(currentSink());
    currentSink() = std::move(sink);
    return previous;
}
