#pragma once

#include <cstdint>
#include <map>
#include <string>
#include <type_traits>
#include <variant>
#include <vector>

#include "GWDate.h"
#include "GWExport.h"

using GWData = std::vector<std::uint8_t>;

struct GWValue;
using GWArray = std::vector<GWValue>;
using GWDictionary = std::map<std::string, GWValue>;

// A property-list value: the payload of extra-info dictionaries, error details
// and keyed archives. Integers remember their signedness, but compare by value.
struct GW_EXPORT GWValue {
    using Storage = std::variant<bool, std::int64_t, std::uint64_t, double, std::string, GWData,
                                 GWDate, GWArray, GWDictionary>;
    Storage storage;

    GWValue() : storage(false) {}
    GWValue(bool v) : storage(v) {}
    template <typename T>
    requires(std::is_integral_v<T> && !std::is_same_v<T, bool>) GWValue(T v) {
        if constexpr (std::is_signed_v<T>) {
            storage = std::int64_t(v);
        } else {
            storage = std::uint64_t(v);
        }
    }
    GWValue(double v) : storage(v) {}
    GWValue(std::string v) : storage(std::move(v)) {}
    GWValue(const char* v) : storage(std::string(v)) {}
    GWValue(GWData v) : storage(std::move(v)) {}
    GWValue(GWDate v) : storage(v) {}
    GWValue(GWArray v) : storage(std::move(v)) {}
    GWValue(GWDictionary v) : storage(std::move(v)) {}

    bool isBool() const { return std::holds_alternative<bool>(storage); }
    bool isInteger() const {
        return std::holds_alternative<std::int64_t>(storage) ||
               std::holds_alternative<std::uint64_t>(storage);
    }
    // Booleans, integers and reals are numbers, as the platform's boxed numbers are.
    bool isNumber() const { return isBool() || isInteger() || isReal(); }
    bool isReal() const { return std::holds_alternative<double>(storage); }

    // Numeric views; a value that is not a number reads as 0 / false.
    bool boolValue() const;
    std::int64_t integerValue() const;
    std::uint64_t unsignedValue() const;
    double doubleValue() const;

    const std::string* string() const { return std::get_if<std::string>(&storage); }
    const GWData* data() const { return std::get_if<GWData>(&storage); }
    const GWDate* date() const { return std::get_if<GWDate>(&storage); }
    const GWArray* array() const { return std::get_if<GWArray>(&storage); }
    const GWDictionary* dictionary() const { return std::get_if<GWDictionary>(&storage); }

    friend bool operator==(const GWValue& a, const GWValue& b);

    // A readable rendering for logs and descriptions.
    std::string description() const;
};

// The value under `key`, or nullptr.
GW_EXPORT const GWValue* GWDictionaryValue(const GWDictionary& dictionary, const std::string& key);
// The answer would point into a dictionary that dies with the statement
// (such as a getter's copy): keep the dictionary in a variable first.
const GWValue* GWDictionaryValue(GWDictionary&& dictionary, const std::string& key) = delete;
