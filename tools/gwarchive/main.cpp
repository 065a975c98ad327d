#include <cstdio>
#include <cstring>

#include "GWArchiveSupport/GWArchiveSupport.h"

namespace {

const char kUsage[] =
    "usage: gwarchive [--version] [--help]\n"
    "\n"
    "Reads ZIP and XAR archives, keeping the metadata that archives made on Macs carry.\n"
    "\n"
    "options:\n"
    "  --version   print the library version and exit\n"
    "  --help      print this help and exit\n";

}  // namespace

int main(int argc, char** argv) {
    if (argc == 2 && std::strcmp(argv[1], "--version") == 0) {
        std::printf("gwarchive %s\n", GWArchiveSupportVersionString);
        return 0;
    }
    if (argc == 2 && (std::strcmp(argv[1], "--help") == 0 || std::strcmp(argv[1], "-h") == 0)) {
        std::fputs(kUsage, stdout);
        return 0;
    }
    std::fputs(kUsage, stderr);
    return 2;
}
