#include "GWFileSystem.h"

#include <fcntl.h>
#include <ftw.h>
#include <linux/fs.h>
#include <pthread.h>
#include <signal.h>
#include <stdio.h>
#include <sys/ioctl.h>
#include <sys/stat.h>
#include <sys/xattr.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>
#include <cstring>
#include <mutex>
#include <set>
#include <thread>
#include <vector>

#include "GWConversions.h"
#include "GWFileManager.h"

namespace {

GWErrorPtr posixError(int number, const std::string& path) {
    return GWPOSIXError(number, GWURL::fileURLWithPath(path));
}

std::string parentPath(const std::string& path) {
    const auto slash = path.find_last_of('/');
    if (slash == std::string::npos) {
        return ".";
    }
    return slash == 0 ? "/" : path.substr(0, slash);
}

std::string makeTemporaryDirectory(std::string pattern) {
    std::vector<char> buffer(pattern.begin(), pattern.end());
    buffer.push_back('\0');
    if (!::mkdtemp(buffer.data())) {
        return {};
    }
    return buffer.data();
}

// The folders alive in this process, for removal when it is interrupted.
struct LiveFolders {
    std::mutex mutex;
    std::set<std::string> paths;
};

LiveFolders& liveFolders() {
    static auto* folders = new LiveFolders;  // never destroyed: the signal thread may outlive main
    return *folders;
}

// Clears the flags that make an item unremovable; devices and FIFOs are
// never opened.
void clearPinningFlags(const std::string& path) {
    struct stat info;
    if (::lstat(path.c_str(), &info) != 0 || !(S_ISREG(info.st_mode) || S_ISDIR(info.st_mode))) {
        return;
    }
    auto fd = GWFileDescriptor::open(path.c_str(), O_RDONLY | O_NONBLOCK | O_NOFOLLOW);
    int flags = 0;
    if (fd.isValid() && ::ioctl(fd.get(), FS_IOC_GETFLAGS, &flags) == 0 &&
        (flags & (FS_IMMUTABLE_FL | FS_APPEND_FL))) {
        flags &= ~(FS_IMMUTABLE_FL | FS_APPEND_FL);
        ::ioctl(fd.get(), FS_IOC_SETFLAGS, &flags);
    }
}

int firstRemovalError = 0;

int removeOne(const char* path, const struct stat*, int, struct FTW*) {
    if (::remove(path) == 0 || errno == ENOENT) {
        return 0;
    }
    if (errno == EPERM) {
        clearPinningFlags(path);
        clearPinningFlags(parentPath(path));
        if (::remove(path) == 0) {
            return 0;
        }
    } else if (errno == EACCES) {
        // A read-only directory keeps its entries from an unprivileged owner.
        const std::string parent = parentPath(path);
        struct stat info;
        if (::lstat(parent.c_str(), &info) == 0 &&
            ::chmod(parent.c_str(), (info.st_mode & 07777) | S_IRWXU) == 0 && ::remove(path) == 0) {
            return 0;
        }
    }
    if (firstRemovalError == 0) {
        firstRemovalError = errno;
    }
    return 0;
}

bool copyAttributes(int source, int target) {
    const ssize_t listLength = ::flistxattr(source, nullptr, 0);
    if (listLength <= 0) {
        return true;
    }
    std::vector<char> names(std::size_t(listLength) + 1, '\0');
    const ssize_t got = ::flistxattr(source, names.data(), names.size() - 1);
    for (ssize_t at = 0; got > 0 && at < got;) {
        const char* name = names.data() + at;
        const ssize_t size = ::fgetxattr(source, name, nullptr, 0);
        if (size >= 0) {
            std::vector<std::uint8_t> value(static_cast<std::size_t>(size));
            const ssize_t read = ::fgetxattr(source, name, value.data(), value.size());
            // Only the user's own namespace is a loss worth failing for.
            if (read >= 0 && ::fsetxattr(target, name, value.data(), std::size_t(read), 0) != 0 &&
                std::strncmp(name, "user.", 5) == 0) {
                return false;
            }
        }
        at += ssize_t(std::strlen(name)) + 1;
    }
    return true;
}

// Copies a regular file with its mode, dates and extended attributes, for
// moves that cannot be renames.
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
    GWFileDescriptor target = GWFileDescriptor::open(
        to.c_str(), O_WRONLY | O_CREAT | O_EXCL | O_NOFOLLOW, status.st_mode & 07777);
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
    for (std::uint64_t offset = 0;;) {
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
    if (!copyAttributes(source.get(), target.get())) {
        return fail(errno);
    }
    const struct timespec times[2] = {status.st_atim, status.st_mtim};
    ::futimens(target.get(), times);
    return true;
}

}  // namespace

GWReplacementFolder::GWReplacementFolder(std::string path) : path_(std::move(path)) {
    auto& folders = liveFolders();
    std::lock_guard lock(folders.mutex);
    folders.paths.insert(path_);
}

GWReplacementFolder::~GWReplacementFolder() {
    GWRemoveItemRecursively(path_, nullptr);
    auto& folders = liveFolders();
    std::lock_guard lock(folders.mutex);
    folders.paths.erase(path_);
}

std::shared_ptr<GWReplacementFolder> GWReplacementFolder::createForDestination(
    const std::string& destinationPath, GWErrorPtr* error) {
    const std::string ancestor = GWNearestExistingAncestor(destinationPath);
    struct stat ancestorInfo;
    if (::stat(ancestor.c_str(), &ancestorInfo) != 0) {
        GWFail(error, posixError(errno, ancestor));
        return nullptr;
    }
    const std::string temporary = GWTemporaryDirectoryPath();
    struct stat temporaryInfo;
    std::string created;
    if (::stat(temporary.c_str(), &temporaryInfo) == 0 &&
        temporaryInfo.st_dev == ancestorInfo.st_dev) {
        created = makeTemporaryDirectory(temporary + "/.gwarchive-XXXXXX");
    }
    if (created.empty()) {
        // The temporary folder is on another device, or unusable: a rename
        // out of it could not be atomic.
        const std::string base = S_ISDIR(ancestorInfo.st_mode) ? ancestor : parentPath(ancestor);
        created = makeTemporaryDirectory((base == "/" ? "" : base) + "/.gwarchive-XXXXXX");
        if (created.empty()) {
            GWFail(error, posixError(errno, base));
            return nullptr;
        }
    }
    return std::shared_ptr<GWReplacementFolder>(new GWReplacementFolder(created));
}

std::string GWReplacementFolder::uniquePath() const {
    return path_ + "/" + std::to_string(used_.fetch_add(1) + 1);
}

void GWRemoveLiveReplacementFolders() {
    auto& folders = liveFolders();
    std::lock_guard lock(folders.mutex);
    for (const auto& path : folders.paths) {
        // Renamed first, so that threads still extracting into it by name
        // cannot add to it while it is being removed.
        const std::string doomed = path + "-removed";
        GWRemoveItemRecursively(::rename(path.c_str(), doomed.c_str()) == 0 ? doomed : path,
                                nullptr);
    }
    folders.paths.clear();
}

void GWRemoveReplacementFoldersOnSignals() {
    sigset_t signals;
    sigemptyset(&signals);
    sigaddset(&signals, SIGINT);
    sigaddset(&signals, SIGTERM);
    sigaddset(&signals, SIGHUP);
    // Threads made later inherit the mask, so only the waiting thread sees them.
    if (::pthread_sigmask(SIG_BLOCK, &signals, nullptr) != 0) {
        return;
    }
    // Also whatever an object kept until exit still owns.
    std::atexit(GWRemoveLiveReplacementFolders);
    std::thread([signals] {
        int number = 0;
        while (::sigwait(&signals, &number) != 0) {
        }
        GWRemoveLiveReplacementFolders();
        // Dies of the signal, as the shell expects of an interrupted command.
        ::signal(number, SIG_DFL);
        sigset_t one;
        sigemptyset(&one);
        sigaddset(&one, number);
        ::pthread_sigmask(SIG_UNBLOCK, &one, nullptr);
        ::raise(number);
        ::_exit(128 + number);
    }).detach();
}

std::string GWNearestExistingAncestor(const std::string& path) {
    std::string candidate = path.empty() ? "." : path;
    struct stat info;
    while (::stat(candidate.c_str(), &info) != 0) {
        const std::string parent = parentPath(candidate);
        if (parent == candidate) {
            break;
        }
        candidate = parent;
    }
    return candidate;
}

bool GWMoveItemNoReplace(const std::string& from, const std::string& to, GWErrorPtr* error) {
    int result = ::renameat2(AT_FDCWD, from.c_str(), AT_FDCWD, to.c_str(), RENAME_NOREPLACE);
    if (result != 0 && (errno == EINVAL || errno == ENOSYS)) {
        // A file system without the flag: check, then rename (racy, but the
        // best such a file system allows).
        struct stat info;
        if (::lstat(to.c_str(), &info) == 0) {
            return GWFail(error, posixError(EEXIST, to));
        }
        result = ::rename(from.c_str(), to.c_str());
    }
    if (result != 0 && errno == EXDEV) {
        int failure = 0;
        if (!copyRegularFile(from, to, &failure)) {
            return GWFail(error, posixError(failure, to));
        }
        ::unlink(from.c_str());
        return true;
    }
    return result == 0 || GWFail(error, posixError(errno, to));
}

bool GWMoveItemReplacing(const std::string& from, const std::string& to, GWErrorPtr* error) {
    struct stat target;
    struct stat source;
    if (::lstat(to.c_str(), &target) == 0 && S_ISDIR(target.st_mode) &&
        (::lstat(from.c_str(), &source) != 0 || !S_ISDIR(source.st_mode))) {
        return GWFail(error, posixError(EISDIR, to));
    }
    if (::rename(from.c_str(), to.c_str()) == 0) {
        return true;
    }
    if (errno != EXDEV) {
        return GWFail(error, posixError(errno, to));
    }
    // A copy beside the target, then one rename over it.
    const std::string beside = parentPath(to) + "/.gwarchive-" + GWUniqueID();
    int failure = 0;
    if (!copyRegularFile(from, beside, &failure)) {
        return GWFail(error, posixError(failure, to));
    }
    if (::rename(beside.c_str(), to.c_str()) != 0) {
        failure = errno;
        ::unlink(beside.c_str());
        return GWFail(error, posixError(failure, to));
    }
    ::unlink(from.c_str());
    return true;
}

bool GWRemoveItemRecursively(const std::string& path, GWErrorPtr* error) {
    // nftw offers no user pointer; removals are rare and short, so one lock
    // around the walk is enough to keep the error slot per call.
    static std::mutex walkMutex;
    std::lock_guard lock(walkMutex);
    firstRemovalError = 0;
    if (::nftw(path.c_str(), removeOne, 16, FTW_DEPTH | FTW_PHYS) != 0 && errno != ENOENT) {
        return GWFail(error, posixError(errno, path));
    }
    if (firstRemovalError != 0) {
        return GWFail(error, posixError(firstRemovalError, path));
    }
    return true;
}

namespace {

constexpr int kDirectoryFlags = O_RDONLY | O_DIRECTORY | O_NOFOLLOW | O_CLOEXEC;

// Walks from the directory `start`, at the path `reached`, down `relative`,
// a component at a time; `current` ends as the last directory reached, or
// stays as it is when `relative` has no components.
bool walkBelow(int start, std::string reached, std::string_view relative, bool create,
               GWFileDescriptor& current, GWErrorPtr* error) {
    while (!relative.empty()) {
        const std::size_t slash = relative.find('/');
        const std::string name(relative.substr(0, slash));
        relative =
            slash == std::string_view::npos ? std::string_view() : relative.substr(slash + 1);
        if (name.empty()) {
            continue;
        }
        reached += "/" + name;
        if (name == "." || name == "..") {
            return GWFail(error, posixError(EINVAL, reached));
        }
        const int at = current.isValid() ? current.get() : start;
        int next = ::openat(at, name.c_str(), kDirectoryFlags);
        if (next < 0 && errno == ENOENT && create) {
            if (::mkdirat(at, name.c_str(), 0777) != 0 && errno != EEXIST) {
                return GWFail(error, posixError(errno, reached));
            }
            next = ::openat(at, name.c_str(), kDirectoryFlags);
        }
        if (next < 0) {
            return GWFail(error, posixError(errno, reached));
        }
        current.reset(next);
    }
    return true;
}

}  // namespace

GWFileDescriptor GWOpenDirectoryBelow(const std::string& root, std::string_view relative,
                                      bool create, GWErrorPtr* error) {
    GWFileDescriptor current = GWFileDescriptor::open(root.c_str(), kDirectoryFlags);
    if (!current.isValid()) {
        GWFail(error, posixError(errno, root));
        return {};
    }
    GWFileDescriptor below;
    if (!walkBelow(current.get(), root, relative, create, below, error)) {
        return {};
    }
    return below.isValid() ? std::move(below) : std::move(current);
}

std::shared_ptr<const GWFileDescriptor> GWDirectoryCache::find(const std::string& relative) {
    std::lock_guard lock(mutex_);
    const auto found = open_.find(relative);
    return found == open_.end() ? nullptr : found->second;
}

std::shared_ptr<const GWFileDescriptor> GWDirectoryCache::open(const std::string& relative,
                                                               GWErrorPtr* error) {
    // From the nearest ancestor already open, or from the root.
    std::shared_ptr<const GWFileDescriptor> start;
    std::string startPath = relative;
    while (!start) {
        if ((start = find(startPath))) {
            break;
        }
        if (startPath.empty()) {
            break;
        }
        const std::size_t slash = startPath.rfind('/');
        startPath = slash == std::string::npos ? std::string() : startPath.substr(0, slash);
    }
    if (start && startPath == relative) {
        return start;
    }
    GWFileDescriptor walked;
    if (start) {
        const std::string rest = relative.substr(startPath.size() + (startPath.empty() ? 0 : 1));
        const std::string startAt = startPath.empty() ? root_ : root_ + "/" + startPath;
        if (!walkBelow(start->get(), startAt, rest, true, walked, error)) {
            return nullptr;
        }
        if (!walked.isValid()) {
            return start;
        }
    } else {
        walked = GWOpenDirectoryBelow(root_, relative, true, error);
        if (!walked.isValid()) {
            return nullptr;
        }
    }
    auto opened = std::make_shared<const GWFileDescriptor>(std::move(walked));
    std::lock_guard lock(mutex_);
    // A few directories at a time are busy; the rest would only hold descriptors.
    if (open_.size() >= 64) {
        open_.clear();
    }
    open_.emplace(relative, opened);
    return opened;
}

void GWDirectoryCache::forget() {
    std::lock_guard lock(mutex_);
    open_.clear();
}
