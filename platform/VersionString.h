// Version texts, as plug-in versions are ordered: runs of decimal digits compare by numeric value,
// every other character by its UTF-8 code unit, case-sensitively.
#pragma once

#include <string>
#include <string_view>

namespace om {

class VersionString {
public:
    // -1 when a orders before b, 0 when they are equivalent, 1 when a orders after b.
    // Equivalent is not identical: digit runs differing only in leading zeros are equal ("1.01" and
    // "1.1" compare 0). When one text is a prefix of the other, the shorter orders first.
    static int compare(std::string_view a, std::string_view b);

    // One text per equivalence class of compare(): two texts compare 0 exactly when their keys are
    // equal. Every digit run loses its leading zeros (a run of zeros becomes "0"), so indexes can
    // look up by key what a comparison would find equal.
    static std::string equivalenceKey(std::string_view text);
};

} // namespace om
