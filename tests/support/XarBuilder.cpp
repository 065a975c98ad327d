#include "XarBuilder.h"

#include <bzlib.h>
#include <lzma.h>
#include <zlib.h>

#include <map>
#include <stdexcept>

#include "TestSupport.h"
#include "foundation/GWChecksum.h"

namespace gwtest {

namespace {

int digestForStyle(const std::string& style) {
    static const std::map<std::string, int> digests = {
        {"sha1", GWChecksumAlgorithmSHA1},     {"md5", GWChecksumAlgorithmMD5},
        {"md2", GWChecksumAlgorithmMD2},       {"sha224", GWChecksumAlgorithmSHA224},
        {"sha256", GWChecksumAlgorithmSHA256}, {"sha384", GWChecksumAlgorithmSHA384},
        {"sha512", GWChecksumAlgorithmSHA512}};
    const auto found = digests.find(style);
    return found == digests.end() ? GWChecksumAlgorithmNone : found->second;
}

std::string styleForHeaderNumber(std::uint32_t number) {
    switch (number) {
        case 0: return "";
        case 1: return "sha1";
        case 2: return "md5";
        case 4: return "sha512";
        default: return "sha256";
    }
}

const char* encodingStyle(XarEncoding encoding) {
    switch (encoding) {
        case XarEncoding::gzip: return "application/x-gzip";
        case XarEncoding::bzip2: return "application/x-bzip2";
        case XarEncoding::xz: return "application/x-xz";
        default: return "application/octet-stream";
    }
}

void appendBigEndian(GWData& out, std::uint64_t value, int width) {
    for (int shift = (width - 1) * 8; shift >= 0; shift -= 8) {
        out.push_back(std::uint8_t(value >> shift));
    }
}

}  // namespace

GWData xarEncode(const GWData& bytes, XarEncoding encoding) {
    if (encoding == XarEncoding::gzip) {
        uLongf length = compressBound(uLong(bytes.size()));
        GWData out(length);
        if (compress2(out.data(), &length, bytes.data(), uLong(bytes.size()), 9) != Z_OK) {
            throw std::runtime_error("zlib compression failed");
        }
        out.resize(length);
        return out;
    }
    if (encoding == XarEncoding::bzip2) {
        unsigned int length = unsigned(bytes.size() + bytes.size() / 100 + 600);
        GWData out(length);
        GWData input = bytes;  // the bzip2 API takes a non-const source
        if (BZ2_bzBuffToBuffCompress(reinterpret_cast<char*>(out.data()), &length,
                                     reinterpret_cast<char*>(input.data()), unsigned(input.size()),
                                     9, 0, 0) != BZ_OK) {
            throw std::runtime_error("bzip2 compression failed");
        }
        out.resize(length);
        return out;
    }
    if (encoding == XarEncoding::xz) {
        GWData out(lzma_stream_buffer_bound(bytes.size()));
        std::size_t length = 0;
        if (lzma_easy_buffer_encode(6, LZMA_CHECK_CRC64, nullptr, bytes.data(), bytes.size(),
                                    out.data(), &length, out.size()) != LZMA_OK) {
            throw std::runtime_error("xz compression failed");
        }
        out.resize(length);
        return out;
    }
    return bytes;
}

XarBuilder::XarBuilder(std::uint32_t headerChecksum)
    : XarBuilder(headerChecksum, styleForHeaderNumber(headerChecksum),
                 digestForStyle(styleForHeaderNumber(headerChecksum))) {}

XarBuilder::XarBuilder(std::uint32_t headerChecksum, std::string style, int digestAlgorithm)
    : headerChecksum_(headerChecksum),
      style_(std::move(style)),
      digestAlgorithm_(digestAlgorithm) {}

std::size_t XarBuilder::digestLength() const {
    return GWChecksum::digestLength(digestAlgorithm_);
}

std::string XarBuilder::tocDocument() const {
    if (document_) {
        return *document_;
    }
    std::string document = "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n<xar>\n <toc>\n";
    if (includeChecksumElement && digestLength() > 0) {
        document += "  <checksum style=\"" + style_ + "\">\n   <offset>0</offset>\n   <size>" +
                    std::to_string(digestLength()) + "</size>\n  </checksum>\n";
    }
    document += tocBody_;
    document += "\n </toc>\n</xar>\n";
    return document;
}

std::uint64_t XarBuilder::addHeapBytes(const GWData& bytes) {
    const std::uint64_t offset = digestLength() + heap_.size();
    heap_.insert(heap_.end(), bytes.begin(), bytes.end());
    return offset;
}

std::string XarBuilder::dataElement(const std::string& tag, const GWData& content,
                                    XarEncoding encoding, const std::string& checksumStyle,
                                    const std::string& extraXML) {
    const GWData stored = xarEncode(content, encoding);
    const std::uint64_t offset = addHeapBytes(stored);
    std::string xml = "<" + tag + ">";
    xml += "<length>" + std::to_string(stored.size()) + "</length>";
    xml += "<offset>" + std::to_string(offset) + "</offset>";
    xml += "<size>" + std::to_string(content.size()) + "</size>";
    xml += "<encoding style=\"" + std::string(encodingStyle(encoding)) + "\"/>";
    if (!checksumStyle.empty()) {
        const int algorithm = digestForStyle(checksumStyle);
        xml += "<archived-checksum style=\"" + checksumStyle + "\">" +
               hex(GWChecksum::checksumForData(stored, algorithm)) + "</archived-checksum>";
        xml += "<extracted-checksum style=\"" + checksumStyle + "\">" +
               hex(GWChecksum::checksumForData(content, algorithm)) + "</extracted-checksum>";
    }
    xml += extraXML;
    xml += "</" + tag + ">";
    return xml;
}

GWData XarBuilder::tocChecksum() const {
    const std::string document = tocDocument();
    const GWData plain(document.begin(), document.end());
    const GWData stored = compressTOC ? xarEncode(plain, XarEncoding::gzip) : plain;
    return digestLength() > 0 ? GWChecksum::checksumForData(stored, digestAlgorithm_) : GWData();
}

GWData XarBuilder::bytes() const {
    const std::string document = tocDocument();
    const GWData plain(document.begin(), document.end());
    const GWData stored = compressTOC ? xarEncode(plain, XarEncoding::gzip) : plain;
    GWData digest = tocChecksum();
    if (corruptStoredChecksum && !digest.empty()) {
        digest[0] ^= 0x01;
    }

    GWData out;
    const std::string magicBytes = magic.value_or("xar!");
    out.insert(out.end(), magicBytes.begin(), magicBytes.end());
    appendBigEndian(out, headerSize.value_or(std::uint16_t(28 + extraHeaderBytes.size())), 2);
    appendBigEndian(out, version.value_or(1), 2);
    appendBigEndian(out, compressedTOCLength.value_or(stored.size()), 8);
    appendBigEndian(out, uncompressedTOCLength.value_or(plain.size()), 8);
    appendBigEndian(out, headerChecksum_, 4);
    out.insert(out.end(), extraHeaderBytes.begin(), extraHeaderBytes.end());
    out.insert(out.end(), stored.begin(), stored.end());
    out.insert(out.end(), digest.begin(), digest.end());
    out.insert(out.end(), heap_.begin(), heap_.end());
    return out;
}

void XarBuilder::write(const std::string& path) const {
    writeFile(path, bytes());
}

}  // namespace gwtest
