#include <zlib.h>

#include <climits>

#include "GWStreamDecoder.h"

namespace {

// The reference decoder: slower than the default one, kept so that tests can
// hold the default to zlib's verdict on the same streams.
class GWZlibInflateDecoder final : public GWStreamDecoder {
public:
    ~GWZlibInflateDecoder() override {
        if (initialised_) {
            inflateEnd(&stream_);
        }
    }

    Step decode(std::span<const std::uint8_t> input, std::span<std::uint8_t> output,
                bool isFinal) override {
        Step step;
        if (!initialised_) {
            // The header decides between the two wrappings; wait for two bytes.
            if (input.size() < 2 && !isFinal) {
                return step;
            }
            const bool zlib = input.size() >= 2 && GWLooksLikeZlibHeader(input[0], input[1]);
            if (inflateInit2(&stream_, zlib ? MAX_WBITS : -MAX_WBITS) != Z_OK) {
                step.failed = true;
                step.error = "could not set up the deflate decoder";
                return step;
            }
            initialised_ = true;
        }
        // zlib counts in 32 bits; larger spans are simply offered in parts.
        stream_.next_in = const_cast<Bytef*>(input.data());
        stream_.avail_in = uInt(std::min<std::size_t>(input.size(), UINT_MAX));
        stream_.next_out = output.data();
        stream_.avail_out = uInt(std::min<std::size_t>(output.size(), UINT_MAX));
        const int status = inflate(&stream_, Z_NO_FLUSH);
        step.consumed = std::min<std::size_t>(input.size(), UINT_MAX) - stream_.avail_in;
        step.produced = std::min<std::size_t>(output.size(), UINT_MAX) - stream_.avail_out;
        switch (status) {
            case Z_STREAM_END: step.finished = true; break;
            case Z_OK:
            case Z_BUF_ERROR:  // no progress possible: more input or more room needed
                // Room left and nothing more to read: the stream was cut short.
                if (isFinal && step.consumed == input.size() && stream_.avail_out > 0) {
                    step.failed = true;
                    step.error = "the deflate stream ends early";
                }
                break;
            default:
                step.failed = true;
                step.error = std::string("damaged deflate stream: ") +
                             (stream_.msg ? stream_.msg : zError(status));
                break;
        }
        return step;
    }

private:
    z_stream stream_{};
    bool initialised_ = false;
};

}  // namespace

std::unique_ptr<GWStreamDecoder> GWMakeZlibInflateDecoder() {
    return std::make_unique<GWZlibInflateDecoder>();
}
