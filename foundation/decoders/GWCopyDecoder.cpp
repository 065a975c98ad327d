#include <algorithm>
#include <cstring>

#include "GWStreamDecoder.h"

namespace {

// Stored data: the output is the input.
class GWCopyDecoder final : public GWStreamDecoder {
public:
    Step decode(std::span<const std::uint8_t> input, std::span<std::uint8_t> output,
                bool isFinal) override {
        Step step;
        step.consumed = step.produced = std::min(input.size(), output.size());
        if (step.produced > 0) {
            std::memcpy(output.data(), input.data(), step.produced);
        }
        step.finished = isFinal && step.consumed == input.size();
        return step;
    }
};

}  // namespace

std::unique_ptr<GWStreamDecoder> GWMakeCopyDecoder() {
    return std::make_unique<GWCopyDecoder>();
}
