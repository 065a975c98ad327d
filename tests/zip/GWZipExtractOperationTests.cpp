// One entry extracted by GWZipExtractOperation: methods, kinds of entry,
// atomic and in-place writing, handlers, cancellation and local headers.

#include <gtest/gtest.h>

#include <sys/stat.h>
#include <unistd.h>
#include <filesystem>
#include <optional>

#include <cerrno>
#include <functional>

#include "GWArchiveSupport/GWArchiveConstants.h"
#include "foundation/GWFileManager.h"
#include "foundation/GWStreamPipeline.h"
#include "support/DecoderTestSupport.h"
#include "support/MetadataTestSupport.h"
#include "support/TestSupport.h"
#include "support/XarBuilder.h"
#include "support/ZipBuilder.h"
#include "support/ZipExtraFields.h"
#include "support/ZipLegacyEncoders.h"
#include "zip/GWZipArchive.h"
#include "zip/GWZipDecryption.h"
#include "zip/ZipExtractTestSupport.h"
#include "zip/ZipTestSupport.h"

namespace {

using namespace gwtest;

class GWZipExtractOperationTest : public ::testing::Test {
protected:
    TemporaryDirectory directory;
    std::string archivePath = directory.file("archive.zip");
    GWURL archiveURL = GWURL::fileURLWithPath(archivePath);

    void write(const ZipBuilder& zip) { zip.write(archivePath); }

    GWZipExtractOperationPtr toDisk(const GWZipFilePtr& file, const std::string& name,
                                    bool atomically,
                                    GWZipExtractOperation::ProgressHandler progress = nullptr) {
        GWErrorPtr error;
        auto operation = GWZipExtractOperation::initForExtractingFile(
            file, archiveURL, 0, directory.url(name), atomically, std::move(progress), &error);
        EXPECT_TRUE(operation) << (error ? error->localizedDescription() : "");
        return operation;
    }

    GWZipExtractOperationPtr toHandler(const GWZipFilePtr& file, DataHandlerLog& log,
                                       bool answer = true) {
        GWErrorPtr error;
        auto operation = GWZipExtractOperation::initForExtractingFile(file, archiveURL, 0,
                                                                      log.handler(answer), &error);
        EXPECT_TRUE(operation);
        return operation;
    }
};

// --- Compression methods -------------------------------------------------------

struct MethodCase {
    const char* label;
    std::uint16_t method;
    std::uint16_t flags;
    // A resource-fork companion, whose size the entry's total counts too.
    bool withCompanion = false;
};

class GWZipExtractMethods : public GWZipExtractOperationTest,
                            public ::testing::WithParamInterface<MethodCase> {};

TEST_P(GWZipExtractMethods, WritesTheDecodedBytes) {
    const MethodCase& c = GetParam();
    const GWData content = textBytes(300000, 17);
    ZipBuilder zip;
    ZipEntry& entry = zip.addFile("member.txt", content, c.method);
    entry.flags = c.flags;
    if (c.method == 1) {
        entry.stored = shrinkBytes(content);
    } else if (c.method == 6) {
        ImplodeSettings settings;
        settings.largeDictionary = (c.flags & 2) != 0;
        settings.literalTree = (c.flags & 4) != 0;
        entry.stored = implodeBytes(content, settings);
    } else if (c.method == 14) {
        entry.stored = zipLzmaBytes(content);
    } else if (c.method == 93) {
        entry.stored = zstdBytes(content);
    } else if (c.method == 95) {
        entry.stored = xarEncode(content, XarEncoding::xz);
    }
    if (c.withCompanion) {
        zip.addFile("XtraStuf.mac/member.txt", bytesOf("fork"));
    }
    write(zip);
    auto file = zipEntryFromBuilder(zip, 0);
    if (c.withCompanion) {
        file->setResourceFork(zipEntryFromBuilder(zip, 1));
    }
    auto operation = toDisk(file, "out.txt", true);
    runToEnd(operation);
    ASSERT_FALSE(operation->error()) << operation->error()->localizedDescription();
    EXPECT_TRUE(operation->started());
    EXPECT_TRUE(operation->done());
    EXPECT_EQ(readFile(directory.file("out.txt")), content);
}

INSTANTIATE_TEST_SUITE_P(
    EveryDecoder, GWZipExtractMethods,
    ::testing::Values(MethodCase{"Stored", 0, 0}, MethodCase{"Shrunk", 1, 0},
                      MethodCase{"ShrunkWithCompanion", 1, 0, true}, MethodCase{"Imploded", 6, 0},
                      MethodCase{"ImplodedWithCompanion", 6, 0, true},
                      MethodCase{"ImplodedLarge", 6, 2}, MethodCase{"ImplodedWithTree", 6, 4},
                      MethodCase{"ImplodedLargeWithTree", 6, 6}, MethodCase{"Deflated", 8, 0},
                      MethodCase{"Bzip2", 12, 0},
                      // The end marker is allowed, not needed, without bit 1.
                      MethodCase{"LZMA", 14, 2}, MethodCase{"LZMASized", 14, 0},
                      MethodCase{"Zstd", 93, 0}, MethodCase{"XZ", 95, 0}),
    [](const auto& info) { return std::string(info.param.label); });

// --- Encryption: archives that zip and 7zz make ---------------------------------

struct EncryptionCase {
    const char* label;
    const char* tool;
    const char* command;  // run where member.bin is; writes archive.zip
    const char* member;
};

class GWZipExtractEncrypted : public GWZipExtractOperationTest,
                              public ::testing::WithParamInterface<EncryptionCase> {};

// Each password gives the bytes or its code, and a failure leaves nothing on
// disk, atomically or in place. Fed to the pipeline in pieces of 1, 7 and
// all bytes, the decryption gives the same output.
TEST_P(GWZipExtractEncrypted, OpensWithThePasswordOnlyAndLeavesNothingOtherwise) {
    const EncryptionCase& c = GetParam();
    if (!toolAvailable(c.tool)) {
        GTEST_SKIP() << c.tool << " is not installed";
    }
    // Text that deflates, then random bytes past the 512 KiB pieces of a read.
    GWData content = textBytes(100000, 3);
    const GWData noise = randomBytes(600000, 4);
    content.insert(content.end(), noise.begin(), noise.end());
    writeFile(directory.file("member.bin"), content);
    ASSERT_EQ(runCommand("cd " + shellQuote(directory.path()) + " && " + c.command).status, 0);
    GWErrorPtr error;
    auto archive = GWZipArchive::initWithURL(archiveURL, &error);
    ASSERT_TRUE(archive) << error->localizedDescription();
    const GWZipFilePtr file = archive->fileWithPath(c.member);
    ASSERT_TRUE(file);
    EXPECT_TRUE(file->isEncrypted());

    const GWData stored = readFile(archivePath);
    const bool isAES = file->compressionMethod() == 99;
    const std::size_t headerAt = file->localHeaderOffset();
    const std::size_t dataStart = headerAt + 30 + std::string(c.member).size() +
                                  (stored[headerAt + 28] | stored[headerAt + 29] << 8);
    // The first data byte's block type turned invalid: a decoder chokes on
    // it, and the AES code still tells forgery from damage.
    const std::size_t encryptionHeader =
        isAES ? 6 + 4 * file->extraInfo().at(kGWZipAESStrengthKey).unsignedValue() : 12;
    GWData tampered = stored;
    tampered[dataStart + encryptionHeader] ^= 0x04;
    const struct {
        std::optional<std::string> password;
        bool tamper;
        long code;  // 0: extracted
    } rows[] = {{"secret", false, 0},
                {std::nullopt, false, GWZipArchivePasswordRequiredError},
                {"Secret", false, GWZipArchiveWrongPasswordError},
                {"public", false, GWZipArchiveWrongPasswordError},
                {"secret", true, isAES ? long(GWZipArchiveAuthenticationFailedError) : -1L}};
    int refusedPasswords = 0;
    for (const auto& row : rows) {
        writeFile(archivePath, row.tamper ? tampered : stored);
        // The batch's options give the password, or else the archive.
        for (bool atomically : {true, false}) {
            GWErrorPtr batchError;
            GWExtractOptions options;
            archive->setPassword(atomically ? std::nullopt : row.password);
            if (atomically) {
                options.password = row.password;
            }
            const bool extracted = archive->extractFiles({file}, directory.url("x"), atomically,
                                                         nullptr, &batchError, options);
            const std::string where = directory.file("x/") + c.member;
            SCOPED_TRACE(row.password.value_or("(none)") + (row.tamper ? " tampered" : "") +
                         (atomically ? " atomically" : " in place"));
            if (row.code == 0) {
                ASSERT_TRUE(extracted) << batchError->localizedDescription();
                EXPECT_TRUE(readFile(where) == content);
                std::filesystem::remove(where);
                continue;
            }
            ASSERT_FALSE(extracted);
            // One wrong password in 256 passes the traditional check byte and
            // fails on the data instead; two wrong ones both do once in 65536.
            const bool passedCheckByte = !isAES && row.code == GWZipArchiveWrongPasswordError &&
                                         !batchError->is(kGWZipArchiveErrorDomain, row.code);
            refusedPasswords += row.code == GWZipArchiveWrongPasswordError && !passedCheckByte;
            // A tampered traditional entry fails in the decoder or on its CRC.
            if (row.code > 0 && !passedCheckByte) {
                EXPECT_TRUE(batchError->is(kGWZipArchiveErrorDomain, row.code))
                    << batchError->localizedDescription();
                EXPECT_EQ(batchError->detailString(kGWZipArchiveUnknownEntityErrorKey), c.member);
            }
            EXPECT_FALSE(GWItemExistsAtURL(GWURL::fileURLWithPath(where)));
        }
    }

    writeFile(archivePath, stored);
    EXPECT_GT(refusedPasswords, 0);

    GWZipLocalFileHeader header;
    ASSERT_TRUE(GWZipWorkOperation().readLocalHeaderRecord(
        &header, std::span(stored).subspan(headerAt), nullptr));
    for (std::size_t piece : {std::size_t(1), std::size_t(7), stored.size()}) {
        GWData out;
        GWStreamPipeline pipeline(
            GWZipWorkOperation().decompressorForFile(file, file->dataCompressionMethod(), nullptr),
            GWStreamCheck{},
            [&](std::span<const std::uint8_t> bytes) {
                out.insert(out.end(), bytes.begin(), bytes.end());
                return true;
            },
            GWZipDecryptorForFile(*file, header, "secret", nullptr));
        const auto data = std::span(stored).subspan(dataStart, file->compressedSize());
        for (std::size_t at = 0; at < data.size(); at += piece) {
            pipeline.feed(data.subspan(at, std::min(piece, data.size() - at)),
                          at + piece >= data.size());
        }
        EXPECT_EQ(pipeline.outcome().end, GWStreamEnd::complete) << piece;
        EXPECT_TRUE(out == content) << piece;
    }
}

INSTANTIATE_TEST_SUITE_P(
    PeerArchives, GWZipExtractEncrypted,
    ::testing::Values(
        EncryptionCase{"ZipCrypto", "zip", "zip -q -e -P secret archive.zip member.bin",
                       "member.bin"},
        EncryptionCase{"ZipCryptoStored", "zip", "zip -q -0 -e -P secret archive.zip member.bin",
                       "member.bin"},
        // From a pipe: a data descriptor, and the check byte from the time.
        EncryptionCase{"ZipCryptoDescriptor", "zip",
                       "zip -q -e -P secret - - < member.bin > archive.zip", "-"},
        EncryptionCase{"AES128Deflate", "7zz",
                       "7zz a -tzip -mem=AES128 -mm=Deflate -psecret archive.zip member.bin "
                       ">/dev/null",
                       "member.bin"},
        EncryptionCase{"AES192", "7zz",
                       "7zz a -tzip -mem=AES192 -psecret archive.zip member.bin >/dev/null",
                       "member.bin"},
        EncryptionCase{"AES256Stored", "7zz",
                       "7zz a -tzip -mem=AES256 -mx=0 -psecret archive.zip member.bin >/dev/null",
                       "member.bin"}),
    [](const auto& info) { return std::string(info.param.label); });

// Strong encryption (flags 0x41) is refused the same way, whatever the method.
TEST_F(GWZipExtractOperationTest, UnsupportedMethodsAreRefusedWithTheirNumber) {
    ZipLogCapture capture;
    const std::pair<std::uint16_t, std::uint16_t> rows[] = {{2, 0},  {5, 0},      {7, 0},   {98, 0},
                                                            {99, 0}, {0xFFFF, 0}, {8, 0x41}};
    for (const auto& [method, flags] : rows) {
        ZipBuilder zip;
        zip.addFile("a.bin", bytesOf("data"), method).flags = flags;
        write(zip);
        DataHandlerLog log;
        auto operation = toHandler(zipEntryFromBuilder(zip, 0), log);
        runToEnd(operation);
        ASSERT_TRUE(operation->error());
        EXPECT_TRUE(operation->error()->is(kGWZipArchiveErrorDomain,
                                           GWZipArchiveUnsupportedCompressionMethodError));
        if (flags == 0) {
            EXPECT_EQ(operation->error()->detailString(kGWZipArchiveUnknownEntityErrorKey),
                      std::to_string(method));
            EXPECT_TRUE(
                capture.contains("unsupported compression method: " + std::to_string(method)));
        }
        // The handler hears of the failure once, with no data.
        ASSERT_EQ(log.doneFlags.size(), 1u);
        EXPECT_TRUE(log.doneFlags[0] && !log.hadData[0]);
        EXPECT_EQ(log.errors[0], operation->error());
    }
    // Shrink and implode need the entry's size and flags.
    for (std::uint16_t method : {1, 6}) {
        GWErrorPtr error;
        EXPECT_EQ(GWZipWorkOperation().decompressorForFile(nullptr, method, &error), nullptr);
        ASSERT_NE(error, nullptr);
        EXPECT_TRUE(error->is(kGWPOSIXErrorDomain, EINVAL));
    }
}

// --- Integrity: what is written is what the archive holds, or an error --------

struct IntegrityCase {
    const char* label;
    std::uint16_t method;
    GWData content;
    std::function<void(ZipEntry&)> damage;
    const char* domain;
    long code;
    // The most bytes a data handler may see before the error.
    std::size_t maxDelivered;
};

void encodeLegacy(ZipEntry& entry) {
    if (entry.method == 1) {
        entry.stored = shrinkBytes(entry.content);
    } else if (entry.method == 6) {
        entry.stored = implodeBytes(entry.content, ImplodeSettings{});
    }
}

const std::vector<IntegrityCase>& integrityCases() {
    const auto wrongCRC = [](ZipEntry& entry) {
        encodeLegacy(entry);
        entry.crc32 = entry.effectiveCRC32() ^ 0x00010000u;
    };
    // A small declared size over a large stream: the shape of a zip bomb.
    const auto lyingSize = [](ZipEntry& entry) { entry.uncompressedSize = 100; };
    const auto claims10 = [](ZipEntry& entry) { entry.uncompressedSize = 10; };
    static const std::vector<IntegrityCase> cases = {
        {"StoredBadCRC", 0, textBytes(70000, 3), wrongCRC, kGWZipArchiveErrorDomain, 5, 70000},
        {"DeflatedBadCRC", 8, textBytes(70000, 3), wrongCRC, kGWZipArchiveErrorDomain, 5, 70000},
        {"Bzip2BadCRC", 12, textBytes(70000, 3), wrongCRC, kGWZipArchiveErrorDomain, 5, 70000},
        {"ShrunkBadCRC", 1, textBytes(70000, 3), wrongCRC, kGWZipArchiveErrorDomain, 5, 70000},
        {"ImplodedBadCRC", 6, textBytes(70000, 3), wrongCRC, kGWZipArchiveErrorDomain, 5, 70000},
        {"EmptyWithACRC", 0, {}, [](ZipEntry& e) { e.crc32 = 1; }, kGWZipArchiveErrorDomain, 5, 0},
        {"ShortStored", 0, textBytes(5000, 4), [](ZipEntry& e) { e.uncompressedSize = 6000; },
         kGWZipArchiveErrorDomain, 6, 5000},
        {"EmptyWithASize", 0, {}, claims10, kGWZipArchiveErrorDomain, 6, 0},
        {"DeflateBomb", 8, GWData(8 << 20, 0), lyingSize, kGWZipArchiveErrorDomain, 6, 100},
        {"Bzip2Bomb", 12, GWData(8 << 20, 0), lyingSize, kGWZipArchiveErrorDomain, 6, 100},
        {"CorruptDeflate", 8, textBytes(5000, 1),
         [](ZipEntry& e) { e.stored = GWData{0xFF, 0xFF, 0xFF, 0xFF, 0xFF, 0xFF}; },
         kGWCocoaErrorDomain, GWFileReadCorruptFileError, 0},
    };
    return cases;
}

class GWZipExtractIntegrity : public GWZipExtractOperationTest,
                              public ::testing::WithParamInterface<IntegrityCase> {
protected:
    GWZipFilePtr build() {
        const IntegrityCase& c = GetParam();
        ZipBuilder zip;
        ZipEntry& entry = zip.addFile("member", c.content, c.method);
        c.damage(entry);
        write(zip);
        return zipEntryFromBuilder(zip, 0);
    }
    void expectFailure(const GWErrorPtr& error) {
        const IntegrityCase& c = GetParam();
        ASSERT_TRUE(error);
        EXPECT_TRUE(error->is(c.domain, c.code)) << error->localizedDescription();
        if (c.domain == std::string(kGWZipArchiveErrorDomain)) {
            EXPECT_EQ(error->detailString(kGWZipArchiveUnknownEntityErrorKey), "member");
        }
    }
};

TEST_P(GWZipExtractIntegrity, TheHandlerHearsTheErrorLastAndNoMoreThanTheDeclaredSize) {
    DataHandlerLog log;
    auto operation = toHandler(build(), log);
    runToEnd(operation);
    expectFailure(operation->error());
    EXPECT_LE(log.bytes.size(), GetParam().maxDelivered);
    ASSERT_FALSE(log.doneFlags.empty());
    EXPECT_TRUE(log.doneFlags.back());
    EXPECT_EQ(log.errors.back(), operation->error());
}

TEST_P(GWZipExtractIntegrity, NothingIsLeftOnDiskAtomicallyOrInPlace) {
    const GWZipFilePtr file = build();
    for (bool atomically : {true, false}) {
        auto operation = toDisk(file, "out", atomically);
        runToEnd(operation);
        expectFailure(operation->error());
        EXPECT_FALSE(GWItemExistsAtURL(directory.url("out"))) << "atomically " << atomically;
    }
}

INSTANTIATE_TEST_SUITE_P(EveryCheck, GWZipExtractIntegrity, ::testing::ValuesIn(integrityCases()),
                         [](const auto& info) { return std::string(info.param.label); });

// --- Kinds of entry ------------------------------------------------------------

// An empty file needs no handler call, a directory reports one empty final
// chunk, and a link takes its target from the data.
TEST_F(GWZipExtractOperationTest, EmptyFilesDirectoriesAndLinksAreMadeFromTheirEntries) {
    ZipBuilder zip;
    zip.addFile("empty", {});
    zip.addDirectory("folder/");
    zip.addSymlink("relative", "../sibling/file");
    zip.addSymlink("absolute", "/etc/hostname");
    write(zip);
    ProgressLog progress;
    auto operation = toDisk(zipEntryFromBuilder(zip, 0), "empty", false, progress.handler());
    runToEnd(operation);
    ASSERT_FALSE(operation->error());
    EXPECT_EQ(progress.calls, 0u);
    struct stat status {};
    ASSERT_EQ(::stat(directory.file("empty").c_str(), &status), 0);
    EXPECT_TRUE(S_ISREG(status.st_mode) && status.st_size == 0);

    auto folder = zipEntryFromBuilder(zip, 1);
    DataHandlerLog log;
    runToEnd(toHandler(folder, log));
    ASSERT_EQ(log.doneFlags.size(), 1u);
    EXPECT_TRUE(log.doneFlags[0] && log.hadData[0] && log.bytes.empty());
    operation = toDisk(folder, "deep/er/folder", false);
    runToEnd(operation);
    ASSERT_FALSE(operation->error());
    ASSERT_EQ(::stat(directory.file("deep/er/folder").c_str(), &status), 0);
    EXPECT_TRUE(S_ISDIR(status.st_mode));

    for (std::size_t i : {2, 3}) {
        auto entry = zipEntryFromBuilder(zip, i);
        const std::string expected = i == 2 ? "../sibling/file" : "/etc/hostname";
        EXPECT_FALSE(entry->symlinkDestination());
        operation = toDisk(entry, "links/" + entry->name(), true);
        runToEnd(operation);
        ASSERT_FALSE(operation->error()) << operation->error()->localizedDescription();
        EXPECT_EQ(std::filesystem::read_symlink(directory.file("links/" + entry->name())),
                  expected);
        EXPECT_EQ(entry->symlinkDestination(), expected);
    }
}

TEST_F(GWZipExtractOperationTest, WhatIsAlreadyThereIsMergedReplacedOrKept) {
    const struct {
        const char* name;
        bool directoryEntry;
        bool atomically;
        std::optional<bool> replace;
        bool existingIsDirectory;
        int expectedError;  // 0: extracted
    } cases[] = {
        {"atomic file keeps a file", false, true, std::nullopt, false, EEXIST},
        {"atomic file replaces when asked", false, true, true, false, 0},
        {"atomic file replaces a directory when asked", false, true, true, true, 0},
        {"in-place file replaces", false, false, std::nullopt, true, 0},
        {"in-place file keeps when told", false, false, false, false, EEXIST},
        {"directory merges in place", true, false, std::nullopt, true, 0},
        {"directory merges atomically", true, true, true, true, 0},
    };
    ZipBuilder zip;
    zip.addFile("a", bytesOf("new"));
    zip.addDirectory("a/");
    write(zip);
    for (const auto& row : cases) {
        std::filesystem::remove_all(directory.file("a"));
        if (row.existingIsDirectory) {
            ::mkdir(directory.file("a").c_str(), 0755);
            writeFile(directory.file("a/mine"), bytesOf("old"));
        } else {
            writeFile(directory.file("a"), bytesOf("old"));
        }
        auto operation =
            toDisk(zipEntryFromBuilder(zip, row.directoryEntry ? 1 : 0), "a", row.atomically);
        operation->setReplacesExistingItems(row.replace);
        runToEnd(operation);
        const std::string kept = row.existingIsDirectory ? "a/mine" : "a";
        if (row.expectedError != 0) {
            ASSERT_TRUE(operation->error()) << row.name;
            EXPECT_TRUE(operation->error()->is(kGWPOSIXErrorDomain, row.expectedError)) << row.name;
            EXPECT_EQ(readFile(directory.file(kept)), bytesOf("old")) << row.name;
        } else if (row.directoryEntry) {
            ASSERT_FALSE(operation->error()) << row.name;
            EXPECT_EQ(readFile(directory.file(kept)), bytesOf("old")) << row.name;
        } else {
            ASSERT_FALSE(operation->error()) << row.name;
            EXPECT_EQ(readFile(directory.file("a")), bytesOf("new")) << row.name;
        }
    }
}

// --- Handlers and cancellation ----------------------------------------------------

// Several pieces of output: the handler gets them all with one done call
// last, and progress deltas add up to the entry's size.
TEST_F(GWZipExtractOperationTest, HandlersGetTheExactBytesAndProgressAddsUp) {
    const GWData content = randomBytes(3 * 1024 * 1024 + 5, 9);
    ZipBuilder zip;
    zip.addFile("big.bin", content, 8);
    zip.addFile("a.txt", textBytes(2 * 1024 * 1024 + 77, 5), 12);
    write(zip);
    DataHandlerLog log;
    auto operation = toHandler(zipEntryFromBuilder(zip, 0), log);
    runToEnd(operation);
    ASSERT_FALSE(operation->error());
    EXPECT_EQ(log.bytes, content);
    ASSERT_GE(log.doneFlags.size(), 2u);
    EXPECT_TRUE(log.doneFlags.back());
    EXPECT_EQ(std::count(log.doneFlags.begin(), log.doneFlags.end(), true), 1);
    EXPECT_FALSE(fileExists(directory.file("big.bin")));

    // Written atomically, the file appears only once its data is complete.
    std::uint64_t total = 0;
    std::size_t calls = 0;
    bool seenEarly = false;
    operation = toDisk(zipEntryFromBuilder(zip, 1), "a.txt", true, [&](std::uint64_t count) {
        total += count;
        ++calls;
        seenEarly = seenEarly || fileExists(directory.file("a.txt"));
        return true;
    });
    runToEnd(operation);
    ASSERT_FALSE(operation->error());
    EXPECT_EQ(total, 2u * 1024 * 1024 + 77);
    EXPECT_GE(calls, 2u);
    EXPECT_FALSE(seenEarly);
    EXPECT_EQ(readFile(directory.file("a.txt")), textBytes(2 * 1024 * 1024 + 77, 5));
}

TEST_F(GWZipExtractOperationTest, AProgressHandlerAnsweringFalseOrCancelStopsAndLeavesNothing) {
    ZipBuilder zip;
    zip.addFile("a.txt", textBytes(100000, 2), 8);
    write(zip);
    ProgressLog progress;
    auto operation = toDisk(zipEntryFromBuilder(zip, 0), "a.txt", true, progress.handler(false));
    runToEnd(operation);
    ASSERT_TRUE(operation->error());
    EXPECT_TRUE(operation->error()->is(kGWCocoaErrorDomain, GWUserCancelledError));
    EXPECT_TRUE(operation->isCancelled());
    EXPECT_EQ(progress.calls, 1u);
    EXPECT_FALSE(fileExists(directory.file("a.txt")));

    operation = toDisk(zipEntryFromBuilder(zip, 0), "sub/a.txt", false);
    operation->cancel();
    runToEnd(operation);
    EXPECT_TRUE(operation->done());
    EXPECT_TRUE(operation->isFinished());
    EXPECT_FALSE(fileExists(directory.file("sub")));
}

// --- Local headers -----------------------------------------------------------------

TEST_F(GWZipExtractOperationTest, ShortOrForeignLocalHeadersAreCorruptAndLogged) {
    ZipBuilder zip;
    zip.prefix = GWData(64, 0);
    zip.addFile("a.txt", bytesOf("abc"));
    write(zip);
    const GWData bytes = zip.bytes();
    const GWData exact(bytes.begin() + 64, bytes.begin() + 64 + 30);
    GWZipLocalFileHeader record;
    GWZipWorkOperation reader;
    EXPECT_TRUE(reader.readLocalHeaderRecord(&record, exact, nullptr));
    std::vector<GWData> bad = {GWData(exact.begin(), exact.end() - 1), {}};
    for (std::size_t i = 0; i < 4; ++i) {
        bad.push_back(exact);
        bad.back()[i] ^= 0x20;
    }
    for (const GWData& header : bad) {
        GWErrorPtr error;
        EXPECT_FALSE(reader.readLocalHeaderRecord(&record, header, &error));
        ASSERT_NE(error, nullptr);
        EXPECT_TRUE(error->is(kGWCocoaErrorDomain, GWFileReadCorruptFileError));
    }

    auto entry = zipEntryFromBuilder(zip, 0);
    entry->setLocalHeaderOffset(entry->localHeaderOffset() + 1);
    ZipLogCapture capture;
    DataHandlerLog log;
    GWErrorPtr error;
    auto operation =
        GWZipExtractOperation::initForExtractingFile(entry, archiveURL, 64, log.handler(), &error);
    runToEnd(operation);
    ASSERT_TRUE(operation->error());
    EXPECT_TRUE(operation->error()->is(kGWCocoaErrorDomain, GWFileReadCorruptFileError));
    EXPECT_TRUE(capture.contains("error reading local record for file a.txt"));
}

// The local header's name and times replace the central ones, and the mode
// and the refreshed time reach the file; a data descriptor's zeroed local
// sizes and CRC leave the central ones alone.
TEST_F(GWZipExtractOperationTest, ALocalHeaderWithMoreInfoRefreshesTheEntry) {
    ZipBuilder zip;
    ZipEntry& entry = zip.addFile("central.txt", bytesOf("hello"), 8);
    entry.externalAttributes = 0100751u << 16;
    entry.localName = bytesOf("dir/local.txt");
    entry.centralExtra = zipExtraBlock(0x5455, extendedTimestampPayload(1, {1000}));
    entry.localExtra = zipExtraBlock(0x5455, extendedTimestampPayload(3, {2000000000, 3000}));
    ZipEntry& described = zip.addFile("a.txt", textBytes(4000, 8), 8);
    described.dataDescriptor = true;
    described.centralExtra = zipExtraBlock(0x5455, extendedTimestampPayload(1, {1000}));
    write(zip);
    auto file = zipEntryFromBuilder(zip, 0);
    ASSERT_TRUE(file->moreInfoAvailableInLocalHeader());
    file->setUncompressedSize(999);
    auto operation = toDisk(file, "out.txt", true);
    runToEnd(operation);
    ASSERT_FALSE(operation->error());
    EXPECT_EQ(file->name(), "local.txt");
    EXPECT_EQ(file->storedUncompressedSize(), 5u);
    EXPECT_FALSE(file->moreInfoAvailableInLocalHeader());
    ASSERT_TRUE(file->modificationDate());
    EXPECT_EQ(file->modificationDate()->timeIntervalSince1970(), 2000000000);
    struct stat status {};
    ASSERT_EQ(::stat(directory.file("out.txt").c_str(), &status), 0);
    EXPECT_EQ(status.st_mtim.tv_sec, 2000000000);
    EXPECT_EQ(status.st_mode & 07777, 0751u);

    file = zipEntryFromBuilder(zip, 1);
    const auto checksum = file->privateUncompressedChecksum();
    const auto compressed = file->compressedSize();
    DataHandlerLog log;
    runToEnd(toHandler(file, log));
    EXPECT_EQ(log.bytes, textBytes(4000, 8));
    EXPECT_EQ(file->privateUncompressedChecksum(), checksum);
    EXPECT_EQ(file->compressedSize(), compressed);
    EXPECT_EQ(file->storedUncompressedSize(), 4000u);
}

}  // namespace
