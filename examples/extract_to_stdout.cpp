// Writes the data of one entry of a ZIP archive to standard output as it is
// decoded, through a data handler; nothing is written to disk.
//   extract_to_stdout ARCHIVE PATH
#include <GWArchiveSupport/GWArchiveSupport.h>

#include <cstdio>
#include <future>
#include <utility>

int main(int argc, char** argv) {
    if (argc != 3) {
        std::fprintf(stderr, "usage: %s ARCHIVE PATH\n", argv[0]);
        return 2;
    }
    GWErrorPtr error;
    GWZipArchivePtr archive = GWZipArchive::initWithURL(GWURL::fileURLWithPath(argv[1]), &error);
    if (!archive) {
        std::fprintf(stderr, "%s: %s\n", argv[1], error->localizedDescription().c_str());
        return 1;
    }
    GWZipFilePtr file = archive->fileWithPath(argv[2]);
    if (!file || file->isDirectory()) {
        std::fprintf(stderr, "%s: no file %s in the archive\n", argv[1], argv[2]);
        return 1;
    }
    // The handler runs on the extraction queue; the last call carries isDone.
    std::promise<GWErrorPtr> finished;
    bool reported = false;
    archive->extractDataForkOfFile(
        file, nullptr,
        [&](std::optional<std::span<const std::uint8_t>> data, bool isDone,
            const GWErrorPtr& failure) {
            if (data && std::fwrite(data->data(), 1, data->size(), stdout) != data->size())
                return false;
            if ((isDone || failure) && !std::exchange(reported, true))
                finished.set_value(failure);
            return true;
        });
    if (GWErrorPtr failure = finished.get_future().get()) {
        std::fprintf(stderr, "%s: %s\n", argv[2], failure->localizedDescription().c_str());
        return 1;
    }
    return std::fflush(stdout) == 0 ? 0 : 1;
}
