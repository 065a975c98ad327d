#include "GWValue.h"

#include <cstdio>

bool GWValue::boolValue() const {
    if (auto v = std::get_if<bool>(&storage)) {
        return *v;
    }
    if (isReal()) {
        return doubleValue() != 0;
    }
    return unsignedValue() != 0;
}

std::int64_t GWValue::integerValue() const {
    if (auto v = std::get_if<std::int64_t>(&storage)) {
        return *v;
    }
    if (auto v = std::get_if<std::uint64_t>(&storage)) {
        return std::int64_t(*v);
    }
    if (auto v = std::get_if<bool>(&storage)) {
        return *v ? 1 : 0;
    }
    if (auto v = std::get_if<double>(&storage)) {
        return std::int64_t(*v);
    }
    return 0;
}

std::uint64_t GWValue::unsignedValue() const {
    if (auto v = std::get_if<std::uint64_t>(&storage)) {
        return *v;
    }
    if (auto v = std::get_if<double>(&storage)) {
        return *v < 0 ? std::uint64_t(std::int64_t(*v)) : std::uint64_t(*v);
    }
    return std::uint64_t(integerValue());
}

double GWValue::doubleValue() const {
    if (auto v = std::get_if<double>(&storage)) {
        return *v;
    }
    if (auto v = std::get_if<std::uint64_t>(&storage)) {
        return double(*v);
    }
    return double(integerValue());
}

bool operator==(const GWValue& a, const GWValue& b) {
    if (a.isInteger() && b.isInteger()) {
        const bool aNegative =
            std::holds_alternative<std::int64_t>(a.storage) && a.integerValue() < 0;
        const bool bNegative =
            std::holds_alternative<std::int64_t>(b.storage) && b.integerValue() < 0;
        return aNegative == bNegative && a.unsignedValue() == b.unsignedValue();
    }
    return a.storage == b.storage;
}

std::string GWValue::description() const {
    struct Describe {
        std::string operator()(bool v) const { return v ? "true" : "false"; }
        std::string operator()(std::int64_t v) const { return std::to_string(v); }
        std::string operator()(std::uint64_t v) const { return std::to_string(v); }
        std::string operator()(double v) const {
            char text[40];
            std::snprintf(text, sizeof text, "%.17g", v);
            return text;
        }
        std::string operator()(const std::string& v) const { return v; }
        std::string operator()(const GWData& v) const {
            static const char kHex[] = "0123456789abcdef";
            std::string text = "<";
            for (std::size_t i = 0; i < v.size(); ++i) {
                if (i > 0 && i % 4 == 0) {
                    text += ' ';
                }
                text += kHex[v[i] >> 4];
                text += kHex[v[i] & 15];
            }
            return text + ">";
        }
        std::string operator()(const GWDate& v) const { return v.ISO8601String(); }
        std::string operator()(const GWArray& v) const {
            std::string text = "(";
            for (std::size_t i = 0; i < v.size(); ++i) {
                text += (i ? ", " : "") + v[i].description();
            }
            return text + ")";
        }
        std::string operator()(const GWDictionary& v) const {
            std::string text = "{";
            bool first = true;
            for (const auto& [key, value] : v) {
                text += (first ? "" : "; ") + key + " = " + value.description();
                first = false;
            }
            return text + "}";
        }
    };
    return std::visit(Describe{}, storage);
}

const GWValue* GWDictionaryValue(const GWDictionary& dictionary, const std::string& key) {
    auto it = dictionary.find(key);
    return it == dictionary.end() ? nullptr : &it->second;
}
