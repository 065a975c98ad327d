#include <gtest/gtest.h>

#include <cerrno>

#include "foundation/GWBlockCache.h"
#include "support/TestSupport.h"

namespace {

// (offset, length) of each fetch, in order.
using Fetches = std::vector<std::pair<std::uint64_t, std::size_t>>;

// A source of known bytes that records every fetch it is asked for.
class CountingSource {
public:
    explicit CountingSource(std::size_t size) : bytes_(gwtest::randomBytes(size, 11)) {}

    GWBlockCache::Fetch fetch() {
        return [this](std::uint64_t offset, std::span<std::uint8_t> into, GWErrorPtr* error) {
            fetches.emplace_back(offset, into.size());
            if (failing || offset + into.size() > bytes_.size()) {
                return GWFail(error, GWPOSIXError(ECONNRESET));
            }
            std::copy_n(bytes_.begin() + std::ptrdiff_t(offset), into.size(), into.begin());
            return true;
        };
    }

    GWData slice(std::uint64_t offset, std::size_t length) const {
        return GWData(bytes_.begin() + std::ptrdiff_t(offset),
                      bytes_.begin() + std::ptrdiff_t(offset + length));
    }
    std::uint64_t size() const { return bytes_.size(); }

    Fetches fetches;
    bool failing = false;

private:
    GWData bytes_;
};

class GWBlockCacheTest : public ::testing::Test {
protected:
    // Reads through the cache and checks the bytes against the source.
    GWData read(std::uint64_t offset, std::size_t length) { return read(cache_, offset, length); }
    GWData read(GWBlockCache& cache, std::uint64_t offset, std::size_t length) {
        GWData into(length);
        std::size_t got = 0;
        GWErrorPtr error;
        EXPECT_TRUE(cache.read(offset, into, source_.size(), source_.fetch(), got, &error));
        into.resize(got);
        const std::size_t expected =
            offset < source_.size() ? std::min<std::uint64_t>(length, source_.size() - offset) : 0;
        EXPECT_EQ(into, source_.slice(std::min<std::uint64_t>(offset, source_.size()), expected));
        return into;
    }

    CountingSource source_{10 * 1000 + 123};
    GWBlockCache cache_{1000, 3};
};

}  // namespace

// Blocks of 1000 bytes, three kept, over a source of 10123.
TEST_F(GWBlockCacheTest, ReadsFetchOnlyWhatIsMissing) {
    const struct {
        const char* label;
        std::vector<std::pair<std::uint64_t, std::size_t>> reads;
        Fetches fetches;
    } cases[] = {
        {"small reads share their aligned block",
         {{2010, 10}, {2500, 100}, {2990, 10}},
         {{2000, 1000}}},
        {"across two blocks", {{1950, 100}, {2950, 100}}, {{1000, 2000}, {3000, 1000}}},
        {"large reads go straight through, unkept",
         {{1234, 1000}, {1234, 5000}, {1300, 10}},
         {{1234, 1000}, {1234, 5000}, {1000, 1000}}},
        // Touching block 0 makes block 1 the one to go.
        {"least recently used goes first",
         {{0, 10}, {1000, 10}, {2000, 10}, {5, 10}, {3000, 10}, {20, 10}, {1020, 10}},
         {{0, 1000}, {1000, 1000}, {2000, 1000}, {3000, 1000}, {1000, 1000}}},
        {"never past the end", {{10100, 100}, {10123, 10}, {UINT64_MAX - 5, 10}}, {{10000, 123}}},
    };
    for (const auto& c : cases) {
        SCOPED_TRACE(c.label);
        GWBlockCache cache{1000, 3};
        source_.fetches.clear();
        for (const auto& [offset, length] : c.reads) {
            read(cache, offset, length);
        }
        EXPECT_EQ(source_.fetches, c.fetches);
    }
}

TEST_F(GWBlockCacheTest, AFailedFetchIsReportedAndLeavesNothingBehind) {
    source_.failing = true;
    GWData into(10);
    std::size_t got = 99;
    GWErrorPtr error;
    EXPECT_FALSE(cache_.read(500, into, source_.size(), source_.fetch(), got, &error));
    ASSERT_TRUE(error);
    EXPECT_EQ(error->code(), ECONNRESET);
    EXPECT_EQ(got, 0u);
    source_.failing = false;
    read(500, 10);
    EXPECT_EQ(source_.fetches.size(), 2u);
}

TEST_F(GWBlockCacheTest, StoredBytesServeLaterReadsWhenTheyAreWholeBlocks) {
    cache_.store(0, source_.slice(0, 1500), source_.size());
    read(900, 100);
    EXPECT_TRUE(source_.fetches.empty());
    read(1000, 10);  // the half block after 1000 was not kept
    EXPECT_EQ(source_.fetches.size(), 1u);
    cache_.store(10000, source_.slice(10000, 123), source_.size());
    read(10050, 50);
    EXPECT_EQ(source_.fetches.size(), 1u);
}
