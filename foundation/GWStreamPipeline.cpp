#include "GWStreamPipeline.h"

#include "GWDecompressor.h"
#include "GWRemoteFileHandle.h"

namespace {

bool digestMatches(const std::optional<GWData>& computed, const std::optional<GWData>& expected) {
    return computed && expected && *computed == *expected;
}

}  // namespace

bool GWStreamOutcome::storedDigestMatches(const GWStreamCheck& check) const {
    return digestMatches(storedDigest, check.storedDigest);
}

bool GWStreamOutcome::decodedDigestMatches(const GWStreamCheck& check) const {
    return digestMatches(decodedDigest, check.decodedDigest);
}

GWStreamPipeline::GWStreamPipeline(std::shared_ptr<GWDecompressor> decoder, GWStreamCheck check,
                                   Sink sink, std::unique_ptr<GWStreamDecryptor> decryptor)
    : decoder_(std::move(decoder)),
      decryptor_(std::move(decryptor)),
      check_(std::move(check)),
      sink_(std::move(sink)),
      storedDigest_(GWChecksum::checksumWithAlgorithm(check_.storedAlgorithm)),
      decodedDigest_(GWChecksum::checksumWithAlgorithm(check_.decodedAlgorithm)) {}

GWStreamPipeline::~GWStreamPipeline() = default;

bool GWStreamPipeline::end(GWStreamEnd how, GWErrorPtr error) {
    ended_ = true;
    outcome_.end = how;
    outcome_.error = std::move(error);
    return false;
}

bool GWStreamPipeline::deliver(std::span<const std::uint8_t> piece) {
    const std::uint64_t room = check_.size ? *check_.size - outcome_.decodedBytes : UINT64_MAX;
    const bool overflows = piece.size() > room;
    if (overflows) {
        piece = piece.first(std::size_t(room));
    }
    if (!piece.empty()) {
        outcome_.decodedBytes += piece.size();
        if (decodedDigest_) {
            decodedDigest_->update(piece);
        }
        if (sink_ && !sink_(piece)) {
            return end(GWStreamEnd::stopped);
        }
    }
    return overflows ? end(GWStreamEnd::tooLong) : true;
}

void GWStreamPipeline::finish() {
    if (check_.size && outcome_.decodedBytes < *check_.size) {
        end(GWStreamEnd::tooShort);
    } else {
        end(GWStreamEnd::complete);
    }
    if (storedDigest_) {
        outcome_.storedDigest = storedDigest_->finish();
    }
    if (decodedDigest_) {
        outcome_.decodedDigest = decodedDigest_->finish();
    }
}

bool GWStreamPipeline::feed(std::span<const std::uint8_t> stored, bool isLast) {
    if (ended_ && !draining_) {
        return false;
    }
    outcome_.storedBytes += stored.size();
    if (storedDigest_) {
        storedDigest_->update(stored);
    }
    if (!decryptor_) {
        return decode(stored, isLast);
    }
    GWErrorPtr decryptError;
    const bool going = decryptor_->decrypt(
        stored, isLast,
        [this](std::span<const std::uint8_t> plain, bool last) {
            return !ended_ && decode(plain, last);
        },
        &decryptError);
    if (decryptError) {
        // Forged bytes explain whatever the decoder said about them.
        draining_ = false;
        return end(GWStreamEnd::failed, decryptError);
    }
    if (!draining_ && ended_ && outcome_.end == GWStreamEnd::failed &&
        decryptor_->authenticates()) {
        draining_ = true;
    }
    if (draining_) {
        draining_ = !isLast;
        return draining_;
    }
    return going && !ended_;
}

bool GWStreamPipeline::decode(std::span<const std::uint8_t> plain, bool isLast) {
    GWErrorPtr decodeError;
    if (!decoder_->decompressStreamWithInputData(
            plain, isLast, [this](std::span<const std::uint8_t> piece) { return deliver(piece); },
            &decodeError)) {
        return ended_ ? false : end(GWStreamEnd::failed, decodeError);
    }
    if (isLast) {
        finish();
        return false;
    }
    return true;
}

const GWStreamOutcome& GWStreamPipeline::run(GWRemoteFileHandle& handle, std::uint64_t offset,
                                             std::uint64_t length,
                                             const std::function<bool()>& isCancelled) {
    if (length == 0) {
        // An empty range is an empty stream whatever its nominal compression;
        // a decryptor still has to find its header missing.
        if (decryptor_) {
            feed({}, true);
        } else {
            finish();
        }
        return outcome_;
    }
    handle.readDataAtOffset(offset, length, UINT64_MAX,
                            [&](GWRemoteFileHandle&, std::span<const std::uint8_t> piece,
                                bool isLast, const GWErrorPtr& readError) {
                                if (isCancelled && isCancelled()) {
                                    return end(GWStreamEnd::stopped);
                                }
                                if (readError) {
                                    return end(GWStreamEnd::failed, readError);
                                }
                                return feed(piece, isLast);
                            });
    if (!ended_) {
        // The handle stopped delivering without a last piece.
        end(GWStreamEnd::failed, GWCocoaError(GWFileReadCorruptFileError, handle.URL()));
    }
    return outcome_;
}
