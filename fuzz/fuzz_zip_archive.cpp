// Opens the input as a ZIP archive, lists every entry with the derived
// properties a listing shows, and streams each one (and its Mac companions)
// through a data handler, with the password of the encrypted seeds.

#include <cstddef>
#include <cstdint>
#include <vector>

#include "FuzzSupport.h"
#include "zip/GWZipArchive.h"

namespace {

// Enough to reach every kind of entry a small input holds, few enough that
// one input never runs for long.
constexpr std::size_t kMaxStreamedEntries = 64;

void list(const GWZipFilePtr& file) {
    (void)file->path();
    (void)file->uncompressedSize();
    (void)file->type();
    (void)file->creator();
    (void)file->creationDate();
    (void)file->modificationDate();
    (void)file->comment();
    (void)file->uncompressedChecksum();
    (void)file->isMacBinaryEncoded();
}

void stream(const GWZipFilePtr& file, const GWZipArchivePtr& archive) {
    GWErrorPtr error;
    auto operation = GWZipExtractOperation::initForExtractingFile(
        file, archive,
        [](std::optional<std::span<const std::uint8_t>>, bool, const GWErrorPtr&) { return true; },
        &error);
    if (operation) {
        operation->start();
        operation->waitUntilFinished();
    }
}

}  // namespace

extern "C" int LLVMFuzzerTestOneInput(const std::uint8_t* data, std::size_t size) {
    static const bool ready = (gwfuzz::silenceLog(), true);
    (void)ready;
    const GWURL url = gwfuzz::urlWithContents({data, size});
    GWErrorPtr error;
    auto archive = GWZipArchive::initWithURL(url, &error);
    if (!archive) {
        return 0;
    }
    // The seeds' password, so that the decryption behind it is reached.
    archive->setPassword("secret");
    std::vector<GWZipFilePtr> pending = archive->files();
    std::size_t streamed = 0;
    while (!pending.empty()) {
        GWZipFilePtr file = pending.back();
        pending.pop_back();
        if (!file) {
            continue;
        }
        list(file);
        if (auto children = file->children()) {
            pending.insert(pending.end(), children->begin(), children->end());
        }
        for (const auto& companion : {file->resourceFork(), file->appleDoubleFile()}) {
            if (companion && streamed < kMaxStreamedEntries) {
                stream(companion, archive);
                ++streamed;
            }
        }
        if (!file->isDirectory() && streamed < kMaxStreamedEntries) {
            stream(file, archive);
            ++streamed;
        }
    }
    return 0;
}
