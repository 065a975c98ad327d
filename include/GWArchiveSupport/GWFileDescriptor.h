#pragma once

#include <fcntl.h>
#include <unistd.h>

#include <cerrno>
#include <utility>

#include "GWExport.h"

// An owned POSIX file descriptor, closed when it goes out of scope so that no
// error path has to remember it.
class GW_EXPORT GWFileDescriptor {
public:
    GWFileDescriptor() = default;
    explicit GWFileDescriptor(int fd) : fd_(fd) {}
    ~GWFileDescriptor() { reset(); }
    GWFileDescriptor(GWFileDescriptor&& other) noexcept : fd_(std::exchange(other.fd_, -1)) {}
    GWFileDescriptor& operator=(GWFileDescriptor&& other) noexcept {
        if (this != &other) {
            reset(std::exchange(other.fd_, -1));
        }
        return *this;
    }
    GWFileDescriptor(const GWFileDescriptor&) = delete;
    GWFileDescriptor& operator=(const GWFileDescriptor&) = delete;

    // open(2), retried when a signal interrupts it; invalid (with errno set) on failure.
    static GWFileDescriptor open(const char* path, int flags, mode_t mode = 0644) {
        int fd;
        do {
            fd = ::open(path, flags | O_CLOEXEC, mode);
        } while (fd < 0 && errno == EINTR);
        return GWFileDescriptor(fd);
    }

    bool isValid() const { return fd_ >= 0; }
    int get() const { return fd_; }
    void reset(int fd = -1) {
        if (fd_ >= 0) {
            ::close(fd_);
        }
        fd_ = fd;
    }
    int release() { return std::exchange(fd_, -1); }

private:
    int fd_ = -1;
};
