#include "Ombrel/OMMatcher.h"

#include <cmath>
#include <limits>

#include "Ombrel/OMLog.h"
#include "Ombrel/OMVersionString.h"
#include "platform/ActivationRule.h"
#include "platform/TypeConformance.h"

namespace om {

namespace {

constexpr std::string_view kEntitlementPrefix = "ENTITLEMENT:";

// A pattern equal to 1 (true, 1, 1.0) or to 0; numbers and booleans only.
bool patternIs(const Value& pattern, double number)
{
    return pattern.isNumber() && pattern.numericallyEquals(number);
}

bool isZero(const Value& value)
{
    return value.isNumber() && value.numericallyEquals(0);
}

// A real election truncated toward zero; NaN is 0 and the infinities saturate, where a plain cast
// would be undefined.
int64_t truncatedReal(double real)
{
    if (std::isnan(real))
        return 0;
    if (real >= 9223372036854775807.0)
        return std::numeric_limits<int64_t>::max();
    if (real <= -9223372036854775808.0)
        return std::numeric_limits<int64_t>::min();
    return static_cast<int64_t>(real);
}

} // namespace

OMMatcher::OMMatcher(AnnotationLookup annotations)
    : m_annotations(std::move(annotations))
{
}

std::string OMMatcher::electionText(const Value& annotation)
{
    const Value& election = annotation["election"];
    int64_t number = 0;
    if (auto integer = election.asInt64())
        number = *integer;
    else if (auto unsignedNumber = election.asUInt64())
        number = static_cast<int64_t>(*unsignedNumber);
    else if (auto real = election.asDouble())
        number = truncatedReal(*real);
    const auto masked = static_cast<int32_t>(static_cast<uint32_t>(number) & ~uint32_t(0xff00));
    return std::to_string(masked);
}

bool OMMatcher::match(const OMPlugInCore& plugIn, const Value& rules) const
{
    for (const auto& [key, pattern] : rules.entries()) {
        if (!matchKey(plugIn, key, pattern))
            return false;
    }
    return true;
}

Value OMMatcher::valueOf(const OMPlugInCore& plugIn, std::string_view key, bool& decided) const
{
    decided = false;
    if (key.starts_with(kEntitlementPrefix))
        return plugIn.entitlements()[key.substr(kEntitlementPrefix.size())];
    Value value;
    if (key == "QSExtensionIdentifier") {
        if (auto name = plugIn.identifier())
            value = Value::string(*name);
    } else if (key == "com.orvex.uuid") {
        if (auto uuid = plugIn.uuid())
            value = Value::string(uuid->string());
    } else if (key == "QSUserElection") {
        value = Value::string(electionText(m_annotations ? m_annotations(plugIn) : Value()));
    } else if (key == "QSExtensionContainingApp") {
        auto containing = plugIn.containingPath();
        if (!containing) {
            decided = true; // no containing application fails the key, whatever the pattern
            return {};
        }
        value = Value::string(*containing);
    }
    if (value.isNone())
        value = plugIn.attribute(key);
    if (value.isNone())
        value = plugIn.infoKey(key);
    return value;
}

bool OMMatcher::matchKey(const OMPlugInCore& plugIn, std::string_view key, const Value& pattern) const
{
    bool decided = false;
    const Value value = valueOf(plugIn, key, decided);
    if (decided)
        return false;
    if (patternIs(pattern, 1))
        return !value.isNone() && !isZero(value);
    if (patternIs(pattern, 0))
        return value.isNone() || isZero(value);
    if (value.isNone())
        return false;
    if (pattern.isDictionary())
        return matchDictionaryPattern(value, pattern);
    if (const std::string* text = value.asString())
        return matchValuePatterns(*text, pattern);
    if (value.isArray()) {
        for (const Value& element : value.elements()) {
            const std::string* text = element.asString();
            if (text && matchValuePatterns(*text, pattern))
                return true;
        }
    }
    return false;
}

bool OMMatcher::matchValuePatterns(const std::string& value, const Value& patterns)
{
    if (const std::string* pattern = patterns.asString())
        return matchValuePattern(value, *pattern);
    for (const Value& element : patterns.elements()) {
        const std::string* pattern = element.asString();
        if (pattern && matchValuePattern(value, *pattern))
            return true;
    }
    return false;
}

bool OMMatcher::matchValuePattern(const std::string& value, std::string_view pattern)
{
    constexpr std::string_view kConforms = "?TY-CONFORMS:";
    constexpr std::string_view kIs = "?TY-IS:";
    if (pattern.starts_with(kConforms))
        return TypeConformance::shared().conforms(value, pattern.substr(kConforms.size()));
    if (pattern.starts_with(kIs))
        return TypeConformance::shared().conforms(pattern.substr(kIs.size()), value);
    if (pattern.starts_with('?')) {
        OMLog::ops().info("unrecognized match operator:%@", pattern);
        return false;
    }
    // Two-character operators first, so that "<=" is never "<" of an operand beginning "=".
    struct Operator {
        std::string_view prefix;
        bool (*holds)(int order);
    };
    static constexpr Operator kOperators[] = {
        { "<>", [](int order) { return order != 0; } },
        { "<=", [](int order) { return order <= 0; } },
        { ">=", [](int order) { return order >= 0; } },
        { "=", [](int order) { return order == 0; } },
        { "<", [](int order) { return order < 0; } },
        { ">", [](int order) { return order > 0; } },
    };
    for (const auto& op : kOperators) {
        if (pattern.starts_with(op.prefix))
            return op.holds(compareVersionString(value, pattern.substr(op.prefix.size())));
    }
    return compareVersionString(value, pattern) == 0;
}

bool OMMatcher::matchDictionaryPattern(const Value& value, const Value& pattern)
{
    OMLog::extension().debug("evaluating QSExtension filter: %@ value: %@", pattern, value);
    return ActivationRule::evaluate(value, pattern);
}

} // namespace om
