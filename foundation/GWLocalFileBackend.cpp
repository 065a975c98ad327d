#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>

#include "GWFileHandleBackend.h"

namespace {

class LocalFileBackend final : public GWFileHandleBackend {
public:
    LocalFileBackend(int fd, GWURL url, bool seekable, bool owns = true)
        : fd_(fd), url_(std::move(url)), seekable_(seekable), owns_(owns) {}
    ~LocalFileBackend() override {
        if (fd_ >= 0 && owns_) {
            ::close(fd_);
        }
    }
    LocalFileBackend(const LocalFileBackend&) = delete;
    LocalFileBackend& operator=(const LocalFileBackend&) = delete;

    bool readAt(std::uint64_t offset, std::span<std::uint8_t> into, std::size_t& got,
                GWErrorPtr* error) override {
        got = 0;
        while (got < into.size()) {
            const ssize_t n =
                ::pread(fd_, into.data() + got, into.size() - got, off_t(offset + got));
            if (n < 0) {
                if (errno == EINTR) {
                    continue;
                }
                return GWFail(error, GWPOSIXError(fd_ < 0 ? EBADF : errno, url_));
            }
            if (n == 0) {
                break;
            }
            got += std::size_t(n);
        }
        return true;
    }

    bool writeAt(std::uint64_t offset, std::span<const std::uint8_t> bytes,
                 GWErrorPtr* error) override {
        std::size_t done = 0;
        while (done < bytes.size()) {
            const ssize_t n =
                ::pwrite(fd_, bytes.data() + done, bytes.size() - done, off_t(offset + done));
            if (n < 0) {
                if (errno == EINTR) {
                    continue;
                }
                return GWFail(error, GWPOSIXError(fd_ < 0 ? EBADF : errno, url_));
            }
            done += std::size_t(n);
        }
        return true;
    }

    std::uint64_t size() const override {
        struct stat info {};
        return fd_ >= 0 && ::fstat(fd_, &info) == 0 ? std::uint64_t(info.st_size) : 0;
    }

    bool isSeekable() const override { return seekable_; }

    bool close(GWErrorPtr* error) override {
        if (fd_ < 0) {
            return true;
        }
        const int result = owns_ ? ::close(fd_) : 0;
        fd_ = -1;
        return result == 0 || GWFail(error, GWPOSIXError(errno, url_));
    }

private:
    int fd_;
    GWURL url_;
    bool seekable_;
    bool owns_;
};

class DiscardingBackend final : public GWFileHandleBackend {
public:
    bool readAt(std::uint64_t, std::span<std::uint8_t>, std::size_t& got, GWErrorPtr*) override {
        got = 0;
        return true;
    }
    bool writeAt(std::uint64_t, std::span<const std::uint8_t>, GWErrorPtr*) override {
        return true;
    }
    std::uint64_t size() const override { return 0; }
    bool isSeekable() const override { return true; }
    bool close(GWErrorPtr*) override { return true; }
};

}  // namespace

std::unique_ptr<GWFileHandleBackend> GWOpenLocalFileBackend(const GWURL& url, bool forWriting,
                                                            GWErrorPtr* error) {
    const std::string path = url.path();
    // Writes never follow a link in the last place: extraction prepares the
    // file it writes, and a link appearing there meanwhile is refused. The
    // file is emptied below rather than with O_TRUNC: ext4 flushes a file
    // truncated on open as soon as it is closed, and extraction writes into
    // files it has just created empty, thousands of them.
    const int flags =
        forWriting ? O_WRONLY | O_CREAT | O_CLOEXEC | O_NOFOLLOW : O_RDONLY | O_CLOEXEC;
    int fd;
    do {
        fd = ::open(path.c_str(), flags, 0666);
    } while (fd < 0 && errno == EINTR);
    if (fd < 0) {
        GWFail(error, GWPOSIXError(errno, url));
        return nullptr;
    }
    struct stat info {};
    if (::fstat(fd, &info) != 0 || S_ISDIR(info.st_mode)) {
        const int number = S_ISDIR(info.st_mode) ? EISDIR : errno;
        ::close(fd);
        GWFail(error, GWPOSIXError(number, url));
        return nullptr;
    }
    if (forWriting && S_ISREG(info.st_mode) && info.st_size != 0 && ::ftruncate(fd, 0) != 0) {
        const int number = errno;
        ::close(fd);
        GWFail(error, GWPOSIXError(number, url));
        return nullptr;
    }
    const bool seekable = S_ISREG(info.st_mode) || S_ISBLK(info.st_mode);
    return std::make_unique<LocalFileBackend>(fd, url, seekable);
}

std::unique_ptr<GWFileHandleBackend> GWMakeLocalFileBackendForDescriptor(int fd, const GWURL& url) {
    return std::make_unique<LocalFileBackend>(fd, url, true, false);
}

std::unique_ptr<GWFileHandleBackend> GWMakeDiscardingBackend() {
    return std::make_unique<DiscardingBackend>();
}
