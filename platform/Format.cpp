#include "platform/Format.h"

#include <charconv>

// Arguments carry their kind, so a specifier never decides how to read memory: it only decides how
// to print what it is given. Decimal conversions print an integer's true value whatever its
// signedness (%u of -1 is "-1", %d of 2^64-1 is "18446744073709551615"); hexadecimal conversions
// print the 64-bit two's-complement bits. Length modifiers (h, l, ll, z, j, t, q) are accepted and
// ignored for the same reason.

namespace om {

namespace {

constexpr std::string_view kMismatch = "<?>";
constexpr std::string_view kPublic = "{public}";

void appendDecimal(std::string& out, const FormatArg& arg)
{
    char buffer[24];
    auto end = arg.kind() == FormatArg::Kind::Signed
        ? std::to_chars(buffer, buffer + sizeof buffer, arg.signedValue()).ptr
        : std::to_chars(buffer, buffer + sizeof buffer, arg.unsignedValue()).ptr;
    out.append(buffer, end);
}

void appendHex(std::string& out, uint64_t bits, bool upper)
{
    char buffer[16];
    auto end = std::to_chars(buffer, buffer + sizeof buffer, bits, 16).ptr;
    if (upper) {
        for (char* c = buffer; c != end; ++c) {
            if (*c >= 'a' && *c <= 'f')
                *c = static_cast<char>(*c - 'a' + 'A');
        }
    }
    out.append(buffer, end);
}

bool isInteger(const FormatArg& arg)
{
    return arg.kind() == FormatArg::Kind::Signed || arg.kind() == FormatArg::Kind::Unsigned;
}

uint64_t integerBits(const FormatArg& arg)
{
    return arg.kind() == FormatArg::Kind::Signed ? static_cast<uint64_t>(arg.signedValue()) : arg.unsignedValue();
}

// Appends one converted argument; a missing or wrong-kind argument becomes the mismatch marker.
void appendConversion(std::string& out, char conversion, const FormatArg* arg)
{
    if (!arg) {
        out += kMismatch;
        return;
    }
    switch (conversion) {
    case 'd':
    case 'i':
    case 'u':
        if (isInteger(*arg))
            return appendDecimal(out, *arg);
        break;
    case 'x':
    case 'X':
        if (isInteger(*arg))
            return appendHex(out, integerBits(*arg), conversion == 'X');
        break;
    case 's':
        if (arg->kind() == FormatArg::Kind::Text) {
            out += arg->text();
            return;
        }
        break;
    case '@':
        if (arg->kind() == FormatArg::Kind::Object) {
            out += arg->value().description();
            return;
        }
        if (arg->kind() == FormatArg::Kind::Text) {
            out += arg->text();
            return;
        }
        break;
    case 'p':
        if (arg->kind() == FormatArg::Kind::Pointer) {
            out += "0x";
            return appendHex(out, reinterpret_cast<uintptr_t>(arg->pointer()), false);
        }
        break;
    }
    out += kMismatch;
}

bool isConversion(char c)
{
    switch (c) {
    case 'd':
    case 'i':
    case 'u':
    case 'x':
    case 'X':
    case 's':
    case '@':
    case 'p':
        return true;
    default:
        return false;
    }
}

bool isLengthModifier(char c)
{
    return c == 'h' || c == 'l' || c == 'z' || c == 'j' || c == 't' || c == 'q';
}

} // namespace

std::string formatString(std::string_view format, std::initializer_list<FormatArg> args)
{
    std::string out;
    out.reserve(format.size() + 16 * args.size());
    const FormatArg* nextArg = args.begin();

    size_t i = 0;
    while (i < format.size()) {
        size_t percent = format.find('%', i);
        if (percent == std::string_view::npos) {
            out.append(format.substr(i));
            break;
        }
        out.append(format.substr(i, percent - i));

        size_t cursor = percent + 1;
        if (cursor < format.size() && format[cursor] == '%') {
            out += '%';
            i = cursor + 1;
            continue;
        }
        if (format.substr(cursor).starts_with(kPublic))
            cursor += kPublic.size();
        while (cursor < format.size() && isLengthModifier(format[cursor]))
            ++cursor;

        if (cursor >= format.size() || !isConversion(format[cursor])) {
            // Not a specifier we know: keep the '%' and let the rest print as ordinary text.
            out += '%';
            i = percent + 1;
            continue;
        }
        const FormatArg* arg = nextArg != args.end() ? nextArg++ : nullptr;
        appendConversion(out, format[cursor], arg);
        i = cursor + 1;
    }
    return out;
}

} // namespace om
