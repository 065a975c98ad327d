#pragma once

#include <cstdint>
#include <memory>
#include <span>

#include "GWOpenSSL.h"
#include "GWXARTrust.h"

// A CMS signed-data message whose content travels apart from it, checked
// signer by signer.
class GWXARCMSMessage {
public:
    // None, with the provider's status, when the bytes are not a signed-data message.
    static std::unique_ptr<GWXARCMSMessage> decode(std::span<const std::uint8_t> der, long* status);

    // Digests the content the signers are checked against; false when it
    // could not be. Without content every signer's signature fails.
    bool setDetachedContent(std::span<const std::uint8_t> content);

    int numberOfSigners() const;

    struct SignerStatus {
        bool callFailed;         // `status` is then an OpenSSL error code
        long status;             // see callFailed
        bool signatureIsValid;   // over the detached content
        GWXARTrustResult trust;  // of the signer's certificate and the message's others
    };
    SignerStatus signerStatus(int index, const GWXARTrust& trust) const;

private:
    explicit GWXARCMSMessage(GWOpenSSLPtr<CMS_ContentInfo> message);

    GWOpenSSLPtr<CMS_ContentInfo> message_;
    // The content behind the message's digest filters, read to its end.
    GWOpenSSLPtr<BIO> digestChain_;
};
