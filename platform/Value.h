// Value: the immutable value tree that requests, replies, bundle dictionaries, annotations and
// preferences are made of.
//
// A Value is a small handle: scalars (integers, reals, booleans, dates, UUIDs) live inline, while
// strings, data, arrays and dictionaries live in a shared, immutable node. Copying a Value is O(1)
// and never copies the tree. "Changing" a dictionary or array builds a new node that shares every
// unchanged child (see DictionaryBuilder and ArrayBuilder), so a mutable copy costs one level.
//
// Dictionaries keep insertion order and have string keys; a key appears at most once. Integers are
// signed or unsigned 64-bit, and numbers compare numerically across kinds: 1 == 1u == 1.0 == true.
// A default-constructed Value is "none": the answer of a lookup that found nothing. None never
// appears inside a container and is never encoded.
#pragma once

#include <chrono>
#include <cstdint>
#include <initializer_list>
#include <memory>
#include <optional>
#include <span>
#include <string>
#include <string_view>
#include <type_traits>
#include <utility>
#include <vector>

#include "platform/Uuid.h"

namespace om {

class Value {
public:
    enum class Type : uint8_t {
        None,
        Dictionary,
        Array,
        String,
        Integer, // signed 64-bit
        Unsigned, // unsigned 64-bit (values above INT64_MAX, or made unsigned on purpose)
        Real,
        Boolean,
        Data,
        Date,
        Uuid,
    };

    using Entry = std::pair<std::string, Value>;

    Value() = default;

    // Scalars. The integer constructors are templates so that every integral type lands on the
    // right kind without ambiguity (bool excluded: use boolean()).
    template <typename I>
    requires(std::is_integral_v<I> && !std::is_same_v<I, bool> && std::is_signed_v<I>) static Value integer(I v)
    {
        return Value(Type::Integer, Scalar { .i = static_cast<int64_t>(v) });
    }
    template <typename I>
    requires(std::is_integral_v<I> && !std::is_same_v<I, bool> && std::is_unsigned_v<I>) static Value
        unsignedInteger(I v)
    {
        return Value(Type::Unsigned, Scalar { .u = static_cast<uint64_t>(v) });
    }
    static Value real(double v) { return Value(Type::Real, Scalar { .r = v }); }
    static Value boolean(bool v) { return Value(Type::Boolean, Scalar { .b = v }); }
    // Seconds since 1970-01-01 UTC.
    static Value date(double secondsSince1970) { return Value(Type::Date, Scalar { .r = secondsSince1970 }); }
    static Value uuid(const Uuid& u);

    static Value string(std::string text);
    static Value data(std::vector<uint8_t> bytes);
    static Value data(std::span<const uint8_t> bytes);

    static Value array(std::vector<Value> elements);
    static Value array(std::initializer_list<Value> elements);
    // Later duplicates of a key replace the earlier value and keep the earlier position.
    static Value dictionary(std::vector<Entry> entries);
    static Value dictionary(std::initializer_list<Entry> entries);
    // For decoders, where a repeated key is an error: none when a key repeats, and the first
    // repeated key is stored in *duplicateKey when given.
    static std::optional<Value> uniqueDictionary(std::vector<Entry> entries, std::string* duplicateKey = nullptr);
    // ISO 8601 UTC text of a date ("2026-11-22T10:00:00Z"; fractional seconds only when present).
    static std::string dateText(double secondsSince1970);

    // Convenience conversions for literals in code and tests: integers keep their signedness,
    // bool is a boolean, floating point a real.
    template <typename T>
    requires std::is_arithmetic_v<T> Value(T v)
    {
        if constexpr (std::is_same_v<T, bool>)
            *this = boolean(v);
        else if constexpr (std::is_floating_point_v<T>)
            *this = real(static_cast<double>(v));
        else if constexpr (std::is_signed_v<T>)
            *this = integer(v);
        else
            *this = unsignedInteger(v);
    }
    Value(const char* text)
        : Value(string(text))
    {
    }
    Value(std::string text)
        : Value(string(std::move(text)))
    {
    }
    Value(std::string_view text)
        : Value(string(std::string(text)))
    {
    }

    Type type() const { return m_type; }
    bool isNone() const { return m_type == Type::None; }
    bool isDictionary() const { return m_type == Type::Dictionary; }
    bool isArray() const { return m_type == Type::Array; }
    bool isString() const { return m_type == Type::String; }
    bool isData() const { return m_type == Type::Data; }
    bool isBoolean() const { return m_type == Type::Boolean; }
    bool isDate() const { return m_type == Type::Date; }
    bool isUuid() const { return m_type == Type::Uuid; }
    bool isReal() const { return m_type == Type::Real; }
    // Integer or Unsigned.
    bool isInteger() const { return m_type == Type::Integer || m_type == Type::Unsigned; }
    // Integer, Unsigned, Real or Boolean: the kinds that compare numerically.
    bool isNumber() const { return isInteger() || isReal() || isBoolean(); }

    // Typed reads: none (nullopt / nullptr) when the kind differs. asInt64 and asUInt64 accept any
    // integer that fits the requested type; asDouble accepts any number.
    std::optional<int64_t> asInt64() const;
    std::optional<uint64_t> asUInt64() const;
    std::optional<double> asDouble() const;
    std::optional<bool> asBool() const; // booleans only
    std::optional<double> asDate() const;
    std::optional<Uuid> asUuid() const;
    const std::string* asString() const;
    const std::vector<uint8_t>* asData() const;

    // Array access; empty for non-arrays.
    std::span<const Value> elements() const;
    // Dictionary access; empty for non-dictionaries. Entries are in insertion order.
    std::span<const Entry> entries() const;
    // Number of elements or entries; 0 for other kinds.
    size_t count() const;
    // Dictionary lookup; none when absent or when this is not a dictionary.
    const Value& operator[](std::string_view key) const;
    bool contains(std::string_view key) const { return !(*this)[key].isNone(); }
    // Array element; none when out of range or when this is not an array.
    const Value& at(size_t index) const;

    // Convenience typed lookups in a dictionary.
    const std::string* stringFor(std::string_view key) const { return (*this)[key].asString(); }

    // Equality: same kind and contents, except that numbers (integers, reals, booleans) compare by
    // numeric value. Dictionaries compare as maps (order does not matter); arrays in order.
    bool operator==(const Value& other) const;
    // True when this is a number equal to n (a boolean counts as 1 or 0).
    bool numericallyEquals(double n) const;
    size_t hash() const;

    // Diagnostic text, used for "%@": strings bare at the top level, quoted inside containers;
    // dictionaries as {key = value; ...}, arrays as (a, b), data as <0a1b...>, dates in ISO 8601,
    // UUIDs in canonical text, booleans as true/false.
    std::string description() const;

private:
    union Scalar {
        int64_t i;
        uint64_t u;
        double r;
        bool b;
    };

    struct StringNode;
    struct DataNode;
    struct ArrayNode;
    struct DictionaryNode;

    Value(Type type, Scalar scalar)
        : m_type(type)
        , m_scalar(scalar)
    {
    }
    Value(Type type, std::shared_ptr<const void> node)
        : m_type(type)
        , m_node(std::move(node))
    {
    }

    void describe(std::string& out, bool nested) const;

    Type m_type = Type::None;
    Scalar m_scalar { .u = 0 };
    Uuid m_uuid; // only for Type::Uuid
    std::shared_ptr<const void> m_node; // StringNode, DataNode, ArrayNode or DictionaryNode

    friend class DictionaryBuilder;
    friend class ArrayBuilder;
};

// Builds a dictionary, optionally starting from an existing one (sharing its values).
class DictionaryBuilder {
public:
    DictionaryBuilder() = default;
    explicit DictionaryBuilder(const Value& dictionary);

    // Replaces the value of an existing key in place, or appends. A none value removes the key.
    DictionaryBuilder& set(std::string key, Value value);
    DictionaryBuilder& remove(std::string_view key);
    const Value& get(std::string_view key) const;
    size_t count() const { return m_entries.size(); }
    Value build(); // leaves the builder empty

private:
    std::vector<Value::Entry> m_entries;
};

class ArrayBuilder {
public:
    ArrayBuilder() = default;
    explicit ArrayBuilder(const Value& array);
    ArrayBuilder& append(Value value);
    size_t count() const { return m_elements.size(); }
    Value build(); // leaves the builder empty

private:
    std::vector<Value> m_elements;
};

} // namespace om
