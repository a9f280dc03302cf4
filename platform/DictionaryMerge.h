// The rules by which an extension point's SDK entry completes a plug-in's own dictionaries. One
// implementation serves the Registrar, which reports plug-ins already merged, and the plug-in model
// of client programs, which merges records rebuilt from their wire form.
//
// Rules, keyed by name at every level of nesting, for a key both sides have:
//   "CleanTimeout" (or any key the override predicate names): the SDK's value wins;
//   "Shared": the union of both lists of resource names, each name once;
//   any other key whose SDK value is a dictionary: the two dictionaries merge by these rules;
//   any other key: the plug-in's value stays.
// A key only the SDK has is added; a key only the plug-in has stays.
#pragma once

#include <functional>
#include <string_view>

#include "platform/Value.h"

namespace om {

class DictionaryMerge {
public:
    using OverridePredicate = std::function<bool(std::string_view key)>;

    // A new dictionary: plugIn completed by sdk. Neither argument changes, and every value the
    // merge does not change is shared with them. overrides defaults to sdkOverridesKey.
    static Value mergeDictionary(const Value& sdk, const Value& plugIn, const OverridePredicate& overrides = {});
    // True for the keys whose SDK value replaces the plug-in's: "CleanTimeout".
    static bool sdkOverridesKey(std::string_view key);
    // The plug-in's names in their order, then the SDK's names it lacks. A single string counts as
    // a list of one; when either side is neither, the plug-in's value stays as it is.
    static Value mergeSharedResources(const Value& sdk, const Value& plugIn);
};

} // namespace om
