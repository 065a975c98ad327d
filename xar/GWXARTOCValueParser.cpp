// Values in table-of-contents elements: text, flags, devices and dates.

#include <limits>
#include <string_view>

#include "GWArchiveSupport/GWArchiveConstants.h"
#include "GWXARLoadOperation.h"
#include "GWXARNumberScanning.h"
#include "foundation/GWFormat.h"
#include "foundation/GWPropertyListSerialization.h"
#include "foundation/GWStringEncoding.h"

namespace {

std::optional<std::uint32_t> flagBit(std::string_view name) {
    static const std::pair<std::string_view, std::uint32_t> kFlags[] = {
        {"UserNoDump", 0x1},       {"UserImmutable", 0x2},      {"UserAppend", 0x4},
        {"UserOpaque", 0x8},       {"SystemArchived", 0x10000}, {"SystemImmutable", 0x20000},
        {"SystemAppend", 0x40000},
    };
    for (const auto& [flag, bit] : kFlags) {
        if (flag == name) {
            return bit;
        }
    }
    return std::nullopt;
}

// A device number as a signed 64-bit value. Text without digits reads 0; a
// value past 64 bits reads as the nearest limit, which the range check refuses.
std::int64_t deviceNumber(std::string_view text) {
    bool overflowed = false;
    auto value = GWXARScanSigned(text, &overflowed);
    if (value) {
        return *value;
    }
    if (!overflowed) {
        return 0;
    }
    const auto start = text.find_first_not_of(" \t\n\r\v\f");
    const bool negative = start != std::string_view::npos && text[start] == '-';
    return negative ? std::numeric_limits<std::int64_t>::min()
                    : std::numeric_limits<std::int64_t>::max();
}

}  // namespace

std::optional<std::string> GWXARLoadOperation::textContentOfElement(const pugi::xml_node& element,
                                                                    GWErrorPtr* error) {
    std::string text;
    for (const pugi::xml_node& child : element.children()) {
        if (child.type() == pugi::node_pcdata || child.type() == pugi::node_cdata) {
            text += child.value();
        }
    }
    if (std::string_view(element.attribute("enctype").value()) != "base64") {
        return text;
    }
    auto bytes = GWPropertyListSerialization::dataWithBase64String(text, error);
    if (!bytes) {
        return std::nullopt;
    }
    if (!GWIsValidUTF8(*bytes)) {
        // Deliberately no error object: the load reports a general read error.
        GWFail(error, nullptr);
        return std::nullopt;
    }
    return std::string(bytes->begin(), bytes->end());
}

bool GWXARLoadOperation::getPOSIXFlags(std::uint32_t* flags, const pugi::xml_node& element,
                                       GWErrorPtr* error) {
    std::uint32_t value = 0;
    for (const pugi::xml_node& child : element.children()) {
        if (child.type() != pugi::node_element) {
            continue;
        }
        auto bit = flagBit(child.name());
        if (!bit) {
            return GWFail(error, errorWithCode(GWXARArchiveUnknownFlagError,
                                               std::string(child.name()), child));
        }
        value |= *bit;
    }
    if (flags) {
        *flags = value;
    }
    return true;
}

bool GWXARLoadOperation::parseDeviceProperty(const pugi::xml_node& element, std::uint64_t* major,
                                             std::uint64_t* minor, GWErrorPtr* error) {
    const pugi::xml_node majorElement = element.child("major");
    if (!majorElement) {
        return GWFail(error, errorWithCode(GWXARArchiveMissingElementError, "major", element));
    }
    const pugi::xml_node minorElement = element.child("minor");
    if (!minorElement) {
        return GWFail(error, errorWithCode(GWXARArchiveMissingElementError, "minor", element));
    }
    auto majorText = textContentOfElement(majorElement, error);
    if (!majorText) {
        return false;
    }
    auto minorText = textContentOfElement(minorElement, error);
    if (!minorText) {
        return false;
    }
    // Compared unsigned, so a negative number is out of range as well.
    const std::int64_t majorValue = deviceNumber(*majorText);
    const std::int64_t minorValue = deviceNumber(*minorText);
    if (std::uint64_t(majorValue) >= 256) {
        return GWFail(error, errorWithCode(GWXARArchiveMalformedValueError,
                                           GWFormat("%lld", (long long)majorValue), majorElement));
    }
    if (std::uint64_t(minorValue) >= 256) {
        return GWFail(error, errorWithCode(GWXARArchiveMalformedValueError,
                                           GWFormat("%lld", (long long)minorValue), minorElement));
    }
    if (major) {
        *major = std::uint64_t(majorValue);
    }
    if (minor) {
        *minor = std::uint64_t(minorValue);
    }
    return true;
}

std::optional<GWDate> GWXARLoadOperation::creationDateFromProperty(const pugi::xml_node& element,
                                                                   GWErrorPtr* error) {
    const pugi::xml_node timeElement = element.child("time");
    if (!timeElement) {
        GWFail(error, errorWithCode(GWXARArchiveMissingElementError, "time", element));
        return std::nullopt;
    }
    auto timeText = textContentOfElement(timeElement, error);
    if (!timeText) {
        return std::nullopt;
    }
    auto date = dateFromTimeString(*timeText, error);
    if (!date) {
        return std::nullopt;
    }
    std::string nanosecondsText = "0";
    if (const pugi::xml_node nanosecondsElement = element.child("nanoseconds")) {
        GWErrorPtr ignored;
        if (auto text = textContentOfElement(nanosecondsElement, &ignored)) {
            nanosecondsText = *text;
        }
    }
    const std::int64_t nanoseconds = GWXARScanSigned(nanosecondsText).value_or(0);
    return date->dateByAddingTimeInterval(double(nanoseconds) / 1e9);
}

std::optional<GWDate> GWXARLoadOperation::dateFromTimeString(std::string_view text, GWErrorPtr*) {
    if (text.ends_with('Z')) {
        text.remove_suffix(1);
    }
    // No error object on failure, by design: the load reports a general read error.
    return GWDate::dateWithISO8601String(text);
}
