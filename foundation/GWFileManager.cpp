#include "GWFileManager.h"

#include <fcntl.h>
#include <stdio.h>
#include <stdlib.h>
#include <sys/stat.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <filesystem>
#include <system_error>
#include <vector>

#include "GWConversions.h"
#include "GWFileDescriptor.h"
#include "GWMetadataStore.h"

namespace {

GWErrorPtr posixError(int number, const GWURL& url, const char* doing) {
    return GWGenerateError(kGWPOSIXErrorDomain, number, url, nullptr, {}, "%s %s failed: %s", doing,
                           url.path().c_str(), std::strerror(number));
}

bool requireFileURL(const GWURL& url, GWErrorPtr* error) {
    if (url.isFileURL()) {
        return true;
    }
    return GWFail(error, GWCocoaError(GWFileWriteUnsupportedSchemeError, url));
}

// Copies the bytes, the mode, the dates and the extended attributes of a
// regular file to a new file, for moves that cannot be renames.
bool copyRegularFile(const std::string& from, const std::string& to, int* failure) {
    GWFileDescriptor source = GWFileDescriptor::open(from.c_str(), O_RDONLY | O_NOFOLLOW);
    struct stat status {};
    if (!source.isValid() || ::fstat(source.get(), &status) != 0) {
        *failure = errno;
        return false;
    }
    if (!S_ISREG(status.st_mode)) {
        *failure = EXDEV;
        return false;
    }
    GWFileDescriptor target =
        GWFileDescriptor::open(to.c_str(), O_WRONLY | O_CREAT | O_EXCL, status.st_mode & 07777);
    if (!target.isValid()) {
        *failure = errno;
        return false;
    }
    auto fail = [&](int number) {
        *failure = number;
        ::unlink(to.c_str());
        return false;
    };
    std::vector<std::uint8_t> buffer(1 << 20);
    std::uint64_t offset = 0;
    for (;;) {
        std::size_t got = 0;
        if (!GWReadFully(source.get(), offset, buffer, got)) {
            return fail(errno);
        }
        if (got == 0) {
            break;
        }
        if (!GWWriteFully(target.get(), offset, std::span(buffer.data(), got))) {
            return fail(errno);
        }
        offset += got;
    }
    const ssize_t listLength = ::flistxattr(source.get(), nullptr, 0);
    if (listLength > 0) {
        std::vector<char> names(std::size_t(listLength) + 1, '\0');
        const ssize_t got = ::flistxattr(source.get(), names.data(), names.size() - 1);
        for (ssize_t at = 0; got > 0 && at < got;) {
            const char* name = names.data() + at;
            const ssize_t size = ::fgetxattr(source.get(), name, nullptr, 0);
            if (size >= 0) {
                std::vector<std::uint8_t> value(static_cast<std::size_t>(size));
                const ssize_t read = ::fgetxattr(source.get(), name, value.data(), value.size());
                if (read >= 0 &&
                    ::fsetxattr(target.get(), name, value.data(), std::size_t(read), 0) != 0 &&
                    std::strncmp(name, "user.", 5) == 0) {
                    return fail(errno);
                }
            }
            at += ssize_t(std::strlen(name)) + 1;
        }
    }
    const struct timespec times[2] = {status.st_atim, status.st_mtim};
    ::futimens(target.get(), times);
    return true;
}

}  // namespace

bool GWItemExistsAtURL(const GWURL& url) {
    struct stat status {};
    return url.isFileURL() && ::lstat(url.path().c_str(), &status) == 0;
}

bool GWRemoveItemAtURL(const GWURL& url, GWErrorPtr* error) {
    if (!requireFileURL(url, error)) {
        return false;
    }
    if (!GWItemExistsAtURL(url)) {
        return GWFail(error, posixError(ENOENT, url, "removing"));
    }
    std::error_code code;
    std::filesystem::remove_all(url.path(), code);
    if (code) {
        return GWFail(error, posixError(code.value(), url, "removing"));
    }
    return GWMetadataStore::removeMetadata(url.path(), error);
}

bool GWCreateDirectoryAtURL(const GWURL& url, bool intermediates, GWErrorPtr* error) {
    if (!requireFileURL(url, error)) {
        return false;
    }
    const std::string path = url.path();
    if (!intermediates) {
        if (::mkdir(path.c_str(), 0777) != 0) {
            return GWFail(error, posixError(errno, url, "creating the directory"));
        }
        return true;
    }
    std::error_code code;
    std::filesystem::create_directories(path, code);
    if (code) {
        return GWFail(error, posixError(code.value(), url, "creating the directory"));
    }
    struct stat status {};
    if (::lstat(path.c_str(), &status) != 0 || !S_ISDIR(status.st_mode)) {
        return GWFail(error, posixError(EEXIST, url, "creating the directory"));
    }
    return true;
}

bool GWCreateEmptyFileAtomicallyAtURL(const GWURL& url, GWErrorPtr* error) {
    if (!requireFileURL(url, error)) {
        return false;
    }
    const std::string path = url.path();
    // An empty file has no partial state to hide, so a free name is simply
    // created; only replacing an item needs a temporary and a rename.
    if (GWFileDescriptor::open(path.c_str(), O_WRONLY | O_CREAT | O_EXCL, 0666).isValid()) {
        return true;
    }
    if (errno != EEXIST) {
        return GWFail(error, posixError(errno, url, "writing"));
    }
    // open() rather than mkstemp(), so that the umask gives the usual mode.
    // A short name of its own, beside the file: the file's name may already
    // be as long as names can be.
    const std::string temporary =
        url.URLByDeletingLastPathComponent().path() + "/.gwtemp-" + GWUniqueID();
    GWFileDescriptor file =
        GWFileDescriptor::open(temporary.c_str(), O_WRONLY | O_CREAT | O_EXCL, 0666);
    if (!file.isValid()) {
        return GWFail(error, posixError(errno, url, "writing"));
    }
    file.reset();
    if (::rename(temporary.c_str(), path.c_str()) != 0) {
        const int number = errno;
        ::unlink(temporary.c_str());
        return GWFail(error, posixError(number, url, "writing"));
    }
    return true;
}

bool GWCreateSymbolicLinkAtURL(const GWURL& url, const std::string& destinationPath,
                               GWErrorPtr* error) {
    if (!requireFileURL(url, error)) {
        return false;
    }
    if (::symlink(destinationPath.c_str(), url.path().c_str()) != 0) {
        return GWFail(error, posixError(errno, url, "creating the symbolic link"));
    }
    return true;
}

bool GWMoveItemAtURL(const GWURL& from, const GWURL& to, GWErrorPtr* error) {
    if (!requireFileURL(from, error) || !requireFileURL(to, error)) {
        return false;
    }
    const std::string source = from.path();
    const std::string target = to.path();
    int result = ::renameat2(AT_FDCWD, source.c_str(), AT_FDCWD, target.c_str(), RENAME_NOREPLACE);
    if (result != 0 && (errno == EINVAL || errno == ENOSYS)) {
        // A file system without the no-replace flag: check, then rename.
        if (GWItemExistsAtURL(to)) {
            return GWFail(error, posixError(EEXIST, to, "moving an item to"));
        }
        result = ::rename(source.c_str(), target.c_str());
    }
    if (result != 0 && errno == EXDEV) {
        int failure = 0;
        if (!copyRegularFile(source, target, &failure)) {
            return GWFail(error, posixError(failure, to, "moving an item to"));
        }
        ::unlink(source.c_str());
        const std::string side = GWMetadataSideFile::pathForItem(source);
        if (::access(side.c_str(), F_OK) == 0) {
            GWMetadataStore::removeMetadata(target, nullptr);
            if (!copyRegularFile(side, GWMetadataSideFile::pathForItem(target), &failure)) {
                return GWFail(error, posixError(failure, to, "moving the metadata of"));
            }
            ::unlink(side.c_str());
        }
        return true;
    }
    if (result != 0) {
        return GWFail(error, posixError(errno, to, "moving an item to"));
    }
    return GWMetadataStore::moveMetadata(source, target, error);
}

std::optional<GWURL> GWItemReplacementDirectoryForURL(const GWURL& appropriateFor,
                                                      GWErrorPtr* error) {
    if (!requireFileURL(appropriateFor, error)) {
        return std::nullopt;
    }
    std::string near = appropriateFor.path();
    struct stat nearStatus {};
    if (::stat(near.c_str(), &nearStatus) != 0) {
        GWFail(error, posixError(errno, appropriateFor, "finding a replacement directory for"));
        return std::nullopt;
    }
    if (!S_ISDIR(nearStatus.st_mode)) {
        near = appropriateFor.URLByDeletingLastPathComponent().path();
    }
    const std::string temporary = GWTemporaryDirectoryPath();
    struct stat temporaryStatus {};
    std::string pattern;
    if (::stat(temporary.c_str(), &temporaryStatus) == 0 &&
        temporaryStatus.st_dev == nearStatus.st_dev) {
        pattern = temporary + "/gwarchive-replace-XXXXXX";
    } else {
        pattern = (near == "/" ? std::string() : near) + "/.gwarchive-XXXXXX";
    }
    if (!::mkdtemp(pattern.data())) {
        GWFail(error, posixError(errno, GWURL::fileURLWithPath(pattern),
                                 "creating the replacement directory"));
        return std::nullopt;
    }
    return GWURL::fileURLWithPath(pattern, true);
}

std::string GWTemporaryDirectoryPath() {
    const char* value = std::getenv("TMPDIR");
    std::string path = value && *value ? value : "/tmp";
    while (path.size() > 1 && path.back() == '/') {
        path.pop_back();
    }
    return path;
}

std::uint32_t GWProcessUserID() {
    static const std::uint32_t user = ::getuid();
    return user;
}

std::uint32_t GWProcessGroupID() {
    static const std::uint32_t group = ::getgid();
    return group;
}
