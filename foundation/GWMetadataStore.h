#pragma once

#include <cstddef>
#include <cstdint>
#include <optional>
#include <span>
#include <string>
#include <string_view>
#include <vector>

#include "GWError.h"
#include "GWMetadataNames.h"
#include "GWMetadataSideFile.h"
#include "GWValue.h"

// The one place that writes and reads Mac metadata on Linux files. Values go
// into extended attributes under their Linux names; when the file system
// refuses one for its size or for want of support (ENOSPC, E2BIG, ERANGE,
// ENOTSUP) it goes into the AppleDouble side file "._name" beside the item
// instead. Reads find a value in either place; a value lives in only one.
//
// Names may be given in Mac form ("com.apple.ResourceFork") or Linux form
// ("user.xdg.comment"). Errors are POSIX errors with the system's number and
// no location; their descriptions name the item and the attribute.
//
// Metadata that has nowhere to go is not kept, with one warning, and the call
// still succeeds: a value the file system refuses whose side file cannot be
// written (somebody else's "._name" is there, or the name would be too
// long). Finder information that carries nothing (all zeros, or a folder's
// "fold"/"MACS" codes alone) is not written at all.
//
// One writer per item at a time: the side file is rewritten without locking.
class GWMetadataStore {
public:
    // The item at `path`; symbolic links are not followed.
    explicit GWMetadataStore(std::string path);
    // An open file. Attributes are set through the descriptor; `path` names
    // the file so that its side file can be placed beside it.
    GWMetadataStore(int fd, std::string path);

    const std::string& path() const { return path_; }
    std::string sideFilePath() const { return sideFile_.path(); }

    // None without an error when the item has no such attribute.
    std::optional<GWData> attribute(std::string_view name, GWErrorPtr* error) const;
    bool setAttribute(std::string_view name, std::span<const std::uint8_t> value,
                      GWErrorPtr* error);
    // Removing an attribute that is not there succeeds.
    bool removeAttribute(std::string_view name, GWErrorPtr* error);
    // Mac names of every attribute held in either place.
    std::optional<std::vector<std::string>> attributeNames(GWErrorPtr* error) const;

    // Writes into the resource fork with pwrite semantics: the bytes at the
    // position are replaced, a position past the end zero-fills the gap, and
    // nothing is truncated.
    bool writeResourceFork(std::span<const std::uint8_t> bytes, std::uint32_t position,
                           GWErrorPtr* error);

    // Keeps the side file with its item once the item has been moved: a side
    // file this process wrote follows the item, and a stale one of ours at
    // the destination goes. An archive member or any other file named like a
    // side file is never moved or removed; one at the destination is replaced
    // only with `replaceExisting`, otherwise the metadata it would have held
    // is dropped with a warning (see GWMetadataSideFile::moveWithItem).
    static bool moveMetadata(const std::string& fromItem, const std::string& toItem,
                             bool replaceExisting, GWErrorPtr* error);
    static bool moveMetadata(const std::string& fromItem, const std::string& toItem,
                             GWErrorPtr* error) {
        return moveMetadata(fromItem, toItem, false, error);
    }
    // Removes the side file of an item that is being removed or replaced,
    // when this process wrote it.
    static bool removeMetadata(const std::string& item, GWErrorPtr* error);

    // Treats attribute values longer than `limit` as refused by the file
    // system, so that tests reach the side file whatever the machine's file
    // systems accept. None restores the file system's own judgement.
    static void setAttributeSizeLimitForTesting(std::optional<std::size_t> limit);

private:
    int getRaw(const std::string& linuxName, GWData& value) const;
    int setRaw(const std::string& linuxName, std::span<const std::uint8_t> value) const;
    int removeRaw(const std::string& linuxName) const;
    bool moveToSideFile(const std::string& macName, const std::string& linuxName,
                        std::span<const std::uint8_t> value, GWErrorPtr* error);
    GWErrorPtr attributeError(int number, const char* doing, const std::string& name) const;
    bool isDirectory() const;
    // Warns that `linuxName` is not kept and makes sure no part of it stays.
    bool dropValue(const std::string& linuxName, const GWErrorPtr& why);

    int fd_ = -1;
    std::string path_;
    GWMetadataSideFile sideFile_;
    // A resource fork that could not be kept ignores the rest of its pieces.
    bool forkDropped_ = false;
};
