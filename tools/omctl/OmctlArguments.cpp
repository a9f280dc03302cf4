#include "tools/omctl/OmctlArguments.h"

#include <algorithm>
#include <charconv>

#include "platform/OMError.h"

namespace om {

Result<OmctlArguments> OmctlArguments::parse(const std::vector<std::string>& arguments, std::span<const Option> options)
{
    OmctlArguments parsed;
    bool optionsEnded = false;
    for (size_t index = 0; index < arguments.size(); ++index) {
        const std::string& argument = arguments[index];
        if (optionsEnded || argument.size() < 2 || argument[0] != '-') {
            parsed.m_operands.push_back(argument);
            continue;
        }
        if (argument == "--") {
            optionsEnded = true;
            continue;
        }
        const auto equals = argument.find('=');
        const std::string_view name = std::string_view(argument).substr(0, equals);
        auto option = std::find_if(options.begin(), options.end(), [&](const Option& candidate) {
            return candidate.name == name || (!candidate.shortName.empty() && candidate.shortName == name);
        });
        if (option == options.end())
            return OMError("omctl", 0, "unknown option " + argument);
        if (!option->takesValue) {
            if (equals != std::string::npos)
                return OMError("omctl", 0, std::string(option->name) + " takes no value");
            parsed.m_options.emplace_back(option->name, std::string());
        } else if (equals != std::string::npos && name == option->name) {
            parsed.m_options.emplace_back(option->name, argument.substr(equals + 1));
        } else if (equals == std::string::npos && index + 1 < arguments.size()) {
            parsed.m_options.emplace_back(option->name, arguments[++index]);
        } else {
            return OMError("omctl", 0, std::string(option->name) + " needs a value");
        }
    }
    return parsed;
}

bool OmctlArguments::has(std::string_view name) const
{
    return std::any_of(m_options.begin(), m_options.end(), [&](const auto& option) { return option.first == name; });
}

std::optional<std::string> OmctlArguments::value(std::string_view name) const
{
    for (auto option = m_options.rbegin(); option != m_options.rend(); ++option) {
        if (option->first == name)
            return option->second;
    }
    return std::nullopt;
}

std::optional<uint64_t> OmctlArguments::number(std::string_view text)
{
    int base = 10;
    if (text.starts_with("0x") || text.starts_with("0X")) {
        base = 16;
        text.remove_prefix(2);
    }
    uint64_t value = 0;
    const char* end = text.data() + text.size();
    auto [at, error] = std::from_chars(text.data(), end, value, base);
    if (text.empty() || error != std::errc() || at != end)
        return std::nullopt;
    return value;
}

} // namespace om
