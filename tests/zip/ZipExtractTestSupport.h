#pragma once

#include <cstdint>
#include <mutex>
#include <string>
#include <vector>

#include "support/ZipBuilder.h"
#include "zip/GWZipExtractOperation.h"

namespace gwtest {

// An entry made by hand from a builder's member, as the loader would list it:
// the last path component as its name, the central sizes, CRC, mode and
// decoded central extra field, and the offset of its local header (the
// builder's bytes() must have run).
GWZipFilePtr zipEntryFromBuilder(const ZipBuilder& zip, std::size_t index,
                                 const GWZipFilePtr& parent = nullptr);

// Starts the operation on the calling thread and waits for it to finish,
// wherever its pipeline ends.
void runToEnd(const GWZipExtractOperationPtr& operation);

// What a data handler saw: the bytes, each call's is-done flag and error.
struct DataHandlerLog {
    std::mutex mutex;
    GWData bytes;
    std::vector<bool> doneFlags;
    std::vector<bool> hadData;
    std::vector<GWErrorPtr> errors;

    GWZipExtractOperation::DataHandler handler(bool answer = true);
};

// The sum and number of progress calls.
struct ProgressLog {
    std::mutex mutex;
    std::uint64_t total = 0;
    std::size_t calls = 0;

    GWZipExtractOperation::ProgressHandler handler(bool answer = true);
};

}  // namespace gwtest
