#include "GWBinaryPropertyList.h"
#include "GWCoder.h"
#include "GWFormat.h"
#include "GWKeyedArchiveFormat.h"

using namespace GWKeyedArchiveFormat;

namespace {

GWErrorPtr corruptArchiveError(const std::string& description) {
    return GWGenerateError(kGWCocoaErrorDomain, GWFileReadCorruptFileError, std::nullopt, nullptr,
                           {}, "%s", description.c_str());
}

const std::string* className(const GWValue& stored) {
    const GWDictionary* dictionary = stored.dictionary();
    const GWValue* name =
        dictionary ? GWDictionaryValue(*dictionary, std::string(kClassKey)) : nullptr;
    return name ? name->string() : nullptr;
}

// The caller's view of a stored value: dictionary keys unescaped, and none
// when an object is found anywhere inside. The reader bounded the nesting.
std::optional<GWValue> plainValue(const GWValue& stored) {
    if (const GWArray* array = stored.array()) {
        GWArray copy;
        copy.reserve(array->size());
        for (const GWValue& element : *array) {
            auto plain = plainValue(element);
            if (!plain) {
                return std::nullopt;
            }
            copy.push_back(std::move(*plain));
        }
        return GWValue(std::move(copy));
    }
    if (const GWDictionary* dictionary = stored.dictionary()) {
        if (className(stored)) {
            return std::nullopt;
        }
        GWDictionary copy;
        for (const auto& [key, element] : *dictionary) {
            auto plain = plainValue(element);
            if (!plain) {
                return std::nullopt;
            }
            copy.insert_or_assign(unescapedKey(key), std::move(*plain));
        }
        return GWValue(std::move(copy));
    }
    return stored;
}

}  // namespace

GWKeyedUnarchiver::GWKeyedUnarchiver(GWValue archive) : archive_(std::move(archive)) {
    const GWValue* top = GWDictionaryValue(*archive_.dictionary(), std::string(kTopKey));
    current_ = top->dictionary();
}

std::shared_ptr<GWKeyedUnarchiver> GWKeyedUnarchiver::initForReadingWithData(
    std::span<const std::uint8_t> data, GWErrorPtr* error) {
    auto archive = GWBinaryPropertyList::valueWithData(data, error);
    if (!archive) {
        return nullptr;
    }
    const GWDictionary* dictionary = archive->dictionary();
    const GWValue* archiver =
        dictionary ? GWDictionaryValue(*dictionary, std::string(kArchiverKey)) : nullptr;
    if (!archiver || !archiver->string() || *archiver->string() != kArchiverName) {
        GWFail(error, corruptArchiveError("The property list is not a keyed archive: its "
                                          "\"$archiver\" is not \"GWKeyedArchiver\""));
        return nullptr;
    }
    const GWValue* version = GWDictionaryValue(*dictionary, std::string(kVersionKey));
    if (!version || !version->isInteger() || version->integerValue() != kVersion) {
        GWFail(error,
               corruptArchiveError(GWFormat("The keyed archive has the unsupported version %s",
                                            version ? version->description().c_str() : "(none)")));
        return nullptr;
    }
    const GWValue* top = GWDictionaryValue(*dictionary, std::string(kTopKey));
    if (!top || !top->dictionary()) {
        GWFail(error, corruptArchiveError("The keyed archive has no \"$top\" dictionary"));
        return nullptr;
    }
    return std::shared_ptr<GWKeyedUnarchiver>(new GWKeyedUnarchiver(std::move(*archive)));
}

std::shared_ptr<GWCoding> GWKeyedUnarchiver::decodeRootObject(GWErrorPtr* error) {
    const GWValue* stored = storedValue(std::string(kRootKey));
    const std::string* name = stored ? className(*stored) : nullptr;
    if (!name) {
        GWFail(error, corruptArchiveError("The keyed archive holds no root object"));
        return nullptr;
    }
    if (!GWCodingRegistry::factoryForClass(*name)) {
        GWFail(error, corruptArchiveError(
                          GWFormat("The keyed archive's root object is of the unknown class \"%s\"",
                                   name->c_str())));
        return nullptr;
    }
    auto root = decodeObjectDictionary(*stored);
    if (!root) {
        GWFail(error, corruptArchiveError(GWFormat(
                          "The keyed archive's root object of class \"%s\" could not be decoded",
                          name->c_str())));
    }
    return root;
}

GWErrorPtr GWKeyedUnarchiver::rootClassError(const std::string& className) {
    return corruptArchiveError(
        GWFormat("The keyed archive's root object of class \"%s\" is not of the class asked for",
                 className.c_str()));
}

const GWValue* GWKeyedUnarchiver::storedValue(const std::string& key) const {
    return GWDictionaryValue(*current_, escapedKey(key));
}

bool GWKeyedUnarchiver::hasValue(const std::string& key) const {
    return storedValue(key) != nullptr;
}

std::optional<GWValue> GWKeyedUnarchiver::readValue(const std::string& key) {
    const GWValue* stored = storedValue(key);
    return stored ? plainValue(*stored) : std::nullopt;
}

std::shared_ptr<GWCoding> GWKeyedUnarchiver::decodeObjectDictionary(const GWValue& stored) {
    const std::string* name = className(stored);
    if (!name) {
        return nullptr;
    }
    GWCodingFactory factory = GWCodingRegistry::factoryForClass(*name);
    if (!factory) {
        return nullptr;
    }
    // The factory reads its keys from the object's own dictionary.
    const GWDictionary* outer = current_;
    current_ = stored.dictionary();
    auto object = factory(*this);
    current_ = outer;
    return object;
}

std::shared_ptr<GWCoding> GWKeyedUnarchiver::readObject(const std::string& key) {
    const GWValue* stored = storedValue(key);
    return stored ? decodeObjectDictionary(*stored) : nullptr;
}

std::optional<std::vector<std::shared_ptr<GWCoding>>> GWKeyedUnarchiver::readObjects(
    const std::string& key) {
    const GWValue* stored = storedValue(key);
    const GWArray* array = stored ? stored->array() : nullptr;
    if (!array) {
        return std::nullopt;
    }
    std::vector<std::shared_ptr<GWCoding>> objects;
    objects.reserve(array->size());
    for (const GWValue& element : *array) {
        auto object = decodeObjectDictionary(element);
        if (!object) {
            return std::nullopt;
        }
        objects.push_back(std::move(object));
    }
    return objects;
}
