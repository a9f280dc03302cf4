// Reads arbitrary bytes as a bundle's Info.vlist the way the Registrar does at registration, with
// the input's own "FuzzSdk" dictionary as the SDK entry of its extension point, then indexes and
// queries the record it yields. Whatever is accepted must come out canonical, survive the trip
// through the database's blob form unchanged, and leave the index as it found it.
#include <cstdint>
#include <cstdio>
#include <cstdlib>

#include "platform/RegistrarBundleReader.h"
#include "platform/RegistrarIndex.h"
#include "platform/Vlist.h"

using om::RegistrarBundleReader;
using om::Value;

namespace {

[[noreturn]] void broken(const char* what, const Value& info)
{
    std::fprintf(stderr, "registrar info invariant broken (%s) for:\n%s\n", what, om::Vlist::writeXml(info).c_str());
    std::abort();
}

} // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size)
{
    auto parsed = RegistrarBundleReader::parseInfo(std::span(data, size));
    if (!parsed.ok())
        return 0;
    const Value& info = *parsed;

    // The database keeps the declared Info in binary form and reads it back at every open.
    auto stored = om::Vlist::parse(om::Vlist::writeBinary(info));
    if (!stored.ok() || !(*stored == info))
        broken("binary form", info);

    const Value sdkEntry = info["FuzzSdk"];
    auto sdk = [&](std::string_view) { return sdkEntry; };
    auto facts = RegistrarBundleReader::plugInFacts("/System/Fuzz/Fuzz.appex", info, info["FuzzEntitlements"], sdk);
    if (!facts.ok())
        return 0;
    const Value& attributes = facts->plugInDictionary["QSExtensionAttributes"];
    if (!facts->plugInDictionary.isDictionary() || !attributes.isDictionary()
        || !attributes.contains("QSExtensionVersion"))
        broken("canonical plug-in dictionary", info);
    if (info["QSExtension"].isDictionary() && !(facts->infoDictionary["QSExtension"] == facts->plugInDictionary))
        broken("info dictionary holds the canonical plug-in dictionary", info);
    if (!facts->onSystemPartition || facts->displayName.empty())
        broken("path facts", info);

    auto record = std::make_shared<const om::RegistrarPlugInRecord>(om::RegistrarPlugInRecord::Facts {
        .uuid = om::Uuid(),
        .bundlePath = "/System/Fuzz/Fuzz.appex",
        .identifier = facts->identifier,
        .infoDictionary = facts->infoDictionary,
        .plugInDictionary = facts->plugInDictionary,
        .sequence = 1,
    });
    om::RegistrarIndex index;
    index.insert(record);
    // A rule naming the record's own identifier always finds it.
    auto found = index.candidates(Value::dictionary({ { "QSExtensionIdentifier", "=" + facts->identifier } }));
    if (found.size() != 1)
        broken("identifier index", info);
    (void)index.candidates(info["FuzzRules"]);
    index.remove(record->uuid());
    if (index.count() != 0 || !index.all().empty() || !index.candidates(Value::dictionary({})).empty())
        broken("index after removal", info);
    return 0;
}
