#include "GWZipErrors.h"

#include <cstdarg>

#include "GWArchiveSupport/GWArchiveConstants.h"
#include "foundation/GWFormat.h"

namespace {

GWErrorPtr entityError(long code, GWValue entity, const char* format, va_list arguments) {
    std::string description = GWFormatV(format, arguments);
    GWDictionary details{{kGWZipArchiveUnknownEntityErrorKey, std::move(entity)}};
    return GWGenerateError(kGWZipArchiveErrorDomain, code, std::nullopt, nullptr,
                           std::move(details), "%s", description.c_str());
}

}  // namespace

GWErrorPtr GWZipUnknownEntityError(long code, std::uint64_t entity, const char* format, ...) {
    va_list arguments;
    va_start(arguments, format);
    GWErrorPtr error = entityError(code, GWValue(entity), format, arguments);
    va_end(arguments);
    return error;
}

GWErrorPtr GWZipEntryError(long code, const std::string& path, const char* format, ...) {
    va_list arguments;
    va_start(arguments, format);
    GWErrorPtr error = entityError(code, GWValue(path), format, arguments);
    va_end(arguments);
    return error;
}

std::string GWZipErrorLogDescription(const GWErrorPtr& error) {
    if (!error) {
        return "(null)";
    }
    return GWFormat("Error Domain=%s Code=%ld \"%s\"", error->domain().c_str(), error->code(),
                    error->localizedDescription().c_str());
}
