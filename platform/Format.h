// The one printf-style formatter, shared by the log and by error messages.
//
// Specifiers: %@ and %{public}@ (a Value's description), %d, %u, %ld, %lx, %llu, %s and
// %{public}s (text), %p (pointer), %%. Arguments are type-checked at run time: a specifier whose
// argument is missing or of the wrong kind prints "<?>" instead of reading past the arguments.
#pragma once

#include <cstdint>
#include <initializer_list>
#include <string>
#include <string_view>
#include <type_traits>

#include "platform/Value.h"

namespace om {

class FormatArg {
public:
    enum class Kind : uint8_t { Signed, Unsigned, Text, Object, Pointer };

    template <typename I>
    requires(std::is_integral_v<I>&& std::is_signed_v<I>) FormatArg(I v)
        : m_kind(Kind::Signed)
        , m_signed(v)
    {
    }
    template <typename I>
    requires(std::is_integral_v<I>&& std::is_unsigned_v<I> && !std::is_same_v<I, bool>) FormatArg(I v)
        : m_kind(Kind::Unsigned)
        , m_unsigned(v)
    {
    }
    FormatArg(bool v)
        : m_kind(Kind::Signed)
        , m_signed(v ? 1 : 0)
    {
    }
    FormatArg(const char* text)
        : m_kind(Kind::Text)
        , m_text(text ? text : "(null)")
    {
    }
    FormatArg(const std::string& text)
        : m_kind(Kind::Text)
        , m_text(text)
    {
    }
    FormatArg(std::string_view text)
        : m_kind(Kind::Text)
        , m_text(text)
    {
    }
    FormatArg(const Value& value)
        : m_kind(Kind::Object)
        , m_value(&value)
    {
    }
    FormatArg(const void* pointer)
        : m_kind(Kind::Pointer)
        , m_pointer(pointer)
    {
    }

    Kind kind() const { return m_kind; }
    int64_t signedValue() const { return m_signed; }
    uint64_t unsignedValue() const { return m_unsigned; }
    std::string_view text() const { return m_text; }
    const Value& value() const { return *m_value; }
    const void* pointer() const { return m_pointer; }

private:
    Kind m_kind;
    int64_t m_signed = 0;
    uint64_t m_unsigned = 0;
    std::string_view m_text;
    const Value* m_value = nullptr;
    const void* m_pointer = nullptr;
};

std::string formatString(std::string_view format, std::initializer_list<FormatArg> args);

template <typename... Args> std::string format(std::string_view fmt, const Args&... args)
{
    return formatString(fmt, { FormatArg(args)... });
}

} // namespace om
