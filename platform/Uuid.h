// A 16-byte UUID. Text form is the canonical upper-case 8-4-4-4-12; parsing accepts either case.
#pragma once

#include <array>
#include <cstdint>
#include <functional>
#include <optional>
#include <string>
#include <string_view>

namespace om {

class Uuid {
public:
    using Bytes = std::array<uint8_t, 16>;

    Uuid() = default; // the nil UUID
    explicit Uuid(const Bytes& bytes)
        : m_bytes(bytes)
    {
    }

    // A version-4 random UUID from the kernel's random source.
    static Uuid random();
    // Exactly 36 characters of 8-4-4-4-12 hexadecimal, either case; anything else is none.
    static std::optional<Uuid> parse(std::string_view text);

    const Bytes& bytes() const { return m_bytes; }
    bool isNil() const;
    std::string string() const;

    auto operator<=>(const Uuid&) const = default;

private:
    Bytes m_bytes {};
};

} // namespace om

template <> struct std::hash<om::Uuid> {
    size_t operator()(const om::Uuid& uuid) const noexcept;
};
