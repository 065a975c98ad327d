#include "GWStringEncoding.h"

#include <iconv.h>
#include <cstring>

#include <cerrno>
#include <map>
#include <memory>

namespace {

const char* iconvName(GWStringEncoding encoding) {
    switch (encoding) {
        case GWStringEncoding::UTF8: return "UTF-8";
        case GWStringEncoding::WindowsCP1250: return "CP1250";
        case GWStringEncoding::WindowsCP1251: return "CP1251";
        case GWStringEncoding::WindowsCP1252: return "CP1252";
        case GWStringEncoding::WindowsCP1253: return "CP1253";
        case GWStringEncoding::WindowsCP1254: return "CP1254";
        case GWStringEncoding::ShiftJIS: return "SHIFT_JIS";
        case GWStringEncoding::MacOSRoman: return "MACINTOSH";
        case GWStringEncoding::ISOLatin1: return "ISO-8859-1";
    }
    return "UTF-8";
}

struct IconvCloser {
    void operator()(void* cd) const { iconv_close(static_cast<iconv_t>(cd)); }
};
using Converter = std::unique_ptr<void, IconvCloser>;

// Opening a converter costs far more than a short name, so each thread keeps
// the ones it has used.
iconv_t converter(const char* from, const char* to) {
    thread_local std::map<std::pair<std::string, std::string>, Converter> cache;
    auto& slot = cache[{from, to}];
    if (!slot) {
        iconv_t cd = iconv_open(to, from);
        if (cd == iconv_t(-1)) {
            return cd;
        }
        slot.reset(cd);
    }
    iconv(static_cast<iconv_t>(slot.get()), nullptr, nullptr, nullptr, nullptr);
    return static_cast<iconv_t>(slot.get());
}

std::optional<std::string> convert(std::string_view input, const char* from, const char* to) {
    iconv_t cd = converter(from, to);
    if (cd == iconv_t(-1)) {
        return std::nullopt;
    }
    std::string output(input.size() * 4 + 16, '\0');
    char* in = const_cast<char*>(input.data());
    std::size_t inLeft = input.size();
    char* out = output.data();
    std::size_t outLeft = output.size();
    while (inLeft > 0) {
        if (iconv(cd, &in, &inLeft, &out, &outLeft) == std::size_t(-1)) {
            if (errno != E2BIG) {
                return std::nullopt;
            }
            const std::size_t used = output.size() - outLeft;
            output.resize(output.size() * 2);
            out = output.data() + used;
            outLeft = output.size() - used;
        }
    }
    if (iconv(cd, nullptr, nullptr, &out, &outLeft) == std::size_t(-1)) {
        return std::nullopt;
    }
    output.resize(output.size() - outLeft);
    return output;
}

}  // namespace

bool GWIsValidUTF8(std::span<const std::uint8_t> bytes) {
    std::size_t i = 0;
    while (i < bytes.size()) {
        // Names are mostly ASCII: eight bytes at a time while no high bit is set.
        std::uint64_t word;
        while (bytes.size() - i >= sizeof word &&
               (std::memcpy(&word, bytes.data() + i, sizeof word), word & 0x8080808080808080u) ==
                   0) {
            i += sizeof word;
        }
        if (i == bytes.size()) {
            break;
        }
        const std::uint8_t lead = bytes[i];
        if (lead < 0x80) {
            ++i;
            continue;
        }
        std::size_t length;
        std::uint32_t value;
        if ((lead & 0xE0) == 0xC0) {
            length = 2, value = lead & 0x1F;
        } else if ((lead & 0xF0) == 0xE0) {
            length = 3, value = lead & 0x0F;
        } else if ((lead & 0xF8) == 0xF0) {
            length = 4, value = lead & 0x07;
        } else {
            return false;
        }
        if (bytes.size() - i < length) {
            return false;
        }
        for (std::size_t k = 1; k < length; ++k) {
            if ((bytes[i + k] & 0xC0) != 0x80) {
                return false;
            }
            value = (value << 6) | (bytes[i + k] & 0x3F);
        }
        static constexpr std::uint32_t kSmallest[] = {0, 0, 0x80, 0x800, 0x10000};
        if (value < kSmallest[length] || value > 0x10FFFF || (value >= 0xD800 && value <= 0xDFFF)) {
            return false;
        }
        i += length;
    }
    return true;
}

std::optional<std::string> GWStringFromBytes(std::span<const std::uint8_t> bytes,
                                             GWStringEncoding encoding) {
    return GWStringFromBytes(
        std::string_view(reinterpret_cast<const char*>(bytes.data()), bytes.size()), encoding);
}

std::optional<std::string> GWStringFromBytes(std::string_view bytes, GWStringEncoding encoding) {
    if (encoding == GWStringEncoding::UTF8) {
        const auto* data = reinterpret_cast<const std::uint8_t*>(bytes.data());
        if (!GWIsValidUTF8(std::span(data, bytes.size()))) {
            return std::nullopt;
        }
        return std::string(bytes);
    }
    bool ascii = true;
    for (char c : bytes) {
        ascii = ascii && static_cast<unsigned char>(c) < 0x80;
    }
    // Every encoding here agrees with ASCII below 0x80 except Shift JIS,
    // which puts the yen sign and overline at 0x5C and 0x7E.
    if (ascii && encoding != GWStringEncoding::ShiftJIS) {
        return std::string(bytes);
    }
    return convert(bytes, iconvName(encoding), "UTF-8");
}

std::optional<std::string> GWStringFromBytesInNamedEncoding(std::string_view bytes,
                                                            const std::string& iconvName) {
    return convert(bytes, iconvName.c_str(), "UTF-8");
}

bool GWIsKnownEncodingName(const std::string& iconvName) {
    return !iconvName.empty() && converter(iconvName.c_str(), "UTF-8") != iconv_t(-1);
}

std::optional<std::string> GWBytesFromString(std::string_view text, GWStringEncoding encoding) {
    const auto* data = reinterpret_cast<const std::uint8_t*>(text.data());
    if (!GWIsValidUTF8(std::span(data, text.size()))) {
        return std::nullopt;
    }
    if (encoding == GWStringEncoding::UTF8) {
        return std::string(text);
    }
    return convert(text, "UTF-8", iconvName(encoding));
}
