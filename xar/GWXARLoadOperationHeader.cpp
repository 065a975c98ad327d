// The load itself: the file's header, the stored table of contents and its
// inflation, bounded by what the file actually holds.

#include <cerrno>
#include <cstdlib>
#include <exception>
#include <string>

#include "GWArchiveSupport/GWArchiveConstants.h"
#include "GWXARLoadOperation.h"
#include "foundation/GWByteReader.h"
#include "foundation/GWChecksum.h"
#include "foundation/GWDecompressor.h"

namespace {

constexpr std::size_t kFixedHeaderLength = 6;  // magic and header length
constexpr std::uint16_t kMinimumHeaderLength = 28;
constexpr std::uint16_t kSupportedVersion = 1;

// pugixml allocates through global hooks. While a table of contents is
// parsed on this thread, its allocations are counted and refused past the
// limit, so a tree of millions of tiny elements fails early instead of
// taking gigabytes. Other threads and other parses allocate as usual.
struct TreeBudget {
    bool active = false;
    bool exceeded = false;
    std::uint64_t used = 0;
    std::uint64_t limit = 0;
};
thread_local TreeBudget tTreeBudget;

void* budgetedAllocate(std::size_t size) {
    TreeBudget& budget = tTreeBudget;
    if (budget.active) {
        if (size > budget.limit - budget.used) {
            budget.exceeded = true;
            return nullptr;
        }
        budget.used += size;
    }
    return std::malloc(size);
}

void budgetedDeallocate(void* pointer) {
    std::free(pointer);
}

// The defaults are malloc and free too, so memory from before the hooks
// were set is freed correctly after.
const bool kTreeBudgetInstalled = [] {
    pugi::set_memory_management_functions(budgetedAllocate, budgetedDeallocate);
    return true;
}();

// Closes the handle however main() is left.
class FileHandleCloser {
public:
    explicit FileHandleCloser(GWXARLoadOperation& operation) : operation_(operation) {}
    ~FileHandleCloser() {
        if (const auto& handle = operation_.fileHandle()) {
            handle->closeFileAndReturnError(nullptr);
        }
        operation_.setFileHandle(nullptr);
    }
    FileHandleCloser(const FileHandleCloser&) = delete;
    FileHandleCloser& operator=(const FileHandleCloser&) = delete;

private:
    GWXARLoadOperation& operation_;
};

}  // namespace

int GWXARLoadOperation::checksumTypeFromXARTypeNumber(std::uint32_t number) {
    switch (number) {
        case 0: return GWChecksumAlgorithmNone;
        case 1: return GWChecksumAlgorithmSHA1;
        case 2: return GWChecksumAlgorithmMD5;
        default: return GWChecksumAlgorithmUnknown;
    }
}

void GWXARLoadOperation::main() {
    FileHandleCloser closer(*this);
    try {
        if (!archiveURL_) {
            error_ = GWCocoaError(GWFileReadUnknownError);
            return;
        }
        GWErrorPtr failure;
        fileHandle_ = GWRemoteFileHandle::initForReadingFromURL(*archiveURL_, &failure);
        if (!fileHandle_) {
            error_ = failure ? failure : GWCocoaError(GWFileReadUnknownError, archiveURL_);
            return;
        }
        files_ = readArchiveContents(failOnInvalidSignature_, &failure);
        if (!files_) {
            // Some paths fail on purpose without an error object.
            error_ = failure ? failure : GWCocoaError(GWFileReadUnknownError, archiveURL_);
        }
    } catch (const std::exception& exception) {
        files_.reset();
        error_ = GWGenerateError(kGWCocoaErrorDomain, GWFileReadUnknownError, archiveURL_, nullptr,
                                 {}, "%s", exception.what());
    } catch (...) {
        files_.reset();
        error_ = GWGenerateError(kGWCocoaErrorDomain, GWFileReadUnknownError, archiveURL_, nullptr,
                                 {}, "An unknown exception was raised while loading the archive");
    }
}

std::optional<GWXARFileArray> GWXARLoadOperation::readArchiveContents(bool failOnInvalidSignature,
                                                                      GWErrorPtr* error) {
    if (isCancelled()) {
        GWFail(error, cancelledError());
        return std::nullopt;
    }
    std::uint64_t headerLength = 0, compressedLength = 0, uncompressedLength = 0;
    int checksumAlgorithm = GWChecksumAlgorithmNone;
    if (!getHeaderLength(&headerLength, &compressedLength, &uncompressedLength, &checksumAlgorithm,
                         error)) {
        return std::nullopt;
    }
    // Wraps only for absurd lengths, which readTOC refuses before the heap is used.
    heapStart_ = headerLength + compressedLength;

    GWData checksum;
    auto document =
        readTOC(compressedLength, uncompressedLength, checksumAlgorithm, &checksum, error);
    if (!document) {
        return std::nullopt;
    }
    setTOCChecksum(std::move(checksum));

    auto files = parseTOC(*document, checksumAlgorithm, failOnInvalidSignature, error);
    if (!files) {
        return std::nullopt;
    }
    if (isCancelled()) {
        GWFail(error, cancelledError());
        return std::nullopt;
    }
    return files;
}

bool GWXARLoadOperation::getHeaderLength(std::uint64_t* headerLength,
                                         std::uint64_t* compressedTOCLength,
                                         std::uint64_t* uncompressedTOCLength,
                                         int* checksumAlgorithm, GWErrorPtr* error) {
    if (isCancelled()) {
        return GWFail(error, cancelledError());
    }
    if (!fileHandle_) {
        return GWFail(error, GWPOSIXError(EBADF, archiveURL_));
    }
    auto start = fileHandle_->readDataOfLength(kFixedHeaderLength, error);
    if (!start) {
        return false;
    }
    GWByteReader fixed(*start);
    const std::string magic = fixed.string(4);
    const std::uint16_t length = fixed.u16be();
    if (!fixed.ok()) {
        return GWFail(error, errorWithCode(GWXARArchiveNotXARFileError, std::nullopt, {}));
    }
    if (headerLength) {
        *headerLength = length;
    }
    if (magic != "xar!") {
        return GWFail(error, errorWithCode(GWXARArchiveNotXARFileError, std::nullopt, {}));
    }
    if (length < kMinimumHeaderLength) {
        return GWFail(error,
                      GWGenerateError(kGWCocoaErrorDomain, GWFileReadCorruptFileError, archiveURL_,
                                      nullptr, {}, "The XAR header is %u bytes long, fewer than %u",
                                      unsigned(length), unsigned(kMinimumHeaderLength)));
    }

    if (isCancelled()) {
        return GWFail(error, cancelledError());
    }
    auto rest = fileHandle_->readDataOfLength(length - kFixedHeaderLength, error);
    if (!rest) {
        return false;
    }
    // A file that ends inside its own header is no archive.
    GWByteReader header(*rest);
    const std::uint16_t version = header.u16be();
    const std::uint64_t compressed = header.u64be();
    const std::uint64_t uncompressed = header.u64be();
    const std::uint32_t checksumNumber = header.u32be();
    if (!header.ok() || rest->size() < length - kFixedHeaderLength) {
        return GWFail(error, errorWithCode(GWXARArchiveNotXARFileError, std::nullopt, {}));
    }
    if (compressedTOCLength) {
        *compressedTOCLength = compressed;
    }
    if (uncompressedTOCLength) {
        *uncompressedTOCLength = uncompressed;
    }
    if (checksumAlgorithm) {
        *checksumAlgorithm = checksumTypeFromXARTypeNumber(checksumNumber);
    }
    if (version != kSupportedVersion) {
        return GWFail(
            error, errorWithCode(GWXARArchiveUnsupportedVersionError, std::to_string(version), {}));
    }
    return true;
}

std::shared_ptr<pugi::xml_document> GWXARLoadOperation::readTOC(std::uint64_t compressedLength,
                                                                std::uint64_t decompressedLength,
                                                                int checksumAlgorithm,
                                                                GWData* checksum,
                                                                GWErrorPtr* error) {
    auto corrupt = [&](const std::string& why) {
        GWFail(error, GWGenerateError(kGWCocoaErrorDomain, GWFileReadCorruptFileError, archiveURL_,
                                      nullptr, {}, "%s", why.c_str()));
        return nullptr;
    };
    if (isCancelled()) {
        GWFail(error, cancelledError());
        return nullptr;
    }
    // Lengths are claims: refuse absurd ones before reading or inflating anything.
    if (compressedLength > kMaxTOCLength || decompressedLength > kMaxTOCLength) {
        return corrupt("The XAR table of contents is larger than the " +
                       std::to_string(kMaxTOCLength >> 20) + " MiB allowed");
    }
    if (!fileHandle_) {
        GWFail(error, GWPOSIXError(EBADF, archiveURL_));
        return nullptr;
    }
    auto stored = fileHandle_->readDataOfLength(compressedLength, error);
    if (!stored) {
        return nullptr;
    }
    if (stored->size() != compressedLength) {
        return corrupt("The XAR table of contents extends past the end of the file");
    }

    if (isCancelled()) {
        GWFail(error, cancelledError());
        return nullptr;
    }
    if (checksum) {
        *checksum = GWChecksum::checksumForData(*stored, checksumAlgorithm);
    }
    std::optional<GWData> inflated;
    if (GWDecompressor::isDataCompressed(*stored)) {
        // One byte more than claimed is enough to tell a wrong length.
        GWErrorPtr failure;
        inflated =
            GWDecompressor::decompressedDataFromData(*stored, &failure, decompressedLength + 1);
        if (!inflated) {
            // Damaged, or longer than stated: either way the archive is corrupt.
            GWFail(error,
                   GWGenerateError(
                       kGWCocoaErrorDomain, GWFileReadCorruptFileError, archiveURL_, failure, {},
                       "The XAR table of contents cannot be inflated: %s",
                       failure ? failure->localizedDescription().c_str() : "unknown failure"));
            return nullptr;
        }
    } else {
        inflated = std::move(*stored);
    }
    stored.reset();

    if (isCancelled()) {
        GWFail(error, cancelledError());
        return nullptr;
    }
    if (inflated->size() != decompressedLength) {
        return corrupt("The XAR table of contents does not inflate to its stated length");
    }

    // pugixml never fetches DTDs or external entities; it only knows the
    // predefined and numeric character references.
    // Parsed in place: the tree points into the text, which lives as long as it.
    struct ParsedTOC {
        GWData text;
        pugi::xml_document document;
    };
    if (!chargeTOCMemory(inflated->size(), error)) {
        return nullptr;
    }
    auto parsedTOC = std::make_shared<ParsedTOC>();
    parsedTOC->text = std::move(*inflated);
    inflated.reset();
    std::shared_ptr<pugi::xml_document> document(parsedTOC, &parsedTOC->document);
    (void)kTreeBudgetInstalled;
    tTreeBudget = {true, false, tocMemoryUsed_, kMaxTOCMemory};
    const pugi::xml_parse_result parsed = document->load_buffer_inplace(
        parsedTOC->text.data(), parsedTOC->text.size(), kTOCParseOptions);
    const TreeBudget budget = tTreeBudget;
    tTreeBudget = {};
    if (budget.exceeded) {
        return corrupt("The XAR table of contents has more elements than fit in the " +
                       std::to_string(kMaxTOCMemory >> 20) + " MiB allowed for parsing it");
    }
    tocMemoryUsed_ = budget.used;
    if (!parsed) {
        GWFail(error, GWGenerateError(kGWCocoaErrorDomain, GWFileReadCorruptFileError, archiveURL_,
                                      nullptr, {},
                                      "The XAR table of contents is not XML: %s at offset %lld",
                                      parsed.description(), (long long)parsed.offset));
        return nullptr;
    }
    return document;
}
