#include "platform/Value.h"

#include <algorithm>
#include <charconv>
#include <cmath>
#include <cstring>
#include <ctime>
#include <limits>

namespace om {

struct Value::StringNode {
    std::string text;
};

struct Value::DataNode {
    std::vector<uint8_t> bytes;
};

struct Value::ArrayNode {
    std::vector<Value> elements;
};

// Small dictionaries are searched linearly; larger ones get a key-sorted index, built once since
// the node never changes.
struct Value::DictionaryNode {
    static constexpr size_t kLinearLimit = 8;

    std::vector<Entry> entries;
    std::vector<uint32_t> sorted; // indexes into entries ordered by key; empty when small

    const Value* find(std::string_view key) const
    {
        if (sorted.empty()) {
            for (const auto& entry : entries) {
                if (entry.first == key)
                    return &entry.second;
            }
            return nullptr;
        }
        auto it = std::lower_bound(
            sorted.begin(), sorted.end(), key, [this](uint32_t i, std::string_view k) { return entries[i].first < k; });
        if (it != sorted.end() && entries[*it].first == key)
            return &entries[*it].second;
        return nullptr;
    }
};

namespace {

const Value kNone;

// Sorts the index by key and reports whether two entries share a key. Stable, so equal keys stay
// in insertion order next to each other.
bool buildIndex(const std::vector<Value::Entry>& entries, std::vector<uint32_t>& sorted)
{
    sorted.resize(entries.size());
    for (uint32_t i = 0; i < sorted.size(); ++i)
        sorted[i] = i;
    std::stable_sort(
        sorted.begin(), sorted.end(), [&](uint32_t a, uint32_t b) { return entries[a].first < entries[b].first; });
    for (size_t i = 1; i < sorted.size(); ++i) {
        if (entries[sorted[i]].first == entries[sorted[i - 1]].first)
            return true;
    }
    return false;
}

// Returns the index of the first key that repeats an earlier one, or npos.
size_t firstRepeatedKey(const std::vector<Value::Entry>& entries, const std::vector<uint32_t>& sorted)
{
    size_t first = std::string::npos;
    if (sorted.empty()) {
        for (size_t i = 1; i < entries.size() && first == std::string::npos; ++i) {
            for (size_t j = 0; j < i; ++j) {
                if (entries[i].first == entries[j].first) {
                    first = i;
                    break;
                }
            }
        }
        return first;
    }
    for (size_t i = 1; i < sorted.size(); ++i) {
        if (entries[sorted[i]].first == entries[sorted[i - 1]].first)
            first = std::min<size_t>(first, sorted[i]);
    }
    return first;
}

// Folds repeated keys: the value of the last occurrence lands at the position of the first.
std::vector<Value::Entry> foldRepeatedKeys(std::vector<Value::Entry> entries)
{
    std::vector<Value::Entry> folded;
    folded.reserve(entries.size());
    for (auto& entry : entries) {
        auto it
            = std::find_if(folded.begin(), folded.end(), [&](const Value::Entry& e) { return e.first == entry.first; });
        if (it == folded.end())
            folded.push_back(std::move(entry));
        else
            it->second = std::move(entry.second);
    }
    return folded;
}

bool isIntegral(double d)
{
    return std::isfinite(d) && std::floor(d) == d;
}

void appendQuoted(std::string& out, std::string_view text)
{
    out.push_back('"');
    for (char c : text) {
        switch (c) {
        case '"':
            out += "\\\"";
            break;
        case '\\':
            out += "\\\\";
            break;
        case '\n':
            out += "\\n";
            break;
        case '\t':
            out += "\\t";
            break;
        default:
            if (static_cast<unsigned char>(c) < 0x20) {
                char buffer[8];
                (void)std::snprintf(buffer, sizeof buffer, "\\u%04x", c);
                out += buffer;
            } else {
                out.push_back(c);
            }
        }
    }
    out.push_back('"');
}

void appendReal(std::string& out, double d)
{
    if (std::isnan(d)) {
        out += "nan";
        return;
    }
    if (std::isinf(d)) {
        out += d < 0 ? "-inf" : "inf";
        return;
    }
    char buffer[32];
    auto result = std::to_chars(buffer, buffer + sizeof buffer, d);
    out.append(buffer, result.ptr);
}

} // namespace

Value Value::uuid(const Uuid& u)
{
    Value v(Type::Uuid, Scalar { .u = 0 });
    v.m_uuid = u;
    return v;
}

Value Value::string(std::string text)
{
    return Value(Type::String, std::make_shared<const StringNode>(StringNode { std::move(text) }));
}

Value Value::data(std::vector<uint8_t> bytes)
{
    return Value(Type::Data, std::make_shared<const DataNode>(DataNode { std::move(bytes) }));
}

Value Value::data(std::span<const uint8_t> bytes)
{
    return data(std::vector<uint8_t>(bytes.begin(), bytes.end()));
}

Value Value::array(std::vector<Value> elements)
{
    return Value(Type::Array, std::make_shared<const ArrayNode>(ArrayNode { std::move(elements) }));
}

Value Value::array(std::initializer_list<Value> elements)
{
    return array(std::vector<Value>(elements));
}

Value Value::dictionary(std::vector<Entry> entries)
{
    auto node = std::make_shared<DictionaryNode>();
    bool repeated;
    if (entries.size() > DictionaryNode::kLinearLimit)
        repeated = buildIndex(entries, node->sorted);
    else
        repeated = firstRepeatedKey(entries, {}) != std::string::npos;
    if (repeated) {
        entries = foldRepeatedKeys(std::move(entries));
        node->sorted.clear();
        if (entries.size() > DictionaryNode::kLinearLimit)
            buildIndex(entries, node->sorted);
    }
    node->entries = std::move(entries);
    return Value(Type::Dictionary, std::shared_ptr<const DictionaryNode>(std::move(node)));
}

Value Value::dictionary(std::initializer_list<Entry> entries)
{
    return dictionary(std::vector<Entry>(entries));
}

std::optional<Value> Value::uniqueDictionary(std::vector<Entry> entries, std::string* duplicateKey)
{
    auto node = std::make_shared<DictionaryNode>();
    if (entries.size() > DictionaryNode::kLinearLimit)
        buildIndex(entries, node->sorted);
    size_t repeated = firstRepeatedKey(entries, node->sorted);
    if (repeated != std::string::npos) {
        if (duplicateKey)
            *duplicateKey = entries[repeated].first;
        return std::nullopt;
    }
    node->entries = std::move(entries);
    return Value(Type::Dictionary, std::shared_ptr<const DictionaryNode>(std::move(node)));
}

std::string Value::dateText(double secondsSince1970)
{
    if (!std::isfinite(secondsSince1970))
        return "invalid-date";
    double whole = std::floor(secondsSince1970);
    auto seconds = static_cast<time_t>(whole);
    struct tm parts { };
    if (!gmtime_r(&seconds, &parts))
        return "invalid-date";
    char buffer[64];
    size_t n = std::strftime(buffer, sizeof buffer, "%Y-%m-%dT%H:%M:%S", &parts);
    std::string text(buffer, n);
    double fraction = secondsSince1970 - whole;
    if (fraction > 0) {
        char digits[32];
        (void)std::snprintf(digits, sizeof digits, "%.9f", fraction); // "0.xxxxxxxxx"
        std::string tail(digits + 1);
        while (!tail.empty() && tail.back() == '0')
            tail.pop_back();
        if (tail.size() > 1)
            text += tail;
    }
    text.push_back('Z');
    return text;
}

std::optional<int64_t> Value::asInt64() const
{
    if (m_type == Type::Integer)
        return m_scalar.i;
    if (m_type == Type::Unsigned && m_scalar.u <= static_cast<uint64_t>(std::numeric_limits<int64_t>::max()))
        return static_cast<int64_t>(m_scalar.u);
    return std::nullopt;
}

std::optional<uint64_t> Value::asUInt64() const
{
    if (m_type == Type::Unsigned)
        return m_scalar.u;
    if (m_type == Type::Integer && m_scalar.i >= 0)
        return static_cast<uint64_t>(m_scalar.i);
    return std::nullopt;
}

std::optional<double> Value::asDouble() const
{
    switch (m_type) {
    case Type::Integer:
        return static_cast<double>(m_scalar.i);
    case Type::Unsigned:
        return static_cast<double>(m_scalar.u);
    case Type::Real:
        return m_scalar.r;
    case Type::Boolean:
        return m_scalar.b ? 1.0 : 0.0;
    default:
        return std::nullopt;
    }
}

std::optional<bool> Value::asBool() const
{
    if (m_type == Type::Boolean)
        return m_scalar.b;
    return std::nullopt;
}

std::optional<double> Value::asDate() const
{
    if (m_type == Type::Date)
        return m_scalar.r;
    return std::nullopt;
}

std::optional<Uuid> Value::asUuid() const
{
    if (m_type == Type::Uuid)
        return m_uuid;
    return std::nullopt;
}

const std::string* Value::asString() const
{
    if (m_type != Type::String)
        return nullptr;
    return &static_cast<const StringNode*>(m_node.get())->text;
}

const std::vector<uint8_t>* Value::asData() const
{
    if (m_type != Type::Data)
        return nullptr;
    return &static_cast<const DataNode*>(m_node.get())->bytes;
}

std::span<const Value> Value::elements() const
{
    if (m_type != Type::Array)
        return {};
    return static_cast<const ArrayNode*>(m_node.get())->elements;
}

std::span<const Value::Entry> Value::entries() const
{
    if (m_type != Type::Dictionary)
        return {};
    return static_cast<const DictionaryNode*>(m_node.get())->entries;
}

size_t Value::count() const
{
    if (m_type == Type::Array)
        return elements().size();
    if (m_type == Type::Dictionary)
        return entries().size();
    return 0;
}

const Value& Value::operator[](std::string_view key) const
{
    if (m_type != Type::Dictionary)
        return kNone;
    const Value* found = static_cast<const DictionaryNode*>(m_node.get())->find(key);
    return found ? *found : kNone;
}

const Value& Value::at(size_t index) const
{
    auto all = elements();
    return index < all.size() ? all[index] : kNone;
}

namespace {

// Exact numeric equality across signed, unsigned, real and boolean.
bool numbersEqual(const Value& a, const Value& b)
{
    using T = Value::Type;
    if (a.type() == T::Real || b.type() == T::Real) {
        double x = *a.asDouble();
        double y = *b.asDouble();
        if (a.type() == T::Real && b.type() == T::Real)
            return x == y || (std::isnan(x) && std::isnan(y));
        const Value& integer = a.type() == T::Real ? b : a;
        double real = a.type() == T::Real ? x : y;
        if (!isIntegral(real))
            return false;
        if (auto i = integer.asInt64())
            return real >= -0x1p63 && real < 0x1p63 && static_cast<int64_t>(real) == *i;
        if (auto u = integer.asUInt64())
            return real >= 0 && real < 0x1p64 && static_cast<uint64_t>(real) == *u;
        return integer.isBoolean() && real == (*integer.asBool() ? 1.0 : 0.0);
    }
    auto wide = [](const Value& v) -> std::pair<bool, uint64_t> { // (negative, magnitude bits)
        if (auto b = v.asBool())
            return { false, *b ? 1u : 0u };
        if (v.type() == Value::Type::Unsigned)
            return { false, *v.asUInt64() };
        int64_t i = *v.asInt64();
        return { i < 0, static_cast<uint64_t>(i) };
    };
    return wide(a) == wide(b);
}

} // namespace

bool Value::operator==(const Value& other) const
{
    if (isNumber() && other.isNumber())
        return numbersEqual(*this, other);
    if (m_type != other.m_type)
        return false;
    switch (m_type) {
    case Type::None:
        return true;
    case Type::String:
        return *asString() == *other.asString();
    case Type::Data:
        return *asData() == *other.asData();
    case Type::Date:
        // As for reals: a NaN date (the wire allows one) equals itself, so round trips compare.
        return m_scalar.r == other.m_scalar.r || (std::isnan(m_scalar.r) && std::isnan(other.m_scalar.r));
    case Type::Uuid:
        return m_uuid == other.m_uuid;
    case Type::Array: {
        if (m_node == other.m_node)
            return true;
        auto a = elements();
        auto b = other.elements();
        return std::equal(a.begin(), a.end(), b.begin(), b.end());
    }
    case Type::Dictionary: {
        if (m_node == other.m_node)
            return true;
        if (count() != other.count())
            return false;
        for (const auto& [key, value] : entries()) {
            const Value& theirs = other[key];
            if (theirs.isNone() || !(theirs == value))
                return false;
        }
        return true;
    }
    default:
        return false; // numbers handled above
    }
}

bool Value::numericallyEquals(double n) const
{
    return isNumber() && numbersEqual(*this, Value::real(n));
}

size_t Value::hash() const
{
    std::hash<std::string_view> text;
    switch (m_type) {
    case Type::None:
        return 0;
    case Type::Integer:
    case Type::Unsigned:
    case Type::Boolean:
    case Type::Real: {
        // Equal numbers hash alike whatever their kind.
        double d = *asDouble();
        if (m_type == Type::Unsigned || m_type == Type::Integer)
            return std::hash<uint64_t>()(m_type == Type::Unsigned ? m_scalar.u : static_cast<uint64_t>(m_scalar.i));
        if (isIntegral(d) && d >= -0x1p63 && d < 0x1p63)
            return std::hash<uint64_t>()(static_cast<uint64_t>(static_cast<int64_t>(d)));
        if (isIntegral(d) && d >= 0 && d < 0x1p64)
            return std::hash<uint64_t>()(static_cast<uint64_t>(d));
        return std::hash<double>()(d);
    }
    case Type::String:
        return text(*asString());
    case Type::Data: {
        const auto& bytes = *asData();
        return text(std::string_view(reinterpret_cast<const char*>(bytes.data()), bytes.size()));
    }
    case Type::Date:
        return std::hash<double>()(m_scalar.r) ^ 0x5bd1e995;
    case Type::Uuid:
        return std::hash<Uuid>()(m_uuid);
    case Type::Array: {
        size_t h = 0x345678;
        for (const auto& element : elements())
            h = h * 1000003 ^ element.hash();
        return h;
    }
    case Type::Dictionary: {
        // Order-independent, as equality is.
        size_t h = count();
        for (const auto& [key, value] : entries())
            h += text(key) * 31 ^ value.hash();
        return h;
    }
    }
    return 0;
}

std::string Value::description() const
{
    std::string out;
    describe(out, false);
    return out;
}

void Value::describe(std::string& out, bool nested) const
{
    static constexpr size_t kDataShown = 64;
    switch (m_type) {
    case Type::None:
        out += "(none)";
        return;
    case Type::String:
        if (nested)
            appendQuoted(out, *asString());
        else
            out += *asString();
        return;
    case Type::Integer:
        out += std::to_string(m_scalar.i);
        return;
    case Type::Unsigned:
        out += std::to_string(m_scalar.u);
        return;
    case Type::Real:
        appendReal(out, m_scalar.r);
        return;
    case Type::Boolean:
        out += m_scalar.b ? "true" : "false";
        return;
    case Type::Date:
        out += dateText(m_scalar.r);
        return;
    case Type::Uuid:
        out += m_uuid.string();
        return;
    case Type::Data: {
        static constexpr char kDigits[] = "0123456789abcdef";
        const auto& bytes = *asData();
        out.push_back('<');
        for (size_t i = 0; i < bytes.size() && i < kDataShown; ++i) {
            out.push_back(kDigits[bytes[i] >> 4]);
            out.push_back(kDigits[bytes[i] & 0xf]);
        }
        if (bytes.size() > kDataShown)
            out += "... " + std::to_string(bytes.size()) + " bytes";
        out.push_back('>');
        return;
    }
    case Type::Array: {
        out.push_back('(');
        bool first = true;
        for (const auto& element : elements()) {
            if (!first)
                out += ", ";
            first = false;
            element.describe(out, true);
        }
        out.push_back(')');
        return;
    }
    case Type::Dictionary: {
        out.push_back('{');
        bool first = true;
        for (const auto& [key, value] : entries()) {
            if (!first)
                out += "; ";
            first = false;
            appendQuoted(out, key);
            out += " = ";
            value.describe(out, true);
        }
        out.push_back('}');
        return;
    }
    }
}

DictionaryBuilder::DictionaryBuilder(const Value& dictionary)
{
    auto all = dictionary.entries();
    m_entries.assign(all.begin(), all.end());
}

DictionaryBuilder& DictionaryBuilder::set(std::string key, Value value)
{
    if (value.isNone())
        return remove(key);
    for (auto& entry : m_entries) {
        if (entry.first == key) {
            entry.second = std::move(value);
            return *this;
        }
    }
    m_entries.emplace_back(std::move(key), std::move(value));
    return *this;
}

DictionaryBuilder& DictionaryBuilder::remove(std::string_view key)
{
    std::erase_if(m_entries, [&](const Value::Entry& entry) { return entry.first == key; });
    return *this;
}

const Value& DictionaryBuilder::get(std::string_view key) const
{
    for (const auto& entry : m_entries) {
        if (entry.first == key)
            return entry.second;
    }
    return kNone;
}

Value DictionaryBuilder::build()
{
    // Keys are unique by construction, so the unique path only builds the index.
    return *Value::uniqueDictionary(std::move(m_entries));
}

ArrayBuilder::ArrayBuilder(const Value& array)
{
    auto all = array.elements();
    m_elements.assign(all.begin(), all.end());
}

ArrayBuilder& ArrayBuilder::append(Value value)
{
    m_elements.push_back(std::move(value));
    return *this;
}

Value ArrayBuilder::build()
{
    return Value::array(std::move(m_elements));
}

} // namespace om
