#include <lzma.h>

#include <algorithm>
#include <string>

#include "GWStreamDecoder.h"

namespace {

// A stream may ask for its dictionary up front; past this it is refused
// rather than allocated. xz's largest preset needs a tenth of it.
constexpr std::uint64_t kMemoryLimit = 1024ull * 1024 * 1024;
constexpr std::size_t kZipHeaderSize = 9;  // version (2), properties size (2), properties (5)

const char* lzmaErrorText(lzma_ret status) {
    switch (status) {
        case LZMA_FORMAT_ERROR: return "not an xz or lzma stream";
        case LZMA_OPTIONS_ERROR: return "unsupported options";
        case LZMA_DATA_ERROR: return "corrupt data";
        case LZMA_MEMLIMIT_ERROR: return "it needs more than 1 GiB of memory";
        case LZMA_MEM_ERROR: return "out of memory";
        case LZMA_UNSUPPORTED_CHECK: return "unsupported integrity check";
        default: return "undecodable data";
    }
}

// xz and .lzma streams (XAR, ZIP method 95), and the raw LZMA of ZIP method
// 14 behind its own small header.
class GWLzmaDecoder final : public GWStreamDecoder {
public:
    GWLzmaDecoder(bool zipForm, std::uint64_t size, bool hasEndMarker)
        : zipForm_(zipForm), size_(size), hasEndMarker_(hasEndMarker) {}
    ~GWLzmaDecoder() override { lzma_end(&stream_); }

    Step decode(std::span<const std::uint8_t> input, std::span<std::uint8_t> output,
                bool isFinal) override {
        Step step;
        if (!started_) {
            if (zipForm_ && input.size() < kZipHeaderSize && !isFinal) {
                return step;
            }
            if (!start(input, step)) {
                return step;
            }
            input = input.subspan(step.consumed);
        }
        if (ended_) {
            step.finished = true;
            return step;
        }
        stream_.next_in = input.data();
        stream_.avail_in = input.size();
        stream_.next_out = output.data();
        stream_.avail_out = output.size();
        const lzma_ret status = lzma_code(&stream_, LZMA_RUN);
        step.consumed += input.size() - stream_.avail_in;
        step.produced = output.size() - stream_.avail_out;
        if (status == LZMA_STREAM_END) {
            ended_ = true;
            step.finished = true;
        } else if (status != LZMA_OK && status != LZMA_BUF_ERROR) {
            step.failed = true;
            step.error = std::string("damaged ") + name() + " stream: " + lzmaErrorText(status);
        } else if (isFinal && stream_.avail_in == 0 && stream_.avail_out > 0) {
            // Room left and nothing more to read: the stream was cut short.
            step.failed = true;
            step.error = std::string("the ") + name() + " stream ends early";
        }
        return step;
    }

private:
    const char* name() const { return zipForm_ ? "LZMA" : "xz"; }

    bool start(std::span<const std::uint8_t> input, Step& step) {
        started_ = true;
        lzma_ret status;
        if (!zipForm_) {
            status = lzma_auto_decoder(&stream_, kMemoryLimit, 0);
        } else {
            if (input.size() < kZipHeaderSize || input[2] != 5 || input[3] != 0) {
                step.failed = true;
                step.error = "damaged LZMA stream: no valid properties header";
                return false;
            }
            const std::uint8_t* properties = input.data() + 4;
            unsigned bits = properties[0];
            if (bits >= 9 * 5 * 5) {
                step.failed = true;
                step.error = "damaged LZMA stream: invalid properties";
                return false;
            }
            lzma_options_lzma options{};
            lzma_lzma_preset(&options, 0);
            options.lc = bits % 9;
            options.lp = (bits / 9) % 5;
            options.pb = bits / 45;
            std::uint64_t dictionary =
                std::uint64_t(properties[1]) | std::uint64_t(properties[2]) << 8 |
                std::uint64_t(properties[3]) << 16 | std::uint64_t(properties[4]) << 24;
            // Nothing can reach back further than the stream's size.
            dictionary = std::clamp<std::uint64_t>(
                dictionary, LZMA_DICT_SIZE_MIN, std::max<std::uint64_t>(size_, LZMA_DICT_SIZE_MIN));
            if (dictionary > kMemoryLimit) {
                step.failed = true;
                step.error =
                    "damaged LZMA stream: " + std::string(lzmaErrorText(LZMA_MEMLIMIT_ERROR));
                return false;
            }
            options.dict_size = std::uint32_t(dictionary);
            options.ext_flags = LZMA_LZMA1EXT_ALLOW_EOPM;
            // Without the end marker the stream stops at the entry's size.
            const std::uint64_t known = hasEndMarker_ ? UINT64_MAX : size_;
            options.ext_size_low = std::uint32_t(known);
            options.ext_size_high = std::uint32_t(known >> 32);
            const lzma_filter filters[] = {{LZMA_FILTER_LZMA1EXT, &options},
                                           {LZMA_VLI_UNKNOWN, nullptr}};
            status = lzma_raw_decoder(&stream_, filters);
            step.consumed = kZipHeaderSize;
        }
        if (status != LZMA_OK) {
            step.failed = true;
            step.error = std::string("could not set up the ") + name() +
                         " decoder: " + lzmaErrorText(status);
            return false;
        }
        return true;
    }

    const bool zipForm_;
    const std::uint64_t size_;
    const bool hasEndMarker_;
    lzma_stream stream_ = LZMA_STREAM_INIT;
    bool started_ = false;
    bool ended_ = false;
};

}  // namespace

std::unique_ptr<GWStreamDecoder> GWMakeXzDecoder() {
    return std::make_unique<GWLzmaDecoder>(false, UINT64_MAX, true);
}

std::unique_ptr<GWStreamDecoder> GWMakeZipLzmaDecoder(std::uint64_t uncompressedSize,
                                                      bool hasEndMarker) {
    return std::make_unique<GWLzmaDecoder>(true, uncompressedSize, hasEndMarker);
}
