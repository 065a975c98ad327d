// Extra fields written by real archivers decode to what their own listing
// tools report for the same archive.

#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/stat.h>
#include <unistd.h>

#include <regex>

#include "support/TestSupport.h"
#include "support/ZipBuilder.h"
#include "zip/ZipTestSupport.h"

namespace {

using namespace gwtest;

const char* const kMonths[] = {"Jan", "Feb", "Mar", "Apr", "May", "Jun",
                               "Jul", "Aug", "Sep", "Oct", "Nov", "Dec"};

// "2022 May 6 07:08:09" as zipinfo prints it (here always in UTC).
std::optional<double> zipinfoTime(const std::string& text) {
    std::smatch match;
    static const std::regex pattern(R"((\d{4}) (\w{3}) +(\d+) (\d\d):(\d\d):(\d\d))");
    if (!std::regex_search(text, match, pattern)) {
        return std::nullopt;
    }
    for (int month = 0; month < 12; ++month) {
        if (match[2] == kMonths[month]) {
            return utcSeconds(std::stoi(match[1]), month + 1, std::stoi(match[3]),
                              std::stoi(match[4]), std::stoi(match[5]), std::stoi(match[6]));
        }
    }
    return std::nullopt;
}

// The hex bytes zipinfo dumps after `header` (up to the closing ".").
GWData zipinfoBytesAfter(const std::string& listing, const std::string& header) {
    GWData bytes;
    auto at = listing.find(header);
    if (at == std::string::npos) {
        return bytes;
    }
    at = listing.find(':', at + header.size());
    const auto end = listing.find('.', at);
    std::istringstream hex(listing.substr(at + 1, end - at - 1));
    std::string byte;
    while (hex >> byte) {
        bytes.push_back(std::uint8_t(std::stoul(byte, nullptr, 16)));
    }
    return bytes;
}

std::uint64_t littleEndian(const GWData& bytes, std::size_t at, std::size_t width) {
    std::uint64_t value = 0;
    for (std::size_t i = 0; i < width && at + i < bytes.size(); ++i) {
        value |= std::uint64_t(bytes[at + i]) << (8 * i);
    }
    return value;
}

// A file with known times and, where the process may set it, a known owner.
std::string makeSample(const TemporaryDirectory& dir, timespec modified) {
    const std::string path = dir.file("a.txt");
    writeFile(path, bytesOf("hello, peers\n"));
    if (chown(path.c_str(), 1234, 5678) != 0) {
        // Not privileged: the file keeps the test's own owner.
    }
    const timespec times[2] = {{modified.tv_sec + 3600, 0}, modified};
    EXPECT_EQ(utimensat(AT_FDCWD, path.c_str(), times, 0), 0);
    return path;
}

class GWZipPeerExtraFields : public ::testing::Test {
protected:
    std::optional<GWDictionary> decode(const GWData& field, bool isLocal) {
        GWErrorPtr error;
        auto info = operation->infoFromExtraFieldData(field, isLocal, &error);
        EXPECT_TRUE(info) << (error ? error->localizedDescription() : "");
        return info;
    }

    std::shared_ptr<GWZipWorkOperation> operation = std::make_shared<GWZipWorkOperation>();
    TemporaryDirectory dir;
};

TEST_F(GWZipPeerExtraFields, InfoZipTimestampsAndOwnersMatchZipinfo) {
    if (!toolAvailable("zip") || !toolAvailable("zipinfo")) {
        GTEST_SKIP() << "zip or zipinfo not installed";
    }
    const double modified = utcSeconds(2022, 5, 6, 7, 8, 9);
    const std::string path = makeSample(dir, {time_t(modified), 0});
    struct stat status {};
    ASSERT_EQ(stat(path.c_str(), &status), 0);
    ASSERT_EQ(runCommand("cd " + shellQuote(dir.path()) + " && zip -q z.zip a.txt").status, 0);
    const auto records = readZipRecords(readFile(dir.file("z.zip")));
    ASSERT_EQ(records.size(), 1u);
    const auto listing = runCommand("TZ=UTC zipinfo -v " + shellQuote(dir.file("z.zip")));
    ASSERT_EQ(listing.status, 0);

    // zipinfo's times from the UT field and the owner bytes of the ux field.
    std::smatch match;
    ASSERT_TRUE(std::regex_search(listing.output, match,
                                  std::regex(R"(\(UT extra field modtime\): +([^\n]+) UTC)")));
    const auto reportedTime = zipinfoTime(match[1]);
    ASSERT_TRUE(reportedTime);
    EXPECT_EQ(*reportedTime, modified);
    const GWData ux = zipinfoBytesAfter(listing.output, "ID 0x7875");
    ASSERT_GE(ux.size(), 3u);
    const std::size_t uidSize = ux[1];
    const std::uint64_t reportedUID = littleEndian(ux, 2, uidSize);
    const std::uint64_t reportedGID = littleEndian(ux, 3 + uidSize, ux[2 + uidSize]);
    EXPECT_EQ(reportedUID, status.st_uid);
    EXPECT_EQ(reportedGID, status.st_gid);

    auto central = decode(records[0].centralExtra, false);
    auto local = decode(records[0].localExtra, true);
    ASSERT_TRUE(central && local);
    for (const GWDictionary* info : {&*central, &*local}) {
        EXPECT_EQ(dateInfo(*info, kGWZipUTCModificationDateKey), *reportedTime);
        EXPECT_EQ(unsignedInfo(*info, kGWZipUserIDKey), reportedUID);
        EXPECT_EQ(unsignedInfo(*info, kGWZipGroupIDKey), reportedGID);
    }
    // The central copy holds only the modification time and says so.
    EXPECT_EQ(boolInfo(*central, kGWZipMoreInfoAvailableInLocalHeaderKey), true);
    EXPECT_FALSE(dateInfo(*central, kGWZipUTCAccessDateKey));
    EXPECT_TRUE(dateInfo(*local, kGWZipUTCAccessDateKey));
}

// "2022-05-06 07:08:09.1234567" as 7-Zip lists times (here in UTC).
std::optional<double> sevenZipTime(const std::string& listing, const std::string& label) {
    std::smatch match;
    const std::regex pattern(label + R"( = (\d{4})-(\d\d)-(\d\d) (\d\d):(\d\d):(\d\d)(\.\d+)?)");
    if (!std::regex_search(listing, match, pattern)) {
        return std::nullopt;
    }
    double seconds = utcSeconds(std::stoi(match[1]), std::stoi(match[2]), std::stoi(match[3]),
                                std::stoi(match[4]), std::stoi(match[5]), std::stoi(match[6]));
    if (match[7].matched) {
        seconds += std::stod("0" + match[7].str());
    }
    return seconds;
}

TEST_F(GWZipPeerExtraFields, SevenZipNTFSTimesMatchZipinfoAndItsOwnListing) {
    if (!toolAvailable("7zz") || !toolAvailable("zipinfo")) {
        GTEST_SKIP() << "7zz or zipinfo not installed";
    }
    const double modified = utcSeconds(2022, 5, 6, 7, 8, 9);
    makeSample(dir, {time_t(modified), 123456700});
    ASSERT_EQ(runCommand("cd " + shellQuote(dir.path()) +
                         " && TZ=UTC 7zz a -tzip -mtm=on -mta=on -mtc=on s.zip a.txt >/dev/null")
                  .status,
              0);
    const auto records = readZipRecords(readFile(dir.file("s.zip")));
    ASSERT_EQ(records.size(), 1u);
    const auto zipinfo = runCommand("TZ=UTC zipinfo -v " + shellQuote(dir.file("s.zip")));
    const auto sevenZip = runCommand("TZ=UTC 7zz l -slt " + shellQuote(dir.file("s.zip")));
    ASSERT_EQ(zipinfo.status, 0);
    ASSERT_EQ(sevenZip.status, 0);

    // zipinfo dumps the NTFS block's first 20 bytes: the modification time
    // sits at 8; its DOS time is the same moment rounded up to 2 seconds.
    const GWData ntfs = zipinfoBytesAfter(zipinfo.output, "ID 0x000a (PKWARE Win32)");
    ASSERT_EQ(ntfs.size(), 20u);
    const double reportedModified =
        GWDate::dateWithNTFSTicks(littleEndian(ntfs, 8, 8)).timeIntervalSince1970();
    std::smatch match;
    ASSERT_TRUE(
        std::regex_search(zipinfo.output, match, std::regex(R"(\(DOS date/time\): +([^\n]+))")));
    const auto dosTime = zipinfoTime(match[1]);
    ASSERT_TRUE(dosTime);
    EXPECT_NEAR(reportedModified, *dosTime, 2.0);

    auto central = decode(records[0].centralExtra, false);
    ASSERT_TRUE(central);
    ASSERT_TRUE(dateInfo(*central, kGWZipUTCModificationDateKey));
    EXPECT_NEAR(*dateInfo(*central, kGWZipUTCModificationDateKey), reportedModified, 1e-6);
    EXPECT_NEAR(*dateInfo(*central, kGWZipUTCModificationDateKey), modified + 0.1234567, 1e-6);
    const std::pair<const char*, const char*> times[] = {{"Modified", kGWZipUTCModificationDateKey},
                                                         {"Accessed", kGWZipUTCAccessDateKey},
                                                         {"Created", kGWZipUTCCreationDateKey}};
    for (const auto& [label, key] : times) {
        const auto listed = sevenZipTime(sevenZip.output, label);
        ASSERT_TRUE(listed) << label;
        ASSERT_TRUE(dateInfo(*central, key)) << key;
        EXPECT_NEAR(*dateInfo(*central, key), *listed, 1e-6) << label;
    }
}

}  // namespace
