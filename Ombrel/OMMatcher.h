// Attribute matching: whether a plug-in satisfies a host's match dictionary. Every key must match
// (in the dictionary's own order, stopping at the first that does not); a pattern is a true or
// false pattern, an item description (a dictionary, tested against the plug-in's activation rule),
// an operator pattern, or an array of operator patterns of which any may match.
//
// The daemon's records match through it, and so does omctl's "why", from the same facts.
#pragma once

#include <functional>
#include <string>
#include <string_view>

#include "Ombrel/OMPlugInCore.h"
#include "platform/Value.h"

namespace om {

class OMMatcher {
public:
    // The plug-in's annotation dictionary (its election among its keys), or none.
    using AnnotationLookup = std::function<Value(const OMPlugInCore& plugIn)>;

    explicit OMMatcher(AnnotationLookup annotations);

    // True when every key of rules matches; none or an empty dictionary matches every plug-in.
    bool match(const OMPlugInCore& plugIn, const Value& rules) const;
    bool matchKey(const OMPlugInCore& plugIn, std::string_view key, const Value& pattern) const;
    // value against one operator pattern, or any of an array of them.
    static bool matchValuePatterns(const std::string& value, const Value& patterns);
    static bool matchValuePattern(const std::string& value, std::string_view pattern);
    // The plug-in's activation rule (value) against a host's item description (pattern).
    static bool matchDictionaryPattern(const Value& value, const Value& pattern);

    // The election as matched: the annotation's "election" as a signed 32-bit integer with bits 8
    // to 15 cleared, in decimal; "0" without one.
    static std::string electionText(const Value& annotation);

private:
    // The value a key yields for the plug-in; decided is set when the key fails whatever the pattern.
    Value valueOf(const OMPlugInCore& plugIn, std::string_view key, bool& decided) const;

    AnnotationLookup m_annotations;
};

} // namespace om
