// Parses arbitrary bytes as a vlist (either form). Whatever parses must come back from both
// writers: identical from the binary form, identical from XML when XML can carry its strings, and
// in every case to the same XML text.
#include <cmath>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <string>

#include "platform/Vlist.h"
#include "platform/VlistXmlWriter.h"

using om::Value;
using om::Vlist;

namespace {

[[noreturn]] void mismatch(const char* what, const Value& original)
{
    std::fprintf(stderr, "vlist round trip mismatch (%s) for:\n%s\n", what, Vlist::writeXml(original).c_str());
    std::abort();
}

bool sameNumber(double x, double y)
{
    return x == y || (std::isnan(x) && std::isnan(y));
}

// Dictionaries in order, reals to the sign of zero, dates by value; any NaN matches any NaN.
bool identical(const Value& a, const Value& b)
{
    if (a.isInteger() && b.isInteger())
        return a == b;
    if (a.type() != b.type())
        return false;
    switch (a.type()) {
    case Value::Type::Real: {
        const double x = *a.asDouble();
        const double y = *b.asDouble();
        return std::isnan(x) ? std::isnan(y) : x == y && std::signbit(x) == std::signbit(y);
    }
    case Value::Type::Date:
        return sameNumber(*a.asDate(), *b.asDate());
    case Value::Type::Array:
        if (a.count() != b.count())
            return false;
        for (size_t i = 0; i < a.count(); ++i) {
            if (!identical(a.at(i), b.at(i)))
                return false;
        }
        return true;
    case Value::Type::Dictionary:
        if (a.count() != b.count())
            return false;
        for (size_t i = 0; i < a.count(); ++i) {
            if (a.entries()[i].first != b.entries()[i].first
                || !identical(a.entries()[i].second, b.entries()[i].second))
                return false;
        }
        return true;
    default:
        return a == b;
    }
}

bool xmlCarriesAllText(const Value& value)
{
    if (value.isString())
        return om::VlistXmlWriter::representable(*value.asString());
    for (const auto& element : value.elements()) {
        if (!xmlCarriesAllText(element))
            return false;
    }
    for (const auto& [key, element] : value.entries()) {
        if (!om::VlistXmlWriter::representable(key) || !xmlCarriesAllText(element))
            return false;
    }
    return true;
}

} // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size)
{
    auto parsed = Vlist::parse(std::span(data, size));
    if (!parsed.ok())
        return 0;
    const Value& value = *parsed;

    const auto binary = Vlist::writeBinary(value);
    auto fromBinary = Vlist::parse(binary);
    if (!fromBinary.ok() || !identical(*fromBinary, value))
        mismatch("binary", value);
    if (Vlist::writeBinary(*fromBinary) != binary)
        mismatch("binary bytes", value);

    const std::string xml = Vlist::writeXml(value);
    auto fromXml = Vlist::parse(xml);
    if (!fromXml.ok())
        mismatch("written XML does not parse", value);
    if (xmlCarriesAllText(value) && !identical(*fromXml, value))
        mismatch("XML", value);
    if (Vlist::writeXml(*fromXml) != xml)
        mismatch("XML text", value);
    return 0;
}
