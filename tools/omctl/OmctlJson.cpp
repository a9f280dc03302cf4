#include "tools/omctl/OmctlJson.h"

#include <cmath>
#include <limits>
#include <vector>

#include "platform/CborDecoder.h"
#include "platform/Format.h"
#include "platform/VlistText.h"

#include <nlohmann/json.hpp>

namespace om {

namespace {

using Json = nlohmann::json;

// Builds the value tree from nlohmann's parse events. Containers wait on a stack of their own, so
// the depth is known, and refused, before anything is allocated for a level too deep.
class TreeBuilder {
public:
    using number_integer_t = Json::number_integer_t;
    using number_unsigned_t = Json::number_unsigned_t;
    using number_float_t = Json::number_float_t;
    using string_t = Json::string_t;
    using binary_t = Json::binary_t;

    bool null() { return fail("null has no value-tree equivalent"); }
    bool boolean(bool value) { return add(Value::boolean(value)); }
    bool number_integer(number_integer_t value) { return add(Value::integer(value)); }
    bool number_unsigned(number_unsigned_t value)
    {
        if (value <= static_cast<uint64_t>(std::numeric_limits<int64_t>::max()))
            return add(Value::integer(static_cast<int64_t>(value)));
        return add(Value::unsignedInteger(value));
    }
    bool number_float(number_float_t value, const string_t& text)
    {
        // The parser falls back to a real for an integer too long for 64 bits; that is no real.
        if (text.find_first_of(".eE") == string_t::npos)
            return fail(format("integer %s out of the 64-bit range", text));
        if (!std::isfinite(value))
            return fail(format("number %s out of range", text));
        return add(Value::real(value));
    }
    bool string(string_t& text) { return add(Value::string(std::move(text))); }
    bool binary(binary_t&) { return fail("binary values are not JSON"); }
    bool start_object(std::size_t) { return open(true); }
    bool key(string_t& key)
    {
        m_stack.back().key = std::move(key);
        return true;
    }
    bool end_object();
    bool start_array(std::size_t) { return open(false); }
    bool end_array()
    {
        Value array = Value::array(std::move(m_stack.back().elements));
        m_stack.pop_back();
        return add(std::move(array));
    }
    bool parse_error(std::size_t, const std::string&, const nlohmann::detail::exception& exception)
    {
        // "[json.exception.parse_error.101] parse error at line 1, column 3: ..." without its tag.
        std::string_view what = exception.what();
        if (auto tagEnd = what.find("] "); what.starts_with("[json.exception") && tagEnd != std::string_view::npos)
            what.remove_prefix(tagEnd + 2);
        return fail(std::string(what));
    }

    Result<Value> result()
    {
        if (!m_error.empty())
            return OMError::platform(m_limit ? kPlatformErrorLimit : kPlatformErrorMalformed, m_error);
        return std::move(m_root);
    }

private:
    struct Level {
        bool object;
        std::string key; // the key whose value comes next
        std::vector<Value::Entry> entries;
        std::vector<Value> elements;
    };

    bool open(bool object)
    {
        if (m_stack.size() >= OmctlJson::kMaxDepth) {
            m_limit = true;
            return fail(format("nesting deeper than %u levels", OmctlJson::kMaxDepth));
        }
        m_stack.push_back(Level { .object = object });
        return true;
    }
    bool add(Value value)
    {
        if (m_stack.empty())
            m_root = std::move(value);
        else if (m_stack.back().object)
            m_stack.back().entries.emplace_back(std::move(m_stack.back().key), std::move(value));
        else
            m_stack.back().elements.push_back(std::move(value));
        return true;
    }
    bool fail(std::string what)
    {
        if (m_error.empty())
            m_error = std::move(what);
        return false;
    }
    std::optional<Value> marker(const std::string& key, const Value& argument);

    std::vector<Level> m_stack;
    Value m_root;
    std::string m_error;
    bool m_limit = false;
};

bool TreeBuilder::end_object()
{
    std::vector<Value::Entry> entries = std::move(m_stack.back().entries);
    m_stack.pop_back();
    if (entries.size() == 1 && entries[0].first.starts_with('$')) {
        auto value = marker(entries[0].first, entries[0].second);
        return value ? add(std::move(*value)) : false;
    }
    std::string repeated;
    auto dictionary = Value::uniqueDictionary(std::move(entries), &repeated);
    if (!dictionary)
        return fail(format("repeated key \"%s\"", repeated));
    return add(std::move(*dictionary));
}

// The value a marker object stands for; an unknown marker is an ordinary one-key dictionary.
std::optional<Value> TreeBuilder::marker(const std::string& key, const Value& argument)
{
    const std::string* text = argument.asString();
    const bool number = argument.isInteger() || argument.isReal();
    if (key == "$uuid") {
        if (auto uuid = text ? Uuid::parse(*text) : std::nullopt)
            return Value::uuid(*uuid);
        fail("\"$uuid\" needs 8-4-4-4-12 hexadecimal text");
    } else if (key == "$data") {
        if (auto bytes = text ? VlistText::parseBase64(*text) : std::nullopt)
            return Value::data(std::move(*bytes));
        fail("\"$data\" needs base64 text");
    } else if (key == "$date") {
        if (auto seconds = text ? VlistText::parseDate(*text) : number ? argument.asDouble() : std::nullopt)
            return Value::date(*seconds);
        fail("\"$date\" needs ISO 8601 UTC text or seconds since 1970");
    } else if (key == "$real") {
        constexpr double kInfinity = std::numeric_limits<double>::infinity();
        if (number)
            return Value::real(*argument.asDouble());
        if (text && *text == "nan")
            return Value::real(std::numeric_limits<double>::quiet_NaN());
        if (text && (*text == "inf" || *text == "-inf"))
            return Value::real(*text == "inf" ? kInfinity : -kInfinity);
        fail("\"$real\" needs a number, \"nan\", \"inf\" or \"-inf\"");
    } else {
        return Value::dictionary({ { key, argument } });
    }
    return std::nullopt;
}

std::string quoted(const std::string& text)
{
    // Replacement characters for bytes that are not UTF-8 rather than an exception: the tree may
    // hold text from anywhere.
    return Json(text).dump(-1, ' ', false, Json::error_handler_t::replace);
}

std::string markerText(std::string_view name, const std::string& argument)
{
    return "{\"" + std::string(name) + "\": " + quoted(argument) + "}";
}

std::string scalar(const Value& value)
{
    switch (value.type()) {
    case Value::Type::String:
        return quoted(*value.asString());
    case Value::Type::Integer:
        return Json(*value.asInt64()).dump();
    case Value::Type::Unsigned:
        return Json(*value.asUInt64()).dump();
    case Value::Type::Boolean:
        return Json(*value.asBool()).dump();
    case Value::Type::Real: {
        const double real = *value.asDouble();
        if (std::isnan(real))
            return markerText("$real", "nan");
        if (std::isinf(real))
            return markerText("$real", real > 0 ? "inf" : "-inf");
        return Json(real).dump(); // always with a fraction or an exponent, so it reads back as a real
    }
    case Value::Type::Data: {
        std::string text;
        VlistText::appendBase64(text, *value.asData());
        return markerText("$data", text);
    }
    case Value::Type::Date: {
        // The vlist spelling, which also covers dates no calendar text can hold.
        std::string text;
        VlistText::appendDate(text, *value.asDate());
        return markerText("$date", text);
    }
    case Value::Type::Uuid:
        return markerText("$uuid", value.asUuid()->string());
    default:
        return "null";
    }
}

// The containers are laid out here, not by nlohmann, so that a marker object stays on one line.
void writeValue(std::string& out, const Value& value, OmctlJson::Layout layout, size_t level)
{
    const bool object = value.isDictionary();
    if ((!object && !value.isArray()) || value.count() == 0) {
        out += object ? "{}" : value.isArray() ? "[]" : scalar(value);
        return;
    }
    auto newline = [&](size_t depth) {
        if (layout == OmctlJson::Layout::Indented) {
            out += '\n';
            out.append(depth * 2, ' ');
        }
    };
    out += object ? '{' : '[';
    const char* separator = layout == OmctlJson::Layout::Indented ? "," : ", ";
    bool first = true;
    auto next = [&] {
        if (!first)
            out += separator;
        first = false;
        newline(level + 1);
    };
    for (const auto& [key, element] : value.entries()) {
        next();
        out += quoted(key) + ": ";
        writeValue(out, element, layout, level + 1);
    }
    for (const Value& element : value.elements()) {
        next();
        writeValue(out, element, layout, level + 1);
    }
    newline(level);
    out += object ? '}' : ']';
}

} // namespace

Result<Value> OmctlJson::parse(std::string_view text)
{
    if (text.size() > kMaxInputBytes)
        return OMError::platform(kPlatformErrorLimit, format("JSON text longer than %u bytes", kMaxInputBytes));
    // nlohmann refuses these too; checked first for the offset in the message.
    auto bytes = std::span(reinterpret_cast<const uint8_t*>(text.data()), text.size());
    if (auto offset = CborDecoder::invalidUtf8Offset(bytes))
        return OMError::platform(kPlatformErrorMalformed, format("invalid UTF-8 at offset %u", *offset));

    // nlohmann would skip a byte-order mark; JSON text has none, and omctl has always refused it.
    if (text.starts_with("\xEF\xBB\xBF"))
        return OMError::platform(kPlatformErrorMalformed, "a byte-order mark is not JSON");

    TreeBuilder builder;
    (void)Json::sax_parse(text.begin(), text.end(), &builder, Json::input_format_t::json, true, false);
    return builder.result();
}

std::string OmctlJson::write(const Value& value, Layout layout)
{
    std::string out;
    writeValue(out, value, layout, 0);
    return out;
}

} // namespace om
