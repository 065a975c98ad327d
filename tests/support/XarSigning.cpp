#include "XarSigning.h"

#include <openssl/evp.h>
#include <openssl/pem.h>

#include "xar/GWOpenSSL.h"

namespace gwtest {

namespace {

// Extensions for each kind of certificate; no authority key identifier, so
// that chains are built by name alone and self-signed leaves need no issuer.
const char* const kConfig =
    "[req]\n"
    "distinguished_name = dn\n"
    "prompt = no\n"
    "[dn]\n"
    "CN = unused\n"
    "[ca_ext]\n"
    "basicConstraints = critical,CA:TRUE\n"
    "keyUsage = critical,keyCertSign,cRLSign\n"
    "subjectKeyIdentifier = hash\n"
    "[leaf_ext]\n"
    "basicConstraints = critical,CA:FALSE\n"
    "keyUsage = critical,digitalSignature\n"
    "subjectKeyIdentifier = hash\n";

const char* const kECKey = "-algorithm EC -pkeyopt ec_paramgen_curve:P-256";

std::string lowered(std::string text) {
    for (char& c : text) {
        if (c >= 'A' && c <= 'Z') {
            c = char(c - 'A' + 'a');
        }
    }
    return text;
}

GWOpenSSLPtr<EVP_PKEY> readKey(const std::string& file) {
    GWOpenSSLPtr<BIO> bio(BIO_new_file(file.c_str(), "r"));
    return GWOpenSSLPtr<EVP_PKEY>(
        bio ? PEM_read_bio_PrivateKey(bio.get(), nullptr, nullptr, nullptr) : nullptr);
}

}  // namespace

std::string base64Encode(const GWData& bytes) {
    std::string text(4 * ((bytes.size() + 2) / 3) + 1, '\0');
    const int length = EVP_EncodeBlock(reinterpret_cast<unsigned char*>(text.data()), bytes.data(),
                                       int(bytes.size()));
    text.resize(std::size_t(length));
    return text;
}

XarSigning::XarSigning() {
    config_ = folder_.file("openssl.cnf");
    writeFile(config_, bytesOf(kConfig));
    rootCertificateFile_ = folder_.file("root.pem");
    const std::string root = folder_.file("root.key");
    const std::string intermediate = folder_.file("intermediate.key");
    const std::string intermediateRequest = folder_.file("intermediate.csr");
    if (!run("openssl genpkey " + std::string(kECKey) + " -out " + shellQuote(root)) ||
        !run("openssl req -x509 -new -config " + shellQuote(config_) + " -extensions ca_ext -key " +
             shellQuote(root) + " -subj '/CN=GW Test Root CA' -days 3650 -sha256 -out " +
             shellQuote(rootCertificateFile_)) ||
        !run("openssl genpkey " + std::string(kECKey) + " -out " + shellQuote(intermediate)) ||
        !run("openssl req -new -config " + shellQuote(config_) + " -key " +
             shellQuote(intermediate) + " -subj '/CN=GW Test Intermediate CA' -out " +
             shellQuote(intermediateRequest)) ||
        !run("openssl x509 -req -in " + shellQuote(intermediateRequest) + " -CA " +
             shellQuote(rootCertificateFile_) + " -CAkey " + shellQuote(root) + " -set_serial " +
             std::to_string(serial_++) + " -extfile " + shellQuote(config_) +
             " -extensions ca_ext -days 3650 -sha256 -out " +
             shellQuote(folder_.file("intermediate.pem")))) {
        return;
    }
    intermediate_.keyFile = intermediate;
    intermediate_.certificateFile = folder_.file("intermediate.pem");
    intermediate_.chain = {derOf(intermediate_.certificateFile)};
    intermediate_.commonNames = {"GW Test Intermediate CA"};
}

bool XarSigning::run(const std::string& command) {
    if (!ok()) {
        return false;
    }
    const CommandResult result = runCommand(command + " 2>&1");
    if (result.status != 0) {
        problem_ = "`" + command + "` failed: " + result.output;
        return false;
    }
    return true;
}

GWData XarSigning::derOf(const std::string& pemFile) {
    const std::string der = folder_.file("der-" + std::to_string(files_++) + ".der");
    if (!run("openssl x509 -in " + shellQuote(pemFile) + " -outform DER -out " + shellQuote(der))) {
        return {};
    }
    return readFile(der);
}

std::optional<XarSigningIdentity> XarSigning::makeIdentity(const std::string& name, XarKeyType type,
                                                           const std::string& keyFile,
                                                           const XarSigningIdentity* issuer,
                                                           int days) {
    XarSigningIdentity identity;
    identity.keyType = type;
    identity.keyFile = keyFile;
    identity.certificateFile = folder_.file(name + ".pem");
    const std::string commonName = "GW Test " + name + " Signer";
    const std::string subject = shellQuote("/CN=" + commonName);
    const std::string request = folder_.file(name + ".csr");
    if (!issuer) {
        if (!run("openssl req -x509 -new -config " + shellQuote(config_) +
                 " -extensions leaf_ext -key " + shellQuote(keyFile) + " -subj " + subject +
                 " -days 3650 -sha256 -out " + shellQuote(identity.certificateFile))) {
            return std::nullopt;
        }
    } else if (!run("openssl req -new -config " + shellQuote(config_) + " -key " +
                    shellQuote(keyFile) + " -subj " + subject + " -out " + shellQuote(request)) ||
               // Negative days make a certificate whose validity has already ended.
               !run("openssl x509 -req -in " + shellQuote(request) + " -CA " +
                    shellQuote(issuer->certificateFile) + " -CAkey " + shellQuote(issuer->keyFile) +
                    " -set_serial " + std::to_string(serial_++) + " -extfile " +
                    shellQuote(config_) + " -extensions leaf_ext -days " + std::to_string(days) +
                    " -sha256 -out " + shellQuote(identity.certificateFile))) {
        return std::nullopt;
    }
    identity.chain = {derOf(identity.certificateFile)};
    identity.commonNames = {commonName};
    if (issuer) {
        // The issuer and what vouches for it, for CMS signing.
        identity.chainFile = folder_.file(name + "-chain.pem");
        GWData chain = readFile(issuer->certificateFile);
        if (!issuer->chainFile.empty()) {
            const GWData more = readFile(issuer->chainFile);
            chain.insert(chain.end(), more.begin(), more.end());
        }
        writeFile(identity.chainFile, chain);
        identity.chain.insert(identity.chain.end(), issuer->chain.begin(), issuer->chain.end());
        identity.commonNames.insert(identity.commonNames.end(), issuer->commonNames.begin(),
                                    issuer->commonNames.end());
    }
    return ok() ? std::optional(identity) : std::nullopt;
}

const XarSigningIdentity& XarSigning::leaf(XarKeyType type) {
    const int index = int(type);
    if (auto found = leaves_.find(index); found != leaves_.end()) {
        return found->second;
    }
    const std::string name = type == XarKeyType::rsa   ? "RSA"
                             : type == XarKeyType::dsa ? "DSA"
                                                       : "ECDSA";
    const std::string key = folder_.file(name + ".key");
    bool made = false;
    if (type == XarKeyType::rsa) {
        made = run("openssl genpkey -algorithm RSA -pkeyopt rsa_keygen_bits:2048 -out " +
                   shellQuote(key));
    } else if (type == XarKeyType::dsa) {
        // Small parameters keep the test fast; their strength is beside the point.
        const std::string parameters = folder_.file("dsa.param");
        made = run("openssl genpkey -genparam -algorithm DSA -pkeyopt dsa_paramgen_bits:1024 "
                   "-pkeyopt dsa_paramgen_q_bits:160 -out " +
                   shellQuote(parameters)) &&
               run("openssl genpkey -paramfile " + shellQuote(parameters) + " -out " +
                   shellQuote(key));
    } else {
        made = run("openssl genpkey " + std::string(kECKey) + " -out " + shellQuote(key));
    }
    auto identity = made ? makeIdentity(name, type, key, &intermediate_, 3650) : std::nullopt;
    if (!identity) {
        return empty_;
    }
    return leaves_.emplace(index, std::move(*identity)).first->second;
}

const XarSigningIdentity& XarSigning::selfSignedLeaf() {
    if (!selfSigned_) {
        const std::string key = folder_.file("SelfSigned.key");
        if (run("openssl genpkey -algorithm RSA -pkeyopt rsa_keygen_bits:2048 -out " +
                shellQuote(key))) {
            selfSigned_ = makeIdentity("SelfSigned", XarKeyType::rsa, key, nullptr, 3650);
        }
    }
    return selfSigned_ ? *selfSigned_ : empty_;
}

const XarSigningIdentity& XarSigning::expiredLeaf() {
    if (!expired_ && ok()) {
        const std::string key = folder_.file("Expired.key");
        if (run("openssl genpkey " + std::string(kECKey) + " -out " + shellQuote(key))) {
            expired_ = makeIdentity("Expired", XarKeyType::ecdsa, key, &intermediate_, -1);
        }
    }
    return expired_ ? *expired_ : empty_;
}

const XarSigningIdentity& XarSigning::leafIssuedByLeaf() {
    if (!issuedByLeaf_ && ok()) {
        const XarSigningIdentity& rsa = leaf(XarKeyType::rsa);
        const std::string key = folder_.file("Leaf-Issued.key");
        if (ok() && run("openssl genpkey " + std::string(kECKey) + " -out " + shellQuote(key))) {
            issuedByLeaf_ = makeIdentity("Leaf-Issued", XarKeyType::ecdsa, key, &rsa, 3650);
        }
    }
    return issuedByLeaf_ ? *issuedByLeaf_ : empty_;
}

GWData XarSigning::signDigest(const XarSigningIdentity& identity, const GWData& checksum) {
    // In process: an archive with hundreds of signatures is signed in a blink.
    auto key = readKey(identity.keyFile);
    GWOpenSSLPtr<EVP_PKEY_CTX> context(key ? EVP_PKEY_CTX_new(key.get(), nullptr) : nullptr);
    const bool isRSA = identity.keyType == XarKeyType::rsa;
    const EVP_MD* digest = checksum.size() == 20            ? EVP_sha1()
                           : checksum.size() == 16 && isRSA ? EVP_md5()
                                                            : nullptr;
    std::size_t length = 0;
    if (!context || EVP_PKEY_sign_init(context.get()) != 1 ||
        (digest && EVP_PKEY_CTX_set_signature_md(context.get(), digest) != 1) ||
        EVP_PKEY_sign(context.get(), nullptr, &length, checksum.data(), checksum.size()) != 1) {
        problem_ = "signDigest: " + std::to_string(GWOpenSSLTakeErrorStatus(0));
        return {};
    }
    GWData signature(length);
    if (EVP_PKEY_sign(context.get(), signature.data(), &length, checksum.data(), checksum.size()) !=
        1) {
        return {};
    }
    signature.resize(length);
    return signature;
}

GWData XarSigning::signCMS(const XarSigningIdentity& identity, const GWData& checksum) {
    const std::string input = folder_.file("content-" + std::to_string(files_++) + ".bin");
    const std::string output = input + ".p7s";
    writeFile(input, checksum);
    const std::string others =
        identity.chainFile.empty() ? "" : " -certfile " + shellQuote(identity.chainFile);
    if (!run("openssl cms -sign -binary -outform DER -in " + shellQuote(input) + " -signer " +
             shellQuote(identity.certificateFile) + " -inkey " + shellQuote(identity.keyFile) +
             others + " -out " + shellQuote(output))) {
        return {};
    }
    return readFile(output);
}

GWData XarSigning::certificatesOnlyCMS(const XarSigningIdentity& identity) {
    const std::string output = folder_.file("certs-" + std::to_string(files_++) + ".p7");
    const std::string others =
        identity.chainFile.empty() ? "" : " -certfile " + shellQuote(identity.chainFile);
    if (!run("openssl crl2pkcs7 -nocrl -certfile " + shellQuote(identity.certificateFile) + others +
             " -outform DER -out " + shellQuote(output))) {
        return {};
    }
    return readFile(output);
}

GWData XarSigning::sign(const std::string& style, const XarSigningIdentity& identity,
                        const GWData& checksum) {
    return lowered(style) == "cms" ? signCMS(identity, checksum) : signDigest(identity, checksum);
}

bool XarSigning::signArchive(XarBuilder& xar, const std::vector<Request>& requests) {
    if (!ok()) {
        return false;
    }
    if (xar.digestLength() == 0) {
        problem_ = "signArchive: the archive has no checksum to sign";
        return false;
    }
    const std::string files = xar.files();
    const std::uint64_t start = xar.nextHeapOffset();
    std::vector<GWData> signatures(requests.size());
    // Each signature element names the size of its signature, which the
    // signature's bytes depend on through the checksum: DSA, ECDSA and CMS
    // sizes vary, so sign until the sizes settle.
    for (int attempt = 0; attempt < 32; ++attempt) {
        std::string elements;
        std::uint64_t offset = start;
        for (std::size_t i = 0; i < requests.size(); ++i) {
            const Request& request = requests[i];
            if (!request.identity) {
                problem_ = "signArchive: a request without an identity";
                return false;
            }
            const std::string keyInfo =
                keyInfoElement(request.certificates.value_or(request.identity->chain));
            elements += signatureElement(request.style, offset, signatures[i].size(), keyInfo,
                                         request.extended);
            offset += signatures[i].size();
        }
        xar.setFiles(elements + files);
        const GWData checksum = xar.tocChecksum();
        bool settled = true;
        for (std::size_t i = 0; i < requests.size(); ++i) {
            GWData signature = requests[i].withoutSigners
                                   ? certificatesOnlyCMS(*requests[i].identity)
                                   : sign(requests[i].style, *requests[i].identity, checksum);
            if (signature.empty()) {
                xar.setFiles(files);
                return false;
            }
            settled = settled && signature.size() == signatures[i].size();
            signatures[i] = std::move(signature);
        }
        if (settled) {
            for (const GWData& signature : signatures) {
                xar.addHeapBytes(signature);
            }
            return true;
        }
    }
    xar.setFiles(files);
    problem_ = "signArchive: the signature sizes never settled";
    return false;
}

std::string XarSigning::keyInfoElement(const std::vector<GWData>& certificates) {
    std::string xml = "<KeyInfo xmlns=\"http://www.w3.org/2000/09/xmldsig#\"><X509Data>";
    for (const GWData& certificate : certificates) {
        xml += "<X509Certificate>" + base64Encode(certificate) + "</X509Certificate>";
    }
    return xml + "</X509Data></KeyInfo>";
}

std::string XarSigning::signatureElement(const std::string& style, std::uint64_t offset,
                                         std::uint64_t size, const std::string& keyInfoXML,
                                         bool extended) {
    const std::string tag = extended ? "x-signature" : "signature";
    return "<" + tag + " style=\"" + style + "\"><offset>" + std::to_string(offset) +
           "</offset><size>" + std::to_string(size) + "</size>" + keyInfoXML + "</" + tag + ">";
}

TrustedRootScope::TrustedRootScope(const std::string& certificateFile)
    : file_("SSL_CERT_FILE", certificateFile), directory_("SSL_CERT_DIR", emptyFolder_.path()) {}

}  // namespace gwtest
