#include <gtest/gtest.h>

#include "XarSignatureTestSupport.h"
#include "XarTestSupport.h"
#include "foundation/GWChecksum.h"

namespace {

using gwtest::XarKeyType;
using gwtest::XarSigning;

// The signing helper's archives, checked the way a load checks them: the
// signatures must sign the checksum of the table of contents they sit in.
TEST(GWXARSignedArchive, SignArchiveSignsTheFinalTableOfContents) {
    auto& signing = gwtest::sharedSigning();
    ASSERT_TRUE(signing.ok()) << signing.problem();
    gwtest::TrustedRootScope trust(signing.rootCertificateFile());
    gwtest::TemporaryDirectory folder;

    for (const std::uint32_t headerChecksum : {1u, 2u}) {
        gwtest::XarBuilder xar(headerChecksum);
        const std::string data =
            xar.dataElement("data", gwtest::bytesOf("hello"), gwtest::XarEncoding::gzip);
        xar.setFiles("<file id=\"1\"><name>a</name><type>file</type>" + data + "</file>");
        ASSERT_TRUE(signing.signArchive(xar, {{"ECDSA", signing.leaf(XarKeyType::ecdsa)},
                                              {"CMS", signing.leaf(XarKeyType::rsa), true},
                                              {"SHA1withRSA", signing.leaf(XarKeyType::rsa)}}))
            << signing.problem();
        xar.write(folder.file("signed.xar"));

        const GWData bytes = gwtest::readFile(folder.file("signed.xar"));
        std::string problem;
        auto toc = gwtest::readXarTOC(bytes, &problem);
        ASSERT_TRUE(toc) << problem;
        const GWData stored(bytes.begin() + toc->headerSize, bytes.begin() + toc->heapStart);
        const int algorithm =
            headerChecksum == 1 ? GWChecksumAlgorithmSHA1 : GWChecksumAlgorithmMD5;

        auto operation = GWXARLoadOperation::initWithArchive(nullptr, false);
        operation->setFileHandle(
            GWRemoteFileHandle::initForReadingFromURL(folder.url("signed.xar"), nullptr));
        operation->setHeapStart(toc->heapStart);
        operation->setTOCChecksum(GWChecksum::checksumForData(stored, algorithm));
        GWErrorPtr error;
        EXPECT_TRUE(operation->verifySignaturesWithTOC(toc->toc(), algorithm, &error))
            << headerChecksum << ": " << (error ? error->localizedDescription() : "");
        ASSERT_EQ(operation->signatures()->size(), 3u);
        EXPECT_TRUE(operation->signatures()->back()->isExtended());

        // The entries' data still lies where the table of contents says.
        auto parsed = operation->filesFromTOCElement(toc->toc(), &error);
        ASSERT_TRUE(parsed);
        ASSERT_EQ(parsed->size(), 1u);
    }
}

}  // namespace
