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
        auto roots = std::make_shared<const GWZipFileArray>(archive_->files());
        // Sized once: arrays that grow by doubling leave their old copies
        // behind, and fresh memory is what listing pays for most.
        const std::size_t count = countEntries(*roots);
        paths_.reserve(count, count * kReservedPathBytes);
        types_.reserve(count);
        files_.reserve(count);
        addTree(std::move(roots));
    }

    const char* formatName() const override { return "zip"; }
    std::size_t entryCount() const override { return files_.size(); }
    std::string_view entryPath(std::size_t index) const override { return paths_[index]; }
    EntryType entryType(std::size_t index) const override { return types_[index]; }

    EntryRecord entry(std::size_t index) const override {
        const GWZipFile& file = *entryFile(index);
        EntryRecord record;
        record.path = std::string(paths_[index]);
        record.mode = file.permissionsMode();
        record.type = types_[index];
        record.size = file.storedUncompressedSize();
        record.compressedSize = file.compressedSize();
        record.uid = file.owner();
        record.gid = file.groupOwner();
        record.linkTarget = file.symlinkDestination();
        // The library dates what it makes up by the clock; a listing should
        // not change from one run to the next.
        record.madeUp = isMadeUp(file);
        if (!record.madeUp) {
            record.modificationDate = file.modificationDate();
        } else if (file.isDirectory()) {
            record.modificationDate = newestDateBelow(index);
        } else if (file.appleDoubleFile()) {
            record.modificationDate = file.appleDoubleFile()->modificationDate();
        }
        // Every folder has a Finder type; worth showing only where Macs were involved.
        if (file.typeCode() != 0 && (!file.isDirectory() || carriesMacMetadata()))
            record.typeCode = file.type();
        if (file.creatorCode() != 0 && (!file.isDirectory() || carriesMacMetadata()))
            record.creatorCode = file.creator();
        if (file.resourceFork())
            record.resourceForkSize = file.resourceFork()->storedUncompressedSize();
        record.appleDouble = file.appleDoubleFile() != nullptr;
        record.macBinary = file.isMacBinaryEncoded();
        record.encrypted = file.isEncrypted();
        if (!file.isDirectory())
            record.compression = compressionName(file.dataCompressionMethod());
        return record;
    }

    // A ZIP link's text is its data.
    std::optional<std::string> readLinkTarget(std::size_t index) override {
        if (types_[index] != EntryType::symlink)
            return std::nullopt;
        std::string text;
        GWErrorPtr ignored;
        bool read = streamFile(
            entryFile(index),
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
        json.key("dataOffset");
        if (auto offset = dataOffset()) {
            json.value(*offset);
        } else {
            json.null();
        }
    }

    std::optional<std::string> damageNote() const override {
        if (const std::uint64_t count = archive_->recoveredEntryCount())
            return "central directory missing: " + std::to_string(count) +
                   " entries recovered from local headers";
        return std::nullopt;
    }

    std::vector<std::string> infoLines() const override {
        std::vector<std::string> lines{"start offset: " + std::to_string(archive_->startOffset())};
        if (auto offset = dataOffset()) {
            lines.push_back("data begins at: " + std::to_string(*offset) + " (" +
                            std::to_string(*offset) + " bytes precede it)");
        }
        return lines;
    }

    void setPassword(const std::string& password) override { archive_->setPassword(password); }

    bool stream(std::size_t index, const DataSink& sink, GWErrorPtr* error,
                bool* checksumFailed) override {
        return streamFile(entryFile(index), sink, error, checksumFailed);
    }

    std::vector<EntryProblem> test(const std::vector<std::size_t>& indexes) override {
        std::vector<EntryProblem> problems;
        for (std::size_t index : indexes) {
            const GWZipFilePtr& file = entryFile(index);
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
    void addTree(GWZipFileArrayPtr roots) {
        struct Pending {
            const GWZipFileArray* siblings;
            std::size_t next;
            std::size_t parent;
        };
        std::vector<Pending> pending;
        pending.push_back({roots.get(), 0, PathTable::kNoParent});
        levels_.push_back(std::move(roots));
        while (!pending.empty()) {
            Pending& top = pending.back();
            if (top.next == top.siblings->size()) {
                pending.pop_back();
                continue;
            }
            const GWZipFilePtr& file = (*top.siblings)[top.next++];
            const std::size_t index = paths_.add(top.parent, file->name());
            types_.push_back(entryTypeFromMode(file->permissionsMode()));
            files_.push_back(&file);
            if (auto children = file->children()) {
                pending.push_back({children.get(), 0, index});
                levels_.push_back(std::move(children));
            }
        }
    }

    const GWZipFilePtr& entryFile(std::size_t index) const { return *files_[index]; }

    // What the loader made up rather than read: a folder that entries imply,
    // or a companion's missing entry. Only those have no stored checksum.
    static bool isMadeUp(const GWZipFile& file) {
        return file.uncompressedChecksumAlgorithm() == 0 && !file.isMacBinaryEncoded();
    }

    std::optional<GWDate> newestDateBelow(std::size_t index) const {
        std::optional<GWDate> newest;
        for (std::size_t member = index + 1, end = subtreeEnd(index); member < end; ++member) {
            const GWZipFile& file = *entryFile(member);
            if (isMadeUp(file))
                continue;
            const std::optional<GWDate> date = file.modificationDate();
            if (date && (!newest || *newest < *date))
                newest = date;
        }
        return newest;
    }

    bool carriesMacMetadata() const {
        std::call_once(macMetadataChecked_, [this] {
            carriesMacMetadata_ = std::any_of(files_.begin(), files_.end(), [](const auto* file) {
                const GWZipFile& entry = **file;
                return entry.appleDoubleFile() || entry.resourceFork() ||
                       entry.isMacBinaryEncoded() ||
                       (!entry.isDirectory() && entry.typeCode() != 0);
            });
        });
        return carriesMacMetadata_;
    }

    // Where the first local header is in the file, whatever the offsets in
    // the directory are counted from; none without entries.
    std::optional<std::uint64_t> dataOffset() const {
        std::optional<std::uint64_t> first;
        auto consider = [&first](const GWZipFile& file) {
            if (!isMadeUp(file) && (!first || file.localHeaderOffset() < *first))
                first = file.localHeaderOffset();
        };
        for (const GWZipFilePtr* file : files_) {
            consider(**file);
            if ((*file)->appleDoubleFile())
                consider(*(*file)->appleDoubleFile());
        }
        if (first && *first > UINT64_MAX - archive_->startOffset())
            return std::nullopt;
        return first ? std::optional(*first + archive_->startOffset()) : std::nullopt;
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
            problems.push_back({path, describeError(error), error ? error->domain() : "",
                                error ? error->code() : 0});
        }
    }

    GWZipArchivePtr archive_;
    PathTable paths_;
    std::vector<EntryType> types_;
    // Each entry's place in the snapshot of its siblings, which levels_
    // keeps: a counted reference per entry costs 16 bytes and two atomic
    // updates in an archive of 200,000 entries.
    std::vector<GWZipFileArrayPtr> levels_;
    std::vector<const GWZipFilePtr*> files_;
    mutable std::once_flag macMetadataChecked_;
    mutable bool carriesMacMetadata_ = false;
};

bool ZipToolArchive::extract(const std::vector<std::size_t>& indexes, const ExtractOptions& options,
                             const std::string& archiveName) {
    // The library brings each directory's subtree.
    GWZipFileArray tops;
    for (std::size_t index : indexes)
        tops.push_back(entryFile(index));
    std::atomic<bool> reported{false};
    GWExtractOptions batchOptions = libraryExtractOptions(options, archiveName);
    batchOptions.continueAfterFailure = true;
    batchOptions.entryWritten = options.written;
    batchOptions.entryFailed = [&](const std::string& path, const GWErrorPtr& error) {
        reportError(archiveName, path, error);
        reported = true;
    };
    GWErrorPtr error;
    if (archive_->extractFiles(tops, options.directory, true, options.progress, &error,
                               batchOptions))
        return true;
    if (!reported)
        reportError(archiveName, std::nullopt, error);
    return false;
}

}  // namespace

std::unique_ptr<ToolArchive> openZipArchive(const GWURL& url, GWErrorPtr* error) {
    GWZipArchivePtr archive = GWZipArchive::initWithURL(url, namesEncoding(), error);
    if (!archive)
        return nullptr;
    return std::make_unique<ZipToolArchive>(std::move(archive));
}

}  // namespace gwarchive
