#include <cerrno>
#include <filesystem>
#include <unordered_map>

#include "Diagnostics.h"
#include "FormatAdapters.h"
#include "JsonWriter.h"
#include "foundation/GWContainment.h"
#include "foundation/GWDispatch.h"
#include "foundation/GWFileSystem.h"

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
        for (const GWXARFilePtr& file : archive_->files())
            add(file);
        // Of several entries with one path the last wins, as the library
        // does among siblings.
        std::unordered_map<std::string_view, std::size_t> last;
        for (std::size_t index = 0; index < records_.size(); ++index)
            last[records_[index].path] = index;
        superseded_.resize(records_.size());
        for (std::size_t index = 0; index < records_.size(); ++index)
            superseded_[index] = last[records_[index].path] != index;
    }

    const char* formatName() const override { return "xar"; }
    std::size_t entryCount() const override { return records_.size(); }
    std::string_view entryPath(std::size_t index) const override { return records_[index].path; }
    EntryType entryType(std::size_t index) const override { return records_[index].type; }
    EntryRecord entry(std::size_t index) const override { return records_[index]; }

    void writeArchiveFields(JsonWriter& json) const override {
        json.key("checksum");
        json.value(checksumVerdict());
        json.key("checksumIsValid");
        json.value(archive_->checksumIsValid());
        json.key("signatureIsValid");
        json.value(archive_->signatureIsValid());
        json.key("signature");
        json.value(signatureVerdict());
        json.key("signatureReason");
        json.value(archive_->signatureVerdictReason());
        json.key("signatures");
        json.beginArray();
        for (const auto& signature : archive_->signatures()) {
            json.beginObject();
            json.key("type");
            json.value(signatureTypeName(signature->type()));
            json.key("extended");
            json.value(signature->isExtended());
            json.key("verdict");
            json.value(GWXARSignatureVerdictName(signature->verdict()));
            json.key("reason");
            json.value(signature->verdictReason());
            json.key("certificates");
            writeNames(json,
                       signature->certificateCommonNames().value_or(std::vector<std::string>{}));
            json.key("chain");
            writeNames(json, signature->chainCommonNames());
            json.endObject();
        }
        json.endArray();
        json.key("subdocuments");
        json.beginArray();
        for (const std::string& name : subdocumentNames())
            json.value(name);
        json.endArray();
    }

    std::vector<std::string> infoLines() const override {
        std::vector<std::string> lines;
        const std::string checksum = checksumVerdict();
        lines.push_back("checksum: " + (checksum == "invalid" ? "INVALID" : checksum));
        lines.push_back("signature: " + signatureSummary());
        for (const auto& signature : archive_->signatures()) {
            std::string line = std::string("  ") + signatureTypeName(signature->type()) +
                               (signature->isExtended() ? " (extended)" : "") + " " +
                               GWXARSignatureVerdictName(signature->verdict()) + ":";
            for (const std::string& name :
                 signature->certificateCommonNames().value_or(std::vector<std::string>{})) {
                line += " \"" + name + "\"";
            }
            lines.push_back(line);
        }
        std::string names;
        for (const std::string& name : subdocumentNames())
            names += (names.empty() ? "" : ", ") + name;
        lines.push_back("subdocuments: " + (names.empty() ? std::string("none") : names));
        return lines;
    }

    std::string signatureVerdict() const override {
        return GWXARSignatureVerdictName(archive_->signatureVerdict());
    }

    // "valid (leaf, anchor)", "untrusted (why, leaf, ..., where it stopped)", "INVALID (why)".
    std::string signatureSummary() const override {
        const GWXARSignatureVerdict verdict = archive_->signatureVerdict();
        const GWXARSignaturePtr deciding = GWXARDecidingSignature(archive_->signatures());
        if (verdict == GWXARSignatureVerdictNone || !deciding)
            return "none";
        const std::vector<std::string>& chain = deciding->chainCommonNames();
        std::vector<std::string> notes;
        if (verdict == GWXARSignatureVerdictValid) {
            if (!chain.empty())
                notes.push_back(chain.front());
            if (chain.size() > 1)
                notes.push_back(chain.back());
        } else {
            notes.push_back(archive_->signatureVerdictReason());
            if (verdict == GWXARSignatureVerdictUntrusted)
                notes.insert(notes.end(), chain.begin(), chain.end());
        }
        std::string text = verdict == GWXARSignatureVerdictInvalid ? "INVALID" : signatureVerdict();
        for (std::size_t index = 0; index < notes.size(); ++index)
            text += (index == 0 ? " (" : ", ") + notes[index];
        return notes.empty() ? text : text + ")";
    }

    bool stream(std::size_t index, const DataSink& sink, GWErrorPtr* error,
                bool* checksumFailed) override {
        return streamReference(nullptr, files_[index], sink, error, checksumFailed);
    }

    GWErrorPtr integrityError() const override {
        if (archive_->checksumIsValid())
            return nullptr;
        return GWGenerateError(kGWXARArchiveErrorDomain, GWXARArchiveInvalidTOCChecksumError,
                               archive_->URL(), nullptr, {},
                               "The table of contents does not match its checksum");
    }

    std::size_t unverifiedCount() const override { return unverified_; }

    std::vector<EntryProblem> test(const std::vector<std::size_t>& indexes) override {
        std::vector<EntryProblem> problems;
        unverified_ = 0;
        auto check = [&](const GWXARDataReferencePtr& reference, const GWXARFilePtr& file,
                         const std::string& label) {
            GWErrorPtr error;
            bool checksumFailed = false;
            bool read = streamReference(
                reference, file, [](const std::uint8_t*, std::size_t) { return true; }, &error,
                &checksumFailed);
            // The library counts a missing digest as a mismatch; here it is
            // only something that could not be checked.
            const GWXARDataReferencePtr stream = reference ? reference : dataForkOf(file);
            if (!read) {
                problems.push_back({label, describeError(error), error ? error->domain() : "",
                                    error ? error->code() : 0});
            } else if (stream && !stream->compressedChecksum() && !stream->uncompressedChecksum()) {
                ++unverified_;
            } else if (checksumFailed) {
                problems.push_back({label, "checksum mismatch (data damaged)", kGWCocoaErrorDomain,
                                    GWFileReadCorruptFileError});
            }
        };
        for (std::size_t index : indexes) {
            EntryType type = records_[index].type;
            if (type != EntryType::file && type != EntryType::hardlink)
                continue;
            check(nullptr, files_[index], records_[index].path);
            for (const auto& attribute : files_[index]->extendedAttributes()) {
                check(attribute, files_[index],
                      records_[index].path + " (extended attribute " +
                          attribute->name().value_or("") + ")");
            }
        }
        return problems;
    }

    bool extract(const std::vector<std::size_t>& indexes, const ExtractOptions& options,
                 const std::string& archiveName) override {
        bool allGood = true;
        std::error_code ignored;  // a folder that cannot be made fails each entry below
        std::filesystem::create_directories(options.directory.path(), ignored);
        for (std::size_t index : indexes) {
            if (superseded_[index])
                continue;  // replaced by a later namesake
            // Roots keep at least one component past the stripped ones.
            const std::string path(
                strippedPath(records_[index].path, options.stripComponents).value_or(""));
            GWURL url = options.directory.URLByAppendingPathComponent(path);
            if (refused(index, url, options, archiveName)) {
                allGood = false;
                continue;
            }
            // The folders on the way are made by a walk no link can redirect.
            const std::size_t slash = path.rfind('/');
            GWErrorPtr failure;
            if (!GWOpenDirectoryBelow(options.directory.path(),
                                      slash == std::string::npos ? "" : path.substr(0, slash), true,
                                      &failure)
                     .isValid()) {
                reportError(archiveName, records_[index].path, failure);
                allGood = false;
                continue;
            }
            const bool extracted = extractItem(index, url, options, archiveName);
            const std::size_t end = extracted && options.written ? subtreeEnd(index) : index;
            for (std::size_t member = index; member < end; ++member) {
                if (!superseded_[member])
                    options.written(records_[member].path);
            }
            allGood &= extracted;
        }
        return allGood;
    }

private:
    // "none" when the header names no checksum and the table of contents has none.
    const char* checksumVerdict() const {
        if (!archive_->checksumIsValid())
            return "invalid";
        return archive_->tocChecksum().empty() ? "none" : "valid";
    }

    // The data fork that streaming `file` reads: a hard link's is its target's.
    static GWXARDataReferencePtr dataForkOf(GWXARFilePtr file) {
        for (int hops = 0; file && file->type() == GWXARFileTypeHardLink && hops < 64; ++hops)
            file = file->hardlinkDestination();
        return file ? file->dataFork() : nullptr;
    }

    static void writeNames(JsonWriter& json, const std::vector<std::string>& names) {
        json.beginArray();
        for (const std::string& name : names)
            json.value(name);
        json.endArray();
    }

    std::vector<std::string> subdocumentNames() const {
        std::vector<std::string> names;
        for (const auto& [name, document] : archive_->subdocuments())
            names.push_back(name);
        return names;
    }

    void add(const GWXARFilePtr& file, std::optional<std::size_t> parent = std::nullopt) {
        EntryRecord record;
        record.path = file->path();
        record.mode = file->permissionsMode();
        record.type = entryTypeOf(*file);
        if (const auto& fork = file->dataFork()) {
            record.size = fork->uncompressedSize();
            record.compressedSize = fork->compressedSize();
            record.compression =
                GWXARDataReference::stringFromCompressionType(fork->compressionType());
        }
        record.modificationDate = file->modificationDate();
        record.uid = file->ownerID();
        record.gid = file->groupOwnerID();
        if (record.type == EntryType::symlink) {
            record.linkTarget = file->symlinkDestination();
        } else if (auto target = file->hardlinkDestination();
                   target && record.type == EntryType::hardlink) {
            record.linkTarget = target->path();
        }
        for (const auto& attribute : file->extendedAttributes()) {
            std::string name = attribute->name().value_or("");
            if (name == kResourceForkAttribute)
                record.resourceForkSize = attribute->uncompressedSize();
            record.xattrs.push_back(name);
        }
        std::size_t index = records_.size();
        records_.push_back(std::move(record));
        files_.push_back(file);
        children_.emplace_back();
        if (parent)
            children_[*parent].push_back(index);
        for (const GWXARFilePtr& child : file->children())
            add(child, index);
    }

    // The archive streams on its own threads; the tool waits for the last call.
    bool streamReference(const GWXARDataReferencePtr& reference, const GWXARFilePtr& file,
                         const DataSink& sink, GWErrorPtr* error, bool* checksumFailed) {
        GWSemaphore finished(0);
        GWErrorPtr failure;
        bool mismatch = false;
        auto handler = [&](std::optional<std::span<const std::uint8_t>> data, bool isDone,
                           bool failedChecksum, const GWErrorPtr& callError) {
            bool last = isDone || callError;
            bool goOn = true;
            if (data && !data->empty() && !callError)
                goOn = sink(data->data(), data->size());
            if (last) {
                failure = callError;
                mismatch = failedChecksum;
                finished.signal();
            }
            return goOn;
        };
        if (reference) {
            archive_->extractDataReference(reference, file, nullptr, handler);
        } else {
            archive_->extractDataForkOfFile(file, nullptr, handler);
        }
        finished.wait();
        if (error)
            *error = failure;
        if (checksumFailed)
            *checksumFailed = mismatch;
        return failure == nullptr;
    }

    // Whether the item may not go to `url`: a name on its way from the top is
    // not one plain component, or the folder holds a link on the way there.
    // The library checks what lies below the item.
    bool refused(std::size_t index, const GWURL& url, const ExtractOptions& options,
                 const std::string& archiveName) {
        bool plain = true;
        for (GWXARFilePtr item = files_[index]; item && plain; item = item->parent())
            plain = GWIsPlainPathComponent(item->name().value_or(""));
        if (plain && GWIsContainedDestination(options.directory, url))
            return false;
        const std::string& path = records_[index].path;
        reportError(
            archiveName, path,
            GWGenerateError(kGWXARArchiveErrorDomain, GWXARArchiveEntryOutsideDestinationError, url,
                            nullptr, {{kGWXARArchiveUnknownEntityErrorKey, GWValue(path)}},
                            "%s would be extracted outside %s", path.c_str(),
                            options.directory.path().c_str()));
        return true;
    }

    // Existing directories are merged into; anything else that exists is an
    // error for that entry unless overwriting, and even then a directory is
    // never replaced by what is not one.
    bool extractItem(std::size_t index, const GWURL& url, const ExtractOptions& options,
                     const std::string& archiveName) {
        const EntryRecord& record = records_[index];
        if (refused(index, url, options, archiveName))
            return false;
        std::error_code error;
        auto status = std::filesystem::symlink_status(url.path(), error);
        if (std::filesystem::is_directory(status)) {
            if (record.type == EntryType::directory) {
                bool allGood = true;
                for (std::size_t child : children_[index]) {
                    if (superseded_[child])
                        continue;
                    allGood &= extractItem(
                        child,
                        url.URLByAppendingPathComponent(files_[child]->name().value_or("item")),
                        options, archiveName);
                }
                return allGood;
            }
            reportError(archiveName, record.path, GWPOSIXError(EISDIR, url));
            return false;
        }
        if (std::filesystem::exists(status) && !options.overwrite) {
            reportError(archiveName, record.path, GWPOSIXError(EEXIST, url));
            return false;
        }
        // Entries that fail are left out of the tree; each is reported under
        // its own path, and the rest stays extracted.
        bool reported = false;
        GWExtractOptions extractOptions = libraryExtractOptions(options, archiveName);
        extractOptions.entryFailed = [&](const std::string& path, const GWErrorPtr& failure) {
            reportError(archiveName, path, failure);
            reported = true;
        };
        bool checksumIsInvalid = false;
        GWErrorPtr failure;
        const bool extracted =
            archive_->extractFile(files_[index], url, &checksumIsInvalid, &failure, extractOptions);
        if (options.progress)
            options.progress(subtreeBytes(index));
        if (!extracted) {
            if (!reported)
                reportError(archiveName, record.path, failure);
            return false;
        }
        if (checksumIsInvalid) {
            reportFailure(archiveName, record.path,
                          "extracted, but a stored checksum did not match or metadata could not "
                          "be applied");
            return false;
        }
        return true;
    }

    std::uint64_t subtreeBytes(std::size_t index) const {
        std::uint64_t bytes = 0;
        for (std::size_t member : subtree(index))
            bytes += records_[member].size;
        return bytes;
    }

    GWXARArchivePtr archive_;
    std::size_t unverified_ = 0;
    std::vector<EntryRecord> records_;
    std::vector<GWXARFilePtr> files_;
    std::vector<std::vector<std::size_t>> children_;
    std::vector<bool> superseded_;
};

}  // namespace

std::unique_ptr<ToolArchive> openXARArchive(const GWURL& url, GWErrorPtr* error) {
    GWXARArchivePtr archive = GWXARArchive::initWithURL(url, false, trustAnchors(), error);
    if (!archive)
        return nullptr;
    return std::make_unique<XARToolArchive>(std::move(archive));
}

}  // namespace gwarchive
