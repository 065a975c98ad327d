#pragma once

#include <cstdint>
#include <optional>
#include <string>

#include "foundation/GWValue.h"

namespace gwtest {

// Writes XAR archives for tests: a header, a table of contents (zlib
// compressed unless asked otherwise) and a heap. The heap starts with the
// digest of the stored table of contents (when the archive has a checksum
// algorithm), followed by whatever the test adds; every offset the builder
// hands out already counts that digest.
//
//     XarBuilder xar;                       // SHA-1, as most tools write
//     std::string data = xar.dataElement("data", bytesOf("hello"), XarEncoding::gzip);
//     xar.setFiles("<file id=\"1\"><name>a</name><type>file</type>" + data + "</file>");
//     writeFile(path, xar.bytes());
enum class XarEncoding { none, gzip, bzip2, xz };

class XarBuilder {
public:
    // `headerChecksum` is the header's number (0 none, 1 SHA-1, 2 MD5, 3 and up
    // as given); `style` names the algorithm in the TOC's checksum element and
    // `digestAlgorithm` (a GWChecksum number) computes it.
    explicit XarBuilder(std::uint32_t headerChecksum = 1);
    XarBuilder(std::uint32_t headerChecksum, std::string style, int digestAlgorithm);

    // The "file" elements (and anything else) inside <toc>, after the checksum element.
    void setFiles(std::string tocBody) { tocBody_ = std::move(tocBody); }
    const std::string& files() const { return tocBody_; }
    // Replaces the whole generated document: written exactly as given.
    void setTOCDocument(std::string document) { document_ = std::move(document); }
    // The document as it will be stored (before compression).
    std::string tocDocument() const;

    // The offset from the heap's start that the next addHeapBytes will return.
    std::uint64_t nextHeapOffset() const { return digestLength() + heap_.size(); }
    // Appends bytes to the heap and returns their offset from the heap's start.
    std::uint64_t addHeapBytes(const GWData& bytes);
    // Appends `content` encoded as asked and returns a "data"-like element
    // (`tag` names it: "data", "ea", ...) with length, offset, size, encoding
    // and both checksums in `checksumStyle` ("sha1", "md5", ... or "" for none).
    // `extraXML` goes inside the element (an EA's <name>, say).
    std::string dataElement(const std::string& tag, const GWData& content, XarEncoding encoding,
                            const std::string& checksumStyle = "sha1",
                            const std::string& extraXML = "");

    // --- Variations for malformed archives -----------------------------------
    bool compressTOC = true;
    bool includeChecksumElement = true;  // the <checksum> element in <toc>
    bool corruptStoredChecksum = false;  // flips a bit of the digest in the heap
    std::optional<std::string> magic;    // 4 bytes, default "xar!"
    std::optional<std::uint16_t> headerSize;
    std::optional<std::uint16_t> version;
    std::optional<std::uint64_t> compressedTOCLength;
    std::optional<std::uint64_t> uncompressedTOCLength;
    GWData extraHeaderBytes;  // after the 28 interpreted bytes

    // Length of the digest at the heap's start (0 without one).
    std::size_t digestLength() const;
    // The digest of the stored table of contents as it stands, which is what
    // signatures sign (uncorrupted, whatever corruptStoredChecksum says).
    GWData tocChecksum() const;
    GWData bytes() const;
    void write(const std::string& path) const;

private:
    std::uint32_t headerChecksum_;
    std::string style_;
    int digestAlgorithm_;
    std::string tocBody_;
    std::optional<std::string> document_;
    GWData heap_;
};

// The zlib, bzip2, xz or stored form of `bytes`, as XAR heaps carry them.
GWData xarEncode(const GWData& bytes, XarEncoding encoding);

}  // namespace gwtest
