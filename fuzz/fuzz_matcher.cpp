// Reads arbitrary bytes as a vlist (either form) and uses the tree as a host's match dictionary
// against one fixed plug-in record; the input's own "FuzzAnnotation" value is the plug-in's
// annotation, so elections of every kind reach the election text. The whole dictionary must
// answer what its keys answer one by one, and the election text must always be a decimal number.
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <memory>

#include "Ombrel/OMBundle.h"
#include "Ombrel/OMMatcher.h"
#include "Ombrel/OMPlugInCore.h"
#include "platform/Vlist.h"

using om::OMMatcher;
using om::OMPlugInCore;
using om::Value;

namespace {

[[noreturn]] void broken(const char* what, const Value& input)
{
    std::fprintf(stderr, "matcher invariant broken (%s) for:\n%s\n", what, om::Vlist::writeXml(input).c_str());
    std::abort();
}

std::shared_ptr<OMPlugInCore> makeRecord()
{
    const Value attributes = Value::dictionary({
        { "QSExtensionVersion", "2.10" },
        { "QSExtensionActivationRule", Value::dictionary({ { "image/png", 1 }, { "text/plain", 3 } }) },
        { "Kind", "photo" },
        { "Type", "image/svg+xml" },
        { "Tags", Value::array({ "a", Value(5), "text/plain" }) },
        { "Count", Value(5) },
        { "Off", Value(false) },
        { "Nested", Value::dictionary({ { "k", "v" } }) },
        { "When", Value::date(1e9) },
    });
    const Value plugIn = Value::dictionary(
        { { "QSExtensionPointIdentifier", "com.orvex.share" }, { "QSExtensionAttributes", attributes } });
    const Value info = Value::dictionary(
        { { "VBBundleIdentifier", "com.example.share" }, { "InfoOnly", "1.0" }, { "QSExtension", plugIn } });
    auto record = OMPlugInCore::initWithName(
        "com.example.share", om::OMBundle::fileURL("/Apps/Notes.app/PlugIns/Share.appex"), info, Value(), std::nullopt);
    if (!record)
        std::abort();
    record->setContainingUrl(om::OMBundle::fileURL("/Apps/Notes.app"));
    record->setEntitlements(Value::dictionary({ { "com.example.tier", "gold" }, { "com.example.on", true } }));
    return record;
}

bool isDecimal(const std::string& text)
{
    size_t start = !text.empty() && text[0] == '-' ? 1 : 0;
    if (start == text.size())
        return false;
    for (size_t i = start; i < text.size(); ++i) {
        if (text[i] < '0' || text[i] > '9')
            return false;
    }
    return true;
}

} // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size)
{
    static const std::shared_ptr<OMPlugInCore> record = makeRecord();
    auto parsed = om::Vlist::parse(std::span(data, size));
    if (!parsed.ok())
        return 0;
    const Value& rules = *parsed;
    const Value annotation = rules["FuzzAnnotation"];
    const OMMatcher matcher([&](const OMPlugInCore&) { return annotation; });

    if (!isDecimal(OMMatcher::electionText(annotation)))
        broken("election text", rules);
    bool every = true;
    for (const auto& [key, pattern] : rules.entries())
        every = matcher.matchKey(*record, key, pattern) && every;
    if (matcher.match(*record, rules) != every)
        broken("dictionary against its keys", rules);
    // Each value of the input is also tried as a pattern of every fact of the record.
    for (const auto& [key, pattern] : rules.entries()) {
        for (const char* fact : { "QSExtensionVersion", "QSExtensionActivationRule", "Tags", "Type", "QSUserElection",
                 "QSExtensionContainingApp", "com.orvex.uuid", "ENTITLEMENT:com.example.tier" })
            (void)matcher.matchKey(*record, fact, pattern);
        if (const std::string* text = pattern.asString())
            (void)OMMatcher::matchValuePattern(key, *text);
    }
    return 0;
}
