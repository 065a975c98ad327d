#include "GWMetadataSideFile.h"

#include <linux/limits.h>
#include <sys/stat.h>

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <cstdio>
#include <cstring>
#include <map>
#include <mutex>

#include "GWConversions.h"
#include "GWFileDescriptor.h"
#include "GWLog.h"
#include "GWMetadataNames.h"

namespace {

constexpr std::size_t kCopyPieceLength = 64 * 1024;

bool isZero(const GWData& bytes) {
    return std::all_of(bytes.begin(), bytes.end(), [](std::uint8_t b) { return b == 0; });
}

GWErrorPtr sideFileError(int number, const std::string& path, const char* doing) {
    return GWGenerateError(kGWPOSIXErrorDomain, number, std::nullopt, nullptr, {},
                           "%s the metadata side file %s failed: %s", doing, path.c_str(),
                           std::strerror(number));
}

std::string parentOf(const std::string& path) {
    const auto slash = path.rfind('/');
    return slash == std::string::npos ? "." : slash == 0 ? "/" : path.substr(0, slash);
}

std::string lastComponent(const std::string& path) {
    const auto slash = path.rfind('/');
    return slash == std::string::npos ? path : path.substr(slash + 1);
}

// The side files this process wrote, by inode, each with the directory and
// name it was last given and its change time after our last change: an inode
// the file system hands out again after one of ours was deleted behind our
// back (a whole folder removed) does not make a stranger's file ours.
class OwnedSideFiles {
public:
    static OwnedSideFiles& shared() {
        static OwnedSideFiles files;
        return files;
    }

    void remember(const struct stat& file, const std::string& path) {
        auto place = placeOf(path);
        if (!place) {
            return;
        }
        std::lock_guard lock(mutex_);
        made_.store(true, std::memory_order_release);
        place->changed = file.st_ctim;
        files_[{file.st_dev, file.st_ino}] = std::move(*place);
        if (files_.size() >= sweepAt_) {
            sweep();
        }
    }

    void forget(const struct stat& file) {
        std::lock_guard lock(mutex_);
        files_.erase({file.st_dev, file.st_ino});
    }

    // Whether no side file was ever made: asked for every extracted file, so
    // without the lock.
    bool noneEverMade() const { return !made_.load(std::memory_order_acquire); }

    bool owns(const struct stat& file, const std::string& path) {
        if (!S_ISREG(file.st_mode)) {
            return false;
        }
        const auto place = placeOf(path);
        std::lock_guard lock(mutex_);
        const auto found = files_.find({file.st_dev, file.st_ino});
        return place && found != files_.end() && found->second == *place &&
               found->second.changed.tv_sec == file.st_ctim.tv_sec &&
               found->second.changed.tv_nsec == file.st_ctim.tv_nsec;
    }

private:
    struct Place {
        dev_t directoryDevice = 0;
        ino_t directoryInode = 0;
        std::string name;
        std::string path;  // as last given, for sweeping
        struct timespec changed {};
        bool operator==(const Place& other) const {
            return directoryDevice == other.directoryDevice &&
                   directoryInode == other.directoryInode && name == other.name;
        }
    };

    static std::optional<Place> placeOf(const std::string& path) {
        struct stat directory {};
        if (::stat(parentOf(path).c_str(), &directory) != 0) {
            return std::nullopt;
        }
        return Place{directory.st_dev, directory.st_ino, lastComponent(path), path};
    }

    // Side files deleted by others (a replacement folder removed whole)
    // leave entries behind; they go once the table has doubled.
    void sweep() {
        std::erase_if(files_, [](const auto& entry) {
            struct stat file {};
            return ::lstat(entry.second.path.c_str(), &file) != 0 ||
                   file.st_dev != entry.first.first || file.st_ino != entry.first.second;
        });
        sweepAt_ = std::max<std::size_t>(256, 2 * files_.size());
    }

    std::mutex mutex_;
    std::map<std::pair<dev_t, ino_t>, Place> files_;
    std::size_t sweepAt_ = 256;
    std::atomic<bool> made_{false};
};

int renameNoReplace(const std::string& from, const std::string& to) {
    const int result = ::renameat2(AT_FDCWD, from.c_str(), AT_FDCWD, to.c_str(), RENAME_NOREPLACE);
    if (result == 0 || (errno != EINVAL && errno != ENOSYS)) {
        return result;
    }
    // A file system without the flag: check, then rename.
    struct stat existing {};
    if (::lstat(to.c_str(), &existing) == 0) {
        errno = EEXIST;
        return -1;
    }
    return ::rename(from.c_str(), to.c_str());
}

bool nameTooLong(const std::string& path) {
    return lastComponent(path).size() > NAME_MAX;
}

bool isOurs(const std::string& path, struct stat& info) {
    return ::lstat(path.c_str(), &info) == 0 && OwnedSideFiles::shared().owns(info, path);
}

// Opens a side file for reading and writing, or reading only where writing is
// not allowed, never through a link.
GWFileDescriptor openSideFile(const std::string& path) {
    auto fd = GWFileDescriptor::open(path.c_str(), O_RDWR | O_NOFOLLOW);
    if (!fd.isValid() && (errno == EACCES || errno == EROFS)) {
        fd = GWFileDescriptor::open(path.c_str(), O_RDONLY | O_NOFOLLOW);
    }
    return fd;
}

// Copies the whole of `from` into the new file `to`, for a move across file systems.
bool copySideFile(int from, int to, int& number) {
    GWData piece(kCopyPieceLength);
    for (std::uint64_t done = 0;;) {
        std::size_t got = 0;
        if (!GWReadFully(from, done, piece, got)) {
            number = errno;
            return false;
        }
        if (got == 0) {
            return true;
        }
        if (!GWWriteFully(to, done, std::span(piece).first(got))) {
            number = errno;
            return false;
        }
        done += got;
    }
}

}  // namespace

struct GWMetadataSideFile::Loaded {
    GWFileDescriptor fd;
    struct stat info {};
    bool exists = false;
    GWAppleDoubleContents contents;
    std::uint64_t fileSize = 0;

    // A resource fork of length zero counts as none, as Mac OS X writes one into every file.
    bool hasResourceFork() const {
        return contents.resourceFork && contents.resourceFork->length > 0;
    }
};

GWMetadataSideFile::GWMetadataSideFile(std::string_view itemPath) : path_(pathForItem(itemPath)) {}

std::string GWMetadataSideFile::pathForItem(std::string_view itemPath) {
    const auto slash = itemPath.rfind('/');
    if (slash == std::string_view::npos) {
        return "._" + std::string(itemPath);
    }
    return std::string(itemPath.substr(0, slash + 1)) + "._" +
           std::string(itemPath.substr(slash + 1));
}

GWErrorPtr GWMetadataSideFile::unavailability() const {
    if (nameTooLong(path_)) {
        return sideFileError(ENAMETOOLONG, path_, "naming");
    }
    struct stat info {};
    if (::lstat(path_.c_str(), &info) == 0 && !OwnedSideFiles::shared().owns(info, path_)) {
        return GWGenerateError(kGWPOSIXErrorDomain, EEXIST, std::nullopt, nullptr, {},
                               "%s is not a metadata side file of this library's", path_.c_str());
    }
    return nullptr;
}

bool GWMetadataSideFile::load(Loaded& loaded, GWErrorPtr* error) const {
    loaded = Loaded{};
    struct stat info {};
    if (nameTooLong(path_) || !isOurs(path_, info)) {
        return true;
    }
    loaded.fd = openSideFile(path_);
    if (!loaded.fd.isValid()) {
        return errno == ENOENT || errno == ELOOP ||
               GWFail(error, sideFileError(errno, path_, "opening"));
    }
    if (fstat(loaded.fd.get(), &loaded.info) != 0) {
        return GWFail(error, sideFileError(errno, path_, "reading"));
    }
    // Swapped for another file between the two looks: not ours after all.
    if (loaded.info.st_dev != info.st_dev || loaded.info.st_ino != info.st_ino) {
        loaded.fd.reset();
        return true;
    }
    loaded.exists = true;
    loaded.fileSize = std::uint64_t(loaded.info.st_size);
    return GWReadAppleDouble(loaded.fd.get(), loaded.contents, error);
}

std::optional<GWData> GWMetadataSideFile::value(const std::string& name, GWErrorPtr* error) const {
    Loaded loaded;
    if (!load(loaded, error) || !loaded.exists) {
        return std::nullopt;
    }
    const auto& contents = loaded.contents;
    if (name == kGWFinderInfoAttributeName) {
        if (contents.finderInfo && !isZero(*contents.finderInfo)) {
            return contents.finderInfo;
        }
        return std::nullopt;
    }
    if (name == kGWCommentAttributeName) {
        return contents.comment;
    }
    if (name == kGWResourceForkAttributeName) {
        if (!loaded.hasResourceFork()) {
            return std::nullopt;
        }
        // The reader checked that the extent lies inside the file.
        GWData fork(contents.resourceFork->length);
        std::size_t got = 0;
        if (!GWReadFully(loaded.fd.get(), contents.resourceFork->offset, fork, got) ||
            got != fork.size()) {
            GWFail(error, sideFileError(got != fork.size() ? EIO : errno, path_, "reading"));
            return std::nullopt;
        }
        return fork;
    }
    if (const auto* attribute = contents.attribute(name)) {
        return attribute->value;
    }
    return std::nullopt;
}

std::optional<std::vector<std::string>> GWMetadataSideFile::names(GWErrorPtr* error) const {
    Loaded loaded;
    if (!load(loaded, error)) {
        return std::nullopt;
    }
    std::vector<std::string> result;
    const auto& contents = loaded.contents;
    if (contents.finderInfo && !isZero(*contents.finderInfo)) {
        result.emplace_back(kGWFinderInfoAttributeName);
    }
    for (const auto& attribute : contents.attributes) {
        result.push_back(attribute.name);
    }
    if (contents.comment) {
        result.emplace_back(kGWCommentAttributeName);
    }
    if (loaded.hasResourceFork()) {
        result.emplace_back(kGWResourceForkAttributeName);
    }
    return result;
}

bool GWMetadataSideFile::contains(const std::string& name, bool& found, GWErrorPtr* error) const {
    found = false;
    const auto held = names(error);
    if (!held) {
        return false;
    }
    found = std::find(held->begin(), held->end(), name) != held->end();
    return true;
}

bool GWMetadataSideFile::setValue(const std::string& name,
                                  std::optional<std::span<const std::uint8_t>> value,
                                  GWErrorPtr* error) {
    Loaded loaded;
    if (!load(loaded, error)) {
        return false;
    }
    if (!loaded.exists && !value) {
        return true;
    }
    if (auto why = unavailability()) {
        return GWFail(error, why);
    }
    auto contents = loaded.contents;
    std::uint64_t forkOffset = 0;
    std::uint64_t forkLength = 0;
    if (loaded.hasResourceFork()) {
        forkOffset = contents.resourceFork->offset;
        forkLength = contents.resourceFork->length;
    }
    if (name == kGWResourceForkAttributeName) {
        const auto bytes = value.value_or(std::span<const std::uint8_t>());
        return rewrite(contents, bytes, -1, 0, bytes.size(), false, error);
    }
    if (name == kGWFinderInfoAttributeName) {
        if (value && value->size() != kGWFinderInfoLength) {
            return GWFail(error, sideFileError(ERANGE, path_, "writing Finder information into"));
        }
        contents.finderInfo.reset();
        if (value) {
            contents.finderInfo = GWData(value->begin(), value->end());
        }
    } else if (name == kGWCommentAttributeName) {
        contents.comment.reset();
        if (value) {
            contents.comment = GWData(value->begin(), value->end());
        }
    } else {
        if (name.size() > 254) {  // the name length byte counts the terminating NUL
            return GWFail(error, sideFileError(ENAMETOOLONG, path_, "writing an attribute into"));
        }
        auto& attributes = contents.attributes;
        std::erase_if(attributes, [&](const GWAppleDoubleAttribute& a) { return a.name == name; });
        if (value) {
            attributes.push_back({name, GWData(value->begin(), value->end())});
        }
    }
    return rewrite(contents, {}, loaded.fd.get(), forkOffset, forkLength, false, error);
}

bool GWMetadataSideFile::rewrite(const GWAppleDoubleContents& contents,
                                 std::span<const std::uint8_t> forkBytes, int forkFd,
                                 std::uint64_t forkOffset, std::uint64_t forkLength,
                                 bool keepEmptyFork, GWErrorPtr* error) {
    const bool hasFinderInfo = contents.finderInfo && !isZero(*contents.finderInfo);
    struct stat old {};
    const bool replacing = isOurs(path_, old);
    if (!hasFinderInfo && contents.attributes.empty() && !contents.comment && forkLength == 0 &&
        !keepEmptyFork) {
        if (!replacing) {
            return true;
        }
        if (::unlink(path_.c_str()) != 0 && errno != ENOENT) {
            return GWFail(error, sideFileError(errno, path_, "removing"));
        }
        OwnedSideFiles::shared().forget(old);
        return true;
    }
    if (forkLength > UINT32_MAX) {
        return GWFail(error, sideFileError(EFBIG, path_, "writing a resource fork into"));
    }
    const GWData prefix = GWAppleDoubleBytesBeforeResourceFork(contents, std::uint32_t(forkLength));
    if (prefix.size() > kGWAppleDoubleMetadataLimit) {
        return GWFail(error, sideFileError(E2BIG, path_, "writing attributes into"));
    }

    // A fresh file renamed over the old one, so a failure never leaves half a
    // side file. Its name is short: the side file's may be as long as names go.
    const std::string temporary = parentOf(path_) + "/.gw-" + GWUniqueID();
    GWFileDescriptor out =
        GWFileDescriptor::open(temporary.c_str(), O_WRONLY | O_CREAT | O_EXCL, 0666);
    if (!out.isValid()) {
        return GWFail(error, sideFileError(errno, path_, "creating"));
    }
    auto fail = [&](int number, const char* doing) {
        ::unlink(temporary.c_str());
        return GWFail(error, sideFileError(number, path_, doing));
    };
    if (!GWWriteFully(out.get(), 0, prefix)) {
        return fail(errno, "writing");
    }
    if (forkFd < 0) {
        if (!GWWriteFully(out.get(), prefix.size(), forkBytes)) {
            return fail(errno, "writing");
        }
    } else {
        GWData piece(std::size_t(std::min<std::uint64_t>(forkLength, kCopyPieceLength)));
        for (std::uint64_t done = 0; done < forkLength;) {
            const auto span = std::span(piece).first(
                std::size_t(std::min<std::uint64_t>(forkLength - done, piece.size())));
            std::size_t got = 0;
            if (!GWReadFully(forkFd, forkOffset + done, span, got)) {
                return fail(errno, "reading");
            }
            if (got != span.size()) {
                return fail(EIO, "reading");
            }
            if (!GWWriteFully(out.get(), prefix.size() + done, span)) {
                return fail(errno, "writing");
            }
            done += got;
        }
    }
    // Only our own side file is replaced; anything that appeared meanwhile stays.
    const int installed =
        replacing ? ::rename(temporary.c_str(), path_.c_str()) : renameNoReplace(temporary, path_);
    if (installed != 0) {
        return fail(errno, "replacing");
    }
    struct stat written {};
    if (fstat(out.get(), &written) != 0) {
        return GWFail(error, sideFileError(errno, path_, "writing"));
    }
    if (replacing) {
        OwnedSideFiles::shared().forget(old);
    }
    OwnedSideFiles::shared().remember(written, path_);
    return true;
}

bool GWMetadataSideFile::writeResourceFork(std::span<const std::uint8_t> bytes,
                                           std::uint64_t position, GWErrorPtr* error) {
    if (position > UINT32_MAX || bytes.size() > UINT32_MAX - position) {
        return GWFail(error, sideFileError(EFBIG, path_, "writing a resource fork into"));
    }
    if (auto why = unavailability()) {
        return GWFail(error, why);
    }
    Loaded loaded;
    if (!load(loaded, error)) {
        return false;
    }
    const auto& fork = loaded.contents.resourceFork;
    const bool forkIsLast = fork && fork->offset + fork->length == loaded.fileSize;
    if (!forkIsLast) {
        // Lay the file out afresh with the resource fork at its end, then write in place.
        const bool hasFork = loaded.hasResourceFork();
        if (!rewrite(loaded.contents, {}, loaded.fd.get(), hasFork ? fork->offset : 0,
                     hasFork ? fork->length : 0, true, error) ||
            !load(loaded, error)) {
            return false;
        }
        if (!loaded.exists) {
            return GWFail(error, sideFileError(ENOENT, path_, "writing"));
        }
    }
    if (bytes.empty()) {
        return true;
    }
    const auto extent = *loaded.contents.resourceFork;
    if (!GWWriteFully(loaded.fd.get(), extent.offset + position, bytes)) {
        return GWFail(error, sideFileError(errno, path_, "writing"));
    }
    const std::uint64_t end = position + bytes.size();
    if (end > extent.length) {
        const std::uint8_t length[4] = {std::uint8_t(end >> 24), std::uint8_t(end >> 16),
                                        std::uint8_t(end >> 8), std::uint8_t(end)};
        if (!GWWriteFully(loaded.fd.get(), GWAppleDoubleEntryLengthOffset(extent.tableIndex),
                          length)) {
            return GWFail(error, sideFileError(errno, path_, "writing"));
        }
    }
    struct stat written {};
    if (fstat(loaded.fd.get(), &written) != 0) {
        return GWFail(error, sideFileError(errno, path_, "writing"));
    }
    OwnedSideFiles::shared().remember(written, path_);
    return true;
}

bool GWMetadataSideFile::moveWithItem(const std::string& fromItem, const std::string& toItem,
                                      bool replaceExisting, GWErrorPtr* error) {
    auto& owned = OwnedSideFiles::shared();
    // Neither item can have a side file of ours: nothing to look for.
    if (owned.noneEverMade()) {
        return true;
    }
    const std::string from = pathForItem(fromItem);
    const std::string to = pathForItem(toItem);
    struct stat source {};
    struct stat target {};
    const bool targetIsOurs = isOurs(to, target);
    if (!isOurs(from, source)) {
        // The item that was at the destination is gone, and so is what it kept.
        if (targetIsOurs && ::unlink(to.c_str()) == 0) {
            owned.forget(target);
        }
        return true;
    }
    auto drop = [&](const char* why) {
        GWLog("the Mac metadata of %s is not kept: %s", toItem.c_str(), why);
        if (::unlink(from.c_str()) == 0) {
            owned.forget(source);
        }
        return true;
    };
    if (nameTooLong(to)) {
        return drop("the name of its side file would be too long");
    }
    const bool targetExists = targetIsOurs || ::lstat(to.c_str(), &target) == 0;
    if (targetExists && !targetIsOurs && !replaceExisting) {
        return drop("another file has the name of its side file");
    }
    auto fail = [&](int number) {
        return GWFail(error, GWGenerateError(kGWPOSIXErrorDomain, number, std::nullopt, nullptr, {},
                                             "moving the metadata side file %s to %s failed: %s",
                                             from.c_str(), to.c_str(), std::strerror(number)));
    };
    auto install = [&](const std::string& path) {
        return targetExists ? ::rename(path.c_str(), to.c_str()) : renameNoReplace(path, to);
    };
    auto installed = [&](const struct stat& file) {
        if (targetIsOurs) {
            owned.forget(target);
        }
        owned.remember(file, to);
        return true;
    };
    const auto moving = GWFileDescriptor::open(from.c_str(), O_RDONLY | O_NOFOLLOW);
    struct stat opened {};
    if (!moving.isValid() || fstat(moving.get(), &opened) != 0 || opened.st_ino != source.st_ino) {
        return fail(moving.isValid() ? ESTALE : errno);
    }
    if (install(from) == 0) {
        struct stat moved {};
        if (fstat(moving.get(), &moved) != 0) {
            return fail(errno);
        }
        return installed(moved);
    }
    if (errno == EEXIST) {
        return drop("another file took the name of its side file");
    }
    if (errno != EXDEV) {
        return fail(errno);
    }
    const int in = moving.get();
    const std::string temporary = parentOf(to) + "/.gw-" + GWUniqueID();
    auto out = GWFileDescriptor::open(temporary.c_str(), O_WRONLY | O_CREAT | O_EXCL, 0666);
    if (!out.isValid()) {
        return fail(errno);
    }
    int number = 0;
    struct stat copied {};
    if (!copySideFile(in, out.get(), number) || install(temporary) != 0 ||
        fstat(out.get(), &copied) != 0) {
        number = number ? number : errno;
        ::unlink(temporary.c_str());
        return number == EEXIST ? drop("another file took the name of its side file")
                                : fail(number);
    }
    if (::unlink(from.c_str()) == 0) {
        owned.forget(source);
    }
    return installed(copied);
}

bool GWMetadataSideFile::removeForItem(const std::string& item, GWErrorPtr* error) {
    const std::string side = pathForItem(item);
    struct stat info {};
    if (nameTooLong(side) || !isOurs(side, info)) {
        return true;
    }
    if (::unlink(side.c_str()) != 0 && errno != ENOENT) {
        return GWFail(error, sideFileError(errno, side, "removing"));
    }
    OwnedSideFiles::shared().forget(info);
    return true;
}
