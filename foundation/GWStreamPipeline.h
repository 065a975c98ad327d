#pragma once

#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <span>

#include "GWChecksum.h"
#include "GWError.h"
#include "GWValue.h"

class GWDecompressor;
class GWRemoteFileHandle;

// What a stream is checked against as it passes. Digests with algorithm 0
// are neither computed nor compared.
struct GWStreamCheck {
    // The declared decoded size: decoding stops there, and a stream that
    // ends short of it does not match either. None: no bound.
    std::optional<std::uint64_t> size;
    int storedAlgorithm = GWChecksumAlgorithmNone;
    std::optional<GWData> storedDigest;
    int decodedAlgorithm = GWChecksumAlgorithmNone;
    std::optional<GWData> decodedDigest;
};

enum class GWStreamEnd {
    complete,  // every stored byte read and decoded, no more than the declared size
    failed,    // a read or decode error, in `error`
    stopped,   // the sink or the caller's cancellation stopped it
    tooLong,   // it would decode past the declared size; nothing beyond was delivered
    tooShort,  // it ended before the declared size
};

struct GWStreamOutcome {
    GWStreamEnd end = GWStreamEnd::complete;
    GWErrorPtr error;
    std::uint64_t storedBytes = 0;
    std::uint64_t decodedBytes = 0;
    // Computed once the stream is complete (none for algorithm 0).
    std::optional<GWData> storedDigest;
    std::optional<GWData> decodedDigest;

    // A digest missing on either side does not match.
    bool storedDigestMatches(const GWStreamCheck& check) const;
    bool decodedDigestMatches(const GWStreamCheck& check) const;
};

// Turns stored bytes into the bytes a decoder reads, checking what it can as
// they pass. A stage that authenticates the whole stream holds back its last
// piece until the end checks out, so a decoder never finishes on forged data.
class GWStreamDecryptor {
public:
    // (plain piece, is the last) -> go on? Exactly one call carries is-last.
    using Sink = std::function<bool(std::span<const std::uint8_t> piece, bool isLast)>;

    virtual ~GWStreamDecryptor() = default;
    // False with an error when the stream cannot be decrypted (a wrong key, a
    // failed authentication, a stream too short for its header), and without
    // one when the sink stopped.
    virtual bool decrypt(std::span<const std::uint8_t> stored, bool isLast, const Sink& sink,
                         GWErrorPtr* error) = 0;
    // Whether the end checks every byte: such a stage goes on checking the
    // rest when the sink refuses more, so that a decoder's complaint about
    // forged bytes can be told from damage.
    virtual bool authenticates() const { return false; }
};

// The one path stored bytes take to a consumer, for both formats and for
// extraction to disk and to data handlers alike:
//     read window -> [decryption] -> decoder -> verifier -> sink.
// The verifier counts and digests what the decoder hands on and never lets
// more than the declared size through, so a lying header cannot fill a disk.
class GWStreamPipeline {
public:
    // One decoded piece; it lives until the sink returns. False stops.
    using Sink = std::function<bool(std::span<const std::uint8_t> piece)>;

    GWStreamPipeline(std::shared_ptr<GWDecompressor> decoder, GWStreamCheck check, Sink sink,
                     std::unique_ptr<GWStreamDecryptor> decryptor = nullptr);
    ~GWStreamPipeline();

    // Reads [offset, offset + length) through the handle and runs it through.
    // `isCancelled` is asked before each piece read.
    const GWStreamOutcome& run(GWRemoteFileHandle& handle, std::uint64_t offset,
                               std::uint64_t length,
                               const std::function<bool()>& isCancelled = nullptr);
    // Stored bytes already in memory; `isLast` ends the stream. False once
    // the stream has ended, well or not: outcome() says how.
    bool feed(std::span<const std::uint8_t> stored, bool isLast);

    const GWStreamOutcome& outcome() const { return outcome_; }
    const GWStreamCheck& check() const { return check_; }

private:
    bool end(GWStreamEnd how, GWErrorPtr error = nullptr);
    bool deliver(std::span<const std::uint8_t> piece);
    // Plain compressed bytes into the decoder.
    bool decode(std::span<const std::uint8_t> plain, bool isLast);
    void finish();

    std::shared_ptr<GWDecompressor> decoder_;
    std::unique_ptr<GWStreamDecryptor> decryptor_;
    GWStreamCheck check_;
    Sink sink_;
    std::unique_ptr<GWChecksum> storedDigest_;
    std::unique_ptr<GWChecksum> decodedDigest_;
    GWStreamOutcome outcome_;
    bool ended_ = false;
    // The decoder failed on authenticated bytes; the rest is read only to learn
    // whether they were forged.
    bool draining_ = false;
};
