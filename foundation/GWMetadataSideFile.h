#pragma once

#include <cstdint>
#include <optional>
#include <span>
#include <string>
#include <string_view>
#include <vector>

#include "GWAppleDouble.h"
#include "GWError.h"

// The AppleDouble side file "._name" beside an item, which keeps the Mac
// metadata its file system refused. Names are Mac attribute names: the Finder
// information, the resource fork and "xdg.comment" live in their own entries,
// every other attribute in the "ATTR" block. The resource fork stays the last
// entry so that positional writes land in place.
//
// Only side files this process wrote are read, changed, moved or removed: a
// "._name" that was there before, or that an archive holds as a member of its
// own, is somebody's file and is left alone. Side files are opened without
// following links.
class GWMetadataSideFile {
public:
    explicit GWMetadataSideFile(std::string_view itemPath);

    static std::string pathForItem(std::string_view itemPath);
    const std::string& path() const { return path_; }

    // Why nothing can be written here, or none: a "._name" of somebody else's
    // is in the way (EEXIST), or "._" and the name exceed NAME_MAX (ENAMETOOLONG).
    GWErrorPtr unavailability() const;

    // Follows `fromItem` to `toItem` with its side file, when it has one this
    // process wrote; a stale one of ours at the destination goes. Somebody
    // else's "._name" at the destination is replaced only with
    // `replaceExisting`; otherwise, or when the name would be too long, the
    // side file's metadata is dropped with a warning and the move succeeds.
    static bool moveWithItem(const std::string& fromItem, const std::string& toItem,
                             bool replaceExisting, GWErrorPtr* error);
    // Removes the side file of `item` when it is one this process wrote.
    static bool removeForItem(const std::string& item, GWErrorPtr* error);

    // The value under `name`; none without an error when the side file or the
    // name is absent.
    std::optional<GWData> value(const std::string& name, GWErrorPtr* error) const;
    // The names held, in the side file's order.
    std::optional<std::vector<std::string>> names(GWErrorPtr* error) const;
    // Whether `name` is held; false with an error when the side file is unreadable.
    bool contains(const std::string& name, bool& found, GWErrorPtr* error) const;

    // Replaces (or, with none, removes) the value under `name`. A side file
    // left with nothing in it is removed.
    bool setValue(const std::string& name, std::optional<std::span<const std::uint8_t>> value,
                  GWErrorPtr* error);
    // Writes into the resource fork with pwrite semantics: the bytes at the
    // position are replaced, a gap is zero-filled, nothing is truncated.
    bool writeResourceFork(std::span<const std::uint8_t> bytes, std::uint64_t position,
                           GWErrorPtr* error);

private:
    struct Loaded;
    // Opens the side file when it is ours; anything else loads as absent.
    bool load(Loaded& loaded, GWErrorPtr* error) const;
    // Writes a new side file from `contents` and a resource fork taken either
    // from `forkBytes` or from [forkOffset, forkOffset + forkLength) of `forkFd`,
    // then renames it over the old one.
    bool rewrite(const GWAppleDoubleContents& contents, std::span<const std::uint8_t> forkBytes,
                 int forkFd, std::uint64_t forkOffset, std::uint64_t forkLength, bool keepEmptyFork,
                 GWErrorPtr* error);

    std::string path_;
};
