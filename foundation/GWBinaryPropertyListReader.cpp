#include <bit>
#include <cstdarg>

#include "GWBinaryPropertyList.h"
#include "GWByteReader.h"
#include "GWFormat.h"
#include "GWUTF16.h"

namespace {

constexpr std::size_t kTrailerSize = 32;
constexpr std::size_t kHeaderSize = 8;

// Shared objects let a small file describe a huge tree (each array naming the
// next one twice doubles it). What the reader materialises is capped in
// proportion to the file: ordinary files stay far below these bounds.
constexpr std::uint64_t kValuesPerFileByte = 2;
constexpr std::uint64_t kExtraValues = 4096;
constexpr std::uint64_t kPayloadPerFileByte = 32;
constexpr std::uint64_t kExtraPayload = 64 << 20;

class Reader {
public:
    explicit Reader(std::span<const std::uint8_t> bytes) : file_(bytes) {}

    std::optional<GWValue> read(GWErrorPtr* error) {
        GWValue root;
        if (!readTrailer() || !readObject(topObject_, 0, root)) {
            GWDictionary details{{"Offset", failureOffset_}};
            GWFail(error, GWGenerateError(kGWCocoaErrorDomain, GWFileReadCorruptFileError,
                                          std::nullopt, nullptr, std::move(details),
                                          "Damaged binary property list at offset 0x%llx: %s",
                                          (unsigned long long)failureOffset_, failure_.c_str()));
            return std::nullopt;
        }
        return root;
    }

private:
    bool fail(std::uint64_t offset, const char* format, ...) __attribute__((format(printf, 3, 4))) {
        va_list arguments;
        va_start(arguments, format);
        failure_ = GWFormatV(format, arguments);
        va_end(arguments);
        failureOffset_ = offset;
        return false;
    }

    bool readTrailer() {
        GWByteReader whole(file_);
        if (file_.size() < kHeaderSize + kTrailerSize) {
            return fail(0, "%zu bytes are too few for a header and a trailer", file_.size());
        }
        if (!GWBinaryPropertyList::isBinaryPropertyList(file_)) {
            return fail(0, "no \"bplist00\" signature");
        }
        const std::size_t trailerOffset = file_.size() - kTrailerSize;
        GWByteReader trailer = whole.slice(trailerOffset, kTrailerSize);
        trailer.skip(6);
        const std::uint8_t offsetSize = trailer.u8();
        refSize_ = trailer.u8();
        const std::uint64_t count = trailer.u64be();
        topObject_ = trailer.u64be();
        const std::uint64_t tableOffset = trailer.u64be();
        if (!trailer.ok()) {
            return fail(trailerOffset, "trailer: %s", trailer.failureDescription().c_str());
        }
        if (offsetSize < 1 || offsetSize > 8 || refSize_ < 1 || refSize_ > 8) {
            return fail(trailerOffset + 6, "the trailer gives offset size %u and reference size %u",
                        offsetSize, refSize_);
        }
        if (tableOffset < kHeaderSize || tableOffset > trailerOffset) {
            return fail(trailerOffset + 24,
                        "offset table at 0x%llx lies outside the object area [0x8, 0x%zx)",
                        (unsigned long long)tableOffset, trailerOffset);
        }
        if (count == 0 || count > (trailerOffset - tableOffset) / offsetSize) {
            return fail(trailerOffset + 8, "%llu objects do not fit the offset table at 0x%llx",
                        (unsigned long long)count, (unsigned long long)tableOffset);
        }
        if (topObject_ >= count) {
            return fail(trailerOffset + 16, "top object %llu is not one of the %llu objects",
                        (unsigned long long)topObject_, (unsigned long long)count);
        }
        GWByteReader table = whole.slice(tableOffset, count * offsetSize);
        offsets_.resize(count);
        for (std::uint64_t i = 0; i < count; ++i) {
            offsets_[i] = table.uintBE(offsetSize);
            if (offsets_[i] < kHeaderSize || offsets_[i] >= tableOffset) {
                return fail(tableOffset + i * offsetSize,
                            "object %llu starts at 0x%llx, outside the object area "
                            "[0x8, 0x%llx)",
                            (unsigned long long)i, (unsigned long long)offsets_[i],
                            (unsigned long long)tableOffset);
            }
        }
        objects_ = whole.slice(0, tableOffset);
        active_.assign(count, false);
        valueBudget_ = kValuesPerFileByte * file_.size() + kExtraValues;
        payloadBudget_ = kPayloadPerFileByte * file_.size() + kExtraPayload;
        return true;
    }

    // The count that follows a marker: the low nibble, or an integer object
    // after a nibble of 0xF.
    bool readCount(GWByteReader& in, std::uint8_t nibble, std::uint64_t start,
                   std::uint64_t& count) {
        if (nibble != 0x0F) {
            count = nibble;
            return true;
        }
        const std::uint8_t marker = in.u8();
        if (in.ok() && ((marker & 0xF0) != 0x10 || (marker & 0x0F) > 3)) {
            return fail(in.offset() - 1,
                        "count marker 0x%02x of the object at 0x%llx is not an integer of 1 to "
                        "8 bytes",
                        marker, (unsigned long long)start);
        }
        count = in.uintBE(std::size_t(1) << (marker & 0x0F));
        return in.ok() || truncated(in, start);
    }

    bool truncated(const GWByteReader& in, std::uint64_t start) {
        return fail(in.offset(), "the object at 0x%llx runs into the offset table (%s)",
                    (unsigned long long)start, in.failureDescription().c_str());
    }

    // `count` elements of `width` bytes, checked against the bytes that remain
    // before anything is allocated.
    bool take(GWByteReader& in, std::uint64_t count, std::uint64_t width, std::uint64_t start,
              std::span<const std::uint8_t>& bytes) {
        if (count > in.remaining() / width) {
            return fail(in.offset(),
                        "the object at 0x%llx claims %llu elements of %llu bytes; only 0x%zx bytes "
                        "remain",
                        (unsigned long long)start, (unsigned long long)count,
                        (unsigned long long)width, in.remaining());
        }
        bytes = in.bytes(count * width);
        return true;
    }

    bool spend(std::uint64_t payload, std::uint64_t start) {
        if (++values_ > valueBudget_ || payload > payloadBudget_ - payload_) {
            return fail(start, "shared objects expand past %llu values or %llu bytes",
                        (unsigned long long)valueBudget_, (unsigned long long)payloadBudget_);
        }
        payload_ += payload;
        return true;
    }

    bool readObject(std::uint64_t index, std::size_t depth, GWValue& out) {
        const std::uint64_t start = offsets_[index];
        GWByteReader in = objects_;
        in.seek(start);
        const std::uint8_t marker = in.u8();
        const std::uint8_t nibble = marker & 0x0F;
        switch (marker & 0xF0) {
            case 0x00:
                if (marker == 0x08 || marker == 0x09) {
                    out = GWValue(marker == 0x09);
                    return spend(0, start);
                }
                break;
            case 0x10: return readInteger(in, nibble, start, out) && spend(0, start);
            case 0x20:
                if (nibble == 2) {
                    out = GWValue(double(std::bit_cast<float>(in.u32be())));
                } else if (nibble == 3) {
                    out = GWValue(std::bit_cast<double>(in.u64be()));
                } else {
                    break;
                }
                return (in.ok() || truncated(in, start)) && spend(0, start);
            case 0x30:
                if (marker != 0x33) {
                    break;
                }
                out = GWValue(GWBinaryPropertyList::dateWithTimeIntervalSince2001(
                    std::bit_cast<double>(in.u64be())));
                return (in.ok() || truncated(in, start)) && spend(0, start);
            case 0x40:
            case 0x50:
            case 0x60: return readBytes(in, marker, start, out);
            case 0xA0:
            case 0xD0: return readContainer(in, index, marker, depth, out);
            default: break;
        }
        if (!in.ok()) {
            return truncated(in, start);
        }
        return fail(start, "object %llu has the unsupported marker 0x%02x",
                    (unsigned long long)index, marker);
    }

    bool readInteger(GWByteReader& in, std::uint8_t nibble, std::uint64_t start, GWValue& out) {
        if (nibble > 4) {
            return fail(start, "an integer is %u bytes wide", 1u << nibble);
        }
        if (nibble < 4) {
            // The format's 8-byte integers are signed; narrower ones cannot be negative.
            const std::uint64_t bits = in.uintBE(std::size_t(1) << nibble);
            out = GWValue(std::int64_t(bits));
            return in.ok() || truncated(in, start);
        }
        const std::uint64_t high = in.u64be();
        const std::uint64_t low = in.u64be();
        if (!in.ok()) {
            return truncated(in, start);
        }
        if (high == 0) {
            out = low > INT64_MAX ? GWValue(low) : GWValue(std::int64_t(low));
        } else if (high == UINT64_MAX && low > INT64_MAX) {
            out = GWValue(std::int64_t(low));
        } else {
            return fail(start, "an integer does not fit in 64 bits");
        }
        return true;
    }

    bool readBytes(GWByteReader& in, std::uint8_t marker, std::uint64_t start, GWValue& out) {
        std::uint64_t count = 0;
        std::span<const std::uint8_t> bytes;
        const std::uint64_t width = (marker & 0xF0) == 0x60 ? 2 : 1;
        if (!in.ok()) {
            return truncated(in, start);
        }
        if (!readCount(in, marker & 0x0F, start, count) || !take(in, count, width, start, bytes) ||
            !spend(bytes.size(), start)) {
            return false;
        }
        if ((marker & 0xF0) == 0x40) {
            out = GWValue(GWData(bytes.begin(), bytes.end()));
        } else if ((marker & 0xF0) == 0x50) {
            std::string text(bytes.begin(), bytes.end());
            if (!GWIsASCII(text)) {
                // Lenient with bytes above 0x7F in an ASCII string: they are read as Latin-1.
                text = GWUTF8FromUTF16(std::u16string(bytes.begin(), bytes.end()));
            }
            out = GWValue(std::move(text));
        } else {
            std::u16string units(count, u'\0');
            for (std::uint64_t i = 0; i < count; ++i) {
                units[i] = char16_t(bytes[2 * i] << 8 | bytes[2 * i + 1]);
            }
            out = GWValue(GWUTF8FromUTF16(units));
        }
        return true;
    }

    bool readContainer(GWByteReader& in, std::uint64_t index, std::uint8_t marker,
                       std::size_t depth, GWValue& out) {
        const std::uint64_t start = offsets_[index];
        const bool isDictionary = (marker & 0xF0) == 0xD0;
        std::uint64_t count = 0;
        std::span<const std::uint8_t> refBytes;
        if (!in.ok()) {
            return truncated(in, start);
        }
        if (!readCount(in, marker & 0x0F, start, count) ||
            !take(in, count, isDictionary ? 2 * refSize_ : refSize_, start, refBytes)) {
            return false;
        }
        if (depth + 1 > kGWPropertyListMaxDepth) {
            return fail(start, "containers nest deeper than %zu levels", kGWPropertyListMaxDepth);
        }
        if (active_[index]) {
            return fail(start, "object %llu contains itself", (unsigned long long)index);
        }
        if (!spend(0, start)) {
            return false;
        }
        const std::uint64_t refsStart = in.offset() - refBytes.size();
        GWByteReader refs(refBytes);
        const auto nextRef = [&](std::uint64_t& ref) {
            ref = refs.uintBE(refSize_);
            if (ref >= offsets_.size()) {
                return fail(refsStart + refs.offset() - refSize_,
                            "the object at 0x%llx refers to object %llu of %zu",
                            (unsigned long long)start, (unsigned long long)ref, offsets_.size());
            }
            return true;
        };
        active_[index] = true;
        bool ok = true;
        if (isDictionary) {
            std::vector<std::string> keys;
            for (std::uint64_t i = 0; ok && i < count; ++i) {
                std::uint64_t ref = 0;
                GWValue key;
                ok = nextRef(ref) && readObject(ref, depth + 1, key);
                if (ok && !key.string()) {
                    ok = fail(offsets_[ref],
                              "the dictionary at 0x%llx has a key that is not a string "
                              "(object %llu)",
                              (unsigned long long)start, (unsigned long long)ref);
                }
                if (ok) {
                    keys.push_back(std::move(*std::get_if<std::string>(&key.storage)));
                }
            }
            // The value references follow all the key references.
            GWDictionary dictionary;
            for (std::uint64_t i = 0; ok && i < count; ++i) {
                std::uint64_t ref = 0;
                GWValue value;
                ok = nextRef(ref) && readObject(ref, depth + 1, value);
                if (ok) {
                    dictionary.insert_or_assign(std::move(keys[i]), std::move(value));
                }
            }
            out = GWValue(std::move(dictionary));
        } else {
            GWArray array;
            for (std::uint64_t i = 0; ok && i < count; ++i) {
                std::uint64_t ref = 0;
                ok = nextRef(ref) && readObject(ref, depth + 1, array.emplace_back());
            }
            out = GWValue(std::move(array));
        }
        active_[index] = false;
        return ok;
    }

    std::span<const std::uint8_t> file_;
    GWByteReader objects_;
    std::vector<std::uint64_t> offsets_;
    std::vector<bool> active_;
    std::uint8_t refSize_ = 0;
    std::uint64_t topObject_ = 0;
    std::uint64_t values_ = 0;
    std::uint64_t payload_ = 0;
    std::uint64_t valueBudget_ = 0;
    std::uint64_t payloadBudget_ = 0;
    std::string failure_;
    std::uint64_t failureOffset_ = 0;
};

}  // namespace

std::optional<GWValue> GWBinaryPropertyList::valueWithData(std::span<const std::uint8_t> bytes,
                                                           GWErrorPtr* error) {
    return Reader(bytes).read(error);
}
