#pragma once

#include <cstdint>
#include <span>

#include "foundation/GWValue.h"

// Info-ZIP's Unicode path and comment fields (0x7075, 0x6375) carry a CRC-32
// that the format defines over the header's own name or comment, while the
// decoders check it against the UTF-8 text. Where the stored CRC matches the
// header's bytes, this rewrites it to the text's, so that archives written to
// the format's letter still load. Other fields are copied unchanged.
GWData GWZipNormaliseUnicodeFieldCRCs(std::span<const std::uint8_t> extraField,
                                      std::span<const std::uint8_t> headerName,
                                      std::span<const std::uint8_t> headerComment);
