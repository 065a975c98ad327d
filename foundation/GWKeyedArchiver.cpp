#include <algorithm>

#include "GWBinaryPropertyList.h"
#include "GWCoder.h"
#include "GWKeyedArchiveFormat.h"

using namespace GWKeyedArchiveFormat;

namespace {

// A copy of `value` with the keys of every dictionary escaped; none when it
// nests deeper than an archive may.
std::optional<GWValue> escapedValue(const GWValue& value, std::size_t depth) {
    const GWArray* array = value.array();
    const GWDictionary* dictionary = value.dictionary();
    if (!array && !dictionary) {
        return value;
    }
    if (depth >= kGWPropertyListMaxDepth) {
        return std::nullopt;
    }
    if (array) {
        GWArray copy;
        copy.reserve(array->size());
        for (const GWValue& element : *array) {
            auto escaped = escapedValue(element, depth + 1);
            if (!escaped) {
                return std::nullopt;
            }
            copy.push_back(std::move(*escaped));
        }
        return GWValue(std::move(copy));
    }
    GWDictionary copy;
    for (const auto& [key, element] : *dictionary) {
        auto escaped = escapedValue(element, depth + 1);
        if (!escaped) {
            return std::nullopt;
        }
        copy.emplace(escapedKey(key), std::move(*escaped));
    }
    return GWValue(std::move(copy));
}

}  // namespace

GWKeyedArchiver::GWKeyedArchiver() : current_(&top_) {}

GWData GWKeyedArchiver::archivedDataWithRootObject(const GWCoding& root, GWErrorPtr* error) {
    GWKeyedArchiver archiver;
    archiver.encodeObject(&root, std::string(kRootKey));
    return archiver.encodedData(error);
}

GWData GWKeyedArchiver::archivedDataWithRootObject(const std::shared_ptr<const GWCoding>& root,
                                                   GWErrorPtr* error) {
    if (!root) {
        GWFail(error, GWGenerateError(kGWCocoaErrorDomain, GWCoderInvalidValueError, std::nullopt,
                                      nullptr, {}, "There is no root object to archive"));
        return {};
    }
    return archivedDataWithRootObject(*root, error);
}

GWData GWKeyedArchiver::encodedData(GWErrorPtr* error) const {
    if (failure_) {
        GWFail(error, failure_);
        return {};
    }
    GWDictionary archive{
        {std::string(kArchiverKey), GWValue(std::string(kArchiverName))},
        {std::string(kVersionKey), GWValue(kVersion)},
        {std::string(kTopKey), GWValue(top_)},
    };
    GWErrorPtr writeError;
    GWData data = GWBinaryPropertyList::dataWithValue(GWValue(std::move(archive)), &writeError);
    if (data.empty()) {
        // Values and objects together can still nest too deeply for the format.
        GWFail(error,
               GWGenerateError(kGWCocoaErrorDomain, GWCoderInvalidValueError, std::nullopt,
                               writeError, {}, "%s", writeError->localizedDescription().c_str()));
    }
    return data;
}

void GWKeyedArchiver::setFailure(const std::string& description, const std::string& className) {
    if (!failure_) {
        failure_ =
            GWGenerateError(kGWCocoaErrorDomain, GWCoderInvalidValueError, std::nullopt, nullptr,
                            {{"ClassName", GWValue(className)}}, "%s", description.c_str());
    }
}

void GWKeyedArchiver::writeValue(const std::string& key, const GWValue& value) {
    if (failure_) {
        return;
    }
    // Objects hold values one level below their own dictionary.
    auto escaped = escapedValue(value, encoding_.size() + 1);
    if (!escaped) {
        const std::string owner = encoding_.empty() ? "" : encoding_.back()->className();
        setFailure("A value of key \"" + key + "\" nests too deeply to archive", owner);
        return;
    }
    current_->insert_or_assign(escapedKey(key), std::move(*escaped));
}

std::optional<GWDictionary> GWKeyedArchiver::encodeObjectDictionary(const GWCoding& object) {
    if (failure_) {
        return std::nullopt;
    }
    if (std::find(encoding_.begin(), encoding_.end(), &object) != encoding_.end()) {
        setFailure("An object of class " + object.className() + " contains itself",
                   object.className());
        return std::nullopt;
    }
    // Every object is at least one level of the property list.
    if (encoding_.size() + 1 >= kGWPropertyListMaxDepth) {
        setFailure(
            "Objects nest too deeply to archive, at an object of class " + object.className(),
            object.className());
        return std::nullopt;
    }
    GWDictionary dictionary{{std::string(kClassKey), GWValue(object.className())}};
    GWDictionary* outer = current_;
    current_ = &dictionary;
    encoding_.push_back(&object);
    object.encodeWithCoder(*this);
    encoding_.pop_back();
    current_ = outer;
    if (failure_) {
        return std::nullopt;
    }
    return dictionary;
}

void GWKeyedArchiver::writeObject(const std::string& key, const GWCoding& object) {
    if (auto dictionary = encodeObjectDictionary(object)) {
        current_->insert_or_assign(escapedKey(key), GWValue(std::move(*dictionary)));
    }
}

void GWKeyedArchiver::writeObjects(const std::string& key,
                                   std::span<const GWCoding* const> objects) {
    GWArray array;
    array.reserve(objects.size());
    for (const GWCoding* object : objects) {
        auto dictionary = encodeObjectDictionary(*object);
        if (!dictionary) {
            return;
        }
        array.emplace_back(std::move(*dictionary));
    }
    if (!failure_) {
        current_->insert_or_assign(escapedKey(key), GWValue(std::move(array)));
    }
}
