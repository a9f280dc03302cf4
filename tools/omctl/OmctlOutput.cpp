#include "tools/omctl/OmctlOutput.h"

#include <algorithm>

#include "platform/Format.h"

namespace om {

namespace {

constexpr size_t kDataBytesShown = 32;

bool isEmptyContainer(const Value& value)
{
    return (value.isDictionary() || value.isArray()) && value.count() == 0;
}

// Text is shown bare unless it would be misread: empty, padded, or holding control characters.
std::string displayText(const std::string& text)
{
    bool bare = !text.empty() && text.front() != ' ' && text.back() != ' '
        && std::none_of(
            text.begin(), text.end(), [](char c) { return static_cast<unsigned char>(c) < 0x20 || c == '"'; });
    if (bare)
        return text;
    std::string out = "\"";
    for (char c : text) {
        auto byte = static_cast<unsigned char>(c);
        if (c == '"' || c == '\\') {
            out += '\\';
            out += c;
        } else if (c == '\n') {
            out += "\\n";
        } else if (c == '\t') {
            out += "\\t";
        } else if (byte < 0x20) {
            out += "\\x";
            out += "0123456789abcdef"[byte >> 4];
            out += "0123456789abcdef"[byte & 15];
        } else {
            out += c;
        }
    }
    return out + "\"";
}

void outline(std::string& out, const Value& value, size_t indent)
{
    auto line = [&](const std::string& label, const Value& element) {
        out.append(indent * 2, ' ');
        out += label;
        if ((element.isDictionary() || element.isArray()) && element.count() > 0) {
            out += '\n';
            outline(out, element, indent + 1);
        } else {
            out += ' ';
            out += OmctlOutput::scalar(element);
            out += '\n';
        }
    };
    if (value.isDictionary()) {
        for (const auto& [key, element] : value.entries())
            line(displayText(key) + ":", element);
    } else if (value.isArray()) {
        size_t index = 0;
        for (const Value& element : value.elements())
            line(format("[%u]", index++), element);
    }
}

} // namespace

std::string OmctlOutput::scalar(const Value& value)
{
    switch (value.type()) {
    case Value::Type::None:
        return "(none)";
    case Value::Type::Dictionary:
        return isEmptyContainer(value) ? "{}" : format("{%u entries}", value.count());
    case Value::Type::Array:
        return isEmptyContainer(value) ? "[]" : format("[%u elements]", value.count());
    case Value::Type::String:
        return displayText(*value.asString());
    case Value::Type::Data: {
        const auto& bytes = *value.asData();
        std::string out = format("<%u bytes", bytes.size());
        if (!bytes.empty())
            out += ": ";
        for (size_t i = 0; i < std::min(bytes.size(), kDataBytesShown); ++i) {
            out += "0123456789abcdef"[bytes[i] >> 4];
            out += "0123456789abcdef"[bytes[i] & 15];
        }
        if (bytes.size() > kDataBytesShown)
            out += "...";
        return out + ">";
    }
    default:
        return value.description();
    }
}

std::string OmctlOutput::tree(const Value& value)
{
    if ((value.isDictionary() || value.isArray()) && value.count() > 0) {
        std::string out;
        outline(out, value, 0);
        return out;
    }
    return scalar(value) + "\n";
}

} // namespace om
