#include "XarSignatureTestSupport.h"

#include "GWArchiveSupport/GWArchiveConstants.h"

namespace gwtest {

namespace {

// Bytes before the heap, so that offsets are seen to count from the heap's start.
const std::string kHeader = "HEADER+TOC";

}  // namespace

XarSigning& sharedSigning() {
    static XarSigning signing;
    return signing;
}

SignedTOCFixture::SignedTOCFixture(const std::vector<TOCSignature>& signatures,
                                   const GWData& checksum, const std::string& extraXML) {
    GWData file = bytesOf(kHeader);
    std::string elements;
    for (const TOCSignature& signature : signatures) {
        const std::uint64_t offset = file.size() - kHeader.size();
        file.insert(file.end(), signature.bytes.begin(), signature.bytes.end());
        elements += XarSigning::signatureElement(signature.style, offset, signature.bytes.size(),
                                                 signature.keyInfoXML, signature.extended);
    }
    writeFile(folder_.file("heap"), file);
    const std::string text = "<xar><toc>" + elements + extraXML + "</toc></xar>";
    document_.load_string(text.c_str(), GWXARLoadOperation::kTOCParseOptions);

    operation_ = GWXARLoadOperation::initWithArchive(nullptr, false);
    operation_->setArchiveURL(folder_.url("heap"));
    operation_->setFileHandle(
        GWRemoteFileHandle::initForReadingFromURL(folder_.url("heap"), nullptr));
    operation_->setHeapStart(kHeader.size());
    operation_->setTOCChecksum(checksum);
}

bool SignedTOCFixture::verify(GWErrorPtr* error, int checksumAlgorithm) {
    return operation_->verifySignaturesWithTOC(toc(), checksumAlgorithm, error);
}

std::string unknownEntity(const GWErrorPtr& error) {
    return error ? error->detailString(kGWXARArchiveUnknownEntityErrorKey) : "(no error)";
}

std::string affectedNode(const GWErrorPtr& error) {
    return error ? error->detailString(kGWXARArchiveAffectedXMLNodeErrorKey) : "(no error)";
}

}  // namespace gwtest
