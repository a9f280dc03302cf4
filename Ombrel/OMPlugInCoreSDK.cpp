// OMPlugInCore: completing a record's own dictionaries with its extension point's SDK entry.
#include "Ombrel/OMLog.h"
#include "Ombrel/OMPlugInCore.h"
#include "platform/DictionaryMerge.h"
#include "platform/Fatal.h"
#include "platform/RegistrarSdk.h"

namespace om {

Value OMPlugInCore::readSDKDictionary(std::string_view name)
{
    Value entry = RegistrarSdk::read(name);
    if (entry.isNone())
        OMLog::ops().notice("plug-in sdk \"%{public}@\" not registered", Value(name));
    return entry;
}

Value OMPlugInCore::sdkDictionaryNamed(std::string_view name) const
{
    return readSDKDictionary(name);
}

void OMPlugInCore::resolveSDK()
{
    const Value info = bundleInfoDictionary();
    if (info.isNone())
        internalInconsistency("cannot resolve SDK without materialized Info.vlist");
    const Value sdk = sdkSpec();
    if (!sdk.isNone() && !sdk.isString()) {
        // A record whose extension point is not even a name is left exactly as it came.
        OMLog::ops().error("invalid SDK key:%{public}@", sdk);
        return;
    }
    if (const std::string* name = sdk.asString()) {
        Value entry = sdkDictionaryNamed(*name);
        // The plug-in's own "QSExtension" dictionary survives the merge, so this cannot fail for a
        // record that passed setup.
        if (!entry.isNone())
            (void)setDictionaries(mergeDictionary(entry, info));
    }
    canonicalize();
}

Value OMPlugInCore::mergeDictionary(const Value& sdk, const Value& into) const
{
    return DictionaryMerge::mergeDictionary(sdk, into, [this](std::string_view key) { return sdkOverridesKey(key); });
}

bool OMPlugInCore::sdkOverridesKey(std::string_view key) const
{
    return DictionaryMerge::sdkOverridesKey(key);
}

Value OMPlugInCore::mergeSharedResources(const Value& sdk, const Value& into)
{
    return DictionaryMerge::mergeSharedResources(sdk, into);
}

} // namespace om
