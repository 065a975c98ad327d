#include <bzlib.h>

#include <climits>

#include "GWStreamDecoder.h"

namespace {

class GWBzip2Decoder final : public GWStreamDecoder {
public:
    ~GWBzip2Decoder() override { reset(); }

    Step decode(std::span<const std::uint8_t> input, std::span<std::uint8_t> output,
                bool isFinal) override {
        Step step;
        if (streamEnded_) {
            // Parallel compressors write several streams back to back.
            if (input.size() < 3 && !isFinal) {
                return step;
            }
            if (input.size() < 3 || input[0] != 'B' || input[1] != 'Z' || input[2] != 'h') {
                step.consumed = input.size();
                step.finished = true;
                return step;
            }
            reset();
        }
        if (!initialised_) {
            if (BZ2_bzDecompressInit(&stream_, 0, 0) != BZ_OK) {
                step.failed = true;
                step.error = "could not set up the bzip2 decoder";
                return step;
            }
            initialised_ = true;
        }
        const std::size_t offeredIn = std::min<std::size_t>(input.size(), UINT_MAX);
        const std::size_t offeredOut = std::min<std::size_t>(output.size(), UINT_MAX);
        stream_.next_in = reinterpret_cast<char*>(const_cast<std::uint8_t*>(input.data()));
        stream_.avail_in = unsigned(offeredIn);
        stream_.next_out = reinterpret_cast<char*>(output.data());
        stream_.avail_out = unsigned(offeredOut);
        const int status = BZ2_bzDecompress(&stream_);
        step.consumed = offeredIn - stream_.avail_in;
        step.produced = offeredOut - stream_.avail_out;
        if (status == BZ_STREAM_END) {
            streamEnded_ = true;
            if (isFinal && step.consumed == input.size()) {
                step.finished = true;
            }
        } else if (status != BZ_OK) {
            step.failed = true;
            step.error = "damaged bzip2 stream (status " + std::to_string(status) + ")";
        } else if (isFinal && step.consumed == input.size() && stream_.avail_out > 0) {
            // Room left and nothing more to read: the stream was cut short.
            step.failed = true;
            step.error = "the bzip2 stream ends early";
        }
        return step;
    }

private:
    void reset() {
        if (initialised_) {
            BZ2_bzDecompressEnd(&stream_);
        }
        stream_ = bz_stream{};
        initialised_ = false;
        streamEnded_ = false;
    }

    bz_stream stream_{};
    bool initialised_ = false;
    bool streamEnded_ = false;
};

}  // namespace

std::unique_ptr<GWStreamDecoder> GWMakeBzip2Decoder() {
    return std::make_unique<GWBzip2Decoder>();
}
