#include "GWFileDescriptor.h"

bool GWReadFully(int fd, std::uint64_t offset, std::span<std::uint8_t> into, std::size_t& got) {
    got = 0;
    while (got < into.size()) {
        const ssize_t n = ::pread(fd, into.data() + got, into.size() - got, off_t(offset + got));
        if (n < 0) {
            if (errno == EINTR) {
                continue;
            }
            return false;
        }
        if (n == 0) {
            break;
        }
        got += std::size_t(n);
    }
    return true;
}

bool GWWriteFully(int fd, std::uint64_t offset, std::span<const std::uint8_t> bytes) {
    std::size_t done = 0;
    while (done < bytes.size()) {
        const ssize_t n =
            ::pwrite(fd, bytes.data() + done, bytes.size() - done, off_t(offset + done));
        if (n < 0) {
            if (errno == EINTR) {
                continue;
            }
            return false;
        }
        done += std::size_t(n);
    }
    return true;
}
