// JSON for omctl: requests typed on the command line become value trees, and replies are printed
// as JSON for scripts.
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
// The parser refuses nesting deeper than kMaxDepth, input over kMaxInputBytes, invalid UTF-8,
// control characters in strings, bad escapes and unpaired surrogates, naming the byte offset.
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

    static Result<Value> parse(std::string_view text);
    // Indented with two spaces; none is written as null.
    static std::string write(const Value& value);

private:
    explicit OmctlJson(std::string_view text)
        : m_text(text)
    {
    }

    bool parseValue(Value& out, size_t depth);
    bool parseObject(Value& out, size_t depth);
    bool parseArray(Value& out, size_t depth);
    bool parseString(std::string& out);
    bool parseEscape(std::string& out);
    bool parseHex4(uint32_t& out);
    bool parseNumber(Value& out);
    bool parseLiteral(Value& out);
    bool applyMarker(Value& out, const std::string& key, const Value& argument, size_t start);
    void skipSpace();
    bool fail(std::string what, size_t offset);

    std::string_view m_text;
    size_t m_position = 0;
    std::string m_error;
};

} // namespace om
