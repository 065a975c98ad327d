#include "GWZipErrors.h"

#include <cstdarg>

#include "GWArchiveSupport/GWArchiveConstants.h"
#include "foundation/GWFormat.h"

GWErrorPtr GWZipUnknownEntityError(long code, std::uint64_t entity, const char* format, ...) {
    va_list arguments;
    va_start(arguments, format);
    std::string description = GWFormatV(format, arguments);
    va_end(arguments);
    GWDictionary details{{kGWZipArchiveUnknownEntityErrorKey, GWValue(entity)}};
    return GWGenerateError(kGWZipArchiveErrorDomain, code, std::nullopt, nullptr,
                           std::move(details), "%s", description.c_str());
}

GWErrorPtr GWZipEntryError(long code, const std::string& path, const char* format, ...) {
    va_list arguments;
    va_start(arguments, format);
    std::string description = GWFormatV(format, arguments);
    va_end(arguments);
    GWDictionary details{{kGWZipArchiveUnknownEntityErrorKey, GWValue(path)}};
    return GWGenerateError(kGWZipArchiveErrorDomain, code, std::nullopt, nullptr,
                           std::move(details), "%s", description.c_str());
}

std::string GWZipErrorLogDescription(const GWErrorPtr& error) {
    if (!error) {
        return "(null)";
    }
    return GWFormat("Error Domain=%s Code=%ld \"%s\"", error->domain().c_str(), error->code(),
                    error->localizedDescription().c_str());
}
