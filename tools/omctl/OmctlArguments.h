// The arguments of one omctl subcommand, split into options and operands: "--name VALUE",
// "--name=VALUE" and "-n VALUE" for options that take a value, "--name" and "-n" for flags, and
// everything else (or everything after "--") an operand.
#pragma once

#include <optional>
#include <span>
#include <string>
#include <string_view>
#include <vector>

#include "platform/Result.h"

namespace om {

class OmctlArguments {
public:
    struct Option {
        std::string_view name; // "--flags"
        std::string_view shortName; // "-f", or empty
        bool takesValue;
    };

    // Fails, with the text for a usage line, on an unknown option or a value that is missing.
    static Result<OmctlArguments> parse(const std::vector<std::string>& arguments, std::span<const Option> options);

    bool has(std::string_view name) const;
    // The last value given for an option.
    std::optional<std::string> value(std::string_view name) const;
    const std::vector<std::string>& operands() const { return m_operands; }

    // A decimal number, or a hexadecimal one after "0x".
    static std::optional<uint64_t> number(std::string_view text);

private:
    std::vector<std::pair<std::string, std::string>> m_options; // name and value ("" for a flag)
    std::vector<std::string> m_operands;
};

} // namespace om
