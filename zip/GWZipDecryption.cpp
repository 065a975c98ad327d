#include "GWZipDecryption.h"

#include <openssl/core_names.h>
#include <openssl/crypto.h>
#include <openssl/evp.h>
#include <zlib.h>

#include <algorithm>
#include <array>
#include <vector>

#include "GWArchiveSupport/GWArchiveConstants.h"
#include "GWZipErrors.h"
#include "GWZipExtraInfoKeys.h"
#include "GWZipWorkOperation.h"

namespace {

// Decrypted bytes go on in pieces of at most this size.
constexpr std::size_t kPieceSize = 64 * 1024;

GWErrorPtr wrongPasswordError(const std::string& path) {
    return GWZipEntryError(GWZipArchiveWrongPasswordError, path, "entry %s: wrong password",
                           path.c_str());
}

GWErrorPtr truncatedError(const std::string& path) {
    return GWGenerateError(kGWCocoaErrorDomain, GWFileReadCorruptFileError, std::nullopt, nullptr,
                           {}, "entry %s: its data is too short for its encryption", path.c_str());
}

// A decryptor behind a fixed-length header, which may arrive over several
// pieces and opens the data or refuses the password.
class HeaderedDecryptor : public GWStreamDecryptor {
public:
    HeaderedDecryptor(std::size_t headerLength, std::string path)
        : path_(std::move(path)), headerLength_(headerLength) {}

    bool decrypt(std::span<const std::uint8_t> stored, bool isLast, const Sink& sink,
                 GWErrorPtr* error) final {
        if (header_.size() < headerLength_) {
            const std::size_t count = std::min(headerLength_ - header_.size(), stored.size());
            header_.insert(header_.end(), stored.begin(), stored.begin() + count);
            stored = stored.subspan(count);
            if (header_.size() < headerLength_) {
                return isLast ? GWFail(error, truncatedError(path_)) : true;
            }
            if (!open(header_, error)) {
                return false;
            }
        }
        return decryptData(stored, isLast, sink, error);
    }

protected:
    virtual bool open(const std::vector<std::uint8_t>& header, GWErrorPtr* error) = 0;
    virtual bool decryptData(std::span<const std::uint8_t> stored, bool isLast, const Sink& sink,
                             GWErrorPtr* error) = 0;

    const std::string path_;

private:
    const std::size_t headerLength_;
    std::vector<std::uint8_t> header_;
};

// Traditional PKWARE encryption: a stream cipher of three CRC-driven keys,
// behind a 12-byte header whose last byte checks the password.
class TraditionalDecryptor final : public HeaderedDecryptor {
public:
    TraditionalDecryptor(const std::string& password, std::uint8_t checkByte, std::string path)
        : HeaderedDecryptor(12, std::move(path)), checkByte_(checkByte) {
        for (unsigned char c : password) {
            updateKeys(c);
        }
    }

private:
    bool open(const std::vector<std::uint8_t>& header, GWErrorPtr* error) override {
        std::uint8_t last = 0;
        for (std::uint8_t byte : header) {
            last = decryptByte(byte);
        }
        return last == checkByte_ || GWFail(error, wrongPasswordError(path_));
    }

    bool decryptData(std::span<const std::uint8_t> stored, bool isLast, const Sink& sink,
                     GWErrorPtr*) override {
        do {
            const std::size_t count = std::min(stored.size(), kPieceSize);
            for (std::size_t i = 0; i < count; ++i) {
                plain_[i] = decryptByte(stored[i]);
            }
            stored = stored.subspan(count);
            if (!sink({plain_.data(), count}, isLast && stored.empty())) {
                return false;
            }
        } while (!stored.empty());
        return true;
    }

    static std::uint32_t crc32Step(std::uint32_t crc, std::uint8_t byte) {
        static const z_crc_t* const table = get_crc_table();
        return (crc >> 8) ^ table[(crc ^ byte) & 0xFF];
    }
    void updateKeys(std::uint8_t plain) {
        keys_[0] = crc32Step(keys_[0], plain);
        keys_[1] = (keys_[1] + (keys_[0] & 0xFF)) * 134775813u + 1;
        keys_[2] = crc32Step(keys_[2], std::uint8_t(keys_[1] >> 24));
    }
    std::uint8_t decryptByte(std::uint8_t cipher) {
        const std::uint32_t temp = (keys_[2] | 2) & 0xFFFF;
        const std::uint8_t plain = cipher ^ std::uint8_t((temp * (temp ^ 1)) >> 8);
        updateKeys(plain);
        return plain;
    }

    std::array<std::uint32_t, 3> keys_{305419896u, 591751049u, 878082192u};
    std::uint8_t checkByte_;
    std::array<std::uint8_t, kPieceSize> plain_{};
};

// WinZip AES: salt and password verifier, then AES-CTR data with a
// little-endian counter from 1, then 10 bytes of HMAC-SHA1 over the
// ciphertext, which are held back until the end checks them.
class AESDecryptor final : public HeaderedDecryptor {
public:
    static constexpr std::size_t kMACLength = 10;

    AESDecryptor(std::string password, int strength, std::string path)
        : HeaderedDecryptor(6 + 4 * std::size_t(strength), std::move(path)),
          password_(std::move(password)),
          keyLength_(8 + 8 * std::size_t(strength)) {}

    ~AESDecryptor() override {
        EVP_CIPHER_CTX_free(cipher_);
        EVP_MAC_CTX_free(mac_);
        OPENSSL_cleanse(password_.data(), password_.size());
    }

    bool authenticates() const override { return true; }

private:
    bool decryptData(std::span<const std::uint8_t> stored, bool isLast, const Sink& sink,
                     GWErrorPtr* error) override {
        // Everything but the last 10 bytes seen so far is ciphertext.
        const std::size_t available = tail_.size() + stored.size();
        if (available > kMACLength) {
            std::size_t release = available - kMACLength;
            const std::size_t fromTail = std::min(release, tail_.size());
            if (fromTail > 0 && !process({tail_.data(), fromTail}, sink, error)) {
                return false;
            }
            tail_.erase(tail_.begin(), tail_.begin() + std::ptrdiff_t(fromTail));
            release -= fromTail;
            if (!process(stored.first(release), sink, error)) {
                return false;
            }
            stored = stored.subspan(release);
        }
        tail_.insert(tail_.end(), stored.begin(), stored.end());
        if (!isLast) {
            return !refused_;
        }
        if (tail_.size() < kMACLength) {
            return GWFail(error, truncatedError(path_));
        }
        std::array<std::uint8_t, EVP_MAX_MD_SIZE> code{};
        std::size_t codeLength = 0;
        if (EVP_MAC_final(mac_, code.data(), &codeLength, code.size()) != 1 ||
            codeLength < kMACLength || CRYPTO_memcmp(code.data(), tail_.data(), kMACLength) != 0) {
            return GWFail(error, GWZipEntryError(GWZipArchiveAuthenticationFailedError, path_,
                                                 "entry %s does not match its authentication "
                                                 "code: a wrong password or damaged data",
                                                 path_.c_str()));
        }
        return !refused_ && sink({}, true);
    }

    bool cryptoFailure(GWErrorPtr* error) {
        return GWFail(
            error,
            GWGenerateError(kGWCocoaErrorDomain, GWFileReadUnknownError, std::nullopt, nullptr, {},
                            "entry %s: the AES decryption could not be set up", path_.c_str()));
    }

    // Derives the keys from the salt and checks the password verifier.
    bool open(const std::vector<std::uint8_t>& header, GWErrorPtr* error) override {
        const std::size_t saltLength = keyLength_ / 2;
        std::vector<std::uint8_t> derived(2 * keyLength_ + 2);
        if (PKCS5_PBKDF2_HMAC(password_.data(), int(password_.size()), header.data(),
                              int(saltLength), 1000, EVP_sha1(), int(derived.size()),
                              derived.data()) != 1) {
            return cryptoFailure(error);
        }
        if (derived[2 * keyLength_] != header[saltLength] ||
            derived[2 * keyLength_ + 1] != header[saltLength + 1]) {
            OPENSSL_cleanse(derived.data(), derived.size());
            return GWFail(error, wrongPasswordError(path_));
        }
        const EVP_CIPHER* cipher = keyLength_ == 16   ? EVP_aes_128_ecb()
                                   : keyLength_ == 24 ? EVP_aes_192_ecb()
                                                      : EVP_aes_256_ecb();
        cipher_ = EVP_CIPHER_CTX_new();
        EVP_MAC* hmac = EVP_MAC_fetch(nullptr, "HMAC", nullptr);
        mac_ = hmac ? EVP_MAC_CTX_new(hmac) : nullptr;
        EVP_MAC_free(hmac);
        char digest[] = "SHA1";
        const OSSL_PARAM parameters[] = {
            OSSL_PARAM_construct_utf8_string(OSSL_MAC_PARAM_DIGEST, digest, 0),
            OSSL_PARAM_construct_end()};
        const bool ready =
            cipher_ && mac_ &&
            EVP_EncryptInit_ex(cipher_, cipher, nullptr, derived.data(), nullptr) == 1 &&
            EVP_CIPHER_CTX_set_padding(cipher_, 0) == 1 &&
            EVP_MAC_init(mac_, derived.data() + keyLength_, keyLength_, parameters) == 1;
        OPENSSL_cleanse(derived.data(), derived.size());
        return ready || cryptoFailure(error);
    }

    // Authenticates and decrypts ciphertext and hands it on; once the sink
    // refuses, the rest is only authenticated.
    bool process(std::span<const std::uint8_t> cipher, const Sink& sink, GWErrorPtr* error) {
        while (!cipher.empty()) {
            const std::size_t count = std::min(cipher.size(), kPieceSize);
            if (EVP_MAC_update(mac_, cipher.data(), count) != 1) {
                return cryptoFailure(error);
            }
            if (!refused_) {
                for (std::size_t i = 0; i < count; ++i) {
                    if (keystreamUsed_ == keystreamLength_ && !refillKeystream(count - i)) {
                        return cryptoFailure(error);
                    }
                    plain_[i] = cipher[i] ^ keystream_[keystreamUsed_++];
                }
                refused_ = !sink({plain_.data(), count}, false);
            }
            cipher = cipher.subspan(count);
        }
        return true;
    }

    // The counter mode by hand: OpenSSL's counts big-endian. Enough blocks
    // for `wanted` bytes, in one call.
    bool refillKeystream(std::size_t wanted) {
        const std::size_t blocks = std::min((wanted + 15) / 16, kPieceSize / 16);
        for (std::size_t block = 0; block < blocks; ++block) {
            std::uint8_t* counter = counters_.data() + 16 * block;
            std::fill(counter, counter + 16, 0);
            ++counter_;
            for (int i = 0; i < 8; ++i) {
                counter[i] = std::uint8_t(counter_ >> (8 * i));
            }
        }
        int length = 0;
        if (EVP_EncryptUpdate(cipher_, keystream_.data(), &length, counters_.data(),
                              int(blocks * 16)) != 1 ||
            std::size_t(length) != blocks * 16) {
            return false;
        }
        keystreamLength_ = blocks * 16;
        keystreamUsed_ = 0;
        return true;
    }

    std::string password_;
    const std::size_t keyLength_;
    EVP_CIPHER_CTX* cipher_ = nullptr;
    EVP_MAC_CTX* mac_ = nullptr;
    std::vector<std::uint8_t> tail_;
    bool refused_ = false;
    std::uint64_t counter_ = 0;
    std::array<std::uint8_t, kPieceSize> counters_{};
    std::array<std::uint8_t, kPieceSize> keystream_{};
    std::size_t keystreamLength_ = 0;
    std::size_t keystreamUsed_ = 0;
    std::array<std::uint8_t, kPieceSize> plain_{};
};

}  // namespace

std::unique_ptr<GWStreamDecryptor> GWZipDecryptorForFile(const GWZipFile& file,
                                                         const GWZipLocalFileHeader& header,
                                                         const std::optional<std::string>& password,
                                                         GWErrorPtr* error) {
    // Either header saying so is enough: ciphertext must never pass as data.
    const std::uint16_t flags = header.generalPurposeFlags | file.generalPurposeFlags();
    if (!(flags & 0x0001)) {
        return nullptr;
    }
    const std::string path = file.path();
    if (flags & 0x0040) {
        GWFail(error, GWZipUnknownEntityError(GWZipArchiveUnsupportedCompressionMethodError,
                                              file.compressionMethod(),
                                              "entry %s uses strong encryption, which is not "
                                              "supported",
                                              path.c_str()));
        return nullptr;
    }
    if (!password) {
        GWFail(error,
               GWZipEntryError(GWZipArchivePasswordRequiredError, path,
                               "entry %s is encrypted: a password is required", path.c_str()));
        return nullptr;
    }
    if (file.compressionMethod() != 99) {
        // With a data descriptor the CRC is not known when the header is
        // written, so the check byte is the high byte of the DOS time.
        const std::uint8_t checkByte = (header.generalPurposeFlags & 0x0008)
                                           ? std::uint8_t(header.modificationTime >> 8)
                                           : std::uint8_t(header.crc32 >> 24);
        return std::make_unique<TraditionalDecryptor>(*password, checkByte, path);
    }
    const GWDictionary info = file.extraInfo();
    const auto strength = info.find(kGWZipAESStrengthKey);
    const std::uint64_t level = strength != info.end() && strength->second.isNumber()
                                    ? strength->second.unsignedValue()
                                    : 0;
    if (level < 1 || level > 3) {
        GWFail(error,
               GWGenerateError(kGWCocoaErrorDomain, GWFileReadCorruptFileError, std::nullopt,
                               nullptr, {}, "entry %s: AES encrypted without a valid 0x9901 field",
                               path.c_str()));
        return nullptr;
    }
    return std::make_unique<AESDecryptor>(*password, int(level), path);
}
