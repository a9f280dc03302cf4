#include "tools/omctl/OmctlJson.h"

#include <charconv>
#include <cmath>
#include <cstdint>
#include <limits>
#include <vector>

#include "platform/CborDecoder.h"
#include "platform/Format.h"
#include "platform/VlistText.h"

namespace om {

namespace {

void appendUtf8(std::string& out, uint32_t codePoint)
{
    if (codePoint < 0x80) {
        out += static_cast<char>(codePoint);
    } else if (codePoint < 0x800) {
        out += static_cast<char>(0xC0 | (codePoint >> 6));
        out += static_cast<char>(0x80 | (codePoint & 0x3F));
    } else if (codePoint < 0x10000) {
        out += static_cast<char>(0xE0 | (codePoint >> 12));
        out += static_cast<char>(0x80 | ((codePoint >> 6) & 0x3F));
        out += static_cast<char>(0x80 | (codePoint & 0x3F));
    } else {
        out += static_cast<char>(0xF0 | (codePoint >> 18));
        out += static_cast<char>(0x80 | ((codePoint >> 12) & 0x3F));
        out += static_cast<char>(0x80 | ((codePoint >> 6) & 0x3F));
        out += static_cast<char>(0x80 | (codePoint & 0x3F));
    }
}

void writeString(std::string& out, std::string_view text)
{
    out += '"';
    for (char c : text) {
        auto byte = static_cast<unsigned char>(c);
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
        case '\r':
            out += "\\r";
            break;
        case '\t':
            out += "\\t";
            break;
        default:
            if (byte < 0x20 || byte == 0x7F) {
                out += "\\u00";
                out += "0123456789abcdef"[byte >> 4];
                out += "0123456789abcdef"[byte & 15];
            } else
                out += c;
        }
    }
    out += '"';
}

void writeReal(std::string& out, double value)
{
    if (!std::isfinite(value)) {
        out += std::isnan(value) ? "{\"$real\": \"nan\"}"
            : value > 0          ? "{\"$real\": \"inf\"}"
                                 : "{\"$real\": \"-inf\"}";
        return;
    }
    char buffer[64];
    auto [end, error] = std::to_chars(buffer, buffer + sizeof buffer, value);
    std::string_view text(buffer, static_cast<size_t>(end - buffer));
    out += text;
    // Without a fraction or an exponent it would read back as an integer.
    if (text.find_first_of(".e") == std::string_view::npos)
        out += ".0";
}

void writeMarker(std::string& out, std::string_view marker, std::string_view text)
{
    out += "{\"";
    out += marker;
    out += "\": ";
    writeString(out, text);
    out += '}';
}

void writeValue(std::string& out, const Value& value, size_t indent)
{
    auto newline = [&out](size_t level) {
        out += '\n';
        out.append(level * 2, ' ');
    };
    switch (value.type()) {
    case Value::Type::None:
        out += "null";
        break;
    case Value::Type::Dictionary: {
        if (value.count() == 0) {
            out += "{}";
            break;
        }
        out += '{';
        bool first = true;
        for (const auto& [key, element] : value.entries()) {
            if (!first)
                out += ',';
            first = false;
            newline(indent + 1);
            writeString(out, key);
            out += ": ";
            writeValue(out, element, indent + 1);
        }
        newline(indent);
        out += '}';
        break;
    }
    case Value::Type::Array: {
        if (value.count() == 0) {
            out += "[]";
            break;
        }
        out += '[';
        bool first = true;
        for (const Value& element : value.elements()) {
            if (!first)
                out += ',';
            first = false;
            newline(indent + 1);
            writeValue(out, element, indent + 1);
        }
        newline(indent);
        out += ']';
        break;
    }
    case Value::Type::String:
        writeString(out, *value.asString());
        break;
    case Value::Type::Integer:
        out += std::to_string(*value.asInt64());
        break;
    case Value::Type::Unsigned:
        out += std::to_string(*value.asUInt64());
        break;
    case Value::Type::Real:
        writeReal(out, *value.asDouble());
        break;
    case Value::Type::Boolean:
        out += *value.asBool() ? "true" : "false";
        break;
    case Value::Type::Data: {
        std::string text;
        VlistText::appendBase64(text, *value.asData());
        writeMarker(out, "$data", text);
        break;
    }
    case Value::Type::Date: {
        // The vlist spelling, which also covers dates no calendar text can hold.
        std::string text;
        VlistText::appendDate(text, *value.asDate());
        writeMarker(out, "$date", text);
        break;
    }
    case Value::Type::Uuid:
        writeMarker(out, "$uuid", value.asUuid()->string());
        break;
    }
}

} // namespace

Result<Value> OmctlJson::parse(std::string_view text)
{
    if (text.size() > kMaxInputBytes)
        return OMError::platform(kPlatformErrorLimit, format("JSON text longer than %u bytes", kMaxInputBytes));
    auto bytes = std::span(reinterpret_cast<const uint8_t*>(text.data()), text.size());
    if (auto offset = CborDecoder::invalidUtf8Offset(bytes))
        return OMError::platform(kPlatformErrorMalformed, format("invalid UTF-8 at offset %u", *offset));

    OmctlJson parser(text);
    Value value;
    parser.skipSpace();
    if (!parser.parseValue(value, 0))
        return OMError::platform(
            parser.m_error.starts_with("nesting") ? kPlatformErrorLimit : kPlatformErrorMalformed, parser.m_error);
    parser.skipSpace();
    if (parser.m_position != text.size()) {
        parser.fail("unexpected text after the value", parser.m_position);
        return OMError::platform(kPlatformErrorMalformed, parser.m_error);
    }
    return value;
}

std::string OmctlJson::write(const Value& value)
{
    std::string out;
    writeValue(out, value, 0);
    return out;
}

bool OmctlJson::fail(std::string what, size_t offset)
{
    if (m_error.empty())
        m_error = format("%s at offset %u", what, offset);
    return false;
}

void OmctlJson::skipSpace()
{
    while (m_position < m_text.size()) {
        char c = m_text[m_position];
        if (c != ' ' && c != '\t' && c != '\n' && c != '\r')
            return;
        ++m_position;
    }
}

bool OmctlJson::parseValue(Value& out, size_t depth)
{
    if (m_position >= m_text.size())
        return fail("unexpected end of text", m_position);
    char c = m_text[m_position];
    switch (c) {
    case '{':
    case '[':
        // Checked before descending, so hostile nesting never reaches the stack limit.
        if (depth >= kMaxDepth)
            return fail(format("nesting deeper than %u levels", kMaxDepth), m_position);
        return c == '{' ? parseObject(out, depth + 1) : parseArray(out, depth + 1);
    case '"': {
        std::string text;
        if (!parseString(text))
            return false;
        out = Value::string(std::move(text));
        return true;
    }
    case 't':
    case 'f':
    case 'n':
        return parseLiteral(out);
    default:
        if (c == '-' || (c >= '0' && c <= '9'))
            return parseNumber(out);
        return fail(format("unexpected character '%s'", std::string(1, c)), m_position);
    }
}

bool OmctlJson::parseObject(Value& out, size_t depth)
{
    size_t start = m_position++;
    std::vector<Value::Entry> entries;
    skipSpace();
    if (m_position < m_text.size() && m_text[m_position] == '}') {
        ++m_position;
        out = Value::dictionary(std::move(entries));
        return true;
    }
    for (;;) {
        skipSpace();
        size_t keyOffset = m_position;
        if (m_position >= m_text.size() || m_text[m_position] != '"')
            return fail("expected a string key", m_position);
        std::string key;
        if (!parseString(key))
            return false;
        skipSpace();
        if (m_position >= m_text.size() || m_text[m_position] != ':')
            return fail("expected ':'", m_position);
        ++m_position;
        skipSpace();
        Value element;
        if (!parseValue(element, depth))
            return false;
        for (const auto& entry : entries) {
            if (entry.first == key)
                return fail(format("repeated key \"%s\"", key), keyOffset);
        }
        entries.emplace_back(std::move(key), std::move(element));
        skipSpace();
        if (m_position < m_text.size() && m_text[m_position] == ',') {
            ++m_position;
            continue;
        }
        if (m_position < m_text.size() && m_text[m_position] == '}') {
            ++m_position;
            break;
        }
        return fail("expected ',' or '}'", m_position);
    }
    if (entries.size() == 1 && entries[0].first.starts_with('$'))
        return applyMarker(out, entries[0].first, entries[0].second, start);
    out = Value::dictionary(std::move(entries));
    return true;
}

bool OmctlJson::applyMarker(Value& out, const std::string& key, const Value& argument, size_t start)
{
    const std::string* text = argument.asString();
    if (key == "$uuid") {
        auto uuid = text ? Uuid::parse(*text) : std::nullopt;
        if (!uuid)
            return fail("\"$uuid\" needs 8-4-4-4-12 hexadecimal text", start);
        out = Value::uuid(*uuid);
    } else if (key == "$data") {
        auto bytes = text ? VlistText::parseBase64(*text) : std::nullopt;
        if (!bytes)
            return fail("\"$data\" needs base64 text", start);
        out = Value::data(std::move(*bytes));
    } else if (key == "$date") {
        auto seconds = text                             ? VlistText::parseDate(*text)
            : argument.isInteger() || argument.isReal() ? argument.asDouble()
                                                        : std::nullopt;
        if (!seconds)
            return fail("\"$date\" needs ISO 8601 UTC text or seconds since 1970", start);
        out = Value::date(*seconds);
    } else if (key == "$real") {
        std::optional<double> real;
        if (text && *text == "nan")
            real = std::numeric_limits<double>::quiet_NaN();
        else if (text && *text == "inf")
            real = std::numeric_limits<double>::infinity();
        else if (text && *text == "-inf")
            real = -std::numeric_limits<double>::infinity();
        else if (argument.isInteger() || argument.isReal())
            real = argument.asDouble();
        if (!real)
            return fail("\"$real\" needs a number, \"nan\", \"inf\" or \"-inf\"", start);
        out = Value::real(*real);
    } else {
        out = Value::dictionary({ { key, argument } });
    }
    return true;
}

bool OmctlJson::parseArray(Value& out, size_t depth)
{
    ++m_position;
    std::vector<Value> elements;
    skipSpace();
    if (m_position < m_text.size() && m_text[m_position] == ']') {
        ++m_position;
        out = Value::array(std::move(elements));
        return true;
    }
    for (;;) {
        skipSpace();
        Value element;
        if (!parseValue(element, depth))
            return false;
        elements.push_back(std::move(element));
        skipSpace();
        if (m_position < m_text.size() && m_text[m_position] == ',') {
            ++m_position;
            continue;
        }
        if (m_position < m_text.size() && m_text[m_position] == ']') {
            ++m_position;
            break;
        }
        return fail("expected ',' or ']'", m_position);
    }
    out = Value::array(std::move(elements));
    return true;
}

bool OmctlJson::parseString(std::string& out)
{
    size_t start = m_position++;
    for (;;) {
        if (m_position >= m_text.size())
            return fail("unterminated string", start);
        char c = m_text[m_position];
        if (c == '"') {
            ++m_position;
            return true;
        }
        if (static_cast<unsigned char>(c) < 0x20)
            return fail("control character in string", m_position);
        if (c == '\\') {
            if (!parseEscape(out))
                return false;
            continue;
        }
        out += c;
        ++m_position;
    }
}

bool OmctlJson::parseEscape(std::string& out)
{
    size_t start = m_position++;
    if (m_position >= m_text.size())
        return fail("unterminated escape", start);
    char c = m_text[m_position++];
    switch (c) {
    case '"':
    case '\\':
    case '/':
        out += c;
        return true;
    case 'b':
        out += '\b';
        return true;
    case 'f':
        out += '\f';
        return true;
    case 'n':
        out += '\n';
        return true;
    case 'r':
        out += '\r';
        return true;
    case 't':
        out += '\t';
        return true;
    case 'u':
        break;
    default:
        return fail("invalid escape", start);
    }
    uint32_t unit;
    if (!parseHex4(unit))
        return fail("invalid \\u escape", start);
    if (unit >= 0xDC00 && unit <= 0xDFFF)
        return fail("unpaired low surrogate", start);
    if (unit >= 0xD800 && unit <= 0xDBFF) {
        uint32_t low;
        if (m_text.substr(m_position, 2) != "\\u")
            return fail("unpaired high surrogate", start);
        m_position += 2;
        if (!parseHex4(low))
            return fail("invalid \\u escape", m_position - 2);
        if (low < 0xDC00 || low > 0xDFFF)
            return fail("unpaired high surrogate", start);
        unit = 0x10000 + ((unit - 0xD800) << 10) + (low - 0xDC00);
    }
    appendUtf8(out, unit);
    return true;
}

bool OmctlJson::parseHex4(uint32_t& out)
{
    if (m_text.size() - m_position < 4)
        return false;
    out = 0;
    for (size_t i = 0; i < 4; ++i) {
        char c = m_text[m_position + i];
        uint32_t digit;
        if (c >= '0' && c <= '9')
            digit = static_cast<uint32_t>(c - '0');
        else if (c >= 'a' && c <= 'f')
            digit = static_cast<uint32_t>(c - 'a' + 10);
        else if (c >= 'A' && c <= 'F')
            digit = static_cast<uint32_t>(c - 'A' + 10);
        else
            return false;
        out = out * 16 + digit;
    }
    m_position += 4;
    return true;
}

bool OmctlJson::parseNumber(Value& out)
{
    size_t start = m_position;
    auto digitAt = [this](size_t at) { return at < m_text.size() && m_text[at] >= '0' && m_text[at] <= '9'; };
    if (m_text[m_position] == '-')
        ++m_position;
    if (!digitAt(m_position))
        return fail("invalid number", start);
    // JSON allows no leading zeros: "0" alone, or a digit 1-9 and more digits.
    if (m_text[m_position] == '0' && digitAt(m_position + 1))
        return fail("invalid number (leading zero)", start);
    while (digitAt(m_position))
        ++m_position;
    bool integral = true;
    if (m_position < m_text.size() && m_text[m_position] == '.') {
        integral = false;
        ++m_position;
        if (!digitAt(m_position))
            return fail("invalid number", start);
        while (digitAt(m_position))
            ++m_position;
    }
    if (m_position < m_text.size() && (m_text[m_position] == 'e' || m_text[m_position] == 'E')) {
        integral = false;
        ++m_position;
        if (m_position < m_text.size() && (m_text[m_position] == '+' || m_text[m_position] == '-'))
            ++m_position;
        if (!digitAt(m_position))
            return fail("invalid number", start);
        while (digitAt(m_position))
            ++m_position;
    }
    const char* first = m_text.data() + start;
    const char* last = m_text.data() + m_position;
    if (!integral) {
        double real;
        auto result = std::from_chars(first, last, real);
        if (result.ec != std::errc() || !std::isfinite(real))
            return fail("number out of range", start);
        out = Value::real(real);
        return true;
    }
    int64_t signedValue;
    if (std::from_chars(first, last, signedValue).ec == std::errc()) {
        out = Value::integer(signedValue);
        return true;
    }
    uint64_t unsignedValue;
    if (*first != '-' && std::from_chars(first, last, unsignedValue).ec == std::errc()) {
        out = Value::unsignedInteger(unsignedValue);
        return true;
    }
    return fail("integer out of the 64-bit range", start);
}

bool OmctlJson::parseLiteral(Value& out)
{
    std::string_view rest = m_text.substr(m_position);
    if (rest.starts_with("true")) {
        m_position += 4;
        out = Value::boolean(true);
        return true;
    }
    if (rest.starts_with("false")) {
        m_position += 5;
        out = Value::boolean(false);
        return true;
    }
    if (rest.starts_with("null"))
        return fail("null has no value-tree equivalent", m_position);
    return fail("invalid literal", m_position);
}

} // namespace om
