// Three-way comparison of version texts, as plug-in versions are ordered: runs of decimal digits
// compare by numeric value, every other character by its UTF-8 code unit, case-sensitively.
#pragma once

#include <string_view>

#include "platform/VersionString.h"

namespace om {

// -1 when a orders before b, 0 when they are equivalent, 1 when a orders after b.
// Equivalent is not identical: digit runs differing only in leading zeros are equal ("1.01" and
// "1.1" compare 0). When one text is a prefix of the other, the shorter orders first.
inline int compareVersionString(std::string_view a, std::string_view b)
{
    return VersionString::compare(a, b);
}

} // namespace om
