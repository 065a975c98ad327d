#include "GWBinaryPropertyList.h"

#include <bit>
#include <cmath>
#include <cstring>
#include <limits>
#include <map>
#include <unordered_map>
#include <utility>

#include "GWUTF16.h"

namespace {

constexpr char kSignature[] = "bplist00";
constexpr double kSeconds1970To2001 = 978307200.0;

enum Marker : std::uint8_t {
    kFalse = 0x08,
    kTrue = 0x09,
    kInteger = 0x10,
    kReal64 = 0x23,
    kDate = 0x33,
    kData = 0x40,
    kASCIIString = 0x50,
    kUTF16String = 0x60,
    kArray = 0xA0,
    kDictionary = 0xD0,
};

// The smallest of the format's widths 1, 2, 4 and 8 that holds `value`.
std::uint8_t widthFor(std::uint64_t value) {
    if (value <= 0xFF) {
        return 1;
    }
    if (value <= 0xFFFF) {
        return 2;
    }
    return value <= 0xFFFFFFFF ? 4 : 8;
}

// One object of the output: a value, or a dictionary key.
struct Slot {
    const GWValue* value = nullptr;
    const std::string* key = nullptr;
    std::vector<std::uint64_t> refs;  // an array's elements; a dictionary's keys, then its values
};

class Writer {
public:
    bool flatten(const GWValue& root) {
        add(root, 0);
        return !tooDeep_;
    }

    GWData write() const {
        const std::uint8_t refSize = widthFor(slots_.size() - 1);
        GWData out(kSignature, kSignature + 8);
        std::vector<std::uint64_t> offsets;
        offsets.reserve(slots_.size());
        for (const Slot& slot : slots_) {
            offsets.push_back(out.size());
            writeSlot(out, slot, refSize);
        }
        const std::uint64_t tableOffset = out.size();
        const std::uint8_t offsetSize = widthFor(tableOffset);
        for (std::uint64_t offset : offsets) {
            putBE(out, offset, offsetSize);
        }
        out.insert(out.end(), 6, 0);  // unused, then the sort version
        out.push_back(offsetSize);
        out.push_back(refSize);
        putBE(out, slots_.size(), 8);
        putBE(out, 0, 8);  // the top object is always the first
        putBE(out, tableOffset, 8);
        return out;
    }

private:
    // Scalars that repeat (keys, class names, small numbers) are written once
    // and shared, as other writers of the format do.
    std::uint64_t add(const GWValue& value, std::size_t depth) {
        if (auto text = value.string()) {
            return addString(*text, &value);
        }
        if (auto flag = std::get_if<bool>(&value.storage)) {
            return shared(booleans_[*flag ? 1 : 0], value);
        }
        if (value.isInteger()) {
            const bool negative =
                value.integerValue() < 0 && std::holds_alternative<std::int64_t>(value.storage);
            auto [it, inserted] = integers_.try_emplace({negative, value.unsignedValue()}, 0);
            if (inserted) {
                it->second = append(&value);
            }
            return it->second;
        }
        const auto* array = value.array();
        const auto* dictionary = value.dictionary();
        if (!array && !dictionary) {
            return append(&value);
        }
        if (depth + 1 > kGWPropertyListMaxDepth) {
            tooDeep_ = true;
            return append(&value);
        }
        const std::uint64_t index = append(&value);
        std::vector<std::uint64_t> refs;
        if (array) {
            refs.reserve(array->size());
            for (const GWValue& element : *array) {
                refs.push_back(add(element, depth + 1));
            }
        } else {
            refs.reserve(2 * dictionary->size());
            for (const auto& entry : *dictionary) {
                refs.push_back(addString(entry.first, nullptr));
            }
            for (const auto& entry : *dictionary) {
                refs.push_back(add(entry.second, depth + 1));
            }
        }
        slots_[index].refs = std::move(refs);
        return index;
    }

    std::uint64_t addString(const std::string& text, const GWValue* value) {
        auto [it, inserted] = strings_.try_emplace(text, 0);
        if (inserted) {
            it->second = append(value, value ? nullptr : &text);
        }
        return it->second;
    }

    std::uint64_t shared(std::optional<std::uint64_t>& cache, const GWValue& value) {
        if (!cache) {
            cache = append(&value);
        }
        return *cache;
    }

    std::uint64_t append(const GWValue* value, const std::string* key = nullptr) {
        Slot& slot = slots_.emplace_back();
        slot.value = value;
        slot.key = key;
        return slots_.size() - 1;
    }

    static void putBE(GWData& out, std::uint64_t value, std::size_t width) {
        for (std::size_t i = width; i-- > 0;) {
            out.push_back(std::uint8_t(value >> (8 * i)));
        }
    }

    static void putInteger(GWData& out, std::uint64_t value) {
        const std::uint8_t width = widthFor(value);
        out.push_back(std::uint8_t(kInteger | std::countr_zero(width)));
        putBE(out, value, width);
    }

    static void putHeader(GWData& out, std::uint8_t marker, std::uint64_t count) {
        if (count < 15) {
            out.push_back(std::uint8_t(marker | count));
        } else {
            out.push_back(std::uint8_t(marker | 0x0F));
            putInteger(out, count);
        }
    }

    static void putString(GWData& out, const std::string& text) {
        if (GWIsASCII(text)) {
            putHeader(out, kASCIIString, text.size());
            out.insert(out.end(), text.begin(), text.end());
            return;
        }
        const std::u16string units = GWUTF16FromUTF8(text);
        putHeader(out, kUTF16String, units.size());
        for (char16_t unit : units) {
            putBE(out, unit, 2);
        }
    }

    static void writeSlot(GWData& out, const Slot& slot, std::uint8_t refSize) {
        if (slot.key) {
            putString(out, *slot.key);
            return;
        }
        const GWValue::Storage& storage = slot.value->storage;
        if (auto flag = std::get_if<bool>(&storage)) {
            out.push_back(*flag ? kTrue : kFalse);
        } else if (auto number = std::get_if<std::int64_t>(&storage); number && *number < 0) {
            out.push_back(kInteger | 3);
            putBE(out, std::uint64_t(*number), 8);
        } else if (slot.value->isInteger() && slot.value->unsignedValue() > INT64_MAX) {
            // Python's plistlib reads these sixteen bytes as a signed integer.
            out.push_back(kInteger | 4);
            putBE(out, 0, 8);
            putBE(out, slot.value->unsignedValue(), 8);
        } else if (slot.value->isInteger()) {
            putInteger(out, slot.value->unsignedValue());
        } else if (auto real = std::get_if<double>(&storage)) {
            out.push_back(kReal64);
            putBE(out, std::bit_cast<std::uint64_t>(*real), 8);
        } else if (auto date = std::get_if<GWDate>(&storage)) {
            out.push_back(kDate);
            const double seconds = GWBinaryPropertyList::timeIntervalSince2001(*date);
            putBE(out, std::bit_cast<std::uint64_t>(seconds), 8);
        } else if (auto text = std::get_if<std::string>(&storage)) {
            putString(out, *text);
        } else if (auto data = std::get_if<GWData>(&storage)) {
            putHeader(out, kData, data->size());
            out.insert(out.end(), data->begin(), data->end());
        } else {
            const bool isArray = std::holds_alternative<GWArray>(storage);
            putHeader(out, isArray ? kArray : kDictionary,
                      isArray ? slot.refs.size() : slot.refs.size() / 2);
            for (std::uint64_t ref : slot.refs) {
                putBE(out, ref, refSize);
            }
        }
    }

    std::vector<Slot> slots_;
    std::unordered_map<std::string_view, std::uint64_t> strings_;
    std::map<std::pair<bool, std::uint64_t>, std::uint64_t> integers_;
    std::optional<std::uint64_t> booleans_[2];
    bool tooDeep_ = false;
};

}  // namespace

bool GWBinaryPropertyList::isBinaryPropertyList(std::span<const std::uint8_t> bytes) {
    return bytes.size() >= 8 && std::memcmp(bytes.data(), kSignature, 8) == 0;
}

GWData GWBinaryPropertyList::dataWithValue(const GWValue& root, GWErrorPtr* error) {
    Writer writer;
    if (!writer.flatten(root)) {
        GWFail(error, GWGenerateError(kGWCocoaErrorDomain, GWPropertyListWriteInvalidError,
                                      std::nullopt, nullptr, {},
                                      "The property list nests arrays and dictionaries deeper "
                                      "than %zu levels",
                                      kGWPropertyListMaxDepth));
        return {};
    }
    return writer.write();
}

double GWBinaryPropertyList::timeIntervalSince2001(const GWDate& date) {
    const double since1970 = date.timeIntervalSince1970();
    const double since2001 = since1970 - kSeconds1970To2001;
    if (!std::isfinite(since2001) || since2001 + kSeconds1970To2001 == since1970) {
        return since2001;
    }
    // The subtraction rounded; a neighbour may still read back exactly.
    for (double candidate :
         {std::nextafter(since2001, -INFINITY), std::nextafter(since2001, INFINITY)}) {
        if (candidate + kSeconds1970To2001 == since1970) {
            return candidate;
        }
    }
    return since2001;
}

GWDate GWBinaryPropertyList::dateWithTimeIntervalSince2001(double seconds) {
    return GWDate(seconds + kSeconds1970To2001);
}
