// JSON for omctl: requests typed on the command line become value trees, and replies are printed
// as JSON for scripts. The lexical work (tokens, escapes, UTF-8, numbers) is nlohmann-json's; this
// class maps its events onto the value tree and back.
//
// Mapping: objects are dictionaries (key order kept, a repeated key is an error), arrays, strings,
// integers (signed when they fit 64 bits, unsigned above INT64_MAX, anything larger is an error),
// numbers with a fraction or an exponent are reals, true and false are booleans; null has no
// value-tree counterpart and is an error. The kinds JSON lacks are objects with one marker key:
//   {"$uuid": "8-4-4-4-12 text"}   a UUID
//   {"$data": "base64"}            a byte string (whitespace skipped, padding optional)
//   {"$date": "2026-11-22T10:00:00Z"} or {"$date": seconds since 1970}   a date
//   {"$real": "nan" | "inf" | "-inf" | number}   a real that JSON cannot write, or a forced real
// The writer uses the same markers, so its output reads back as the same tree. A dictionary whose
// only key is one of these markers cannot be written in JSON.
//
// The parser refuses nesting deeper than kMaxDepth (counted as containers are opened, so hostile
// nesting never reaches the stack), input over kMaxInputBytes, invalid UTF-8, control characters
// in strings, bad escapes and unpaired surrogates.
#pragma once

#include <cstddef>
#include <string>
#include <string_view>

#include "platform/Result.h"
#include "platform/Value.h"

namespace om {

class OmctlJson {
public:
    static constexpr size_t kMaxDepth = 128;
    static constexpr size_t kMaxInputBytes = 16u << 20;

    enum class Layout : uint8_t {
        Indented, // two spaces per level, one entry per line
        OneLine, // the whole value on one line, for line-oriented output
    };

    static Result<Value> parse(std::string_view text);
    // None is written as null.
    static std::string write(const Value& value, Layout layout = Layout::Indented);
};

} // namespace om
