#include <gtest/gtest.h>
#include <zlib.h>

#include <filesystem>
#include <functional>
#include <random>

#include "foundation/GWByteReader.h"
#include "foundation/GWDecompressor.h"
#include "foundation/decoders/GWStreamDecoder.h"
#include "support/DecoderTestSupport.h"
#include "support/TestSupport.h"
#include "support/ZipLegacyEncoders.h"

namespace {

constexpr std::uint16_t kShrunk = 1;
constexpr std::uint16_t kImploded = 6;

using gwtest::ImplodeSettings;

const ImplodeSettings kImplodeSettings[] = {
    {false, false}, {false, true}, {true, false}, {true, true}};

std::shared_ptr<GWDecompressor> makeDecompressor(std::uint16_t method, std::uint16_t flags,
                                                 std::uint64_t size) {
    if (method == kShrunk) {
        return GWDecompressor::initForUnshrinkStreamingWithUncompressedSize(size, nullptr);
    }
    return GWDecompressor::initForExplodeStreamingWithUncompressedSize(size, flags & 2, flags & 4,
                                                                       nullptr);
}

std::optional<GWData> decodeInPieces(std::uint16_t method, std::uint16_t flags,
                                     std::span<const std::uint8_t> stored, std::uint64_t size,
                                     std::size_t pieceSize, GWErrorPtr* error = nullptr) {
    auto decompressor = makeDecompressor(method, flags, size);
    return gwtest::decodeInPieces(*decompressor, stored, pieceSize, error);
}

// Shrink codes, least significant bit first, starting at nine bits and
// following the 256, 1 announcements.
GWData shrinkCodes(std::initializer_list<unsigned> codes) {
    GWData bytes;
    std::uint64_t buffer = 0;
    unsigned count = 0, size = 9;
    bool afterControl = false;
    for (unsigned code : codes) {
        buffer |= std::uint64_t(code) << count;
        for (count += size; count >= 8; count -= 8, buffer >>= 8) {
            bytes.push_back(std::uint8_t(buffer));
        }
        if (afterControl && code == 1) {
            size = std::min(size + 1, 13u);
        }
        afterControl = !afterControl && code == 256;
    }
    if (count > 0) {
        bytes.push_back(std::uint8_t(buffer));
    }
    return bytes;
}

// Records with counters, short runs of zeros and long ones, and text: matches
// of every length at every distance.
GWData binaryBytes(std::size_t count, std::uint32_t seed) {
    std::mt19937 generator(seed);
    GWData bytes;
    std::uint32_t counter = 0;
    while (bytes.size() < count) {
        switch (generator() % 4) {
            case 0:
                for (int i = 0; i < 4; ++i) {
                    bytes.push_back(std::uint8_t(counter >> (8 * i)));
                }
                counter += generator() % 3;
                break;
            case 1: bytes.insert(bytes.end(), generator() % 700, 0); break;
            case 2: {
                const GWData words = gwtest::textBytes(generator() % 60, generator());
                bytes.insert(bytes.end(), words.begin(), words.end());
                break;
            }
            default: bytes.push_back(std::uint8_t(generator()));
        }
    }
    bytes.resize(count);
    return bytes;
}

std::vector<GWData> sampleInputs() {
    return {GWData{},
            GWData{'x'},
            GWData(1500, 'a'),
            gwtest::textBytes(300000, 1),
            binaryBytes(200000, 2),
            gwtest::randomBytes(100000, 3)};
}

// A member of a ZIP archive with what decoding it takes.
struct ArchiveMember {
    std::string name;
    std::uint16_t method = 0;
    std::uint16_t flags = 0;
    std::uint32_t crc = 0;
    std::uint32_t uncompressedSize = 0;
    std::span<const std::uint8_t> stored;
};

// The sample archives carry no data descriptors, so walking the local headers
// from the start reaches every member.
std::vector<ArchiveMember> readMembers(const GWData& archive, std::string& failure) {
    GWByteReader reader(archive);
    std::vector<ArchiveMember> members;
    while (reader.remaining() >= 4 && reader.u32le() == 0x04034B50) {
        ArchiveMember member;
        reader.skip(2);
        member.flags = reader.u16le();
        member.method = reader.u16le();
        reader.skip(4);
        member.crc = reader.u32le();
        const std::uint32_t compressedSize = reader.u32le();
        member.uncompressedSize = reader.u32le();
        const unsigned nameLength = reader.u16le(), extraLength = reader.u16le();
        member.name = reader.string(nameLength);
        reader.skip(extraLength);
        member.stored = reader.bytes(compressedSize);
        members.push_back(member);
    }
    failure = reader.failureDescription();
    return reader.ok() ? members : std::vector<ArchiveMember>();
}

// A stream of one method and setting, with its encoder.
struct Subject {
    std::uint16_t method, flags;
    std::function<GWData(const GWData&)> encode;
};

// Shrink clearing at 9 bits (partial clears) and at 13, and every implode setting.
std::vector<Subject> everySubject() {
    std::vector<Subject> subjects;
    for (unsigned clearing : {9u, 13u}) {
        subjects.push_back({kShrunk, 0, [clearing](const GWData& input) {
                                return gwtest::shrinkBytes(input, {clearing});
                            }});
    }
    for (const ImplodeSettings& settings : kImplodeSettings) {
        subjects.push_back({kImploded, settings.flags(), [settings](const GWData& input) {
                                return gwtest::implodeBytes(input, settings);
                            }});
    }
    return subjects;
}

void expectCorrupt(std::uint16_t method, std::uint16_t flags, const GWData& stream,
                   const char* message) {
    SCOPED_TRACE(message);
    GWErrorPtr error;
    EXPECT_FALSE(decodeInPieces(method, flags, stream, 100, 1, &error));
    ASSERT_TRUE(error);
    EXPECT_TRUE(error->is(kGWCocoaErrorDomain, GWFileReadCorruptFileError));
    EXPECT_NE(error->localizedDescription().find(message), std::string::npos)
        << error->localizedDescription();
}

std::string sampleFolder() {
    return GW_SHARED_TESTDATA_DIR "/pkzip";
}

}  // namespace

TEST(GWLegacyDecoders, RoundTripInPiecesOfAnySize) {
    for (const Subject& subject : everySubject()) {
        for (const GWData& input : sampleInputs()) {
            const GWData stored = subject.encode(input);
            for (std::size_t pieceSize : {1, 13, 0}) {
                if (pieceSize == 1 && stored.size() > 100000) {
                    continue;
                }
                GWErrorPtr error;
                auto output = decodeInPieces(subject.method, subject.flags, stored, input.size(),
                                             pieceSize, &error);
                ASSERT_TRUE(output) << subject.method << "/" << subject.flags << ": "
                                    << error->localizedDescription();
                EXPECT_TRUE(*output == input)
                    << subject.method << "/" << subject.flags << ", " << input.size()
                    << " bytes in pieces of " << pieceSize;
            }
        }
    }
    // Full tables clear, codes reach 13 bits, and output runs over several calls.
    const GWData random = gwtest::randomBytes(400000, 21);
    gwtest::ShrinkStats stats;
    const GWData shrunk = gwtest::shrinkBytes(random, {}, &stats);
    EXPECT_EQ(stats.largestCodeSize, 13u);
    EXPECT_GT(stats.partialClears, 3);
    EXPECT_TRUE(decodeInPieces(kShrunk, 0, shrunk, random.size(), 4096) == random);
    const GWData text = gwtest::textBytes(3 * 1024 * 1024, 22);
    const ImplodeSettings settings{true, true};
    EXPECT_TRUE(decodeInPieces(kShrunk, 0, gwtest::shrinkBytes(text), text.size(), 13) == text);
    EXPECT_TRUE(decodeInPieces(kImploded, settings.flags(), gwtest::implodeBytes(text, settings),
                               text.size(), 0) == text);
}

TEST(GWLegacyDecoders, HandMadeStreamsDecodeOrNameTheirDamage) {
    // A code may run through the slot that its own arrival completes: after a
    // partial clear freed the previous code, the entry built on it went to a lower
    // slot, and the freed slot is the next to be filled. Codes: "a", "b", "c",
    // "bc", clear (frees 257 to 259), "x" (257 becomes 258 + "x"), then 257 runs
    // through 258, which this very code defines as "x" + "x". unzip and 7zz agree.
    auto output =
        decodeInPieces(kShrunk, 0, shrinkCodes({'a', 'b', 'c', 258, 256, 2, 'x', 257}), 9, 1);
    EXPECT_EQ(gwtest::hex(output.value_or(GWData())), gwtest::hex(gwtest::bytesOf("abcbcxxxx")));
    // Matches before the first byte read zeros.
    const ImplodeSettings small{false, false};
    output = decodeInPieces(
        kImploded, small.flags(),
        gwtest::implodeTokenStream({{0, 5, 4000}, {'a', 0, 0}, {0, 3, 1}, {0, 2, 10}}, small), 11,
        0);
    EXPECT_EQ(gwtest::hex(output.value_or(GWData())), "0000000000616161610000");

    // Explode tables are lengths first, then distances. 0xF5 is a run of 16
    // six-bit codes, so four of them make a complete table of 64.
    const struct {
        std::uint16_t method, flags;
        GWData stream;
        const char* message;
    } cases[] = {
        {kShrunk, 0, shrinkCodes({'A', 300}), "shrink code 300 refers to a free slot"},
        {kShrunk, 0, shrinkCodes({257}), "the shrunk stream begins with code 257"},
        {kShrunk, 0, shrinkCodes({'A', 256, 3}), "unknown shrink control code 256, 3"},
        {kShrunk, 0, shrinkCodes({'A', 'B'}), "the shrunk stream ends early"},
        // The clear frees 257 and 258; 257 is the next slot, 258 is not.
        {kShrunk, 0, shrinkCodes({'a', 'b', 'c', 256, 2, 258}),
         "shrink code 258 refers to a free slot"},
        // The clear frees 257 to 260; 257 is then built on the freed 259.
        {kShrunk, 0, shrinkCodes({'a', 'b', 'c', 'd', 259, 256, 2, 'x', 257}),
         "shrink code 257 is built on a free slot"},
        // Sizes 9 to 13 are four steps; a fifth is one too many.
        {kShrunk, 0, shrinkCodes({'A', 256, 1, 256, 1, 256, 1, 256, 1, 256, 1}), "beyond 13 bits"},
        {kImploded,
         0,
         {0x03, 0xF0, 0xF0, 0xF0, 0xF0},
         "invalid Shannon-Fano tree for length codes"},
        {kImploded,
         0,
         {0x04, 0xF5, 0xF5, 0xF5, 0xF5, 0x05},
         "invalid Shannon-Fano tree for length codes"},
        {kImploded, 0, {0x02, 0xF5, 0xF5, 0xF5}, "invalid Shannon-Fano tree for length codes"},
        {kImploded,
         0,
         {0x03, 0xF5, 0xF5, 0xF5, 0xF5, 0x03, 0xF5, 0xF5, 0xF5, 0xE5, 0x00},
         "invalid Shannon-Fano tree for distance codes"},
        {kImploded, 0, {0x03, 0xF5, 0xF5, 0xF5}, "the imploded stream ends inside its code tables"},
        // Seven-bit lengths leave half the codes unused; all-ones is one of them.
        {kImploded,
         0,
         {0x03, 0xF6, 0xF6, 0xF6, 0xF6, 0x03, 0xF6, 0xF6, 0xF6, 0xF6, 0xFE, 0xFF, 0xFF},
         "invalid Shannon-Fano code"},
        {kImploded,
         0,
         {0x03, 0xF5, 0xF5, 0xF5, 0xF5, 0x03, 0xF5, 0xF5, 0xF5, 0xF5, 0x01},
         "the imploded stream ends early"},
        // With the literal tree the first table has 256 entries.
        {kImploded, 4, {0x03, 0xF5, 0xF5, 0xF5, 0xF5}, "for literal codes"},
    };
    for (const auto& c : cases) {
        expectCorrupt(c.method, c.flags, c.stream, c.message);
    }
}

TEST(GWLegacyDecoders, OutputStopsAtTheExpectedSize) {
    const GWData input = gwtest::textBytes(50000, 31);
    const ImplodeSettings settings{true, false};
    for (const auto& [method, flags, stored] :
         {std::tuple(kShrunk, std::uint16_t(0), gwtest::shrinkBytes(input)),
          std::tuple(kImploded, settings.flags(), gwtest::implodeBytes(input, settings))}) {
        for (std::uint64_t size : {std::uint64_t(0), std::uint64_t(1), std::uint64_t(49999)}) {
            auto output = decodeInPieces(method, flags, stored, size, 13);
            ASSERT_TRUE(output) << method << " " << size;
            EXPECT_TRUE(GWData(input.begin(), input.begin() + std::ptrdiff_t(size)) == *output);
        }
        GWErrorPtr error;
        EXPECT_FALSE(decodeInPieces(method, flags, stored, input.size() + 1, 13, &error));
        ASSERT_TRUE(error);
        EXPECT_NE(error->localizedDescription().find("ends early"), std::string::npos);
        // Nothing at all is a valid stream of nothing.
        auto empty = decodeInPieces(method, flags, {}, 0, 0);
        ASSERT_TRUE(empty);
        EXPECT_TRUE(empty->empty());
    }
}

// The engines themselves, given an output span of a few bytes per call: a
// match or string longer than the span must be held back, not lost.
TEST(GWLegacyDecoders, EnginesHoldBackOutputForSmallSpans) {
    const GWData input = binaryBytes(60000, 41);
    const ImplodeSettings settings{true, true};
    const GWData streams[] = {gwtest::shrinkBytes(input), gwtest::implodeBytes(input, settings)};
    for (int which = 0; which < 2; ++which) {
        for (std::size_t span : {1, 7}) {
            auto engine = which == 0 ? GWMakeUnshrinkDecoder(input.size())
                                     : GWMakeExplodeDecoder(input.size(), true, true);
            std::span<const std::uint8_t> pending = streams[which];
            GWData output;
            std::uint8_t room[7];
            bool finished = false;
            for (std::size_t calls = 0; !finished && calls < 10 * input.size(); ++calls) {
                const auto step = engine->decode(pending, std::span(room, span), true);
                ASSERT_FALSE(step.failed) << step.error;
                ASSERT_TRUE(step.consumed > 0 || step.produced > 0 || step.finished);
                pending = pending.subspan(step.consumed);
                output.insert(output.end(), room, room + step.produced);
                finished = step.finished;
            }
            EXPECT_TRUE(finished);
            EXPECT_TRUE(output == input) << which << " span " << span;
        }
    }
}

TEST(GWLegacyDecoders, DamagedStreamsEndInAnErrorOrAShortResult) {
    const GWData input = binaryBytes(30000, 51);
    std::mt19937 generator(20240601);
    for (const Subject& subject : everySubject()) {
        const GWData encoded = subject.encode(input);
        const std::span<const std::uint8_t> stored = encoded;
        for (std::size_t cut = 0; cut < stored.size(); cut += stored.size() / 97 + 1) {
            GWErrorPtr error;
            EXPECT_FALSE(decodeInPieces(subject.method, subject.flags, stored.first(cut),
                                        input.size(), 13, &error))
                << subject.method << " cut at " << cut;
        }
        int refused = 0;
        for (int flip = 0; flip < 300; ++flip) {
            GWData damaged = encoded;
            damaged[generator() % damaged.size()] ^= std::uint8_t(1u << (generator() % 8));
            auto output = decodeInPieces(subject.method, subject.flags, damaged, input.size(),
                                         1 + generator() % 4000);
            refused += !output;
            if (output) {
                EXPECT_EQ(output->size(), input.size());
            }
        }
        EXPECT_GT(refused, 0) << subject.method << " " << subject.flags;
        for (int noise = 0; noise < 50; ++noise) {
            const GWData garbage = gwtest::randomBytes(1 + generator() % 3000, generator());
            auto output = decodeInPieces(subject.method, subject.flags, garbage, 100000, 512);
            EXPECT_TRUE(!output || output->size() == 100000);
        }
    }
}

// PKZIP's own archives: what it stored decodes to the CRC it recorded.
TEST(GWLegacyDecoders, PKZIPArchivesDecodeToTheirRecordedCRC) {
    if (!std::filesystem::is_directory(sampleFolder())) {
        GTEST_SKIP() << sampleFolder() << " is absent";
    }
    int decoded[7] = {};
    for (const char* name : {"PKZ110.ZIP", "PKZ110EI.ZIP", "PKZ110ES.ZIP", "PKZ80B1.ZIP"}) {
        const std::string path = sampleFolder() + "/" + name;
        const GWData archive = gwtest::readFile(path);
        std::string failure;
        const auto members = readMembers(archive, failure);
        ASSERT_FALSE(members.empty()) << name << ": " << failure;
        for (const ArchiveMember& member : members) {
            if (member.method != kShrunk && member.method != kImploded) {
                continue;
            }
            SCOPED_TRACE(std::string(name) + " " + member.name);
            GWErrorPtr error;
            auto output = decodeInPieces(member.method, member.flags, member.stored,
                                         member.uncompressedSize, 997, &error);
            ASSERT_TRUE(output) << error->localizedDescription();
            EXPECT_EQ(crc32(0, output->data(), uInt(output->size())), member.crc);
            ++decoded[member.method];
        }
    }
    // Eight shrunk members in PKZ110ES, one each in PKZ110 and PKZ80B1; seven
    // imploded members in PKZ110 and in PKZ110EI.
    EXPECT_EQ(decoded[kShrunk], 10);
    EXPECT_EQ(decoded[kImploded], 14);
}
