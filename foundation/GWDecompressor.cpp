#include "GWDecompressor.h"

#include <algorithm>

#include "GWRemoteFileHandle.h"
#include "GWStreamPipeline.h"
#include "decoders/GWStreamDecoder.h"

namespace {

// Output handed back per step; a caller asked to run again gets the rest in
// further pieces of this size.
constexpr std::size_t kOutputPieceSize = 256 * 1024;
// Pieces handed to a sink start this small and double while steps fill them,
// so that the thousands of small entries of an archive do not each pay for a
// large buffer.
constexpr std::size_t kFirstSinkPieceSize = 16 * 1024;

GWErrorPtr damagedStreamError(const std::string& reason) {
    return GWGenerateError(kGWCocoaErrorDomain, GWFileReadCorruptFileError, std::nullopt, nullptr,
                           {}, "%s", reason.c_str());
}

}  // namespace

GWDecompressor::GWDecompressor(std::unique_ptr<GWStreamDecoder> engine)
    : engine_(std::move(engine)) {}

GWDecompressor::~GWDecompressor() = default;

std::shared_ptr<GWDecompressor> GWDecompressor::initForStreamingWithAlgorithm(int algorithm,
                                                                              GWErrorPtr* error) {
    std::unique_ptr<GWStreamDecoder> engine;
    switch (algorithm) {
        case GWDecompressorAlgorithmCopy: engine = GWMakeCopyDecoder(); break;
        case GWDecompressorAlgorithmDeflate: engine = GWMakeInflateDecoder(); break;
        case GWDecompressorAlgorithmBzip2: engine = GWMakeBzip2Decoder(); break;
        case GWDecompressorAlgorithmDeflate64: engine = GWMakeDeflate64Decoder(); break;
        case GWDecompressorAlgorithmLZMA: engine = GWMakeZipLzmaDecoder(UINT64_MAX, true); break;
        case GWDecompressorAlgorithmZstd: engine = GWMakeZstdDecoder(); break;
        case GWDecompressorAlgorithmXZ: engine = GWMakeXzDecoder(); break;
        default:
            GWFail(error, GWGenerateError(kGWPOSIXErrorDomain, EINVAL, std::nullopt, nullptr, {},
                                          "Unknown decompressor algorithm %d", algorithm));
            return nullptr;
    }
    return std::make_shared<GWDecompressor>(std::move(engine));
}

std::shared_ptr<GWDecompressor> GWDecompressor::initForUnshrinkStreamingWithUncompressedSize(
    std::uint64_t size, GWErrorPtr* /*error*/) {
    return std::make_shared<GWDecompressor>(GWMakeUnshrinkDecoder(size));
}

std::shared_ptr<GWDecompressor> GWDecompressor::initForExplodeStreamingWithUncompressedSize(
    std::uint64_t size, bool useLargeDictionary, bool useLiteralTree, GWErrorPtr* /*error*/) {
    return std::make_shared<GWDecompressor>(
        GWMakeExplodeDecoder(size, useLargeDictionary, useLiteralTree));
}

std::shared_ptr<GWDecompressor> GWDecompressor::initForLZMAStreamingWithUncompressedSize(
    std::uint64_t size, bool hasEndMarker, GWErrorPtr* /*error*/) {
    return std::make_shared<GWDecompressor>(GWMakeZipLzmaDecoder(size, hasEndMarker));
}

std::span<const std::uint8_t> GWDecompressor::takeInput(std::span<const std::uint8_t> input) {
    if (pendingStart_ == pending_.size()) {
        return input;
    }
    // Input left over from an earlier step comes first; copy only then.
    if (!input.empty()) {
        pending_.erase(pending_.begin(), pending_.begin() + std::ptrdiff_t(pendingStart_));
        pendingStart_ = 0;
        pending_.insert(pending_.end(), input.begin(), input.end());
    }
    return std::span<const std::uint8_t>(pending_).subspan(pendingStart_);
}

void GWDecompressor::keepInput(std::span<const std::uint8_t> rest) {
    const bool insidePending = !pending_.empty() && rest.data() >= pending_.data() &&
                               rest.data() <= pending_.data() + pending_.size();
    if (insidePending) {
        // A caller running again with empty input moves through the held
        // input without copying it each time.
        pendingStart_ = std::size_t(rest.data() - pending_.data());
    } else {
        pending_.assign(rest.begin(), rest.end());
        pendingStart_ = 0;
    }
}

std::span<std::uint8_t> GWDecompressor::outputRoom(std::size_t size) {
    if (scratchSize_ < size) {
        scratch_.reset(new std::uint8_t[size]);
        scratchSize_ = size;
    }
    return {scratch_.get(), scratchSize_};
}

bool GWDecompressor::fail(const std::string& reason, GWErrorPtr* error) {
    failure_ = damagedStreamError(reason);
    pending_.clear();
    pendingStart_ = 0;
    return GWFail(error, failure_);
}

std::optional<GWData> GWDecompressor::decompressedDataFromStreamWithInputData(
    std::span<const std::uint8_t> input, bool isFinal, bool* shouldRunAgain, GWErrorPtr* error) {
    if (shouldRunAgain) {
        *shouldRunAgain = false;
    }
    if (failure_) {
        GWFail(error, failure_);
        return std::nullopt;
    }
    if (finished_) {
        return GWData();
    }
    std::span<const std::uint8_t> in = takeInput(input);
    // Decode into a buffer kept across steps and copy out only what came, so
    // small input pieces do not pay for a large allocation each.
    std::span<std::uint8_t> output = outputRoom(kOutputPieceSize).first(kOutputPieceSize);
    std::size_t produced = 0;
    bool full = false;
    for (;;) {
        const auto step = engine_->decode(in, output.subspan(produced), isFinal);
        in = in.subspan(step.consumed);
        produced += step.produced;
        if (step.failed) {
            fail(step.error, error);
            return std::nullopt;
        }
        if (step.finished) {
            finished_ = true;
            break;
        }
        if (produced == output.size()) {
            full = true;
            break;
        }
        if (step.consumed == 0 && step.produced == 0) {
            if (isFinal) {
                fail("the compressed stream ends early", error);
                return std::nullopt;
            }
            break;  // the engine waits for more input
        }
    }
    if (finished_) {
        pending_.clear();
        pendingStart_ = 0;
    } else {
        keepInput(in);
    }
    if (shouldRunAgain) {
        *shouldRunAgain = full && !finished_;
    }
    return GWData(output.begin(), output.begin() + std::ptrdiff_t(produced));
}

bool GWDecompressor::decompressStreamWithInputData(std::span<const std::uint8_t> input,
                                                   bool isFinal, const PieceSink& sink,
                                                   GWErrorPtr* error) {
    if (failure_) {
        return GWFail(error, failure_);
    }
    if (finished_) {
        return true;
    }
    std::span<const std::uint8_t> in = takeInput(input);
    std::span<std::uint8_t> room = outputRoom(kFirstSinkPieceSize);
    for (;;) {
        const auto step = engine_->decode(in, room, isFinal);
        in = in.subspan(step.consumed);
        if (step.failed) {
            return fail(step.error, error);
        }
        if (step.produced > 0 && !sink(room.first(step.produced))) {
            keepInput(in);
            return false;
        }
        if (step.produced == room.size() && room.size() < kOutputPieceSize) {
            room = outputRoom(room.size() * 2);
        }
        if (step.finished) {
            finished_ = true;
            pending_.clear();
            pendingStart_ = 0;
            return true;
        }
        if (step.consumed == 0 && step.produced == 0) {
            if (isFinal) {
                return fail("the compressed stream ends early", error);
            }
            keepInput(in);  // the engine waits for more input
            return true;
        }
    }
}

bool GWDecompressor::isDataCompressed(std::span<const std::uint8_t> data, int* algorithm) {
    int found = -1;
    if (data.size() >= 2 && (data[0] & 0x0F) == 8 && (data[0] >> 4) <= 7 &&
        ((unsigned(data[0]) << 8) | data[1]) % 31 == 0) {
        found = GWDecompressorAlgorithmDeflate;
    } else if (data.size() >= 4 && data[0] == 'B' && data[1] == 'Z' && data[2] == 'h' &&
               data[3] >= '1' && data[3] <= '9') {
        found = GWDecompressorAlgorithmBzip2;
    }
    if (found < 0) {
        return false;
    }
    if (algorithm) {
        *algorithm = found;
    }
    return true;
}

std::optional<GWData> GWDecompressor::decompressedDataFromData(std::span<const std::uint8_t> data,
                                                               GWErrorPtr* error,
                                                               std::uint64_t maxLength) {
    int algorithm = 0;
    if (!isDataCompressed(data, &algorithm)) {
        GWFail(error, damagedStreamError("The data is not a recognised compressed stream"));
        return std::nullopt;
    }
    auto decompressor = initForStreamingWithAlgorithm(algorithm, error);
    GWData result;
    std::span<const std::uint8_t> input = data;
    bool again = true;
    while (again) {
        auto piece =
            decompressor->decompressedDataFromStreamWithInputData(input, true, &again, error);
        if (!piece) {
            return std::nullopt;
        }
        if (piece->size() > maxLength - result.size()) {
            GWFail(error,
                   GWGenerateError(kGWCocoaErrorDomain, GWFileReadCorruptFileError, std::nullopt,
                                   nullptr, {}, "The data decompresses to more than %llu bytes",
                                   (unsigned long long)maxLength));
            return std::nullopt;
        }
        result.insert(result.end(), piece->begin(), piece->end());
        input = {};
    }
    return result;
}

void GWDecompressor::decompressRemoteFileHandle(const std::shared_ptr<GWRemoteFileHandle>& handle,
                                                std::uint64_t offset, std::uint64_t length,
                                                int algorithm, int compressedChecksumAlgorithm,
                                                int decompressedChecksumAlgorithm,
                                                const StreamHandler& handler) {
    GWErrorPtr error;
    auto decompressor = initForStreamingWithAlgorithm(algorithm, &error);
    if (!decompressor) {
        handler({}, 0, 0, true, std::nullopt, std::nullopt, error);
        return;
    }
    GWStreamCheck check;
    check.storedAlgorithm = compressedChecksumAlgorithm;
    check.decodedAlgorithm = decompressedChecksumAlgorithm;
    const GWStreamPipeline* running = nullptr;
    GWStreamPipeline pipeline(decompressor, check, [&](std::span<const std::uint8_t> piece) {
        const GWStreamOutcome& sofar = running->outcome();
        return handler(piece, sofar.storedBytes, sofar.decodedBytes, false, std::nullopt,
                       std::nullopt, nullptr);
    });
    running = &pipeline;
    const GWStreamOutcome& outcome = pipeline.run(*handle, offset, length);
    const std::uint64_t storedBytes = outcome.storedBytes, decodedBytes = outcome.decodedBytes;
    if (outcome.end == GWStreamEnd::failed) {
        handler({}, storedBytes, decodedBytes, true, std::nullopt, std::nullopt, outcome.error);
    } else if (outcome.end == GWStreamEnd::complete) {
        // The end is known only after the last piece, so the digests come with an empty one.
        handler({}, storedBytes, decodedBytes, true, outcome.storedDigest, outcome.decodedDigest,
                nullptr);
    }
}
