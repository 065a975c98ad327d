#include <zstd.h>

#include <string>

#include "GWStreamDecoder.h"

namespace {

// Frames follow each other until the input ends; a window beyond zstd's
// default limit (128 MiB) is refused by the library.
class GWZstdDecoder final : public GWStreamDecoder {
public:
    ~GWZstdDecoder() override { ZSTD_freeDCtx(context_); }

    Step decode(std::span<const std::uint8_t> input, std::span<std::uint8_t> output,
                bool isFinal) override {
        Step step;
        if (input.empty() && frameEnded_) {
            step.finished = isFinal;  // until then another frame may follow
            return step;
        }
        if (!context_ && !(context_ = ZSTD_createDCtx())) {
            step.failed = true;
            step.error = "could not set up the zstd decoder";
            return step;
        }
        ZSTD_inBuffer in{input.data(), input.size(), 0};
        ZSTD_outBuffer out{output.data(), output.size(), 0};
        const std::size_t status = ZSTD_decompressStream(context_, &out, &in);
        step.consumed = in.pos;
        step.produced = out.pos;
        if (ZSTD_isError(status)) {
            step.failed = true;
            step.error = std::string("damaged zstd stream: ") + ZSTD_getErrorName(status);
            return step;
        }
        frameEnded_ = status == 0;
        if (isFinal && in.pos == in.size) {
            if (frameEnded_) {
                step.finished = true;
            } else if (out.pos < out.size) {
                step.failed = true;
                step.error = "the zstd stream ends early";
            }
        }
        return step;
    }

private:
    ZSTD_DCtx* context_ = nullptr;
    bool frameEnded_ = false;  // the last frame begun was decoded and handed out whole
};

}  // namespace

std::unique_ptr<GWStreamDecoder> GWMakeZstdDecoder() {
    return std::make_unique<GWZstdDecoder>();
}
