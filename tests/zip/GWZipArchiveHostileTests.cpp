// Malformed and hostile archives: every broken structure is
// GWFileReadCorruptFileError, and entries sharing bytes are
// GWZipArchiveOverlappingEntriesError; never a crash, a hang or a huge
// allocation.

#include <gtest/gtest.h>

#include <chrono>
#include <functional>

#include "GWArchiveSupport/GWArchiveConstants.h"
#include "support/MetadataTestSupport.h"
#include "support/TestSupport.h"
#include "support/ZipBuilder.h"
#include "support/ZipExtraFields.h"
#include "zip/GWZipArchive.h"
#include "zip/ZipTestSupport.h"

namespace {

using namespace gwtest;

std::size_t find(const GWData& bytes, std::initializer_list<std::uint8_t> pattern) {
    auto at = std::search(bytes.begin(), bytes.end(), pattern.begin(), pattern.end());
    return std::size_t(at - bytes.begin());
}

// `bytes` with the little-endian `values` written from `offset` bytes past
// the first `signature`, each `width` bytes wide.
GWData patched(GWData bytes, std::initializer_list<std::uint8_t> signature, std::size_t offset,
               std::vector<std::uint32_t> values, int width = 4) {
    std::size_t at = find(bytes, signature) + offset;
    for (std::uint32_t value : values) {
        for (int i = 0; i < width; ++i) {
            bytes[at++] = std::uint8_t(value >> (8 * i));
        }
    }
    return bytes;
}

// Two plain entries; the mutations below break one structure each.
GWData sampleArchive() {
    ZipBuilder zip;
    zip.addFile("one.txt", bytesOf("first entry"));
    zip.addFile("dir/two.txt", textBytes(400, 7), 8);
    return zip.bytes();
}

// One small entry, with `change` made to the builder.
GWData oneEntry(const std::function<void(ZipBuilder&)>& change) {
    ZipBuilder zip;
    zip.addFile("a", bytesOf("x"));
    change(zip);
    return zip.bytes();
}

GWData withZip64EndRecord() {
    return oneEntry([](ZipBuilder& zip) { zip.zip64EndRecord = true; });
}

struct HostileCase {
    const char* name;
    std::function<GWData()> bytes;
    // The entry refused for sharing bytes with another; none for corrupt ones.
    const char* overlappingEntry = nullptr;
    const char* logged = nullptr;
};

class GWZipArchiveHostile : public ::testing::TestWithParam<HostileCase> {};

TEST_P(GWZipArchiveHostile, FailsOrRecoversQuickly) {
    TemporaryDirectory directory;
    writeFile(directory.file("bad.zip"), GetParam().bytes());
    GWErrorPtr error;
    ZipLogCapture log;
    const auto started = std::chrono::steady_clock::now();
    auto archive = GWZipArchive::initWithURL(directory.url("bad.zip"), &error);
    EXPECT_LT(std::chrono::steady_clock::now() - started, std::chrono::seconds(5));
    if (const char* line = GetParam().logged) {
        EXPECT_TRUE(log.contains(line));
    }
    if (const char* entry = GetParam().overlappingEntry) {
        ASSERT_FALSE(archive);
        EXPECT_TRUE(error->is(kGWZipArchiveErrorDomain, GWZipArchiveOverlappingEntriesError))
            << error->localizedDescription();
        const GWValue* path =
            GWDictionaryValue(error->userInfo(), kGWZipArchiveUnknownEntityErrorKey);
        ASSERT_TRUE(path && path->string());
        EXPECT_EQ(*path->string(), entry);
        EXPECT_NE(error->localizedDescription().find("overlapping entries"), std::string::npos);
        return;
    }
    if (archive) {
        // A damaged directory leaves the entries its local headers describe.
        EXPECT_GT(archive->recoveredEntryCount(), 0u);
        EXPECT_FALSE(archive->files().empty());
        return;
    }
    ASSERT_TRUE(error);
    EXPECT_EQ(error->domain(), kGWCocoaErrorDomain);
    EXPECT_EQ(error->code(), GWFileReadCorruptFileError) << error->localizedDescription();
}

const HostileCase kHostileCases[] = {
    {"Empty", [] { return GWData(); }},
    {"ShorterThanAnEndRecord", [] { return GWData{'P', 'K', 3, 4, 0, 0, 0}; }},
    {"EndRecordMissing",
     [] {
         GWData bytes = sampleArchive();
         bytes.resize(bytes.size() - 22);
         return bytes;
     }},
    {"EndRecordSignatureOnlyNearTheEnd",
     [] {
         GWData bytes = sampleArchive();
         bytes.resize(bytes.size() - 4);
         return bytes;
     }},
    {"CentralSignatureBroken",
     [] {
         return patched(sampleArchive(), {'P', 'K', 1, 2}, 3, {9}, 1);
     },
     nullptr, "Couldn't read central directory record!"},
    {"MoreEntriesThanTheDirectoryHolds",
     [] { return oneEntry([](ZipBuilder& zip) { zip.endRecordEntryCount = 0xFFF0; }); }},
    {"Zip64CountOfBillions",
     [] {
         return patched(withZip64EndRecord(), {'P', 'K', 6, 6}, 24,
                        {0xFFFFFFFF, 0x0FFFFFFF, 0xFFFFFFFF, 0x0FFFFFFF});
     }},
    {"DirectoryOffsetPastTheEnd",
     [] {
         return oneEntry([](ZipBuilder& zip) { zip.endRecordCentralDirectoryOffset = 0x7FFFFFFF; });
     }},
    {"Zip64OffsetWithoutLocator",
     [] {
         return oneEntry([](ZipBuilder& zip) { zip.endRecordCentralDirectoryOffset = 0xFFFFFFFF; });
     }},
    {"Zip64LocatorPointsPastItself",
     [] {
         return patched(withZip64EndRecord(), {'P', 'K', 6, 7}, 8, {0x7FFFFFF0});
     }},
    {"Zip64RecordSignatureBroken",
     [] {
         return patched(withZip64EndRecord(), {'P', 'K', 6, 6}, 2, {0}, 1);
     },
     nullptr, "error parsing Zip64 end of central dir record"},
    {"LocalHeaderOffsetPastTheEnd",
     [] {
         return oneEntry([](ZipBuilder& zip) {
             zip.addFile("b", bytesOf("y")).centralLocalHeaderOffset = 0x7FFFFFFF;
         });
     }},
    {"LocalHeaderOffsetIntoData",
     [] {
         ZipBuilder zip;
         zip.addFile("a", bytesOf("some data that is not a header"));
         zip.addFile("b", bytesOf("y")).centralLocalHeaderOffset = 40;
         return zip.bytes();
     }},
    {"LocalNameRunsPastTheFile",
     [] {
         return patched(sampleArchive(), {'P', 'K', 3, 4}, 26, {0xFFFF}, 2);
     }},
    {"CentralNameRunsPastTheDirectory",
     [] {
         return patched(sampleArchive(), {'P', 'K', 1, 2}, 28, {0xFFFF}, 2);
     }},
    {"CentralExtraRunsPastTheDirectory",
     [] {
         return patched(sampleArchive(), {'P', 'K', 1, 2}, 30, {0xFFF0}, 2);
     }},
    {"TenThousandRecordsShareOneLocalHeader",
     [] {
         ZipBuilder zip;
         const GWData content = textBytes(4000, 3);
         zip.addFile("bomb", content, 8);
         for (int i = 0; i < 10000; ++i) {
             ZipEntry& copy = zip.addFile("copy" + std::to_string(i), content, 8);
             copy.omitLocalHeader = true;
             copy.centralLocalHeaderOffset = 0;
         }
         return zip.bytes();
     },
     "bomb"},
    {"RangesCrossInADirectoryOutOfOrder",
     [] {
         // The records name q first, then p, whose data runs over q's.
         ZipBuilder zip;
         zip.addFile("p", bytesOf("p's data")).compressedSize = 100;
         zip.addFile("q", bytesOf("q's data"));
         zip.bytes();
         zip.entries()[0].centralLocalHeaderOffset = zip.localHeaderOffsets()[1];
         zip.entries()[1].centralLocalHeaderOffset = 0;
         return zip.bytes();
     },
     "q"},
    {"MacCompanionStartsInsideItsFilesData",
     [] {
         ZipBuilder zip;
         zip.addFile("a.txt", bytesOf("a")).compressedSize = 1 + 30 + 16 + 82;
         zip.addFile("__MACOSX/._a.txt", GWData(82, 1));
         return zip.bytes();
     },
     "__MACOSX/._a.txt"},
    {"NameNoEncodingDecodes",
     [] {
         ZipBuilder zip;
         ZipEntry entry;
         // 0x81 is undefined in Windows-1252, -1250, -1253 and -1254, 0x98
         // in -1251, and a lone 0xA0 (after the pair 81 98) in Shift JIS.
         entry.name = GWData{0x81, 0x98, 0xA0};
         entry.host = kZipHostMSDOS;
         zip.add(entry);
         return zip.bytes();
     }},
};

INSTANTIATE_TEST_SUITE_P(Mutations, GWZipArchiveHostile, ::testing::ValuesIn(kHostileCases),
                         [](const auto& info) { return std::string(info.param.name); });

TEST(GWZipArchiveEmpty, AnEndRecordAloneIsAnEmptyArchiveAndNothingAtAllIsNoArchive) {
    TemporaryDirectory directory;
    for (const char* comment : {"", "made by nobody"}) {
        ZipBuilder zip;
        zip.archiveComment = bytesOf(comment);
        writeFile(directory.file("empty.zip"), zip.bytes());
        GWErrorPtr error;
        auto archive = GWZipArchive::initWithURL(directory.url("empty.zip"), &error);
        ASSERT_TRUE(archive) << error->localizedDescription();
        EXPECT_TRUE(archive->files().empty());
    }
    writeFile(directory.file("text.zip"), bytesOf("just some text, long enough to be searched"));
    GWErrorPtr error;
    EXPECT_FALSE(GWZipArchive::initWithURL(directory.url("text.zip"), &error));
    ASSERT_TRUE(error);
    EXPECT_NE(error->localizedDescription().find("is not a ZIP archive"), std::string::npos);
}

TEST(GWZipArchiveTruncation, EveryCutGivesOnlyWholeEntriesOrAnError) {
    const GWData whole = sampleArchive();
    TemporaryDirectory directory;
    ZipLogCapture log;
    for (std::size_t length = 0; length < whole.size(); ++length) {
        writeFile(directory.file("cut.zip"), GWData(whole.begin(), whole.begin() + length));
        GWErrorPtr error;
        auto archive = GWZipArchive::initWithURL(directory.url("cut.zip"), &error);
        if (!archive) {
            ASSERT_TRUE(error) << length;
            EXPECT_TRUE(error->is(kGWCocoaErrorDomain, GWFileReadCorruptFileError))
                << length << ": " << error->localizedDescription();
            continue;
        }
        const std::string out = directory.file("out" + std::to_string(length));
        EXPECT_TRUE(archive->extractFiles(archive->files(), GWURL::fileURLWithPath(out), true,
                                          nullptr, &error))
            << length << ": " << error->localizedDescription();
        if (fileExists(out + "/one.txt")) {
            EXPECT_EQ(readFile(out + "/one.txt"), bytesOf("first entry")) << length;
        }
        if (fileExists(out + "/dir/two.txt")) {
            EXPECT_EQ(readFile(out + "/dir/two.txt"), textBytes(400, 7)) << length;
        }
    }
}

// Up to `flips` random bytes changed per round: every one opens or fails
// with an error, nothing else.
void expectArchiveOrErrorAfterDamage(const GWData& whole, int rounds, int flips,
                                     std::uint32_t state) {
    TemporaryDirectory directory;
    ZipLogCapture log;
    auto next = [&state] {
        state = state * 1103515245u + 12345u;
        return state >> 8;
    };
    for (int round = 0; round < rounds; ++round) {
        GWData damaged = whole;
        for (int i = 1 + int(next() % flips); i > 0; --i) {
            damaged[next() % damaged.size()] = std::uint8_t(next());
        }
        writeFile(directory.file("damaged.zip"), damaged);
        GWErrorPtr error;
        auto archive = GWZipArchive::initWithURL(directory.url("damaged.zip"), &error);
        EXPECT_NE(bool(archive), bool(error)) << "round " << round;
    }
}

TEST(GWZipArchiveTruncation, RandomDamageEndsInAnArchiveOrAnError) {
    ZipBuilder zip;
    zip.addFile("a.txt", textBytes(300, 1), 8);
    zip.addFile("dir/b", bytesOf("b")).zip64Sizes = true;
    zip.addFile("__MACOSX/dir/._b", GWData(82, 1));
    zip.addFile("XtraStuf.mac/a.txt", GWData(20, 1));
    zip.zip64EndRecord = true;
    expectArchiveOrErrorAfterDamage(zip.bytes(), 400, 4, 12345);
}

// Directories this large are read on one thread and built into a tree on
// another: damage anywhere still ends in an archive or an error.
TEST(GWZipArchiveTruncation, DamageInALargeDirectoryEndsInAnArchiveOrAnError) {
    ZipBuilder zip;
    for (int i = 0; i < 6000; ++i) {
        zip.addFile("d" + std::to_string(i % 9) + "/f" + std::to_string(i), bytesOf("x"));
    }
    const GWData whole = zip.bytes();
    expectArchiveOrErrorAfterDamage(whole, 30, 8, 99);

    // The 4,501st central record loses its signature: its entry, and all the
    // rest, come from the local headers.
    GWData bad = whole;
    const std::uint8_t signature[] = {'P', 'K', 1, 2};
    auto record = bad.begin() + std::ptrdiff_t(find(bad, {'P', 'K', 1, 2}));
    for (int i = 0; i < 4500; ++i) {
        record = std::search(record + 1, bad.end(), std::begin(signature), std::end(signature));
    }
    record[3] = 9;
    TemporaryDirectory directory;
    ZipLogCapture log;
    writeFile(directory.file("bad.zip"), bad);
    GWErrorPtr error;
    auto recovered = GWZipArchive::initWithURL(directory.url("bad.zip"), &error);
    ASSERT_TRUE(recovered) << error->localizedDescription();
    EXPECT_EQ(recovered->recoveredEntryCount(), 6000u);
}

}  // namespace
