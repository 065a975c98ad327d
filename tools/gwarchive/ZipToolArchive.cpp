#include <sys/stat.h>

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <filesystem>
#include <mutex>
#include <thread>

#include "Diagnostics.h"
#include "FormatAdapters.h"
#include "JsonWriter.h"
#include "PathTable.h"

namespace gwarchive {

namespace {

std::string compressionName(std::uint16_t method) {
    switch (method) {
        case 0: return "stored";
        case 1: return "shrink";
        case 6: return "implode";
        case 8: return "deflate";
        case 9: return "deflate64";
        case 12: return "bzip2";
        case 14: return "lzma";
        case 93: return "zstd";
        case 95: return "xz";
        case 98: return "ppmd";
        case 99: return "aes";
        default: return "method " + std::to_string(method);
    }
}

class ZipToolArchive final : public ToolArchive {
public:
    explicit ZipToolArchive(GWZipArchivePtr archive) : archive_(std::move(archive)) {
        const GWZipFileArray roots = archive_->files();
        // Sized once: arrays that grow by doubling leave their old copies
        // behind, and fresh memory is what listing pays for most.
        const std::size_t count = countEntries(roots);
        paths_.reserve(count, count * kReservedPathBytes);
        types_.reserve(count);
        files_.reserve(count);
        addTree(roots);
    }

    const char* formatName() const override { return "zip"; }
    std::size_t entryCount() const override { return files_.size(); }
    std::string_view entryPath(std::size_t index) const override { return paths_[index]; }
    EntryType entryType(std::size_t index) const override { return types_[index]; }

    EntryRecord entry(std::size_t index) const override {
        const GWZipFile& file = *files_[index];
        EntryRecord record;
        record.path = std::string(paths_[index]);
        record.mode = file.permissionsMode();
        record.type = types_[index];
        record.size = file.storedUncompressedSize();
        record.compressedSize = file.compressedSize();
        record.modificationDate = file.modificationDate();
        record.uid = file.owner();
        record.gid = file.groupOwner();
        record.linkTarget = file.symlinkDestination();
        if (file.typeCode() != 0)
            record.typeCode = file.type();
        if (file.creatorCode() != 0)
            record.creatorCode = file.creator();
        if (file.resourceFork())
            record.resourceForkSize = file.resourceFork()->storedUncompressedSize();
        record.appleDouble = file.appleDoubleFile() != nullptr;
        record.macBinary = file.isMacBinaryEncoded();
        if (!file.isDirectory())
            record.compression = compressionName(file.compressionMethod());
        return record;
    }

    // A ZIP link's text is its data.
    std::optional<std::string> readLinkTarget(std::size_t index) override {
        if (types_[index] != EntryType::symlink)
            return std::nullopt;
        std::string text;
        GWErrorPtr ignored;
        bool read = streamFile(
            files_[index],
            [&](const std::uint8_t* bytes, std::size_t length) {
                text.append(reinterpret_cast<const char*>(bytes), length);
                return text.size() <= 4096;
            },
            &ignored, nullptr);
        if (!read)
            return std::nullopt;
        return text;
    }

    void writeArchiveFields(JsonWriter& json) const override {
        json.key("startOffset");
        json.value(archive_->startOffset());
    }

    std::vector<std::string> infoLines() const override {
        return {"start offset: " + std::to_string(archive_->startOffset())};
    }

    bool stream(std::size_t index, const DataSink& sink, GWErrorPtr* error,
                bool* checksumFailed) override {
        return streamFile(files_[index], sink, error, checksumFailed);
    }

    std::vector<EntryProblem> test() override {
        std::vector<EntryProblem> problems;
        for (std::size_t index = 0; index < files_.size(); ++index) {
            const GWZipFilePtr& file = files_[index];
            if (file->isDirectory())
                continue;
            const std::string path(paths_[index]);
            checkFile(file, path, problems);
            if (file->resourceFork()) {
                checkFile(file->resourceFork(), path + " (resource fork)", problems);
            }
            if (file->appleDoubleFile()) {
                checkFile(file->appleDoubleFile(), path + " (AppleDouble)", problems);
            }
        }
        return problems;
    }

    bool extract(const std::vector<std::size_t>& indexes, const ExtractOptions& options,
                 const std::string& archiveName) override;

private:
    // Room reserved per path; a longer average only makes the buffer grow,
    // and reserved room that stays unused is never touched.
    static constexpr std::size_t kReservedPathBytes = 64;

    static std::size_t countEntries(const GWZipFileArray& roots) {
        std::size_t count = roots.size();
        std::vector<GWZipFileArrayPtr> pending;
        auto queueChildren = [&pending, &count](const GWZipFileArray& files) {
            for (const GWZipFilePtr& file : files) {
                if (auto children = file->children()) {
                    count += children->size();
                    pending.push_back(std::move(children));
                }
            }
        };
        queueChildren(roots);
        while (!pending.empty()) {
            GWZipFileArrayPtr level = std::move(pending.back());
            pending.pop_back();
            queueChildren(*level);
        }
        return count;
    }

    // Depth-first, parents before children; paths grow from the parent's, as
    // GWZipFile::path() joins them, without climbing to the root for each of
    // many thousand entries. A work list: trees may be very deep.
    void addTree(const GWZipFileArray& roots) {
        struct Pending {
            GWZipFileArrayPtr siblings;
            std::size_t next;
            std::size_t parent;
        };
        std::vector<Pending> pending;
        pending.push_back({std::make_shared<const GWZipFileArray>(roots), 0, PathTable::kNoParent});
        while (!pending.empty()) {
            Pending& top = pending.back();
            if (top.next == top.siblings->size()) {
                pending.pop_back();
                continue;
            }
            const GWZipFilePtr& file = (*top.siblings)[top.next++];
            const std::size_t index = paths_.add(top.parent, file->name());
            types_.push_back(entryTypeFromMode(file->permissionsMode()));
            files_.push_back(file);
            if (auto children = file->children())
                pending.push_back({std::move(children), 0, index});
        }
    }

    // The library checks CRC-32 and size as the bytes pass; a mismatch is an error.
    bool streamFile(const GWZipFilePtr& file, const DataSink& sink, GWErrorPtr* error,
                    bool* checksumFailed) {
        if (checksumFailed)
            *checksumFailed = false;
        auto handler = [&](std::optional<std::span<const std::uint8_t>> data, bool,
                           const GWErrorPtr&) {
            return !data || data->empty() || sink(data->data(), data->size());
        };
        GWErrorPtr initError;
        auto operation =
            GWZipExtractOperation::initForExtractingFile(file, archive_, handler, &initError);
        if (!operation) {
            if (error)
                *error = initError;
            return false;
        }
        // Every call of the handler comes before the operation finishes; an
        // empty entry makes none at all.
        operation->start();
        operation->waitUntilFinished();
        GWErrorPtr failure = operation->error();
        if (error)
            *error = failure;
        return failure == nullptr;
    }

    void checkFile(const GWZipFilePtr& file, const std::string& path,
                   std::vector<EntryProblem>& problems) {
        GWErrorPtr error;
        if (!streamFile(
                file, [](const std::uint8_t*, std::size_t) { return true; }, &error, nullptr)) {
            problems.push_back({path,
                                error ? error->localizedDescription() + " (" + error->domain() +
                                            " " + std::to_string(error->code()) + ")"
                                      : "unknown error",
                                error ? error->domain() : "", error ? error->code() : 0});
        }
    }

    // Makes room for an entry at `url`: fails for an existing item unless overwriting.
    bool prepare(const GWURL& url, const std::string& path, EntryType type,
                 const ExtractOptions& options, const std::string& archiveName) {
        std::error_code ignored;
        auto status = std::filesystem::symlink_status(url.path(), ignored);
        if (std::filesystem::exists(status)) {
            if (type == EntryType::directory && std::filesystem::is_directory(status)) {
                return true;  // merged into
            }
            if (!options.overwrite) {
                reportError(archiveName, path, GWPOSIXError(EEXIST, url));
                return false;
            }
            std::filesystem::remove_all(url.path(), ignored);
        }
        std::filesystem::create_directories(
            type == EntryType::directory ? url.path() : url.URLByDeletingLastPathComponent().path(),
            ignored);
        return true;
    }

    GWZipArchivePtr archive_;
    PathTable paths_;
    std::vector<EntryType> types_;
    std::vector<GWZipFilePtr> files_;
};

bool ZipToolArchive::extract(const std::vector<std::size_t>& indexes, const ExtractOptions& options,
                             const std::string& archiveName) {
    auto queue = std::make_shared<GWOperationQueue>();
    long cores = static_cast<long>(std::max(1u, std::thread::hardware_concurrency()));
    queue->setMaxConcurrentOperationCount(2 * cores);
    std::atomic<bool> allGood{true};
    std::vector<std::pair<GWZipFilePtr, GWURL>> directories;
    for (std::size_t index : indexes) {
        const std::string path(paths_[index]);
        const EntryType type = types_[index];
        GWURL url = options.directory.URLByAppendingPathComponent(path);
        // Checked before anything is made for the entry, and again by its
        // operation, when links extracted meanwhile are on disk.
        if (auto refusal = GWZipExtractOperation::containmentErrorForFile(files_[index],
                                                                          options.directory, url)) {
            reportError(archiveName, path, refusal);
            allGood = false;
            continue;
        }
        if (!prepare(url, path, type, options, archiveName)) {
            allGood = false;
            continue;
        }
        if (type == EntryType::directory) {
            directories.emplace_back(files_[index], url);
            continue;
        }
        // Written under a private name beside the destination, then moved into
        // place without replacing: as atomic as the library's own mode, but
        // without a replacement folder left in $TMPDIR for every entry.
        GWURL temporary = url.URLByDeletingLastPathComponent().URLByAppendingPathComponent(
            ".gwarchive-" + GWUniqueID());
        GWErrorPtr error;
        auto operation = GWZipExtractOperation::initForExtractingFile(
            files_[index], archive_, temporary, false, options.progress, &error);
        if (!operation) {
            reportError(archiveName, path, error);
            allGood = false;
            continue;
        }
        operation->setContainmentRoot(options.directory);
        std::weak_ptr<GWZipExtractOperation> weak = operation;
        operation->setCompletionBlock([weak, path, temporary, url, archiveName, &allGood] {
            auto finished = weak.lock();
            GWErrorPtr failure = finished ? finished->error() : nullptr;
            if (!failure && !GWMoveItemAtURL(temporary, url, &failure) && !failure) {
                failure = GWPOSIXError(EIO, url);
            }
            if (failure) {
                GWRemoveItemAtURL(temporary, nullptr);
                reportError(archiveName, path, failure);
                allGood = false;
            }
        });
        queue->addOperation(operation);
    }
    queue->waitUntilAllOperationsAreFinished();
    // Directory dates and modes last, deepest first, so that writing their
    // contents does not undo them.
    for (auto it = directories.rbegin(); it != directories.rend(); ++it) {
        GWErrorPtr error;
        auto operation = GWZipExtractOperation::initForExtractingFile(
            it->first, archive_, it->second, false, nullptr, &error);
        if (!operation || !operation->setInfoForFile(it->first, it->second, &error)) {
            reportError(archiveName, it->first->path(), error);
            allGood = false;
        }
    }
    return allGood;
}

}  // namespace

std::unique_ptr<ToolArchive> openZipArchive(const GWURL& url, GWErrorPtr* error) {
    GWZipArchivePtr archive = GWZipArchive::initWithURL(url, error);
    if (!archive)
        return nullptr;
    return std::make_unique<ZipToolArchive>(std::move(archive));
}

}  // namespace gwarchive
