#include "Locations.h"

#include <fcntl.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>
#include <filesystem>
#include <vector>

#include "Diagnostics.h"
#include "foundation/GWFileDescriptor.h"
#include "foundation/GWFileManager.h"

namespace gwarchive {

namespace {

// Standard input as a path that can be read at any offset: itself when it
// can seek, otherwise an unlinked copy in $TMPDIR, bounded only by the disk.
std::string standardInputPath() {
    if (::lseek(STDIN_FILENO, 0, SEEK_CUR) >= 0)
        return "/proc/self/fd/0";
    const std::string folder = GWTemporaryDirectoryPath();
    const int fd = ::open(folder.c_str(), O_TMPFILE | O_RDWR | O_CLOEXEC, 0600);
    auto fail = [&](int number) {
        reportError("-", std::nullopt, GWPOSIXError(number, GWURL::fileURLWithPath(folder)));
        std::exit(kExitFailure);
    };
    if (fd < 0)
        fail(errno);
    std::vector<std::uint8_t> buffer(1 << 20);
    for (std::uint64_t offset = 0;;) {
        const ssize_t got = ::read(STDIN_FILENO, buffer.data(), buffer.size());
        if (got < 0 && errno == EINTR)
            continue;
        if (got < 0)
            fail(errno);
        if (got == 0)
            break;
        if (!GWWriteFully(fd, offset, std::span(buffer.data(), std::size_t(got))))
            fail(errno);
        offset += std::uint64_t(got);
    }
    // Kept open for the rest of the run: the name lives as long as the descriptor.
    return "/proc/self/fd/" + std::to_string(fd);
}

}  // namespace

GWURL localURL(const std::string& path) {
    std::error_code ignored;
    std::filesystem::path absolute = std::filesystem::absolute(path, ignored);
    return GWURL::fileURLWithPath(absolute.empty() ? path : absolute.string());
}

GWURL archiveURL(const std::string& operand) {
    if (operand == "-") {
        static const std::string path = standardInputPath();
        return GWURL::fileURLWithPath(path);
    }
    for (const char* scheme : {"http://", "https://", "file://"}) {
        if (operand.rfind(scheme, 0) == 0) {
            if (auto url = GWURL::URLWithString(operand))
                return *url;
        }
    }
    return localURL(operand);
}

}  // namespace gwarchive
