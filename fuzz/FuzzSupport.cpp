#include "FuzzSupport.h"

#include <sys/mman.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <filesystem>

#include "foundation/GWLog.h"

namespace gwfuzz {

namespace {

[[noreturn]] void fail(const char* what) {
    std::perror(what);
    std::abort();
}

}  // namespace

void silenceLog() {
    GWSetLogSink([](const std::string&) {});
}

GWURL urlWithContents(std::span<const std::uint8_t> bytes) {
    static const int fd = [] {
        const int created = ::memfd_create("gwfuzz-input", MFD_CLOEXEC);
        if (created < 0) {
            fail("memfd_create");
        }
        return created;
    }();
    static const GWURL url = GWURL::fileURLWithPath("/proc/self/fd/" + std::to_string(fd));
    if (::ftruncate(fd, 0) != 0) {
        fail("ftruncate");
    }
    for (std::size_t done = 0; done < bytes.size();) {
        const ssize_t wrote = ::pwrite(fd, bytes.data() + done, bytes.size() - done, off_t(done));
        if (wrote <= 0) {
            fail("pwrite");
        }
        done += std::size_t(wrote);
    }
    return url;
}

const std::string& scratchDirectory() {
    static const std::string path = [] {
        const char* base = std::getenv("TMPDIR");
        std::string pattern = std::string(base && *base ? base : "/tmp") + "/gwfuzz-XXXXXX";
        if (!::mkdtemp(pattern.data())) {
            fail("mkdtemp");
        }
        static const std::string removed = pattern;
        std::atexit([] {
            std::error_code ignored;
            std::filesystem::remove_all(removed, ignored);
        });
        return pattern;
    }();
    return path;
}

void emptyDirectory(const std::string& path) {
    std::error_code ignored;
    for (const auto& item : std::filesystem::directory_iterator(path, ignored)) {
        std::filesystem::remove_all(item.path(), ignored);
    }
}

}  // namespace gwfuzz
