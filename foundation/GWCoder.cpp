#include "GWCoder.h"

#include <map>
#include <mutex>

namespace {

struct Registry {
    std::mutex mutex;
    std::map<std::string, GWCodingFactory, std::less<>> factories;
};

Registry& registry() {
    static Registry shared;
    return shared;
}

// Carries an error through the object machinery, since GWError itself is a
// plain value and not a persistable class.
class GWErrorCoding final : public GWCoding {
public:
    static constexpr const char* kClassName = "GWError";

    explicit GWErrorCoding(GWErrorPtr error) : error_(std::move(error)) {}

    const GWErrorPtr& error() const { return error_; }

    std::string className() const override { return kClassName; }

    void encodeWithCoder(GWCoder& coder) const override {
        coder.encodeValue(error_->domain(), "Domain");
        coder.encodeInt64(error_->code(), "Code");
        if (error_->URL()) {
            coder.encodeValue(error_->URL()->absoluteString(), "URL");
        }
        coder.encodeError(error_->underlyingError(), "UnderlyingError");
        coder.encodeValue(error_->userInfo(), "UserInfo");
        coder.encodeValue(error_->localizedDescription(), "Description");
    }

    static std::shared_ptr<GWErrorCoding> initWithCoder(GWCoder& coder) {
        auto domain = coder.decodeString("Domain");
        if (!domain || !coder.allowsKeyedCoding()) {
            return nullptr;
        }
        std::optional<GWURL> url;
        if (auto text = coder.decodeString("URL")) {
            url = GWURL::URLWithString(*text);
        }
        auto error = std::make_shared<const GWError>(
            std::move(*domain), long(coder.decodeInt64("Code")), std::move(url),
            coder.decodeError("UnderlyingError"),
            coder.decodeDictionary("UserInfo").value_or(GWDictionary()),
            coder.decodeString("Description").value_or(std::string()));
        return std::make_shared<GWErrorCoding>(std::move(error));
    }

private:
    GWErrorPtr error_;
};

}  // namespace

void GWCodingRegistry::registerClass(const std::string& className, GWCodingFactory factory) {
    std::lock_guard lock(registry().mutex);
    registry().factories.insert_or_assign(className, std::move(factory));
}

GWCodingFactory GWCodingRegistry::factoryForClass(const std::string& className) {
    std::lock_guard lock(registry().mutex);
    auto it = registry().factories.find(className);
    return it == registry().factories.end() ? GWCodingFactory() : it->second;
}

void GWCoder::encodeError(const GWErrorPtr& error, const std::string& key) {
    if (error) {
        writeObject(key, GWErrorCoding(error));
    }
}

GWErrorPtr GWCoder::decodeError(const std::string& key) {
    auto coding = decodeObjectOfClass<GWErrorCoding>(key);
    return coding ? coding->error() : nullptr;
}

std::optional<std::string> GWCoder::decodeString(const std::string& key) {
    auto value = readValue(key);
    if (!value || !value->string()) {
        return std::nullopt;
    }
    return std::move(*std::get_if<std::string>(&value->storage));
}

std::optional<GWData> GWCoder::decodeData(const std::string& key) {
    auto value = readValue(key);
    if (!value || !value->data()) {
        return std::nullopt;
    }
    return std::move(*std::get_if<GWData>(&value->storage));
}

std::optional<GWDate> GWCoder::decodeDate(const std::string& key) {
    auto value = readValue(key);
    if (!value || !value->date()) {
        return std::nullopt;
    }
    return *value->date();
}

std::optional<GWArray> GWCoder::decodeArray(const std::string& key) {
    auto value = readValue(key);
    if (!value || !value->array()) {
        return std::nullopt;
    }
    return std::move(*std::get_if<GWArray>(&value->storage));
}

std::optional<GWDictionary> GWCoder::decodeDictionary(const std::string& key) {
    auto value = readValue(key);
    if (!value || !value->dictionary()) {
        return std::nullopt;
    }
    return std::move(*std::get_if<GWDictionary>(&value->storage));
}

bool GWCoder::decodeBool(const std::string& key) {
    auto value = readValue(key);
    return value && (value->isBool() || value->isInteger()) && value->boolValue();
}

std::int32_t GWCoder::decodeInt32(const std::string& key) {
    auto value = readValue(key);
    if (!value || !value->isInteger()) {
        return 0;
    }
    const bool isSigned = std::holds_alternative<std::int64_t>(value->storage);
    const std::int64_t number = value->integerValue();
    if (isSigned ? (number < INT32_MIN || number > std::int64_t(UINT32_MAX))
                 : value->unsignedValue() > UINT32_MAX) {
        return 0;
    }
    return std::int32_t(std::uint32_t(value->unsignedValue()));
}

std::int64_t GWCoder::decodeInt64(const std::string& key) {
    auto value = readValue(key);
    return value && value->isInteger() ? value->integerValue() : 0;
}

std::uint64_t GWCoder::decodeUInt64(const std::string& key) {
    auto value = readValue(key);
    return value && value->isInteger() ? value->unsignedValue() : 0;
}

double GWCoder::decodeDouble(const std::string& key) {
    auto value = readValue(key);
    return value && (value->isReal() || value->isInteger()) ? value->doubleValue() : 0;
}

void GWCoder::writeValue(const std::string&, const GWValue&) {}

void GWCoder::writeObject(const std::string&, const GWCoding&) {}

void GWCoder::writeObjects(const std::string&, std::span<const GWCoding* const>) {}

bool GWCoder::hasValue(const std::string&) const {
    return false;
}

std::optional<GWValue> GWCoder::readValue(const std::string&) {
    return std::nullopt;
}

std::shared_ptr<GWCoding> GWCoder::readObject(const std::string&) {
    return nullptr;
}

std::optional<std::vector<std::shared_ptr<GWCoding>>> GWCoder::readObjects(const std::string&) {
    return std::nullopt;
}
