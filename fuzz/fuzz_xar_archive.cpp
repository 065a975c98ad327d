// Opens the input as a XAR archive and streams every entry's data fork and
// each of its extended attributes through a data handler.

#include <cstddef>
#include <cstdint>
#include <vector>

#include "FuzzSupport.h"
#include "xar/GWXARArchive.h"

namespace {

constexpr std::size_t kMaxStreams = 64;

}  // namespace

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
