#pragma once

#include <atomic>
#include <memory>
#include <mutex>
#include <string>
#include <string_view>
#include <unordered_map>

#include "GWError.h"
#include "GWFileDescriptor.h"

// The file-system steps both formats and the tool extract through. Failures
// are POSIX errors naming the location concerned. Nothing here follows a
// symbolic link that sits where a directory or an item is expected.

// A private folder (mode 0700) on a destination's file system where one
// extraction builds its items before a rename moves each into place: in
// $TMPDIR when that is on the destination's device, otherwise a hidden
// ".gwarchive-XXXXXX" in the destination's nearest existing ancestor. It goes,
// with whatever is still in it, when its last owner lets it go, and at once
// when the process is interrupted (see GWRemoveReplacementFoldersOnSignals).
class GWReplacementFolder {
public:
    static std::shared_ptr<GWReplacementFolder> createForDestination(
        const std::string& destinationPath, GWErrorPtr* error);

    ~GWReplacementFolder();
    GWReplacementFolder(const GWReplacementFolder&) = delete;
    GWReplacementFolder& operator=(const GWReplacementFolder&) = delete;

    const std::string& path() const { return path_; }
    // A path in the folder that no other caller gets; nothing is made there.
    // A count, not a random name: nobody else can write in the folder.
    std::string uniquePath() const;

private:
    explicit GWReplacementFolder(std::string path);

    std::string path_;
    mutable std::atomic<std::uint64_t> used_{0};
};

// Removes the replacement folders of this process that are still there.
void GWRemoveLiveReplacementFolders();
// From now on SIGINT, SIGTERM and SIGHUP remove the live replacement folders
// before the process dies of the signal, and so does exit(). Called before any other thread
// exists, since the signals are taken by a thread of their own.
void GWRemoveReplacementFoldersOnSignals();

// The nearest ancestor of `path` (or `path` itself) that exists.
std::string GWNearestExistingAncestor(const std::string& path);

// Moves an item, failing with EEXIST when something is already at `to`.
// Across file systems a regular file is copied with its mode, dates and
// extended attributes, then the original removed.
bool GWMoveItemNoReplace(const std::string& from, const std::string& to, GWErrorPtr* error);

// Moves an item over whatever non-directory is at `to`, in one rename. An
// existing directory is not replaced (EISDIR, or ENOTEMPTY/EEXIST from the
// system for a directory moved over one).
bool GWMoveItemReplacing(const std::string& from, const std::string& to, GWErrorPtr* error);

// Removes an item and everything below it without following symbolic links.
// Immutable and append-only flags, which would pin the tree, are cleared first.
bool GWRemoveItemRecursively(const std::string& path, GWErrorPtr* error);

// The directory at `relative` ("/"-separated, plain components) below the
// directory `root`, reached one component at a time with O_NOFOLLOW and
// O_DIRECTORY, so that a symbolic link anywhere on the way fails the walk
// (ELOOP or ENOTDIR) instead of leading elsewhere. With `create`, missing
// components are made with mode 0777 less the umask. An empty `relative`
// opens `root` itself.
GWFileDescriptor GWOpenDirectoryBelow(const std::string& root, std::string_view relative,
                                      bool create, GWErrorPtr* error);

// The directories below one root that an extraction has walked to (as
// GWOpenDirectoryBelow does, making what is missing), kept open so that each
// is walked once rather than once per entry. Whatever is removed below the
// root makes the cache forget them all: a descriptor of a directory that was
// replaced would lead entries to a place nobody sees. Thread-safe.
class GWDirectoryCache {
public:
    explicit GWDirectoryCache(std::string root) : root_(std::move(root)) {}

    const std::string& root() const { return root_; }
    // The directory at `relative` if it was walked to and nothing was removed
    // since; none otherwise. Makes no system call.
    std::shared_ptr<const GWFileDescriptor> find(const std::string& relative);
    // The directory at `relative`, walked to from the nearest one known.
    std::shared_ptr<const GWFileDescriptor> open(const std::string& relative, GWErrorPtr* error);
    void forget();

private:
    std::string root_;
    std::mutex mutex_;
    std::unordered_map<std::string, std::shared_ptr<const GWFileDescriptor>> open_;
};
