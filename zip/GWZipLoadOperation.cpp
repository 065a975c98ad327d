#include "GWZipLoadOperation.h"

#include <algorithm>
#include <cstdarg>
#include <system_error>
#include <thread>
#include <vector>

#include "GWArchiveSupport/GWArchiveConstants.h"
#include "GWZipNames.h"
#include "foundation/GWByteReader.h"
#include "foundation/GWFormat.h"
#include "foundation/GWLog.h"

namespace {

// A central record's whole length, which its fixed part gives: the lengths
// of the name, extra field and comment follow the 28 bytes before them.
std::uint64_t centralRecordLength(std::span<const std::uint8_t> fixed) {
    GWByteReader reader(fixed);
    reader.seek(28);
    const std::uint64_t name = reader.u16le();
    const std::uint64_t extra = reader.u16le();
    const std::uint64_t comment = reader.u16le();
    return GWZipCentralDirectoryRecord::kLength + name + extra + comment;
}

// Where each entry's bytes lie, to refuse archives in which two entries share
// some: extracting them would write the same bytes over and over (a zip
// bomb's trick). Directories are written in offset order, where an overlap
// shows as the records come and nothing need be kept; a directory out of
// order has every extent kept and sorted once at the end.
class DataSpans {
public:
    // True the first time `start` is lower than the one before: from then
    // on every extent is kept, and the earlier ones must be added again.
    bool breaksOrder(std::uint64_t start) {
        if (!inOrder_ || start >= lastStart_) {
            return false;
        }
        inOrder_ = false;
        return true;
    }

    // True when, in order, [start, end) overlaps an earlier extent.
    bool addOverlaps(std::uint64_t start, std::uint64_t end, std::uint64_t record) {
        if (!inOrder_) {
            spans_.push_back({start, end, record});
            return false;
        }
        const bool overlaps = start < furthestEnd_;
        lastStart_ = start;
        furthestEnd_ = std::max(furthestEnd_, end);
        return overlaps;
    }

    // After the last record: the record of an extent that starts inside
    // another, the later one in the directory when two start together.
    std::optional<std::uint64_t> overlappingRecord() {
        std::ranges::sort(spans_, [](const Span& a, const Span& b) {
            return a.start != b.start ? a.start < b.start : a.record < b.record;
        });
        std::uint64_t furthestEnd = 0;
        for (const Span& span : spans_) {
            if (span.start < furthestEnd) {
                return span.record;
            }
            furthestEnd = std::max(furthestEnd, span.end);
        }
        return std::nullopt;
    }

private:
    struct Span {
        std::uint64_t start;
        std::uint64_t end;
        std::uint64_t record;  // its position in the directory
    };
    std::vector<Span> spans_;
    std::uint64_t lastStart_ = 0;
    std::uint64_t furthestEnd_ = 0;
    bool inOrder_ = true;
};

}  // namespace

GWZipLoadOperationPtr GWZipLoadOperation::initWithURL(const GWURL& url) {
    return GWZipLoadOperationPtr(new GWZipLoadOperation(url));
}

std::optional<GWZipFileArray> GWZipLoadOperation::files() const {
    std::lock_guard lock(resultMutex_);
    return files_;
}

void GWZipLoadOperation::setFiles(std::optional<GWZipFileArray> files) {
    std::lock_guard lock(resultMutex_);
    files_ = std::move(files);
}

GWErrorPtr GWZipLoadOperation::error() const {
    std::lock_guard lock(resultMutex_);
    return error_;
}

void GWZipLoadOperation::setError(GWErrorPtr error) {
    std::lock_guard lock(resultMutex_);
    error_ = std::move(error);
}

GWErrorPtr GWZipLoadOperation::corruptError(const char* format, ...) const {
    va_list arguments;
    va_start(arguments, format);
    std::string description = GWFormatV(format, arguments);
    va_end(arguments);
    return GWGenerateError(kGWCocoaErrorDomain, GWFileReadCorruptFileError, url_, nullptr, {}, "%s",
                           description.c_str());
}

GWErrorPtr GWZipLoadOperation::cancelledError() const {
    return GWGenerateError(kGWCocoaErrorDomain, GWUserCancelledError, url_, nullptr, {},
                           "Loading the archive was cancelled");
}

void GWZipLoadOperation::main() {
    GWErrorPtr error;
    auto file = GWRemoteFileHandle::initForReadingFromURL(url_, &error);
    if (!file) {
        setError(error);
        return;
    }
    // Only proves the file is readable; the bytes are not examined.
    if (!file->readDataOfLength(4, &error)) {
        setError(error);
        return;
    }
    static constexpr std::uint8_t kLocalHeaderSignature[] = {'P', 'K', 3, 4};
    std::uint64_t found = kNotFound;
    auto cancelled = [this] { return isCancelled(); };
    // Self-extractor stubs are far smaller than this; a resource that holds
    // no local header this early is not read to its end to find one.
    static constexpr std::uint64_t kLongestStub = 4 << 20;
    if (!searchForData(kLocalHeaderSignature, *file, 0, kLongestStub, &found, cancelled, &error)) {
        setError(error);
        file->closeFileAndReturnError(nullptr);
        return;
    }
    if (found == kNotFound && file->fileSize() > kLongestStub) {
        // The end record tells where the data begins, if it is there at all.
        found = 0;
    } else if (found == kNotFound) {
        // Without a local header only an end record that counts no entries
        // makes an archive: an empty one.
        GWZipEndOfCentralDirectoryRecord end;
        GWErrorPtr endError;
        if (getEnd(&end, *file, &endError) && end.totalEntries == 0) {
            setStartOffset(0);
            setFiles(GWZipFileArray());
        } else {
            setError(
                corruptError("%s is not a ZIP archive: it has neither a local file header "
                             "nor an end record",
                             url_.path().c_str()));
        }
        file->closeFileAndReturnError(nullptr);
        return;
    }
    setStartOffset(found);
    auto roots = loadFilesFromZipArchiveAtHandle(*file, &error);
    if (!roots && error && error->is(kGWCocoaErrorDomain, GWFileReadCorruptFileError)) {
        // A lost or damaged directory still leaves the entries written before it.
        setStartOffset(found);
        if (auto recovered = recoverFilesFromLocalHeaders(*file, nullptr)) {
            roots = std::move(recovered);
            error = nullptr;
        }
    }
    if (!roots) {
        setError(error);
    } else {
        setFiles(std::move(roots));
        if (isCancelled()) {
            setError(cancelledError());
        }
    }
    file->closeFileAndReturnError(nullptr);
}

bool GWZipLoadOperation::chooseStartOffset(const GWZipEndOfCentralDirectoryRecord& end,
                                           std::uint64_t endOffset, GWRemoteFileHandle& file,
                                           GWErrorPtr* error) {
    static constexpr std::uint8_t kCentralSignature[] = {'P', 'K', 1, 2};
    auto directoryAt = [&](std::uint64_t start) -> std::optional<bool> {
        if (end.centralDirectoryOffset > endOffset ||
            start > endOffset - end.centralDirectoryOffset) {
            return false;
        }
        if (!file.seekToFileOffset(start + end.centralDirectoryOffset, error)) {
            return std::nullopt;
        }
        auto bytes = file.readDataOfLength(4, error);
        if (!bytes) {
            return std::nullopt;
        }
        return bytes->size() == 4 && std::equal(bytes->begin(), bytes->end(), kCentralSignature);
    };
    // Offsets are normally relative to the first local header, which is
    // right for a stub prepended as is. A stub prepended by a tool that
    // adjusted the offsets (zip -A) makes them absolute instead; the end
    // record's position minus the directory's size tells which.
    std::vector<std::uint64_t> candidates{startOffset_};
    if (end.centralDirectorySize <= endOffset &&
        end.centralDirectoryOffset <= endOffset - end.centralDirectorySize) {
        candidates.push_back(endOffset - end.centralDirectorySize - end.centralDirectoryOffset);
    }
    candidates.push_back(0);
    for (std::uint64_t candidate : candidates) {
        auto found = directoryAt(candidate);
        if (!found) {
            return false;
        }
        if (*found) {
            setStartOffset(candidate);
            return true;
        }
    }
    // None fits: the walk reports the damage where the first guess leads.
    return true;
}

std::optional<GWZipFileArray> GWZipLoadOperation::loadFilesFromZipArchiveAtHandle(
    GWRemoteFileHandle& file, GWErrorPtr* error) {
    GWZipEndOfCentralDirectoryRecord end;
    auto endOffset = getEnd(&end, file, error);
    if (!endOffset) {
        return std::nullopt;
    }
    if (!chooseStartOffset(end, *endOffset, file, error)) {
        return std::nullopt;
    }
    // The directory is taken to run up to the end record; its size field is
    // not trusted.
    const std::uint64_t start = startOffset_;
    if (end.centralDirectoryOffset > *endOffset ||
        start > *endOffset - end.centralDirectoryOffset) {
        GWFail(error, corruptError("The central directory at offset %llu (+%llu) lies past the end "
                                   "record at offset %llu",
                                   (unsigned long long)end.centralDirectoryOffset,
                                   (unsigned long long)start, (unsigned long long)*endOffset));
        return std::nullopt;
    }
    const std::uint64_t directoryOffset = start + end.centralDirectoryOffset;
    const std::uint64_t directorySize = *endOffset - directoryOffset;

    GWZipTreeBuilder tree;
    if (!buildTreeFromDirectory(end, directoryOffset, directorySize, file, tree, error)) {
        return std::nullopt;
    }
    return finishTree(tree, error);
}

std::optional<GWZipFileArray> GWZipLoadOperation::finishTree(GWZipTreeBuilder& tree,
                                                             GWErrorPtr* error) {
    lastParent_ = nullptr;
    GWZipFileArray roots = tree.finish();
    if (!setUpMetadataItemsForFiles(roots, error)) {
        return std::nullopt;
    }
    return roots;
}

bool GWZipLoadOperation::buildTreeFromDirectory(const GWZipEndOfCentralDirectoryRecord& end,
                                                std::uint64_t directoryOffset,
                                                std::uint64_t directorySize,
                                                GWRemoteFileHandle& file, GWZipTreeBuilder& tree,
                                                GWErrorPtr* error) {
    // Reading and decoding the records takes about as long as building the
    // tree from them; a large directory does both at once, on two threads.
    static constexpr std::uint64_t kThreadedEntryCount = 4096;
    if (end.totalEntries >= kThreadedEntryCount && std::thread::hardware_concurrency() > 1) {
        GWZipEntryPipe pipe(4);
        std::optional<std::thread> walker;
        try {
            walker.emplace(
                [&] { walkCentralDirectory(end, directoryOffset, directorySize, file, pipe); });
        } catch (const std::system_error&) {
            // No thread to be had: the walk runs first, below.
        }
        if (walker) {
            struct Join {
                GWZipEntryPipe& pipe;
                std::thread& thread;
                ~Join() {
                    pipe.abandon();
                    thread.join();
                }
            } join{pipe, *walker};
            return buildTree(pipe, tree, error);
        }
    }
    GWZipEntryPipe pipe(GWZipEntryPipe::kUnbounded);
    walkCentralDirectory(end, directoryOffset, directorySize, file, pipe);
    return buildTree(pipe, tree, error);
}

void GWZipLoadOperation::walkCentralDirectory(const GWZipEndOfCentralDirectoryRecord& end,
                                              std::uint64_t directoryOffset,
                                              std::uint64_t directorySize, GWRemoteFileHandle& file,
                                              GWZipEntryPipe& pipe) {
    static constexpr std::size_t kBatchSize = 1024;
    GWZipReadWindow window(file);
    // The directory is read a window at a time: a huge one is never held whole.
    // Remotely every window is a round trip: a large directory comes in one.
    const bool remote = file.URL() && !file.URL()->isFileURL();
    GWZipReadWindow directory(
        file, std::size_t(remote ? std::clamp<std::uint64_t>(directorySize, 1 << 20, 16 << 20)
                                 : 1 << 20));
    GWErrorPtr error;
    // Parses the record at `position` into `batch`, unless its name ends in
    // "..", and gives its length.
    auto readRecord = [&](std::uint64_t position, GWZipParsedBatch& batch,
                          std::uint64_t* length) -> bool {
        auto bytes =
            directory.read(directoryOffset + position,
                           std::size_t(std::min<std::uint64_t>(GWZipCentralDirectoryRecord::kLength,
                                                               directorySize - position)),
                           &error);
        if (bytes && bytes->size() == GWZipCentralDirectoryRecord::kLength) {
            const std::uint64_t recordLength = centralRecordLength(*bytes);
            bytes = directory.read(directoryOffset + position,
                                   std::size_t(std::min(recordLength, directorySize - position)),
                                   &error);
        }
        if (!bytes) {
            return false;
        }
        GWZipCentralDirectoryRecord record;
        std::optional<std::string> filename;
        std::optional<GWData> extraFieldData;
        std::optional<std::string> comment;
        std::size_t pointer = 0;
        if (!readCentralDirRecord(&record, *bytes, &pointer, &filename, &extraFieldData, &comment,
                                  &error, position)) {
            GWLog("Couldn't read central directory record!");
            return false;
        }
        *length = pointer;
        std::string name = filename ? std::move(*filename) : std::string();
        if (GWZipLastPOSIXPathComponent(name) == "..") {
            return true;
        }
        const auto nameBytes =
            bytes->subspan(GWZipCentralDirectoryRecord::kLength, record.filenameLength);
        return parseItemFromCentralDirectoryRecord(record, window, std::move(name), nameBytes,
                                                   extraFieldData, comment, batch, &error);
    };

    DataSpans spans;
    GWZipParsedBatch batch;
    std::uint64_t position = 0;
    for (std::uint64_t entry = 0; entry < end.totalEntries; ++entry) {
        if (isCancelled()) {
            pipe.close(false, cancelledError());
            return;
        }
        const std::size_t parsed = batch.entries.size();
        std::uint64_t length = 0;
        if (!readRecord(position, batch, &length)) {
            pipe.close(false, error);
            return;
        }
        if (batch.entries.size() > parsed) {
            const GWZipParsedEntry& added = batch.entries.back();
            if (spans.breaksOrder(added.localHeaderOffset)) {
                // Rare enough that reading the earlier records again costs
                // less than keeping every extent of every directory.
                for (std::uint64_t earlier = 0, skip = 0; earlier < position; earlier += skip) {
                    GWZipParsedBatch again;
                    if (!readRecord(earlier, again, &skip)) {
                        pipe.close(false, error);
                        return;
                    }
                    if (!again.entries.empty()) {
                        const GWZipParsedEntry& entry = again.entries.back();
                        spans.addOverlaps(entry.localHeaderOffset, entry.dataEnd, earlier);
                    }
                }
            }
            if (spans.addOverlaps(added.localHeaderOffset, added.dataEnd, position)) {
                pipe.close(false, overlappingEntriesError(std::string(batch.name(added))));
                return;
            }
        }
        position += length;
        if (batch.entries.size() == kBatchSize) {
            if (!pipe.push(std::move(batch))) {
                return;
            }
            batch = GWZipParsedBatch();
        }
    }
    if (auto record = spans.overlappingRecord()) {
        // Read again for its name: keeping every name for this rare case
        // would cost more than the walk.
        GWZipParsedBatch named;
        std::uint64_t length = 0;
        std::string name;
        if (readRecord(*record, named, &length) && !named.entries.empty()) {
            name = named.name(named.entries.back());
        }
        pipe.close(false, overlappingEntriesError(std::move(name)));
        return;
    }
    if (!batch.entries.empty() && !pipe.push(std::move(batch))) {
        return;
    }
    pipe.close(true);
}

GWErrorPtr GWZipLoadOperation::overlappingEntriesError(std::string path) const {
    if (path.size() > 1 && path.back() == '/') {
        path.pop_back();
    }
    return GWGenerateError(kGWZipArchiveErrorDomain, GWZipArchiveOverlappingEntriesError, url_,
                           nullptr, {{kGWZipArchiveUnknownEntityErrorKey, GWValue(path)}},
                           "Entry \"%s\": overlapping entries (possible zip bomb)", path.c_str());
}

bool GWZipLoadOperation::buildTree(GWZipEntryPipe& pipe, GWZipTreeBuilder& tree,
                                   GWErrorPtr* error) {
    while (auto batch = pipe.pop()) {
        for (GWZipParsedEntry& entry : batch->entries) {
            if (!addItemWithFilename(
                    batch->name(entry), entry.compressedSize, entry.uncompressedSize,
                    entry.compressionMethod, entry.generalPurposeFlags, entry.crc32,
                    entry.localHeaderOffset, entry.modificationDate, entry.permissionsMode,
                    std::move(entry.extraInfo), tree, error)) {
                return false;
            }
        }
    }
    if (!pipe.succeeded()) {
        return GWFail(error, pipe.error());
    }
    return true;
}
