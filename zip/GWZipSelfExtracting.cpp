// Recognising self-extracting archives: Windows executables that carry a ZIP
// after their code. The answer is a hint; opening finds the ZIP by itself.

#include <algorithm>
#include <cstring>
#include <string_view>

#include "GWZipLoadOperation.h"
#include "foundation/GWByteReader.h"

namespace {

// Section headers follow the PE signature, the file header and a 32-bit
// optional header; 64-bit images are searched at the same place.
constexpr std::uint64_t kSectionTableOffset = 0xF8;
constexpr std::uint64_t kSectionSearchLength = 0x140;  // eight 40-byte headers
constexpr std::uint64_t kWinZipSearchLength = 0x100;
constexpr std::uint64_t kRelocTrailerSearchLength = 0x180;
constexpr std::uint64_t kFallbackWindow = 66000;

std::span<const std::uint8_t> bytesOf(std::string_view text) {
    return {reinterpret_cast<const std::uint8_t*>(text.data()), text.size()};
}

const std::uint8_t kLocalHeaderSignature[] = {'P', 'K', 3, 4};

class SelfExtractorProbe {
public:
    explicit SelfExtractorProbe(GWRemoteFileHandle& file) : file_(file) {}

    // The offset of `pattern` in [start, start + length); none when absent,
    // and `failed` set when the search could not read.
    std::optional<std::uint64_t> find(std::string_view pattern, std::uint64_t start,
                                      std::uint64_t length) {
        return find(bytesOf(pattern), start, length);
    }
    std::optional<std::uint64_t> find(std::span<const std::uint8_t> pattern, std::uint64_t start,
                                      std::uint64_t length) {
        std::uint64_t found = GWZipLoadOperation::kNotFound;
        if (!GWZipLoadOperation::searchForData(pattern, file_, start, length, &found, nullptr,
                                               nullptr)) {
            failed = true;
            return std::nullopt;
        }
        if (found == GWZipLoadOperation::kNotFound) {
            return std::nullopt;
        }
        return found;
    }

    std::optional<GWData> read(std::uint64_t offset, std::uint64_t length) {
        if (!file_.seekToFileOffset(offset, nullptr)) {
            return std::nullopt;
        }
        return file_.readDataOfLength(length, nullptr);
    }

    // Where a section's raw data ends, from its header at `header`.
    std::optional<std::uint64_t> sectionDataEnd(std::uint64_t header) {
        auto bytes = read(header + 16, 8);
        if (!bytes || bytes->size() < 8) {
            return std::nullopt;
        }
        GWByteReader reader(*bytes);
        const std::uint64_t rawSize = reader.u32le();
        const std::uint64_t rawOffset = reader.u32le();
        return rawOffset + rawSize;
    }

    bool localHeaderAt(std::uint64_t offset) {
        auto bytes = read(offset, 4);
        return bytes && bytes->size() == 4 &&
               std::equal(bytes->begin(), bytes->end(), kLocalHeaderSignature);
    }

    bool failed = false;

private:
    GWRemoteFileHandle& file_;
};

bool endRecordNearEnd(GWRemoteFileHandle& file, const GWURL& url) {
    if (!url.isFileURL()) {
        return false;
    }
    const std::uint64_t size = file.fileSize();
    const std::uint64_t window = std::min(size, kFallbackWindow);
    static constexpr std::uint8_t kEndSignature[] = {'P', 'K', 5, 6};
    std::uint64_t found = GWZipLoadOperation::kNotFound;
    if (!GWZipLoadOperation::searchForData(kEndSignature, file, size - window, window, &found,
                                           nullptr, nullptr)) {
        return false;
    }
    return found != GWZipLoadOperation::kNotFound;
}

}  // namespace

bool GWZipLoadOperation::isSelfExtractingZipArchiveAtURL(const GWURL& url) {
    auto file = GWRemoteFileHandle::initForReadingFromURL(url, nullptr);
    if (!file) {
        return false;
    }
    SelfExtractorProbe probe(*file);
    auto header = probe.read(0, 64);
    if (!header || header->size() < 64 || (*header)[0] != 'M' || (*header)[1] != 'Z') {
        return false;
    }
    GWByteReader reader(*header);
    reader.seek(8);
    const std::uint64_t stubStart = std::uint64_t(reader.u16le()) * 16;
    reader.seek(0x3C);
    const std::uint64_t peOffset = reader.u32le();

    auto signature = probe.read(peOffset, 4);
    if (!signature) {
        return false;
    }
    if (probe.find("PKSFX", stubStart, 32)) {
        return true;
    }
    if (probe.failed) {
        return false;
    }
    const bool isPE = signature->size() == 4 && std::memcmp(signature->data(), "PE\0\0", 4) == 0;
    if (!isPE) {
        return endRecordNearEnd(*file, url);
    }

    const std::uint64_t sections = peOffset + kSectionTableOffset;
    bool recognised = false;
    // A ZIP appended right after the relocations, as some builders leave it.
    if (auto reloc = probe.find(".reloc", sections, kSectionSearchLength)) {
        if (auto dataEnd = probe.sectionDataEnd(*reloc)) {
            if (probe.find(kLocalHeaderSignature, *dataEnd, kRelocTrailerSearchLength)) {
                recognised = true;
            }
            if (probe.failed) {
                return false;
            }
        }
    } else if (probe.failed) {
        return false;
    }
    if (!recognised) {
        if (probe.find("_winzip_", sections, kWinZipSearchLength)) {
            recognised = true;
        } else if (probe.failed) {
            return false;
        }
    }
    // Packed executables: the ZIP follows the packed section's data.
    for (std::string_view name : {"UPX0", "PEC2", "UPX2"}) {
        auto section = probe.find(name, sections, kSectionSearchLength);
        if (probe.failed) {
            return false;
        }
        if (!section) {
            continue;
        }
        auto dataEnd = probe.sectionDataEnd(*section);
        if (!dataEnd) {
            return false;
        }
        auto bytes = probe.read(*dataEnd, 4);
        if (!bytes) {
            return false;
        }
        if (bytes->size() == 4 && std::equal(bytes->begin(), bytes->end(), kLocalHeaderSignature)) {
            return true;
        }
    }
    if (recognised) {
        return true;
    }
    auto idata = probe.find(".idata", sections, kSectionSearchLength);
    if (probe.failed) {
        return false;
    }
    if (!idata) {
        return endRecordNearEnd(*file, url);
    }
    auto dataEnd = probe.sectionDataEnd(*idata);
    if (!dataEnd) {
        return false;
    }
    if (probe.localHeaderAt(*dataEnd)) {
        return true;
    }
    return endRecordNearEnd(*file, url);
}
