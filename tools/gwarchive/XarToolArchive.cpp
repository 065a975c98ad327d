#include <filesystem>

#include "Diagnostics.h"
#include "FormatAdapters.h"
#include "JsonWriter.h"

namespace gwarchive {

namespace {

constexpr const char* kResourceForkAttribute = "com.apple.ResourceFork";

EntryType entryTypeOf(const GWXARFile& file) {
    switch (file.type()) {
        case GWXARFileTypeRegular: return EntryType::file;
        case GWXARFileTypeDirectory: return EntryType::directory;
        case GWXARFileTypeSymbolicLink: return EntryType::symlink;
        case GWXARFileTypeHardLink: return EntryType::hardlink;
        case GWXARFileTypeCharacterSpecial: return EntryType::charDevice;
        case GWXARFileTypeBlockSpecial: return EntryType::blockDevice;
        case GWXARFileTypeFIFO: return EntryType::fifo;
        case GWXARFileTypeSocket: return EntryType::socket;
        case GWXARFileTypeWhiteout: return EntryType::whiteout;
        default: return EntryType::unknown;
    }
}

const char* signatureTypeName(std::uint64_t type) {
    switch (type) {
        case 1: return "RSA";
        case 2: return "DSA";
        case 3: return "ECDSA";
        case 4: return "CMS";
        default: return "unknown";
    }
}

class XARToolArchive final : public ToolArchive {
public:
    explicit XARToolArchive(GWXARArchivePtr archive) : archive_(std::move(archive)) {
        for (const GWXARFilePtr& file : archive_->files()) add(file);
    }

    const char* formatName() const override { return "xar"; }
    const std::vector<EntryRecord>& entries() const override { return records_; }

    void writeArchiveFields(JsonWriter& json) const override {
        json.key("checksumIsValid");
        json.value(archive_->checksumIsValid());
        json.key("signatureIsValid");
        json.value(archive_->signatureIsValid());
        json.key("signatures");
        json.beginArray();
        for (const auto& signature : archive_->signatures()) {
            json.beginObject();
            json.key("type");
            json.value(signatureTypeName(signature->type()));
            json.key("certificates");
            json.beginArray();
            for (const std::string& name : signature->certificateCommonNames().value_or(
                     std::vector<std::string>{})) {
                json.value(name);
            }
            json.endArray();
            json.endObject();
        }
        json.endArray();
        json.key("subdocuments");
        json.beginArray();
        for (const std::string& name : subdocumentNames()) json.value(name);
        json.endArray();
    }

    std::vector<std::string> infoLines() const override {
        std::vector<std::string> lines;
        lines.push_back(std::string("checksum: ") + (archive_->checksumIsValid() ? "valid" : "INVALID"));
        std::string verdict = archive_->signatures().empty() ? "none"
                              : archive_->signatureIsValid() ? "valid"
                                                             : "INVALID";
        lines.push_back("signature: " + verdict);
        for (const auto& signature : archive_->signatures()) {
            std::string line = std::string("  ") + signatureTypeName(signature->type()) +
                               (signature->isExtended() ? " (extended)" : "") + ":";
            for (const std::string& name : signature->certificateCommonNames().value_or(
                     std::vector<std::string>{})) {
                line += " \"" + name + "\"";
            }
            lines.push_back(line);
        }
        std::string names;
        for (const std::string& name : subdocumentNames()) names += (names.empty() ? "" : ", ") + name;
        lines.push_back("subdocuments: " + (names.empty() ? std::string("none") : names));
        return lines;
    }

    bool stream(std::size_t index, const DataSink& sink, GWErrorPtr* error) override;
    std::vector<EntryProblem> test() override;
    bool extract(const std::vector<std::size_t>& indexes, const ExtractOptions& options,
                 const std::string& archiveName) override;

private:
    std::vector<std::string> subdocumentNames() const {
        std::vector<std::string> names;
        for (const auto& [name, document] : archive_->subdocuments()) names.push_back(name);
        return names;
    }

    void add(const GWXARFilePtr& file) {
        EntryRecord record;
        record.path = file->path();
        record.mode = file->permissionsMode();
        record.type = entryTypeOf(*file);
        if (const auto& fork = file->dataFork()) {
            record.size = fork->uncompressedSize();
            record.compressedSize = fork->compressedSize();
            record.compression = GWXARDataReference::stringFromCompressionType(fork->compressionType());
        }
        record.modificationDate = file->modificationDate();
        record.uid = file->ownerID();
        record.gid = file->groupOwnerID();
        if (record.type == EntryType::symlink) {
            record.linkTarget = file->symlinkDestination();
        } else if (auto target = file->hardlinkDestination(); target && record.type == EntryType::hardlink) {
            record.linkTarget = target->path();
        }
        for (const auto& attribute : file->extendedAttributes()) {
            std::string name = attribute->name().value_or("");
            if (name == kResourceForkAttribute) record.resourceForkSize = attribute->uncompressedSize();
            record.xattrs.push_back(name);
        }
        records_.push_back(std::move(record));
        files_.push_back(file);
        for (const GWXARFilePtr& child : file->children()) add(child);
    }

    GWXARArchivePtr archive_;
    std::vector<EntryRecord> records_;
    std::vector<GWXARFilePtr> files_;
};

}  // namespace

std::unique_ptr<ToolArchive> openXARArchive(const GWURL& url, GWErrorPtr* error) {
    GWXARArchivePtr archive = GWXARArchive::initWithURL(url, false, error);
    if (!archive) return nullptr;
    return std::make_unique<XARToolArchive>(std::move(archive));
}

}  // namespace gwarchive
