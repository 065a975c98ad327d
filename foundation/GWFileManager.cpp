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
#include "GWFileSystem.h"
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
    return GWRemoveItemRecursively(url.path(), error) &&
           GWMetadataStore::removeMetadata(url.path(), error);
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
    return GWMoveItemNoReplace(from.path(), to.path(), error) &&
           GWMetadataStore::moveMetadata(from.path(), to.path(), error);
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
