#include "zip/ZipExtractTestSupport.h"

#include <gtest/gtest.h>

#include "zip/GWZipNames.h"

namespace gwtest {

GWZipFilePtr zipEntryFromBuilder(const ZipBuilder& zip, std::size_t index,
                                 const GWZipFilePtr& parent) {
    auto& entries = const_cast<ZipBuilder&>(zip).entries();
    const ZipEntry& entry = entries.at(index);
    const std::string path(entry.name.begin(), entry.name.end());
    const std::uint32_t crc = entry.effectiveCRC32();
    GWData checksum{std::uint8_t(crc), std::uint8_t(crc >> 8), std::uint8_t(crc >> 16),
                    std::uint8_t(crc >> 24)};
    GWZipWorkOperation decoder;
    auto info = decoder.infoFromExtraFieldData(entry.centralExtra, false, nullptr);
    const std::uint64_t prefix = zip.offsetsIncludePrefix ? 0 : zip.prefix.size();
    auto file = GWZipFile::initWithName(
        std::string(GWZipLastPOSIXPathComponent(path)), parent,
        entry.compressedSize.value_or(entry.storedBytes().size()),
        entry.uncompressedSize.value_or(entry.content.size()), checksum, 1, 0, 0,
        std::uint16_t(entry.externalAttributes >> 16), GWDate(1577880000), std::nullopt,
        zip.localHeaderOffsets().at(index) - prefix, entry.flags, entry.method,
        info.value_or(GWDictionary()));
    if (parent) {
        parent->addChild(file);
    }
    return file;
}

void runToEnd(const GWZipExtractOperationPtr& operation) {
    ASSERT_TRUE(operation);
    operation->start();
    operation->waitUntilFinished();
}

GWZipExtractOperation::DataHandler DataHandlerLog::handler(bool answer) {
    return [this, answer](std::optional<std::span<const std::uint8_t>> data, bool isDone,
                          const GWErrorPtr& error) {
        std::lock_guard lock(mutex);
        if (data) {
            bytes.insert(bytes.end(), data->begin(), data->end());
        }
        hadData.push_back(data.has_value());
        doneFlags.push_back(isDone);
        errors.push_back(error);
        return answer;
    };
}

GWZipExtractOperation::ProgressHandler ProgressLog::handler(bool answer) {
    return [this, answer](std::uint64_t count) {
        std::lock_guard lock(mutex);
        total += count;
        ++calls;
        return answer;
    };
}

}  // namespace gwtest
