#pragma once

#include <cstddef>
#include <cstdint>
#include <functional>
#include <memory>
#include <mutex>
#include <optional>
#include <span>
#include <string>
#include <string_view>
#include <unordered_map>

#include "GWDate.h"
#include "GWError.h"
#include "GWExport.h"
#include "GWURL.h"
#include "GWZipFile.h"
#include "GWZipWorkOperation.h"

class GWRemoteFileHandle;
class GWZipEntryList;
class GWZipEntryPipe;
class GWZipReadWindow;
class GWZipTreeBuilder;
struct GWZipCentralDirectoryRecord;
struct GWZipEndOfCentralDirectoryRecord;
struct GWZipParsedBatch;

class GWZipLoadOperation;
using GWZipLoadOperationPtr = std::shared_ptr<GWZipLoadOperation>;

// Turns a ZIP file into a tree of GWZipFile nodes: finds where the ZIP data
// begins (it may follow a self-extractor stub), reads the end record (classic
// or Zip64) and the central directory, consults local headers, builds the tree
// and attaches Mac metadata companions to their entries. The result is left in
// files() and error(); a GWZipArchive runs it.
class GW_EXPORT GWZipLoadOperation : public GWZipWorkOperation {
public:
    // Nothing is read until the operation runs.
    static GWZipLoadOperationPtr initWithURL(const GWURL& url);

    const GWURL& URL() const { return url_; }
    // The roots after a successful load; none before or after a failure.
    std::optional<GWZipFileArray> files() const;
    void setFiles(std::optional<GWZipFileArray> files);
    GWErrorPtr error() const;
    void setError(GWErrorPtr error);
    // Where the ZIP data begins; every offset the archive stores is relative to it.
    std::uint64_t startOffset() const { return startOffset_; }
    void setStartOffset(std::uint64_t offset) { startOffset_ = offset; }
    // Never assigned by loading.
    std::uint64_t compressedSize() const { return 0; }
    // The iconv name of the encoding for names that do not carry the UTF-8
    // flag; empty (the default) guesses from the host system.
    void setFilenameEncoding(std::string iconvName) { filenameEncoding_ = std::move(iconvName); }

    void main() override;

    // --- Recognising archives ---------------------------------------------------

    static constexpr std::uint64_t kNotFound = UINT64_MAX;

    // Finds the first occurrence of `pattern` within [start, start + length)
    // of the file, reading 16 KiB at a time; `foundOffset` is kNotFound when
    // there is none. Fails on a read error, or with GWUserCancelledError when
    // the cancel block answers true.
    static bool searchForData(std::span<const std::uint8_t> pattern, GWRemoteFileHandle& file,
                              std::uint64_t startOffset, std::uint64_t length,
                              std::uint64_t* foundOffset, const std::function<bool()>& cancelBlock,
                              GWErrorPtr* error);
    // A local header at the start, a self-extractor, or (local files only) an
    // end record in the last 512 bytes. Never reports errors.
    static bool isZipArchiveAtURL(const GWURL& url);
    // A Windows executable that carries a ZIP after its code.
    static bool isSelfExtractingZipArchiveAtURL(const GWURL& url);

    // --- End of central directory -----------------------------------------------

    // The root entries, or none with an error (or, for an undecodable name,
    // without one).
    std::optional<GWZipFileArray> loadFilesFromZipArchiveAtHandle(GWRemoteFileHandle& file,
                                                                  GWErrorPtr* error);
    // Fills the record and returns the file offset it was read from: the
    // classic record's, or the Zip64 record's when that one was used.
    std::optional<std::uint64_t> getEnd(GWZipEndOfCentralDirectoryRecord* record,
                                        GWRemoteFileHandle& file, GWErrorPtr* error) const;
    // The Zip64 record whose locator precedes the classic record at
    // `endingAtOffset`; returns the Zip64 record's file offset.
    std::optional<std::uint64_t> getEnd(GWZipEndOfCentralDirectoryRecord* record,
                                        std::uint64_t endingAtOffset, GWRemoteFileHandle& file,
                                        GWErrorPtr* error) const;
    bool parseEndOfCentralDirRecord(GWZipEndOfCentralDirectoryRecord* record,
                                    std::span<const std::uint8_t> data, GWErrorPtr* error) const;
    bool parseZip64EndOfCentralDirRecord(GWZipEndOfCentralDirectoryRecord* record,
                                         std::span<const std::uint8_t> data,
                                         GWErrorPtr* error) const;

    // --- Central directory --------------------------------------------------------

    using GWZipWorkOperation::readLocalHeaderRecord;
    // The 30 bytes at the handle's current position.
    bool readLocalHeaderRecord(GWZipLocalFileHeader* record, GWRemoteFileHandle& file,
                               GWErrorPtr* error) const;
    // Reads the record at `*pointer` in `buffer` with its name, extra field and
    // comment, and moves the pointer past them. Fails with 259 when the record
    // does not lie inside the buffer, and without an error when the name
    // cannot be decoded. Messages count offsets from `bufferOffset`, where the
    // buffer starts within the directory.
    bool readCentralDirRecord(GWZipCentralDirectoryRecord* record,
                              std::span<const std::uint8_t> buffer, std::size_t* pointer,
                              std::optional<std::string>* filename,
                              std::optional<GWData>* extraFieldData,
                              std::optional<std::string>* comment, GWErrorPtr* error,
                              std::uint64_t bufferOffset = 0) const;
    // UTF-8 when valid, else the legacy encodings of the record's host system.
    std::optional<std::string> filenameFromData(std::span<const std::uint8_t> data,
                                                const GWZipCentralDirectoryRecord& record,
                                                GWErrorPtr* error) const;
    static std::uint8_t operatingSystemFromCentralDirectoryRecord(
        const GWZipCentralDirectoryRecord& record);
    static std::string convertBackslashesInFilename(std::string filename);
    // Consults the local header where needed and derives mode and date; the
    // entry is appended to `batch`. `filename` was decoded from
    // `centralNameBytes`.
    bool parseItemFromCentralDirectoryRecord(const GWZipCentralDirectoryRecord& record,
                                             GWZipReadWindow& file, std::string filename,
                                             std::span<const std::uint8_t> centralNameBytes,
                                             const std::optional<GWData>& extraFieldData,
                                             const std::optional<std::string>& comment,
                                             GWZipParsedBatch& batch, GWErrorPtr* error);
    // Adds the entry to the tree, making the directories on its path.
    bool addItemWithFilename(std::string_view filename, std::uint64_t compressedSize,
                             std::uint64_t uncompressedSize, std::uint16_t compressionMethod,
                             std::uint16_t generalPurposeFlags, std::uint32_t crc32,
                             std::uint64_t localHeaderOffset, GWDate modificationDate,
                             std::uint16_t permissionsMode, GWDictionary extraInfo,
                             GWZipTreeBuilder& rootItems, GWErrorPtr* error);

    // The roots of a built tree, with the Mac metadata companions attached.
    std::optional<GWZipFileArray> finishTree(GWZipTreeBuilder& tree, GWErrorPtr* error);

    // --- Damaged archives --------------------------------------------------------------
    // The entries found by walking the local headers from the start offset,
    // for an archive whose end record or central directory cannot be read;
    // only entries whose data lies wholly in the file. Fails when there is none.
    std::optional<GWZipFileArray> recoverFilesFromLocalHeaders(GWRemoteFileHandle& file,
                                                               GWErrorPtr* error);
    // How many entries the load recovered that way; 0 for a whole archive.
    std::uint64_t recoveredEntryCount() const { return recoveredEntryCount_; }

    // --- Mac metadata companions ----------------------------------------------------

    // Attaches the entries of "__MACOSX" and of "XtraStuf.mac" / "Re$0urce.Fk"
    // to the entries they describe and removes those folders, then joins
    // "…r" / "…d" resource and data pairs at the root. Fails only when cancelled.
    bool setUpMetadataItemsForFiles(GWZipFileArray& files, GWErrorPtr* error);
    // Attaches the files below `item`, a folder inside (or equal to)
    // `metadataRoot`, to the entries of `rootFiles` their paths name.
    bool makeMetadataItemsForItem(const GWZipFilePtr& item, GWZipEntryList& rootFiles,
                                  const GWZipFilePtr& metadataRoot, const std::string& prefix,
                                  bool isAppleDouble, GWErrorPtr* error);
    // Pairs resource entries named "…r" with their data entries "…d" (renamed
    // to the base name) or with the base name itself.
    bool joinParallelMetadataFiles(GWZipEntryList& files, const GWZipFilePtr& parent,
                                   GWErrorPtr* error);
    // Among the parent's children when there is a parent, else in the list.
    static GWZipFilePtr fileWithName(std::string_view name, const GWZipEntryList& array,
                                     const GWZipFilePtr& parent);

private:
    explicit GWZipLoadOperation(GWURL url) : url_(std::move(url)) {}

    // Where the offsets of the archive count from: the first local header,
    // unless the central directory is only found when they count from
    // elsewhere (a prefix whose length a tool added to every offset).
    bool chooseStartOffset(const GWZipEndOfCentralDirectoryRecord& end, std::uint64_t endOffset,
                           GWRemoteFileHandle& file, GWErrorPtr* error);
    // Walks the directory and builds the tree from its records.
    bool buildTreeFromDirectory(const GWZipEndOfCentralDirectoryRecord& end,
                                std::uint64_t directoryOffset, std::uint64_t directorySize,
                                GWRemoteFileHandle& file, GWZipTreeBuilder& tree,
                                GWErrorPtr* error);
    // Reads `end.totalEntries` records of the directory at `directoryOffset`
    // into batches for the pipe, and closes it.
    void walkCentralDirectory(const GWZipEndOfCentralDirectoryRecord& end,
                              std::uint64_t directoryOffset, std::uint64_t directorySize,
                              GWRemoteFileHandle& file, GWZipEntryPipe& pipe);
    // Adds the pipe's entries to the tree until the walk closes it.
    bool buildTree(GWZipEntryPipe& pipe, GWZipTreeBuilder& tree, GWErrorPtr* error);
    // A DOS date and time in the system's zone. Converting costs a time-zone
    // lookup, and archives repeat a few stamps thousands of times.
    GWDate dateFromDOS(std::uint16_t time, std::uint16_t date);
    GWErrorPtr corruptError(const char* format, ...) const __attribute__((format(printf, 2, 3)));
    GWErrorPtr cancelledError() const;
    // Code 7 of the ZIP domain, naming the entry.
    GWErrorPtr overlappingEntriesError(std::string path) const;
    // Looks the path up in the roots, or makes the placeholder entry a lone
    // companion is attached to.
    GWZipFilePtr metadataTarget(const std::vector<std::string>& components,
                                GWZipEntryList& rootFiles) const;

    GWURL url_;
    std::uint64_t startOffset_ = 0;
    std::uint64_t recoveredEntryCount_ = 0;
    std::string filenameEncoding_;
    // The walk's (dateFromDOS) and the tree builder's own, when they run on
    // two threads.
    std::unordered_map<std::uint32_t, GWDate> dosDates_;
    GWZipFilePtr lastParent_;
    std::string lastParentPath_;
    mutable std::mutex resultMutex_;
    std::optional<GWZipFileArray> files_;
    GWErrorPtr error_;
};
