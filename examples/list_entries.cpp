// Lists the entries of a ZIP or XAR archive with their sizes, depth-first.
//   list_entries ARCHIVE
#include <GWArchiveSupport/GWArchiveSupport.h>

#include <cinttypes>
#include <cstdio>

namespace {

void listZip(const GWZipFileArray& files) {
    for (const GWZipFilePtr& file : files) {
        std::printf("%12" PRIu64 "  %s%s\n", file->uncompressedSize(), file->path().c_str(),
                    file->isDirectory() ? "/" : "");
        if (GWZipFileArrayPtr children = file->children())
            listZip(*children);
    }
}

void listXAR(const GWXARFileArray& files) {
    for (const GWXARFilePtr& file : files) {
        const GWXARDataReferencePtr& data = file->dataFork();
        std::printf("%12" PRIu64 "  %s\n", data ? data->uncompressedSize() : 0,
                    file->path().c_str());
        listXAR(file->children());
    }
}

}  // namespace

int main(int argc, char** argv) {
    if (argc != 2) {
        std::fprintf(stderr, "usage: %s ARCHIVE\n", argv[0]);
        return 2;
    }
    GWURL url = GWURL::fileURLWithPath(argv[1]);
    GWErrorPtr error;
    switch (GWArchiveFormatAtURL(url)) {
        case GWArchiveFormatZip:
        case GWArchiveFormatSelfExtractingZip:
            if (GWZipArchivePtr archive = GWZipArchive::initWithURL(url, &error)) {
                listZip(archive->files());
                return 0;
            }
            break;
        case GWArchiveFormatXAR:
            if (GWXARArchivePtr archive = GWXARArchive::initWithURL(url, false, &error)) {
                listXAR(archive->files());
                return 0;
            }
            break;
        case GWArchiveFormatUnknown:
            std::fprintf(stderr, "%s: not a ZIP or XAR archive\n", argv[1]);
            return 1;
    }
    std::fprintf(stderr, "%s: %s\n", argv[1],
                 error ? error->localizedDescription().c_str() : "cannot be opened");
    return 1;
}
