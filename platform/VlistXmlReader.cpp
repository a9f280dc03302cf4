#include "platform/VlistXmlReader.h"

#include <libxml/SAX2.h>
#include <libxml/parser.h>
#include <libxml/tree.h>

#include <algorithm>
#include <cerrno>
#include <climits>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>
#include <vector>

#include "platform/Cbor.h"
#include "platform/VlistText.h"

namespace om {

namespace {

// A vlist nests containers at most Cbor::kMaxDepth deep, inside <vlist> and around one scalar.
constexpr unsigned kMaxElementDepth = Cbor::kMaxDepth + 2;
constexpr size_t kQuotedTextLimit = 40;

enum class Element { Dict, Array, String, Integer, Real, True, False, Data, Date, Uuid, Key, Unknown };

struct Parser {
    void operator()(xmlParserCtxt* parser) const { xmlFreeParserCtxt(parser); }
};
struct Document {
    void operator()(xmlDoc* document) const { xmlFreeDoc(document); }
};
struct XmlString {
    void operator()(xmlChar* text) const { xmlFree(text); }
};

// What the SAX hooks share with parse(), reached through the parser's _private.
struct ParseGuard {
    unsigned elementDepth = 0;
    std::optional<OMError> refusal;
};

std::string_view view(const xmlChar* text)
{
    return text ? std::string_view(reinterpret_cast<const char*>(text)) : std::string_view();
}

bool isXmlSpace(char c)
{
    return c == ' ' || c == '\t' || c == '\n' || c == '\r';
}

std::string_view trimmed(std::string_view text)
{
    while (!text.empty() && isXmlSpace(text.front()))
        text.remove_prefix(1);
    while (!text.empty() && isXmlSpace(text.back()))
        text.remove_suffix(1);
    return text;
}

// Text from the file is quoted in errors, but only so much of it.
std::string quoted(std::string_view text)
{
    if (text.size() <= kQuotedTextLimit)
        return '"' + std::string(text) + '"';
    size_t cut = kQuotedTextLimit;
    while (cut > 0 && (static_cast<uint8_t>(text[cut]) & 0xc0) == 0x80)
        --cut; // never split a UTF-8 sequence
    return '"' + std::string(text.substr(0, cut)) + "\"...";
}

OMError malformed(long line, std::string_view what)
{
    return OMError::platform(kPlatformErrorMalformed, "line " + std::to_string(line) + ": " + std::string(what));
}

OMError tooDeep(long line)
{
    return OMError::platform(kPlatformErrorLimit,
        "line " + std::to_string(line) + ": nesting deeper than " + std::to_string(Cbor::kMaxDepth) + " levels");
}

long lineOf(const xmlNode* node)
{
    return xmlGetLineNo(node);
}

// The line of a text node's first non-blank character (text nodes are numbered by where they
// start: see recordTextLine).
long lineOfText(const xmlNode* node, std::string_view text)
{
    const size_t first = text.find_first_not_of(" \t\r\n");
    return lineOf(node) + std::count(text.begin(), text.begin() + static_cast<ptrdiff_t>(first), '\n');
}

std::string tagOf(const xmlNode* node)
{
    std::string tag = "<";
    if (node->ns && node->ns->prefix) {
        tag += view(node->ns->prefix);
        tag += ':';
    }
    tag += view(node->name);
    tag += '>';
    return tag;
}

Element elementOf(const xmlNode* node)
{
    static constexpr std::pair<std::string_view, Element> kNames[] = {
        { "dict", Element::Dict },
        { "array", Element::Array },
        { "string", Element::String },
        { "integer", Element::Integer },
        { "real", Element::Real },
        { "true", Element::True },
        { "false", Element::False },
        { "data", Element::Data },
        { "date", Element::Date },
        { "uuid", Element::Uuid },
        { "key", Element::Key },
    };
    if (node->ns)
        return Element::Unknown;
    const std::string_view name = view(node->name);
    for (const auto& [known, element] : kNames) {
        if (name == known)
            return element;
    }
    return Element::Unknown;
}

OMError entityReference(const xmlNode* node)
{
    return malformed(lineOf(node), "entity reference &" + std::string(view(node->name)) + "; is not allowed");
}

// The next element among the children, from cursor on, passing over comments, processing
// instructions and whitespace; nullptr after the last. Any other text is an error.
Result<xmlNode*> nextElement(xmlNode*& cursor, const xmlNode* parent)
{
    for (; cursor; cursor = cursor->next) {
        switch (cursor->type) {
        case XML_ELEMENT_NODE: {
            xmlNode* element = cursor;
            cursor = cursor->next;
            return element;
        }
        case XML_TEXT_NODE:
        case XML_CDATA_SECTION_NODE: {
            const std::string_view text = view(cursor->content);
            if (!trimmed(text).empty())
                return malformed(
                    lineOfText(cursor, text), "unexpected text " + quoted(trimmed(text)) + " in " + tagOf(parent));
            break;
        }
        case XML_ENTITY_REF_NODE:
            return entityReference(cursor);
        default:
            break;
        }
    }
    return static_cast<xmlNode*>(nullptr);
}

// The character data of a scalar element; comments and processing instructions inside are skipped.
Result<std::string> textOf(const xmlNode* element)
{
    const xmlNode* only = element->children;
    if (only && !only->next && only->type == XML_TEXT_NODE)
        return std::string(view(only->content));
    std::string text;
    for (const xmlNode* child = element->children; child; child = child->next) {
        switch (child->type) {
        case XML_TEXT_NODE:
        case XML_CDATA_SECTION_NODE:
            text += view(child->content);
            break;
        case XML_ELEMENT_NODE:
            return malformed(lineOf(child), "element " + tagOf(child) + " inside " + tagOf(element));
        case XML_ENTITY_REF_NODE:
            return entityReference(child);
        default:
            break;
        }
    }
    return text;
}

Result<Value> readValue(xmlNode* element, unsigned depth);

Result<Value> readScalar(const xmlNode* element, Element kind)
{
    const std::string text = OM_TRY(textOf(element));
    const std::string_view token = trimmed(text);
    const long line = lineOf(element);
    switch (kind) {
    case Element::String:
        return Value::string(text);
    case Element::Integer: {
        bool outOfRange = false;
        if (auto integer = VlistText::parseInteger(token, &outOfRange))
            return std::move(*integer);
        return malformed(line,
            outOfRange ? "integer " + quoted(token) + " does not fit 64 bits" : "invalid integer " + quoted(token));
    }
    case Element::Real:
        if (auto real = VlistText::parseReal(token))
            return Value::real(*real);
        return malformed(line, "invalid real " + quoted(token));
    case Element::True:
    case Element::False:
        if (!token.empty())
            return malformed(line, tagOf(element) + " holds text; it must be empty");
        return Value::boolean(kind == Element::True);
    case Element::Data:
        if (auto bytes = VlistText::parseBase64(token))
            return Value::data(std::move(*bytes));
        return malformed(line, "invalid base64 in <data>");
    case Element::Date:
        if (auto date = VlistText::parseDate(token))
            return Value::date(*date);
        return malformed(line, "invalid date " + quoted(token));
    case Element::Uuid:
        if (auto uuid = Uuid::parse(token))
            return Value::uuid(*uuid);
        return malformed(line, "invalid uuid " + quoted(token));
    default:
        return malformed(line, "unknown element " + tagOf(element));
    }
}

Result<Value> readArray(xmlNode* array, unsigned depth)
{
    if (depth >= Cbor::kMaxDepth)
        return tooDeep(lineOf(array));
    std::vector<Value> elements;
    xmlNode* cursor = array->children;
    while (xmlNode* element = OM_TRY(nextElement(cursor, array)))
        elements.push_back(OM_TRY(readValue(element, depth + 1)));
    return Value::array(std::move(elements));
}

// Finds the line of the second <key> holding text, to name a duplicate where it stands.
long lineOfRepeat(xmlNode* dictionary, const std::string& key)
{
    bool seen = false;
    for (xmlNode* child = dictionary->children; child; child = child->next) {
        if (child->type != XML_ELEMENT_NODE || elementOf(child) != Element::Key)
            continue;
        auto text = textOf(child);
        if (!text.ok() || *text != key)
            continue;
        if (seen)
            return lineOf(child);
        seen = true;
    }
    return lineOf(dictionary);
}

Result<Value> readDictionary(xmlNode* dictionary, unsigned depth)
{
    if (depth >= Cbor::kMaxDepth)
        return tooDeep(lineOf(dictionary));
    std::vector<Value::Entry> entries;
    xmlNode* cursor = dictionary->children;
    while (xmlNode* key = OM_TRY(nextElement(cursor, dictionary))) {
        const Element kind = elementOf(key);
        if (kind == Element::Unknown)
            return malformed(lineOf(key), "unknown element " + tagOf(key));
        if (kind != Element::Key)
            return malformed(lineOf(key), tagOf(key) + " where a <key> is expected in <dict>");
        std::string name = OM_TRY(textOf(key));
        xmlNode* element = OM_TRY(nextElement(cursor, dictionary));
        if (!element || elementOf(element) == Element::Key)
            return malformed(lineOf(key), "key " + quoted(name) + " has no value");
        Value value = OM_TRY(readValue(element, depth + 1));
        entries.emplace_back(std::move(name), std::move(value));
    }
    std::string repeated;
    auto built = Value::uniqueDictionary(std::move(entries), &repeated);
    if (!built)
        return malformed(lineOfRepeat(dictionary, repeated), "duplicate key " + quoted(repeated));
    return std::move(*built);
}

Result<Value> readValue(xmlNode* element, unsigned depth)
{
    switch (const Element kind = elementOf(element)) {
    case Element::Dict:
        return readDictionary(element, depth);
    case Element::Array:
        return readArray(element, depth);
    case Element::Key:
        return malformed(lineOf(element), "<key> outside a <dict>");
    case Element::Unknown:
        return malformed(lineOf(element), "unknown element " + tagOf(element));
    default:
        return readScalar(element, kind);
    }
}

Result<Value> readDocument(xmlDoc* document)
{
    xmlNode* root = xmlDocGetRootElement(document);
    if (!root)
        return malformed(1, "no root element");
    if (root->ns || view(root->name) != "vlist")
        return malformed(lineOf(root), "root element " + tagOf(root) + " is not <vlist>");
    std::unique_ptr<xmlChar, XmlString> version(xmlGetNoNsProp(root, reinterpret_cast<const xmlChar*>("version")));
    if (!version)
        return malformed(lineOf(root), "<vlist> has no version");
    if (view(version.get()) != "1")
        return malformed(lineOf(root), "unsupported vlist version " + quoted(view(version.get())));

    xmlNode* cursor = root->children;
    xmlNode* first = OM_TRY(nextElement(cursor, root));
    if (!first)
        return malformed(lineOf(root), "<vlist> holds no value");
    Value value = OM_TRY(readValue(first, 0));
    if (xmlNode* second = OM_TRY(nextElement(cursor, root)))
        return malformed(lineOf(second), "more than one value in <vlist>");
    return value;
}

ParseGuard& guardOf(void* context)
{
    return *static_cast<ParseGuard*>(static_cast<xmlParserCtxt*>(context)->_private);
}

void refuse(void* context, OMError error)
{
    ParseGuard& guard = guardOf(context);
    if (!guard.refusal)
        guard.refusal = std::move(error);
    xmlStopParser(static_cast<xmlParserCtxt*>(context));
}

// Entities are where XML's external fetches and exponential expansions live; a vlist has no use
// for them, so the first declaration ends the parse before it can be referenced.
void refuseEntityDeclaration(void* context, const xmlChar* name, int, const xmlChar*, const xmlChar*, xmlChar*)
{
    refuse(context,
        malformed(xmlSAX2GetLineNumber(context), "entity declaration " + quoted(view(name)) + " is not allowed"));
}

// Refuses depth while parsing, so that no deeper tree is built than the reader would accept.
void startElement(void* context, const xmlChar* localName, const xmlChar* prefix, const xmlChar* uri,
    int namespaceCount, const xmlChar** namespaces, int attributeCount, int defaultedCount, const xmlChar** attributes)
{
    if (++guardOf(context).elementDepth > kMaxElementDepth)
        return refuse(context, tooDeep(xmlSAX2GetLineNumber(context)));
    xmlSAX2StartElementNs(
        context, localName, prefix, uri, namespaceCount, namespaces, attributeCount, defaultedCount, attributes);
}

// libxml2 numbers a text node by the line where its first chunk of characters ended; number it
// by the line where it starts instead, stored the way libxml2 stores lines past 65534.
void recordTextLine(void* context, const xmlChar* text, int length)
{
    auto* parser = static_cast<xmlParserCtxt*>(context);
    const xmlNode* before = parser->node ? parser->node->last : nullptr;
    xmlSAX2Characters(context, text, length);
    xmlNode* node = parser->node ? parser->node->last : nullptr;
    if (!node || node == before || node->type != XML_TEXT_NODE)
        return; // appended to the text node already there
    const long line = xmlSAX2GetLineNumber(context) - std::count(text, text + length, '\n');
    if (line < 65535) {
        node->line = static_cast<unsigned short>(line);
    } else {
        node->line = 65535;
        node->psvi = reinterpret_cast<void*>(static_cast<ptrdiff_t>(line));
    }
}

void endElement(void* context, const xmlChar* localName, const xmlChar* prefix, const xmlChar* uri)
{
    --guardOf(context).elementDepth;
    xmlSAX2EndElementNs(context, localName, prefix, uri);
}

} // namespace

Result<Value> VlistXmlReader::parse(std::span<const uint8_t> bytes)
{
    if (bytes.size() > INT_MAX)
        return OMError::platform(
            kPlatformErrorLimit, "XML vlist of " + std::to_string(bytes.size()) + " bytes is too large");
    static std::once_flag initialized;
    std::call_once(initialized, xmlInitParser);

    std::unique_ptr<xmlParserCtxt, Parser> parser(xmlNewParserCtxt());
    if (!parser)
        return OMError::fromErrno("xmlNewParserCtxt", ENOMEM);
    ParseGuard guard;
    parser->_private = &guard;
    parser->sax->entityDecl = refuseEntityDeclaration;
    parser->sax->startElementNs = startElement;
    parser->sax->endElementNs = endElement;
    parser->sax->characters = recordTextLine;
    parser->sax->ignorableWhitespace = recordTextLine;
    // Diagnostics are read from the parser's last error instead of being printed. (Generic, as
    // libxml2 2.12 made the error const.)
    parser->sax->serror = [](void*, auto*) {};

    // Not XML_PARSE_NOENT or XML_PARSE_DTDLOAD: nothing outside the bytes is ever read.
    constexpr int kOptions = XML_PARSE_NONET | XML_PARSE_NOCDATA | XML_PARSE_BIG_LINES | XML_PARSE_COMPACT
        | XML_PARSE_NOERROR | XML_PARSE_NOWARNING;
    std::unique_ptr<xmlDoc, Document> document(xmlCtxtReadMemory(parser.get(),
        reinterpret_cast<const char*>(bytes.data()), static_cast<int>(bytes.size()), nullptr, nullptr, kOptions));
    if (guard.refusal)
        return std::move(*guard.refusal);
    if (!document) {
        const xmlError* error = xmlCtxtGetLastError(parser.get());
        if (!error || !error->message)
            return malformed(1, "not well-formed XML");
        return malformed(error->line, trimmed(error->message));
    }
    return readDocument(document.get());
}

} // namespace om
