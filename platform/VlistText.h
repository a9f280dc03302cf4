// The text spellings of the XML vlist form's scalars, exact in both directions: what a writer
// produces parses back to the same bits (only a NaN's payload and a date's zero sign are lost).
//
// A <date> is ISO 8601 UTC, "2026-11-22T10:00:00Z", with a decimal fraction of the second only
// when there is one ("...:00.25Z"); years outside 0000-9999 take a sign ("+12026-...", "-0044-").
// Dates no calendar text can hold (NaN, infinities, beyond +-2^62 s) are written as a number of
// seconds, spelt as a <real> is ("nan", "inf", "1e+300"). Each date has exactly one spelling:
// parseDate() refuses the number form for a date that has a calendar one.
#pragma once

#include <cstdint>
#include <optional>
#include <span>
#include <string>
#include <string_view>
#include <vector>

#include "platform/Value.h"

namespace om {

class VlistText {
public:
    static void appendDate(std::string& out, double secondsSince1970);
    static std::optional<double> parseDate(std::string_view text);

    // Shortest digits that read back bit-exactly, or nan, inf, -inf.
    static void appendReal(std::string& out, double value);
    // Decimal or exponent form with an optional sign, or nan, inf, -inf (any case).
    static std::optional<double> parseReal(std::string_view text);

    // Decimal with an optional sign: an integer, unsigned above INT64_MAX. None when the text is
    // not a decimal integer or does not fit 64 bits (*outOfRange tells the two apart).
    static std::optional<Value> parseInteger(std::string_view text, bool* outOfRange = nullptr);

    // Standard alphabet with padding.
    static void appendBase64(std::string& out, std::span<const uint8_t> bytes);
    // Whitespace anywhere is skipped; padding may be left out but never stands in the middle.
    static std::optional<std::vector<uint8_t>> parseBase64(std::string_view text);
};

} // namespace om
