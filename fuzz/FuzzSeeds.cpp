// Writes the seed corpus of every fuzz target into DIRECTORY/<target>/,
// made with the archive builders the tests use, so each target starts from
// inputs that reach deep into its parser.

#include <openssl/evp.h>
#include <openssl/hmac.h>
#include <sys/stat.h>
#include <zlib.h>

#include <cstdio>
#include <cstring>
#include <string>
#include <vector>

#include "support/AppleDoubleBuilder.h"
#include "support/DecoderTestSupport.h"
#include "support/MacBinaryBuilder.h"
#include "support/TestSupport.h"
#include "support/XarBuilder.h"
#include "support/XarSigning.h"
#include "support/ZipBuilder.h"
#include "support/ZipExtraFields.h"
#include "support/ZipLegacyEncoders.h"

using namespace gwtest;

namespace {

using Seeds = std::vector<GWData>;

void put32(GWData& bytes, std::size_t at, std::uint32_t value) {
    for (int i = 0; i < 4; ++i) {
        bytes[at + i] = std::uint8_t(value >> (8 * i));
    }
}

GWData appleDouble() {
    AppleDoubleFile file;
    file.finderInfo = finderInfoBytes("TEXT", "ttxt", 0x0100, 10, 20);
    file.attributes = {{"com.example.origin", bytesOf("seed")}, {"user.color", bytesOf("blue")}};
    file.resourceFork = bytesOf("a small resource fork");
    file.comment = "a comment";
    return buildAppleDouble(file);
}

GWData macBinary(int version) {
    MacBinaryFile file;
    file.version = version;
    file.dataFork = textBytes(300, version);
    file.resourceFork = bytesOf("resource fork bytes");
    file.comment = version > 1 ? "comment" : "";
    file.creationDate = 3000000000u;
    file.modificationDate = 3000000100u;
    return buildMacBinary(file);
}

// The password fuzz_zip_archive opens encrypted entries with.
constexpr char kPassword[] = "secret";

// Traditional PKWARE encryption behind its 12-byte header.
GWData traditionalEncrypted(const GWData& plain, std::uint8_t checkByte) {
    std::uint32_t keys[3] = {305419896u, 591751049u, 878082192u};
    const z_crc_t* table = get_crc_table();
    auto update = [&](std::uint8_t byte) {
        keys[0] = (keys[0] >> 8) ^ table[(keys[0] ^ byte) & 0xFF];
        keys[1] = (keys[1] + (keys[0] & 0xFF)) * 134775813u + 1;
        keys[2] = (keys[2] >> 8) ^ table[(keys[2] ^ (keys[1] >> 24)) & 0xFF];
    };
    for (const char* c = kPassword; *c; ++c) {
        update(std::uint8_t(*c));
    }
    GWData input(11, 0x5A);
    input.push_back(checkByte);
    input.insert(input.end(), plain.begin(), plain.end());
    GWData out;
    for (std::uint8_t byte : input) {
        const std::uint32_t temp = (keys[2] | 2) & 0xFFFF;
        out.push_back(byte ^ std::uint8_t((temp * (temp ^ 1)) >> 8));
        update(byte);
    }
    return out;
}

// WinZip AES: salt, verifier, AES-CTR (little-endian counter from 1), then
// 10 bytes of HMAC-SHA1 over the ciphertext.
GWData aesEncrypted(const GWData& plain, int strength) {
    const int keyLength = 8 + 8 * strength;
    GWData out(std::size_t(keyLength / 2), 0x33);
    std::uint8_t keys[66];
    PKCS5_PBKDF2_HMAC(kPassword, int(sizeof kPassword - 1), out.data(), int(out.size()), 1000,
                      EVP_sha1(), 2 * keyLength + 2, keys);
    out.insert(out.end(), keys + 2 * keyLength, keys + 2 * keyLength + 2);
    const EVP_CIPHER* cipher = strength == 1   ? EVP_aes_128_ecb()
                               : strength == 2 ? EVP_aes_192_ecb()
                                               : EVP_aes_256_ecb();
    EVP_CIPHER_CTX* context = EVP_CIPHER_CTX_new();
    EVP_EncryptInit_ex(context, cipher, nullptr, keys, nullptr);
    EVP_CIPHER_CTX_set_padding(context, 0);
    const std::size_t start = out.size();
    for (std::size_t at = 0; at < plain.size(); at += 16) {
        std::uint8_t counter[16] = {}, stream[16];
        const std::uint64_t block = at / 16 + 1;
        for (int i = 0; i < 8; ++i) {
            counter[i] = std::uint8_t(block >> (8 * i));
        }
        int length = 0;
        EVP_EncryptUpdate(context, stream, &length, counter, 16);
        for (std::size_t i = at; i < plain.size() && i < at + 16; ++i) {
            out.push_back(plain[i] ^ stream[i - at]);
        }
    }
    EVP_CIPHER_CTX_free(context);
    std::uint8_t code[20];
    unsigned int codeLength = 0;
    HMAC(EVP_sha1(), keys + keyLength, keyLength, out.data() + start, out.size() - start, code,
         &codeLength);
    out.insert(out.end(), code, code + 10);
    return out;
}

Seeds zipSeeds() {
    Seeds seeds;
    {
        ZipBuilder zip;
        zip.addDirectory("dir/");
        zip.addFile("dir/stored.txt", textBytes(200, 1), 0);
        zip.addFile("dir/deflated.txt", textBytes(2000, 2), 8);
        zip.addFile("dir/bzip2.txt", textBytes(500, 3), 12);
        zip.addSymlink("dir/link", "stored.txt");
        seeds.push_back(zip.bytes());
    }
    {
        ZipBuilder zip;
        auto& entry = zip.addFile("times.txt", bytesOf("timed"), 8);
        entry.centralExtra = concat({zipExtraBlock(0x5455, extendedTimestampPayload(3, {1, 2})),
                                     zipExtraBlock(0x7875, infoZipUnix3GPayload(501, 20)),
                                     zipExtraBlock(0x000A, ntfsPayload(1, 2, 3))});
        entry.localExtra = zipExtraBlock(0x5455, extendedTimestampPayload(3, {1, 2}));
        entry.dataDescriptor = true;
        auto& unicode = zip.addFile("unicode.txt", bytesOf("renamed"));
        unicode.centralExtra = zipExtraBlock(0x7075, infoZipUnicodePayload("ünïcode.txt"));
        seeds.push_back(zip.bytes());
    }
    {
        ZipBuilder zip;
        zip.zip64EndRecord = true;
        zip.addFile("sizes.bin", randomBytes(100, 4), 8).zip64Sizes = true;
        // The central Zip64 block gives the offset from its first slot, so
        // only an entry with nothing else escaped keeps a usable one.
        zip.addFile("offset.bin", randomBytes(50, 5)).zip64Offset = true;
        seeds.push_back(zip.bytes());
    }
    {
        ZipBuilder zip;
        zip.addFile("Read Me.txt", bytesOf("from a Mac"), 8);
        zip.addDirectory("__MACOSX/");
        zip.addFile("__MACOSX/._Read Me.txt", appleDouble(), 8);
        auto& mac3 = zip.addFile("mac3.txt", bytesOf("mac3"));
        Mac3Attributes attributes;
        attributes.comment = "comment";
        mac3.localExtra = zipExtraBlock(
            0x334D,
            mac3Payload(0x0000, "TEXT", "ttxt", mac3AttributeBlock(attributes, true, true)));
        mac3.centralExtra = zipExtraBlock(0x334D, mac3Payload(0x0000, "TEXT", "ttxt", {}));
        auto& bin = zip.addFile("encoded.bin", macBinary(2), 8);
        bin.centralExtra = zipExtraBlock(0x07C8, jleePayload("TEXT", "ttxt", 0, 1, 2, true));
        seeds.push_back(zip.bytes());
    }
    {
        // Shrink and implode, which only this library's own encoders write.
        ZipBuilder zip;
        const GWData text = textBytes(3000, 8);
        zip.addFile("shrunk.txt", text, 1).stored = shrinkBytes(text, {.clearingCodeSize = 10});
        for (bool literalTree : {false, true}) {
            const ImplodeSettings settings{.largeDictionary = literalTree,
                                           .literalTree = literalTree};
            auto& entry = zip.addFile(literalTree ? "imploded-8k.txt" : "imploded.txt", text, 6);
            entry.stored = implodeBytes(text, settings);
            entry.flags = settings.flags();
        }
        // Companions, whose sizes the entries' totals count but their decoders must not.
        zip.addFile("XtraStuf.mac/shrunk.txt", bytesOf("fork"), 8);
        zip.addFile("__MACOSX/._imploded.txt", appleDouble(), 8);
        seeds.push_back(zip.bytes());
    }
    {
        ZipBuilder zip;
        zip.prefix = GWData(64, 'M');
        zip.archiveComment = bytesOf("an archive comment");
        zip.addFile("after-prefix.txt", textBytes(100, 5), 8).comment = bytesOf("entry comment");
        seeds.push_back(zip.bytes());
    }
    {
        // Records out of offset order, the last sharing a local header.
        ZipBuilder zip;
        zip.addFile("first.txt", textBytes(100, 6), 8);
        zip.addFile("second.txt", bytesOf("second"));
        zip.addFile("shared.txt", bytesOf("second")).omitLocalHeader = true;
        zip.bytes();
        zip.entries()[0].centralLocalHeaderOffset = zip.localHeaderOffsets()[1];
        zip.entries()[1].centralLocalHeaderOffset = zip.localHeaderOffsets()[0];
        zip.entries()[2].centralLocalHeaderOffset = zip.localHeaderOffsets()[1];
        seeds.push_back(zip.bytes());
    }
    {
        // Encrypted entries: traditional (the check byte from the CRC, or
        // from the time with a data descriptor) and AES of each strength.
        ZipBuilder zip;
        const GWData text = textBytes(300, 9);
        const std::uint32_t crc = std::uint32_t(crc32(0, text.data(), uInt(text.size())));
        auto& traditional = zip.addFile("traditional.txt", text);
        traditional.flags = 0x0001;
        traditional.stored = traditionalEncrypted(text, std::uint8_t(crc >> 24));
        auto& described = zip.addFile("described.txt", text);
        described.flags = 0x0001;
        described.dataDescriptor = true;
        described.stored = traditionalEncrypted(text, std::uint8_t(described.dosTime >> 8));
        for (std::uint8_t strength : {1, 2, 3}) {
            auto& aes = zip.addFile("aes" + std::to_string(strength) + ".txt", text, 99);
            aes.flags = 0x0001;
            aes.crc32 = 0;
            aes.stored = aesEncrypted(text, strength);
            aes.centralExtra = zipExtraBlock(0x9901, {2, 0, 'A', 'E', strength, 0, 0});
            aes.localExtra = aes.centralExtra;
        }
        seeds.push_back(zip.bytes());
    }
    return seeds;
}

Seeds extraFieldSeeds() {
    const std::vector<GWData> fields = {
        zipExtraBlock(0x0001, zip64Payload({1, 2, 3})),
        zipExtraBlock(0x000A, ntfsPayload(1, 2, 3)),
        zipExtraBlock(0x000D, unixPayload(1, 2, 3, 4, "target")),
        zipExtraBlock(0x5855, unixPayload(1, 2, 3, 4)),
        zipExtraBlock(0x5455, extendedTimestampPayload(7, {1, 2, 3})),
        zipExtraBlock(0x7855, infoZipUnixPayload(1, 2)),
        zipExtraBlock(0x7875, infoZipUnix3GPayload(1, 2)),
        zipExtraBlock(0x7075, infoZipUnicodePayload("name")),
        zipExtraBlock(0x6375, infoZipUnicodePayload("comment")),
        zipExtraBlock(0x756E, asiUnixPayload(0, 0120777, 1, 2, "target")),
        zipExtraBlock(0x07C8, jleePayload("TEXT", "ttxt", 0, 1, 2, true)),
        zipExtraBlock(0x2605, zipItPayload("name", "TEXT", "ttxt", 0x0100)),
        zipExtraBlock(0x2705, zipItPayload({}, "TEXT", "ttxt", 0x0100)),
        zipExtraBlock(0x2805, zipIt135Payload(0x0100, true)),
        zipExtraBlock(0x4D63, smartZipPayload(SmartZipInfo{.name = "name"})),
        zipExtraBlock(0x334D, mac3Payload(0x0000, "TEXT", "ttxt",
                                          mac3AttributeBlock(Mac3Attributes{}, true, true))),
        zipExtraBlock(0x334D, mac3Payload(0x0004, "TEXT", "ttxt",
                                          mac3AttributeBlock(Mac3Attributes{}, false, false))),
        zipExtraBlock(0xA220, GWData{0, 0, 0, 0}),
    };
    Seeds seeds;
    for (const auto& field : fields) {
        for (std::uint8_t local : {0, 1}) {
            GWData seed{local};
            seed.insert(seed.end(), field.begin(), field.end());
            seeds.push_back(seed);
        }
    }
    return seeds;
}

std::string xarFiles(XarBuilder& xar) {
    const std::string gz = xar.dataElement("data", textBytes(500, 6), XarEncoding::gzip);
    const std::string bz = xar.dataElement("data", textBytes(300, 7), XarEncoding::bzip2, "md5");
    const std::string ea = xar.dataElement("ea", bytesOf("blue"), XarEncoding::none, "sha1",
                                           "<name>user.color</name>");
    return "<file id=\"1\"><name>dir</name><type>directory</type><mode>0755</mode>"
           "<uid>1</uid><gid>2</gid><user>u</user><group>g</group>"
           "<mtime>2024-05-01T10:00:00Z</mtime><FinderCreateTime><time>2024-05-01T10:00:00"
           "</time></FinderCreateTime><flags><UserNoDump/></flags>"
           "<file id=\"2\"><name>a.txt</name><type>file</type><mode>0644</mode>" +
           gz + ea + "</file><file id=\"3\"><name>b.txt</name><type>file</type>" + bz +
           "</file><file id=\"4\"><name>hard</name><type link=\"2\">hardlink</type></file>"
           "<file id=\"5\"><name>soft</name><type>symlink</type><link type=\"file\">a.txt"
           "</link></file><file id=\"6\"><name>dev</name><type>character special</type>"
           "<device><major>1</major><minor>3</minor></device></file>"
           "<file id=\"7\"><name enctype=\"base64\">YmFzZTY0</name><type>file</type></file>"
           "</file>";
}

Seeds xarSeeds() {
    Seeds seeds;
    for (std::uint32_t checksum : {0u, 1u, 2u}) {
        XarBuilder xar(checksum);
        xar.setFiles(xarFiles(xar));
        seeds.push_back(xar.bytes());
    }
    XarBuilder stored;
    stored.compressTOC = false;
    stored.setFiles(xarFiles(stored));
    seeds.push_back(stored.bytes());
    // Signatures and a digest that name one heap range between them.
    XarBuilder shared;
    const std::string range =
        "<offset>" + std::to_string(shared.addHeapBytes(GWData(64, 0x11))) + "</offset>";
    shared.setFiles("<signature style=\"RSA\">" + range +
                    "<size>64</size><KeyInfo/></signature><x-signature style=\"CMS\">" + range +
                    "<size>64</size></x-signature><file id=\"1\"><name>f</name><data>"
                    "<archived-checksum style=\"sha1\">" +
                    range + "<size>20</size></archived-checksum></data></file>");
    seeds.push_back(shared.bytes());
    // Real chains and CMS signers, one message without any, for the checks to chew on.
    XarSigning signing;
    XarBuilder signedXar;
    signedXar.setFiles(xarFiles(signedXar));
    XarSigning::Request noSigners("CMS", signing.leaf(XarKeyType::ecdsa), true);
    noSigners.withoutSigners = true;
    if (signing.signArchive(signedXar, {{"RSA", signing.leaf(XarKeyType::rsa)},
                                        {"CMS", signing.leaf(XarKeyType::ecdsa)},
                                        noSigners})) {
        seeds.push_back(signedXar.bytes());
    } else {
        std::fprintf(stderr, "no signed XAR seed: %s\n", signing.problem().c_str());
    }
    return seeds;
}

Seeds tocEntrySeeds() {
    XarBuilder xar;
    return {bytesOf(xarFiles(xar)),
            bytesOf("<file id=\"1\"><name>.</name><file id=\"2\"><name>x</name></file></file>"),
            bytesOf("<file id=\"1\"><name>a</name><acl><access>user::rw-\ngroup::r--\nother::r--"
                    "\n</access></acl><ea><name>n</name><offset>0</offset><size>1</size>"
                    "<length>1</length><encoding style=\"application/octet-stream\"/>"
                    "<extracted-checksum style=\"sha1\">00</extracted-checksum></ea></file>")};
}

Seeds appleDoubleSeeds() {
    AppleDoubleFile plain;
    plain.withAttributeHeader = false;
    plain.resourceFork = bytesOf("fork");
    return {appleDouble(), buildAppleDouble(plain)};
}

Seeds macBinarySeeds() {
    return {macBinary(1), macBinary(2), macBinary(3)};
}

Seeds sfxSeeds() {
    ZipBuilder zip;
    zip.addFile("inside.txt", bytesOf("packed"));
    const GWData archive = zip.bytes();
    Seeds seeds;
    for (const char* signature : {"PE\0\0", "NE\0\0"}) {
        GWData image(0x400, 0);
        image[0] = 'M';
        image[1] = 'Z';
        image[8] = 4;
        put32(image, 0x3C, 0x80);
        std::memcpy(image.data() + 0x80, signature, 4);
        // One section whose raw data ends where the archive begins.
        const std::size_t section = 0x80 + 0xF8;
        std::memcpy(image.data() + section, ".data", 5);
        put32(image, section + 16, 0x100);
        put32(image, section + 20, 0x300);
        image.insert(image.end(), archive.begin(), archive.end());
        seeds.push_back(image);
    }
    GWData marked(0x200, 0);
    marked[0] = 'M';
    marked[1] = 'Z';
    marked[8] = 4;
    std::memcpy(marked.data() + 64, "PKSFX", 5);
    seeds.push_back(marked);
    return seeds;
}

// Answers a server might give to a request for the first 64 bytes.
Seeds httpResponseSeeds() {
    const std::string body(64, 'x');
    Seeds seeds;
    for (const std::string& answer : {
             "HTTP/1.1 206 Partial Content\r\nETag: \"v1\"\r\nContent-Range: bytes 0-63/5000\r\n"
             "Content-Length: 64\r\n\r\n" +
                 body,
             "HTTP/1.1 100 Continue\r\n\r\nHTTP/1.1 206 Partial Content\r\nContent-Range: bytes "
             "0-63/64\r\nTransfer-Encoding: chunked\r\n\r\n40\r\n" +
                 body + "\r\n0\r\nContent-Range: bytes 1-2/3\r\n\r\n",
             std::string("HTTP/1.1 416 Range Not Satisfiable\r\nContent-Range: bytes */0\r\n"
                         "Content-Length: 0\r\n\r\n"),
             std::string("HTTP/1.1 503 Busy\r\nRetry-After: 2\r\nContent-Length: 0\r\n\r\n"),
             std::string("HTTP/1.1 302 Found\r\nContent-Length: 3\r\n\r\nabc"),
         }) {
        seeds.emplace_back(answer.begin(), answer.end());
    }
    return seeds;
}

Seeds decompressorSeeds() {
    const GWData text = textBytes(4000, 9);
    // Kind, expanded size in units of 64 (big-endian), piece length - 1.
    auto seed = [](std::uint8_t kind, std::size_t expanded, std::uint8_t piece, GWData stream) {
        GWData bytes{kind, std::uint8_t(expanded / 64 >> 8), std::uint8_t(expanded / 64), piece};
        bytes.insert(bytes.end(), stream.begin(), stream.end());
        return bytes;
    };
    Seeds seeds{seed(0, 0, 255, zipCompress(text, 8)), seed(0, 0, 7, zipCompress(text, 8)),
                seed(1, 0, 255, zipCompress(text, 12)),
                seed(2, text.size(), 255, shrinkBytes(text, {.clearingCodeSize = 10}))};
    for (std::uint8_t flags : {0x00, 0x10, 0x20, 0x30}) {
        const ImplodeSettings settings{.largeDictionary = (flags & 0x10) != 0,
                                       .literalTree = (flags & 0x20) != 0};
        seeds.push_back(
            seed(std::uint8_t(3 | flags), text.size(), 100, implodeBytes(text, settings)));
    }
    // Deflate without 258-byte matches is also Deflate64.
    seeds.push_back(seed(4, 0, 255, zipCompress(text, 8)));
    seeds.push_back(seed(5, 0, 6, zipCompress(text, 8)));
    seeds.push_back(seed(6, 0, 255, zipLzmaBytes(text)));
    seeds.push_back(seed(7, text.size(), 255, zipLzmaBytes(text)));
    seeds.push_back(seed(8, 0, 255, zstdBytes(text)));
    seeds.push_back(seed(9, 0, 255, xarEncode(text, XarEncoding::xz)));
    return seeds;
}

bool writeSeeds(const std::string& directory, const std::string& target, const Seeds& seeds) {
    const std::string folder = directory + "/" + target;
    if (::mkdir(folder.c_str(), 0755) != 0 && errno != EEXIST) {
        std::perror(folder.c_str());
        return false;
    }
    for (std::size_t i = 0; i < seeds.size(); ++i) {
        writeFile(folder + "/seed-" + std::to_string(i), seeds[i]);
    }
    return true;
}

}  // namespace

int main(int argc, char** argv) {
    if (argc != 2) {
        std::fprintf(stderr, "usage: gwarchive_fuzz_seeds DIRECTORY\n");
        return 2;
    }
    const std::string directory = argv[1];
    if (::mkdir(directory.c_str(), 0755) != 0 && errno != EEXIST) {
        std::perror(directory.c_str());
        return 1;
    }
    const bool ok = writeSeeds(directory, "fuzz_zip_archive", zipSeeds()) &&
                    writeSeeds(directory, "fuzz_zip_extra_fields", extraFieldSeeds()) &&
                    writeSeeds(directory, "fuzz_xar_archive", xarSeeds()) &&
                    writeSeeds(directory, "fuzz_xar_toc_entry", tocEntrySeeds()) &&
                    writeSeeds(directory, "fuzz_macbinary", macBinarySeeds()) &&
                    writeSeeds(directory, "fuzz_appledouble", appleDoubleSeeds()) &&
                    writeSeeds(directory, "fuzz_sfx_detect", sfxSeeds()) &&
                    writeSeeds(directory, "fuzz_decompressors", decompressorSeeds()) &&
                    writeSeeds(directory, "fuzz_http_response", httpResponseSeeds());
    return ok ? 0 : 1;
}
