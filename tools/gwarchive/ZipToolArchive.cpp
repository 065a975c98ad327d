#include <sys/stat.h>

#include <cerrno>
#include <filesystem>
#include <mutex>
#include <thread>

#include "Diagnostics.h"
#include "FormatAdapters.h"
#include "JsonWriter.h"

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
        for (const GWZipFilePtr& file : archive_->files()) add(file);
    }

    const char* formatName() const override { return "zip"; }
    const std::vector<EntryRecord>& entries() const override { return records_; }

    void writeArchiveFields(JsonWriter& json) const override {
        json.key("startOffset");
        json.value(archive_->startOffset());
    }

    std::vector<std::string> infoLines() const override {
        return {"start offset: " + std::to_string(archive_->startOffset())};
    }

    bool stream(std::size_t index, const DataSink& sink, GWErrorPtr* error) override {
        return streamFile(files_[index], sink, error);
    }

    std::vector<EntryProblem> test() override {
        std::vector<EntryProblem> problems;
        for (std::size_t index = 0; index < files_.size(); ++index) {
            const GWZipFilePtr& file = files_[index];
            if (file->isDirectory()) continue;
            checkFile(file, records_[index].path, problems);
            if (file->resourceFork()) {
                checkFile(file->resourceFork(), records_[index].path + " (resource fork)", problems);
            }
            if (file->appleDoubleFile()) {
                checkFile(file->appleDoubleFile(), records_[index].path + " (AppleDouble)", problems);
            }
        }
        return problems;
    }

    bool extract(const std::vector<std::size_t>& indexes, const ExtractOptions& options,
                 const std::string& archiveName) override;

private:
    void add(const GWZipFilePtr& file) {
        EntryRecord record;
        record.path = file->path();
        record.mode = file->permissionsMode();
        record.type = entryTypeFromMode(record.mode);
        record.size = file->storedUncompressedSize();
        record.compressedSize = file->compressedSize();
        record.modificationDate = file->modificationDate();
        record.uid = file->owner();
        record.gid = file->groupOwner();
        record.linkTarget = file->symlinkDestination();
        if (file->typeCode() != 0) record.typeCode = file->type();
        if (file->creatorCode() != 0) record.creatorCode = file->creator();
        if (file->resourceFork()) record.resourceForkSize = file->resourceFork()->storedUncompressedSize();
        record.appleDouble = file->appleDoubleFile() != nullptr;
        record.macBinary = file->isMacBinaryEncoded();
        if (!file->isDirectory()) record.compression = compressionName(file->compressionMethod());
        std::size_t index = records_.size();
        records_.push_back(std::move(record));
        files_.push_back(file);
        if (records_[index].type == EntryType::symlink && !records_[index].linkTarget) {
            records_[index].linkTarget = readLinkText(file);
        }
        if (auto children = file->children()) {
            for (const GWZipFilePtr& child : *children) add(child);
        }
    }

    // A ZIP link's text is its data; small, so reading it for the listing is cheap.
    std::optional<std::string> readLinkText(const GWZipFilePtr& file) {
        std::string text;
        GWErrorPtr ignored;
        bool read = streamFile(
            file,
            [&](const std::uint8_t* bytes, std::size_t length) {
                text.append(reinterpret_cast<const char*>(bytes), length);
                return text.size() <= 4096;
            },
            &ignored);
        if (!read) return std::nullopt;
        return text;
    }

    bool streamFile(const GWZipFilePtr& file, const DataSink& sink, GWErrorPtr* error);
    void checkFile(const GWZipFilePtr& file, const std::string& path,
                   std::vector<EntryProblem>& problems);

    GWZipArchivePtr archive_;
    std::vector<EntryRecord> records_;
    std::vector<GWZipFilePtr> files_;
};

}  // namespace

std::unique_ptr<ToolArchive> openZipArchive(const GWURL& url, GWErrorPtr* error) {
    GWZipArchivePtr archive = GWZipArchive::initWithURL(url, error);
    if (!archive) return nullptr;
    return std::make_unique<ZipToolArchive>(std::move(archive));
}

}  // namespace gwarchive
