#pragma once

#include <concepts>
#include <cstdint>
#include <functional>
#include <memory>
#include <optional>
#include <span>
#include <string>
#include <string_view>
#include <vector>

#include "GWError.h"
#include "GWExport.h"
#include "GWValue.h"

class GWCoder;

// Code of kGWCocoaErrorDomain for an object graph the archiver cannot write:
// a cycle, or objects nested deeper than an archive may be.
inline constexpr long GWCoderInvalidValueError = 4866;

// An object that can be written to a coder. A class that can also be decoded
// declares
//     static constexpr const char* kClassName = "GWSomething";
//     static std::shared_ptr<GWSomething> initWithCoder(GWCoder& coder);
// and is then made again from any archive that records that class name. A
// subclass declares both again, or it would be registered as its base.
class GW_EXPORT GWCoding {
public:
    virtual ~GWCoding() = default;

    // The class name recorded in archives.
    virtual std::string className() const = 0;
    virtual void encodeWithCoder(GWCoder& coder) const = 0;
};

template <typename T>
concept GWDecodable = std::derived_from<T, GWCoding> && requires(GWCoder& coder) {
    { T::kClassName } -> std::convertible_to<std::string_view>;
    { T::initWithCoder(coder) } -> std::convertible_to<std::shared_ptr<GWCoding>>;
};

using GWCodingFactory = std::function<std::shared_ptr<GWCoding>(GWCoder& coder)>;

// Class name -> the function that decodes an object of that class. Decoding
// with a GWDecodable type registers it on first use; a subclass that is only
// ever decoded through its base class registers itself explicitly.
class GW_EXPORT GWCodingRegistry {
public:
    // Replaces whatever was registered under the name.
    static void registerClass(const std::string& className, GWCodingFactory factory);

    template <GWDecodable T>
    static void registerClass() {
        static const bool registered = [] {
            registerClass(std::string(T::kClassName),
                          [](GWCoder& coder) -> std::shared_ptr<GWCoding> {
                              return T::initWithCoder(coder);
                          });
            return true;
        }();
        (void)registered;
    }

    // Empty when nothing is registered under the name.
    static GWCodingFactory factoryForClass(const std::string& className);
};

// Writes and reads the state of objects by key. Absent values (a null object,
// an empty optional) are not written, and decoding a key that was not written
// gives none or zero. A value of another kind than the one asked for under a
// key decodes the same way: never a crash, never a conversion between kinds
// other than integer -> double and integer -> bool.
//
// The base class is the non-keyed coder: it writes nothing and decodes
// nothing, which is what persistable classes expect of such a coder.
class GW_EXPORT GWCoder {
public:
    virtual ~GWCoder() = default;

    // Persistable classes write nothing to, and decode to none from, a coder
    // that does not allow keyed coding.
    virtual bool allowsKeyedCoding() const { return false; }

    // --- Encoding -----------------------------------------------------------

    // Any property-list value: string, data, date, number, GWArray, GWDictionary.
    void encodeValue(const GWValue& value, const std::string& key) { writeValue(key, value); }
    template <typename T>
    requires std::convertible_to<const T&, GWValue>
    void encodeValue(const std::optional<T>& value, const std::string& key) {
        if (value) {
            writeValue(key, GWValue(*value));
        }
    }

    void encodeBool(bool value, const std::string& key) { writeValue(key, GWValue(value)); }
    void encodeInt32(std::int32_t value, const std::string& key) { writeValue(key, value); }
    void encodeInt64(std::int64_t value, const std::string& key) { writeValue(key, value); }
    // The platform's word-sized integer, 64 bits here.
    void encodeInteger(std::int64_t value, const std::string& key) { writeValue(key, value); }
    // Unsigned 64-bit fields, so that readers of the archive see the true value.
    void encodeUInt64(std::uint64_t value, const std::string& key) { writeValue(key, value); }
    void encodeDouble(double value, const std::string& key) { writeValue(key, value); }

    // The object's class name and whatever its encodeWithCoder writes.
    void encodeObject(const GWCoding* object, const std::string& key) {
        if (object) {
            writeObject(key, *object);
        }
    }
    template <std::derived_from<GWCoding> T>
    void encodeObject(const std::shared_ptr<T>& object, const std::string& key) {
        encodeObject(static_cast<const GWCoding*>(object.get()), key);
    }

    // An array of objects; null elements are left out.
    template <std::derived_from<GWCoding> T>
    void encodeArrayOfObjects(const std::vector<std::shared_ptr<T>>& objects,
                              const std::string& key) {
        std::vector<const GWCoding*> pointers;
        pointers.reserve(objects.size());
        for (const auto& object : objects) {
            if (object) {
                pointers.push_back(object.get());
            }
        }
        writeObjects(key, pointers);
    }
    template <std::derived_from<GWCoding> T>
    void encodeArrayOfObjects(const std::optional<std::vector<std::shared_ptr<T>>>& objects,
                              const std::string& key) {
        if (objects) {
            encodeArrayOfObjects(*objects, key);
        }
    }

    // Domain, code, URL, details, description and the underlying error.
    void encodeError(const GWErrorPtr& error, const std::string& key);

    // --- Decoding -----------------------------------------------------------

    bool containsValueForKey(const std::string& key) const { return hasValue(key); }

    // A property-list value; none for an object or a missing key.
    std::optional<GWValue> decodeValue(const std::string& key) { return readValue(key); }
    std::optional<std::string> decodeString(const std::string& key);
    std::optional<GWData> decodeData(const std::string& key);
    std::optional<GWDate> decodeDate(const std::string& key);
    std::optional<GWArray> decodeArray(const std::string& key);
    std::optional<GWDictionary> decodeDictionary(const std::string& key);

    bool decodeBool(const std::string& key);
    // Values of the int32 or uint32 range; their low 32 bits, so an unsigned
    // 32-bit field written either way reads back the same.
    std::int32_t decodeInt32(const std::string& key);
    std::int64_t decodeInt64(const std::string& key);
    std::int64_t decodeInteger(const std::string& key) { return decodeInt64(key); }
    // Values of the uint64 or int64 range, as their 64 bits.
    std::uint64_t decodeUInt64(const std::string& key);
    double decodeDouble(const std::string& key);

    // The object made by the factory registered for its recorded class; none
    // for an unknown class, or when the factory refuses.
    std::shared_ptr<GWCoding> decodeObject(const std::string& key) { return readObject(key); }
    template <std::derived_from<GWCoding> T>
    std::shared_ptr<T> decodeObjectOfClass(const std::string& key) {
        if constexpr (GWDecodable<T>) {
            GWCodingRegistry::registerClass<T>();
        }
        return std::dynamic_pointer_cast<T>(readObject(key));
    }

    // None unless every element decodes as a T.
    template <std::derived_from<GWCoding> T>
    std::optional<std::vector<std::shared_ptr<T>>> decodeArrayOfObjectsOfClass(
        const std::string& key) {
        if constexpr (GWDecodable<T>) {
            GWCodingRegistry::registerClass<T>();
        }
        auto objects = readObjects(key);
        if (!objects) {
            return std::nullopt;
        }
        std::vector<std::shared_ptr<T>> typed;
        typed.reserve(objects->size());
        for (auto& object : *objects) {
            auto element = std::dynamic_pointer_cast<T>(std::move(object));
            if (!element) {
                return std::nullopt;
            }
            typed.push_back(std::move(element));
        }
        return typed;
    }

    GWErrorPtr decodeError(const std::string& key);

protected:
    // What a concrete coder provides; the base class does nothing.
    virtual void writeValue(const std::string& key, const GWValue& value);
    virtual void writeObject(const std::string& key, const GWCoding& object);
    virtual void writeObjects(const std::string& key, std::span<const GWCoding* const> objects);
    virtual bool hasValue(const std::string& key) const;
    virtual std::optional<GWValue> readValue(const std::string& key);
    virtual std::shared_ptr<GWCoding> readObject(const std::string& key);
    virtual std::optional<std::vector<std::shared_ptr<GWCoding>>> readObjects(
        const std::string& key);
};

// A coder without keys, for which persistable classes write nothing and from
// which they decode to none.
class GWNonKeyedCoder final : public GWCoder {};

// Writes objects into a keyed archive: a binary property list that Python's
// plistlib and other property-list tools read. Its top level is
//     {"$archiver": "GWKeyedArchiver", "$version": 1, "$top": {key: value, ...}}
// and each object a dictionary {"$class": <class name>, key: value, ...};
// arrays of objects are arrays of such dictionaries. Keys of the archive's
// own dictionaries that begin with "$" are stored with one more "$". An object
// reached twice is written twice and decodes as two equal objects.
class GW_EXPORT GWKeyedArchiver final : public GWCoder {
public:
    GWKeyedArchiver();

    // The root object is stored under the top-level key "root". Empty, with
    // GWCoderInvalidValueError, when the object graph has a cycle or nests
    // too deeply.
    static GWData archivedDataWithRootObject(const GWCoding& root, GWErrorPtr* error = nullptr);
    static GWData archivedDataWithRootObject(const std::shared_ptr<const GWCoding>& root,
                                             GWErrorPtr* error = nullptr);

    bool allowsKeyedCoding() const override { return true; }

    // The archive of everything encoded at the top level so far; empty, with
    // the error, when something could not be written.
    GWData encodedData(GWErrorPtr* error = nullptr) const;

protected:
    void writeValue(const std::string& key, const GWValue& value) override;
    void writeObject(const std::string& key, const GWCoding& object) override;
    void writeObjects(const std::string& key, std::span<const GWCoding* const> objects) override;

private:
    std::optional<GWDictionary> encodeObjectDictionary(const GWCoding& object);
    void setFailure(const std::string& description, const std::string& className);

    GWDictionary top_;
    GWDictionary* current_;
    std::vector<const GWCoding*> encoding_;  // objects being written, outermost first
    GWErrorPtr failure_;
};

// Reads a keyed archive written by GWKeyedArchiver. The bytes are untrusted:
// anything malformed is GWFileReadCorruptFileError.
class GW_EXPORT GWKeyedUnarchiver final : public GWCoder {
public:
    static std::shared_ptr<GWKeyedUnarchiver> initForReadingWithData(
        std::span<const std::uint8_t> data, GWErrorPtr* error = nullptr);

    // The root object of an archive made by archivedDataWithRootObject; none,
    // with GWFileReadCorruptFileError, when it is missing, of an unknown class,
    // not a T, or refused by its class.
    template <std::derived_from<GWCoding> T = GWCoding>
    static std::shared_ptr<T> unarchiveObjectWithData(std::span<const std::uint8_t> data,
                                                      GWErrorPtr* error = nullptr) {
        if constexpr (GWDecodable<T>) {
            GWCodingRegistry::registerClass<T>();
        }
        auto unarchiver = initForReadingWithData(data, error);
        if (!unarchiver) {
            return nullptr;
        }
        auto root = unarchiver->decodeRootObject(error);
        auto typed = std::dynamic_pointer_cast<T>(root);
        if (root && !typed) {
            GWFail(error, rootClassError(root->className()));
        }
        return typed;
    }

    bool allowsKeyedCoding() const override { return true; }

    std::shared_ptr<GWCoding> decodeRootObject(GWErrorPtr* error = nullptr);

protected:
    bool hasValue(const std::string& key) const override;
    std::optional<GWValue> readValue(const std::string& key) override;
    std::shared_ptr<GWCoding> readObject(const std::string& key) override;
    std::optional<std::vector<std::shared_ptr<GWCoding>>> readObjects(
        const std::string& key) override;

private:
    explicit GWKeyedUnarchiver(GWValue archive);
    static GWErrorPtr rootClassError(const std::string& className);

    const GWValue* storedValue(const std::string& key) const;
    std::shared_ptr<GWCoding> decodeObjectDictionary(const GWValue& stored);

    GWValue archive_;
    const GWDictionary* current_ = nullptr;
};
