// Opens the input as a XAR archive and streams every entry's data fork and
// each of its extended attributes through a data handler.
//
// Byte-level mutation of a compressed table of contents yields little but
// inflate errors, so the custom mutator mostly mutates the XML text itself
// and stores it back the way it found it (zlib or plain), with the header's
// lengths made to match. The heap stays where it was, so the offsets the
// table of contents names still land in it.

#include <zlib.h>

#include <algorithm>
#include <cstddef>
#include <cstdint>
#include <cstring>
#include <optional>
#include <vector>

#include "FuzzSupport.h"
#include "xar/GWXARArchive.h"

extern "C" std::size_t LLVMFuzzerMutate(std::uint8_t* data, std::size_t size, std::size_t maxSize);

namespace {

constexpr std::size_t kMaxStreams = 64;
constexpr std::size_t kFixedHeaderLength = 28;
constexpr std::size_t kMaxTOCLength = 64 * 1024;

std::uint64_t loadBE(const std::uint8_t* bytes, int count) {
    std::uint64_t value = 0;
    for (int i = 0; i < count; ++i) {
        value = (value << 8) | bytes[i];
    }
    return value;
}

void storeBE64(std::uint8_t* bytes, std::uint64_t value) {
    for (int i = 7; i >= 0; --i, value >>= 8) {
        bytes[i] = std::uint8_t(value);
    }
}

std::optional<std::vector<std::uint8_t>> inflated(const std::uint8_t* data, std::size_t size) {
    std::vector<std::uint8_t> out(kMaxTOCLength);
    uLongf length = out.size();
    if (uncompress(out.data(), &length, data, size) != Z_OK) {
        return std::nullopt;
    }
    out.resize(length);
    return out;
}

std::vector<std::uint8_t> deflated(const std::vector<std::uint8_t>& text) {
    std::vector<std::uint8_t> out(compressBound(text.size()));
    uLongf length = out.size();
    compress(out.data(), &length, text.data(), text.size());
    out.resize(length);
    return out;
}

}  // namespace

extern "C" std::size_t LLVMFuzzerCustomMutator(std::uint8_t* data, std::size_t size,
                                               std::size_t maxSize, unsigned int seed) {
    const std::size_t headerLength = size >= kFixedHeaderLength ? loadBE(data + 4, 2) : 0;
    const std::uint64_t stored = size >= kFixedHeaderLength ? loadBE(data + 8, 8) : 0;
    // One time in eight, or for anything that is not a XAR, plain byte mutation.
    if (seed % 8 == 0 || size < kFixedHeaderLength || std::memcmp(data, "xar!", 4) != 0 ||
        headerLength < kFixedHeaderLength || headerLength > size || stored > size - headerLength) {
        return LLVMFuzzerMutate(data, size, maxSize);
    }
    const std::uint8_t* toc = data + headerLength;
    const bool compressed = stored >= 2 && toc[0] == 0x78;
    std::vector<std::uint8_t> text;
    if (compressed) {
        auto plain = inflated(toc, stored);
        if (!plain) {
            return LLVMFuzzerMutate(data, size, maxSize);
        }
        text = std::move(*plain);
    } else {
        text.assign(toc, toc + stored);
    }
    if (text.empty()) {
        text.push_back('<');
    }
    const std::size_t room = std::min(kMaxTOCLength, maxSize);
    const std::size_t textSize = std::min(text.size(), room);
    text.resize(room);
    text.resize(LLVMFuzzerMutate(text.data(), textSize, room));
    const std::vector<std::uint8_t> newTOC = compressed ? deflated(text) : text;
    const std::size_t heapLength = size - headerLength - stored;
    if (headerLength + newTOC.size() + heapLength > maxSize) {
        return LLVMFuzzerMutate(data, size, maxSize);
    }
    const std::vector<std::uint8_t> heap(data + headerLength + stored, data + size);
    std::copy(newTOC.begin(), newTOC.end(), data + headerLength);
    std::copy(heap.begin(), heap.end(), data + headerLength + newTOC.size());
    storeBE64(data + 8, newTOC.size());
    storeBE64(data + 16, text.size());
    return headerLength + newTOC.size() + heap.size();
}

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    static const bool ready = (gwfuzz::silenceLog(), true);
    (void)ready;
    const GWURL url = gwfuzz::urlWithContents({data, size});
    GWErrorPtr error;
    auto archive = GWXARArchive::initWithURL(url, false, &error);
    if (!archive) {
        return 0;
    }
    const GWXARDataHandler discard = [](std::optional<std::span<const std::uint8_t>>, bool, bool,
                                        const GWErrorPtr&) { return true; };
    std::vector<GWXARFilePtr> pending = archive->files();
    std::size_t streams = 0;
    while (!pending.empty() && streams < kMaxStreams) {
        GWXARFilePtr file = pending.back();
        pending.pop_back();
        if (!file) {
            continue;
        }
        (void)file->path();
        (void)file->description();
        pending.insert(pending.end(), file->children().begin(), file->children().end());
        archive->extractDataForkOfFile(file, nullptr, discard);
        ++streams;
        for (const auto& attribute : file->extendedAttributes()) {
            if (attribute && attribute->name() && streams < kMaxStreams) {
                archive->extractExtendedAttribute(*attribute->name(), file, nullptr, discard);
                ++streams;
            }
        }
        // A refused or failed stream may leave the archive cancelled.
        archive->setIsCancelled(false);
    }
    return 0;
}
