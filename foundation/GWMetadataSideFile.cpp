#include "GWMetadataSideFile.h"

#include <sys/stat.h>

#include <algorithm>
#include <cerrno>
#include <cstdio>
#include <cstring>

#include "GWConversions.h"
#include "GWFileDescriptor.h"
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

}  // namespace

struct GWMetadataSideFile::Loaded {
    GWFileDescriptor fd;
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

bool GWMetadataSideFile::load(Loaded& loaded, GWErrorPtr* error) const {
    loaded = Loaded{};
    loaded.fd = GWFileDescriptor::open(path_.c_str(), O_RDWR);
    if (!loaded.fd.isValid() && (errno == EACCES || errno == EROFS)) {
        loaded.fd = GWFileDescriptor::open(path_.c_str(), O_RDONLY);
    }
    if (!loaded.fd.isValid()) {
        return errno == ENOENT || GWFail(error, sideFileError(errno, path_, "opening"));
    }
    loaded.exists = true;
    struct stat info {};
    if (fstat(loaded.fd.get(), &info) != 0) {
        return GWFail(error, sideFileError(errno, path_, "reading"));
    }
    loaded.fileSize = std::uint64_t(info.st_size);
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
    if (!hasFinderInfo && contents.attributes.empty() && !contents.comment && forkLength == 0 &&
        !keepEmptyFork) {
        if (::unlink(path_.c_str()) != 0 && errno != ENOENT) {
            return GWFail(error, sideFileError(errno, path_, "removing"));
        }
        return true;
    }
    if (forkLength > UINT32_MAX) {
        return GWFail(error, sideFileError(EFBIG, path_, "writing a resource fork into"));
    }
    const GWData prefix = GWAppleDoubleBytesBeforeResourceFork(contents, std::uint32_t(forkLength));
    if (prefix.size() > kGWAppleDoubleMetadataLimit) {
        return GWFail(error, sideFileError(E2BIG, path_, "writing attributes into"));
    }

    // A fresh file renamed over the old one, so a failure never leaves half a side file.
    const std::string temporary = path_ + ".gw-" + GWUniqueID();
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
    if (::rename(temporary.c_str(), path_.c_str()) != 0) {
        return fail(errno, "replacing");
    }
    return true;
}

bool GWMetadataSideFile::writeResourceFork(std::span<const std::uint8_t> bytes,
                                           std::uint64_t position, GWErrorPtr* error) {
    if (position > UINT32_MAX || bytes.size() > UINT32_MAX - position) {
        return GWFail(error, sideFileError(EFBIG, path_, "writing a resource fork into"));
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
    return true;
}
