#include "platform/VlistXmlWriter.h"

#include <charconv>
#include <string_view>
#include <unordered_set>

#include "platform/Fatal.h"
#include "platform/VlistText.h"

namespace om {

namespace {

constexpr std::string_view kReplacement = "\xEF\xBF\xBD"; // U+FFFD

// The length of the well-formed UTF-8 sequence starting at text[at] (at least 2 bytes, since
// text[at] is not ASCII), with its code point; 0 when ill-formed.
size_t decodeSequence(std::string_view text, size_t at, char32_t& codePoint)
{
    const auto lead = static_cast<uint8_t>(text[at]);
    size_t length;
    uint8_t low = 0x80;
    uint8_t high = 0xbf;
    if (lead >= 0xc2 && lead <= 0xdf) {
        length = 2;
        codePoint = lead & 0x1f;
    } else if (lead >= 0xe0 && lead <= 0xef) {
        length = 3;
        codePoint = lead & 0x0f;
        low = lead == 0xe0 ? 0xa0 : 0x80; // overlong
        high = lead == 0xed ? 0x9f : 0xbf; // surrogates
    } else if (lead >= 0xf0 && lead <= 0xf4) {
        length = 4;
        codePoint = lead & 0x07;
        low = lead == 0xf0 ? 0x90 : 0x80; // overlong
        high = lead == 0xf4 ? 0x8f : 0xbf; // past U+10FFFF
    } else {
        return 0;
    }
    if (text.size() - at < length)
        return 0;
    for (size_t i = 1; i < length; ++i) {
        const auto byte = static_cast<uint8_t>(text[at + i]);
        if (byte < (i == 1 ? low : 0x80) || byte > (i == 1 ? high : 0xbf))
            return 0;
        codePoint = codePoint << 6 | (byte & 0x3f);
    }
    return length;
}

// XML 1.0's Char production, for code points past ASCII.
bool isXmlCharacter(char32_t c)
{
    return (c <= 0xd7ff) || (c >= 0xe000 && c <= 0xfffd) || (c >= 0x10000 && c <= 0x10ffff);
}

// The escape an ASCII byte needs in character data; "" when it stands as itself, nullptr when XML
// 1.0 cannot carry it at all. A carriage return is escaped because a reader would turn a literal
// one into a newline.
const char* escapeOf(char c)
{
    switch (c) {
    case '&':
        return "&amp;";
    case '<':
        return "&lt;";
    case '>':
        return "&gt;";
    case '"':
        return "&quot;";
    case '\'':
        return "&apos;";
    case '\r':
        return "&#13;";
    case '\t':
    case '\n':
        return "";
    default:
        return static_cast<uint8_t>(c) < 0x20 ? nullptr : "";
    }
}

// Appends text as character data; false when something in it had to be replaced.
bool appendEscaped(std::string& out, std::string_view text)
{
    bool exact = true;
    size_t run = 0; // start of the bytes not yet copied
    size_t at = 0;
    while (at < text.size()) {
        const char c = text[at];
        if (static_cast<uint8_t>(c) >= 0x80) {
            char32_t codePoint = 0;
            const size_t length = decodeSequence(text, at, codePoint);
            if (length && isXmlCharacter(codePoint)) {
                at += length;
                continue;
            }
            out.append(text, run, at - run);
            out += kReplacement;
            exact = false;
            at += length ? length : 1;
            run = at;
            continue;
        }
        const char* escape = escapeOf(c);
        if (escape && !*escape) {
            ++at;
            continue;
        }
        out.append(text, run, at - run);
        if (escape) {
            out += escape;
        } else {
            out += kReplacement;
            exact = false;
        }
        run = ++at;
    }
    out.append(text, run, text.size() - run);
    return exact;
}

template <typename Integer> void appendInteger(std::string& out, Integer value)
{
    char buffer[24];
    auto [end, ec] = std::to_chars(buffer, buffer + sizeof buffer, value);
    (void)ec; // 24 characters hold any 64-bit integer
    out.append(buffer, end);
}

bool isInline(const Value& value)
{
    return !(value.isDictionary() || value.isArray()) || value.count() == 0;
}

void appendIndent(std::string& out, unsigned level)
{
    out.append(size_t { level } * 2, ' ');
}

// A scalar or an empty container, on one line.
void appendInline(std::string& out, const Value& value)
{
    switch (value.type()) {
    case Value::Type::None:
        internalInconsistency("a none value cannot be written");
    case Value::Type::Dictionary:
        out += "<dict/>";
        return;
    case Value::Type::Array:
        out += "<array/>";
        return;
    case Value::Type::String:
        out += "<string>";
        appendEscaped(out, *value.asString());
        out += "</string>";
        return;
    case Value::Type::Integer:
        out += "<integer>";
        appendInteger(out, *value.asInt64());
        out += "</integer>";
        return;
    case Value::Type::Unsigned:
        out += "<integer>";
        appendInteger(out, *value.asUInt64());
        out += "</integer>";
        return;
    case Value::Type::Real:
        out += "<real>";
        VlistText::appendReal(out, *value.asDouble());
        out += "</real>";
        return;
    case Value::Type::Boolean:
        out += *value.asBool() ? "<true/>" : "<false/>";
        return;
    case Value::Type::Data:
        out += "<data>";
        VlistText::appendBase64(out, *value.asData());
        out += "</data>";
        return;
    case Value::Type::Date:
        out += "<date>";
        VlistText::appendDate(out, *value.asDate());
        out += "</date>";
        return;
    case Value::Type::Uuid:
        out += "<uuid>";
        out += value.asUuid()->string();
        out += "</uuid>";
        return;
    }
}

void appendValue(std::string& out, const Value& value, unsigned level);

void appendEntry(std::string& out, std::string_view escapedKey, const Value& value, unsigned level)
{
    appendIndent(out, level);
    out += "<key>";
    out += escapedKey;
    out += "</key>";
    if (isInline(value)) {
        appendInline(out, value);
        out += '\n';
        return;
    }
    out += '\n';
    appendValue(out, value, level);
}

void appendEntries(std::string& out, const Value& dictionary, unsigned level)
{
    const auto entries = dictionary.entries();
    bool exactKeys = true;
    for (const auto& entry : entries)
        exactKeys = exactKeys && VlistXmlWriter::representable(entry.first);
    if (exactKeys) {
        std::string key;
        for (const auto& [name, value] : entries) {
            key.clear();
            appendEscaped(key, name);
            appendEntry(out, key, value, level);
        }
        return;
    }
    // Replacement made some keys alike: the file must still read back, so the first one wins.
    std::unordered_set<std::string> written;
    for (const auto& [name, value] : entries) {
        std::string key;
        appendEscaped(key, name);
        if (written.insert(key).second)
            appendEntry(out, key, value, level);
    }
}

// A value on lines of its own, starting at the indentation of level.
void appendValue(std::string& out, const Value& value, unsigned level)
{
    appendIndent(out, level);
    if (isInline(value)) {
        appendInline(out, value);
        out += '\n';
        return;
    }
    if (value.isArray()) {
        out += "<array>\n";
        for (const auto& element : value.elements())
            appendValue(out, element, level + 1);
        appendIndent(out, level);
        out += "</array>\n";
        return;
    }
    out += "<dict>\n";
    appendEntries(out, value, level + 1);
    appendIndent(out, level);
    out += "</dict>\n";
}

// Roughly the size of the text, so that a large tree is written without the string regrowing
// (and, for long ones, refaulting fresh pages) about log2(size) times.
size_t estimatedSize(const Value& value, unsigned level)
{
    constexpr size_t kMarkup = 24; // tags, indentation and a short scalar
    size_t size = kMarkup + size_t { level } * 2;
    if (const std::string* text = value.asString())
        size += text->size();
    else if (const auto* bytes = value.asData())
        size += bytes->size() / 3 * 4 + 4;
    for (const auto& element : value.elements())
        size += estimatedSize(element, level + 1);
    for (const auto& [key, element] : value.entries())
        size += key.size() + estimatedSize(element, level + 1);
    return size;
}

} // namespace

std::string VlistXmlWriter::write(const Value& value)
{
    std::string out;
    out.reserve(estimatedSize(value, 0) + 64);
    out += "<?xml version=\"1.0\" encoding=\"UTF-8\"?>\n<vlist version=\"1\">\n";
    appendValue(out, value, 0);
    out += "</vlist>\n";
    return out;
}

void VlistXmlWriter::appendDictionaryEntry(std::string& out, std::string_view key, const Value& value, unsigned level)
{
    std::string escaped;
    appendEscaped(escaped, key);
    appendEntry(out, escaped, value, level);
}

bool VlistXmlWriter::representable(std::string_view text)
{
    for (size_t at = 0; at < text.size();) {
        const char c = text[at];
        if (static_cast<uint8_t>(c) < 0x80) {
            if (!escapeOf(c))
                return false;
            ++at;
            continue;
        }
        char32_t codePoint = 0;
        const size_t length = decodeSequence(text, at, codePoint);
        if (!length || !isXmlCharacter(codePoint))
            return false;
        at += length;
    }
    return true;
}

} // namespace om
