#include <gtest/gtest.h>

#include <algorithm>

#include "foundation/GWRemoteFileHandle.h"
#include "support/TestSupport.h"

namespace {

struct Piece {
    GWData bytes;
    bool isLast;
    GWErrorPtr error;
};

std::vector<Piece> readRange(GWRemoteFileHandle& handle, std::uint64_t offset, std::uint64_t length,
                             std::uint64_t maxBuffer) {
    std::vector<Piece> pieces;
    handle.readDataAtOffset(
        offset, length, maxBuffer,
        [&](GWRemoteFileHandle&, std::span<const std::uint8_t> piece, bool isLast,
            const GWErrorPtr& error) {
            pieces.push_back({GWData(piece.begin(), piece.end()), isLast, error});
            return true;
        });
    return pieces;
}

class GWRemoteFileHandleTest : public ::testing::Test {
protected:
    void SetUp() override {
        contents_ = gwtest::randomBytes(1500000, 3);
        gwtest::writeFile(directory_.file("data"), contents_);
        GWErrorPtr error;
        handle_ = GWRemoteFileHandle::initForReadingFromURL(directory_.url("data"), &error);
        ASSERT_TRUE(handle_);
    }

    gwtest::TemporaryDirectory directory_;
    GWData contents_;
    std::shared_ptr<GWRemoteFileHandle> handle_;
};

}  // namespace

TEST_F(GWRemoteFileHandleTest, ReadingPastTheEndGivesShortThenEmptyData) {
    ASSERT_TRUE(handle_->seekToFileOffset(contents_.size() - 10, nullptr));
    auto tail = handle_->readDataOfLength(100, nullptr);
    ASSERT_TRUE(tail);
    EXPECT_EQ(*tail, GWData(contents_.end() - 10, contents_.end()));
    EXPECT_EQ(handle_->offsetInFile(), contents_.size());
    auto empty = handle_->readDataOfLength(100, nullptr);
    ASSERT_TRUE(empty);
    EXPECT_TRUE(empty->empty());
    // A huge request is bounded by the file, not allocated as asked.
    ASSERT_TRUE(handle_->seekToFileOffset(0, nullptr));
    EXPECT_EQ(handle_->readDataOfLength(UINT64_MAX, nullptr)->size(), contents_.size());
}

TEST_F(GWRemoteFileHandleTest, ReadingIntoABufferFillsItUpToTheEnd) {
    GWData buffer(1000, 0xEE);
    auto got = handle_->readDataAtOffset(500, buffer, nullptr);
    ASSERT_TRUE(got);
    EXPECT_EQ(*got, 1000u);
    EXPECT_TRUE(std::equal(buffer.begin(), buffer.end(), contents_.begin() + 500));
    EXPECT_EQ(handle_->offsetInFile(), 1500u);
    // Short at the end, and the bytes past what came are left alone.
    buffer.assign(1000, 0xEE);
    got = handle_->readDataAtOffset(contents_.size() - 10, buffer, nullptr);
    ASSERT_TRUE(got);
    EXPECT_EQ(*got, 10u);
    EXPECT_TRUE(std::equal(buffer.begin(), buffer.begin() + 10, contents_.end() - 10));
    EXPECT_EQ(buffer[10], 0xEE);
    EXPECT_EQ(handle_->readDataAtOffset(contents_.size() + 5, buffer, nullptr), 0u);
    // Use after close is an error, not a crash.
    handle_->closeFileAndReturnError(nullptr);
    GWErrorPtr error;
    EXPECT_FALSE(handle_->readDataAtOffset(0, buffer, &error));
    EXPECT_TRUE(error);
    EXPECT_FALSE(handle_->readDataOfLength(3, &error));
    EXPECT_TRUE(error->is(kGWPOSIXErrorDomain, EBADF));
    EXPECT_FALSE(handle_->writeData(gwtest::bytesOf("x"), &error));
}

TEST_F(GWRemoteFileHandleTest, RangesArriveInPiecesWithOnlyTheLastMarkedAndNeverShort) {
    struct Row {
        std::uint64_t offset, length, maxBuffer;
        std::size_t pieces;  // 0: any number, in pieces of at least 256 KiB
        bool fails = false;
    };
    const std::uint64_t size = contents_.size();
    for (const Row& row : {Row{7, size - 7, UINT64_MAX, 0}, Row{0, 1000, 300, 4},
                           Row{5, 0, UINT64_MAX, 1}, Row{size - 100, 1000, UINT64_MAX, 0, true},
                           Row{UINT64_MAX - 5, 100, UINT64_MAX, 1, true}}) {
        SCOPED_TRACE(row.offset);
        const auto pieces = readRange(*handle_, row.offset, row.length, row.maxBuffer);
        ASSERT_FALSE(pieces.empty());
        if (row.pieces) {
            EXPECT_EQ(pieces.size(), row.pieces);
        }
        GWData joined;
        for (std::size_t i = 0; i < pieces.size(); ++i) {
            const bool last = i + 1 == pieces.size();
            EXPECT_EQ(pieces[i].isLast, last);
            EXPECT_EQ(bool(pieces[i].error), last && row.fails);
            EXPECT_TRUE(last || row.pieces || pieces[i].bytes.size() >= 256u * 1024);
            EXPECT_LE(pieces[i].bytes.size(), row.maxBuffer);
            joined.insert(joined.end(), pieces[i].bytes.begin(), pieces[i].bytes.end());
        }
        if (row.fails) {
            EXPECT_TRUE(pieces.back().error->is(kGWCocoaErrorDomain, GWFileReadCorruptFileError));
        } else {
            EXPECT_EQ(joined, GWData(contents_.begin() + std::ptrdiff_t(row.offset),
                                     contents_.begin() + std::ptrdiff_t(row.offset + row.length)));
        }
    }
    // A handler that answers false stops the reading.
    int calls = 0;
    handle_->readDataAtOffset(0, contents_.size(), 1000,
                              [&](GWRemoteFileHandle&, std::span<const std::uint8_t>, bool,
                                  const GWErrorPtr&) { return ++calls < 3; });
    EXPECT_EQ(calls, 3);
}

TEST(GWRemoteFileHandle, WritesLandAtThePositionAndAHandleWithoutURLDiscards) {
    gwtest::TemporaryDirectory directory;
    auto writer = GWRemoteFileHandle::initForWritingToURL(directory.url("out"), nullptr);
    ASSERT_TRUE(writer);
    ASSERT_TRUE(writer->writeData(gwtest::bytesOf("hello world"), nullptr));
    ASSERT_TRUE(writer->seekToFileOffset(6, nullptr));
    ASSERT_TRUE(writer->writeData(gwtest::bytesOf("there"), nullptr));
    EXPECT_TRUE(writer->closeFileAndReturnError(nullptr));
    EXPECT_EQ(gwtest::readFile(directory.file("out")), gwtest::bytesOf("hello there"));

    // Writing to an existing file starts from nothing, as O_TRUNC would.
    auto again = GWRemoteFileHandle::initForWritingToURL(directory.url("out"), nullptr);
    ASSERT_TRUE(again);
    ASSERT_TRUE(again->writeData(gwtest::bytesOf("hi"), nullptr));
    EXPECT_TRUE(again->closeFileAndReturnError(nullptr));
    EXPECT_EQ(gwtest::readFile(directory.file("out")), gwtest::bytesOf("hi"));

    auto sink = GWRemoteFileHandle::initForWritingToURL(std::nullopt, nullptr);
    ASSERT_TRUE(sink);
    EXPECT_TRUE(sink->writeData(gwtest::randomBytes(1000, 1), nullptr));
    EXPECT_EQ(sink->offsetInFile(), 1000u);
    EXPECT_TRUE(sink->closeFileAndReturnError(nullptr));
}
