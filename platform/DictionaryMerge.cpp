#include "platform/DictionaryMerge.h"

#include <unordered_set>
#include <vector>

namespace om {

namespace {

struct ValueHash {
    size_t operator()(const Value& value) const { return value.hash(); }
};

// A list of names: an array as it is, a string as a list of one; none for anything else.
std::optional<std::vector<Value>> namesOf(const Value& value)
{
    if (value.isString())
        return std::vector<Value> { value };
    if (!value.isArray())
        return std::nullopt;
    return std::vector<Value>(value.elements().begin(), value.elements().end());
}

} // namespace

Value DictionaryMerge::mergeDictionary(const Value& sdk, const Value& plugIn, const OverridePredicate& overrides)
{
    DictionaryBuilder merged(plugIn);
    for (const auto& [key, sdkValue] : sdk.entries()) {
        const Value& own = plugIn[key];
        if (own.isNone() || (overrides ? overrides(key) : sdkOverridesKey(key)))
            merged.set(key, sdkValue);
        else if (key == "Shared")
            merged.set(key, mergeSharedResources(sdkValue, own));
        else if (sdkValue.isDictionary() && own.isDictionary())
            merged.set(key, mergeDictionary(sdkValue, own, overrides));
    }
    return merged.build();
}

bool DictionaryMerge::sdkOverridesKey(std::string_view key)
{
    return key == "CleanTimeout";
}

Value DictionaryMerge::mergeSharedResources(const Value& sdk, const Value& plugIn)
{
    auto own = namesOf(plugIn);
    auto added = namesOf(sdk);
    if (!own || !added)
        return plugIn;
    std::unordered_set<Value, ValueHash> seen;
    ArrayBuilder merged;
    for (const auto* list : { &*own, &*added }) {
        for (const auto& name : *list) {
            if (seen.insert(name).second)
                merged.append(name);
        }
    }
    return merged.build();
}

} // namespace om
