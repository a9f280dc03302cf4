// Activation rules: whether a plug-in accepts the items a host offers it.
//
// A plug-in's rule is a dictionary from type identifier to the greatest number of items of that
// type it accepts: a non-negative integer, or a real, which is truncated; any other value accepts
// none. A host describes its items as {"types": [the type identifier of each item]}. The plug-in
// accepts them when there is at least one item, every item conforms to a type of the rule, and the
// items can be shared out among the rule's types so that no type receives more than it accepts.
// An item that conforms to several rule types may go to any one of them, so the sharing is decided
// exactly, as a flow problem, never greedily.
#pragma once

#include <cstddef>

#include "platform/TypeConformance.h"
#include "platform/Value.h"

namespace om {

class ActivationRule {
public:
    // Rules and item descriptions come from other processes. Past these sizes the answer is no,
    // which bounds the work one evaluation can cost at about a million conformance tests.
    static constexpr size_t kMaxItems = 1000;
    static constexpr size_t kMaxRuleTypes = 1000;

    // Malformed input (a rule that is not a dictionary, items without a "types" array, a type that
    // is not a string) is no.
    static bool evaluate(const Value& rule, const Value& items);
    // The same against a given type database (tests use a private one).
    static bool evaluate(const Value& rule, const Value& items, const TypeConformance& types);
};

} // namespace om
