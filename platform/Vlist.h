// vlist files: the platform's serialised value trees. Two forms, told apart by their first bytes:
// binary ("vlst1\0" followed by one CBOR item) and XML (<vlist version="1"> with one typed element
// per value). Readers take either; writers produce XML unless asked for binary.
#pragma once

#include <cstdint>
#include <filesystem>
#include <span>
#include <string>
#include <vector>

#include "platform/Result.h"
#include "platform/Value.h"

namespace om {

class Vlist {
public:
    // Parses either form. XML errors name the line.
    static Result<Value> parse(std::span<const uint8_t> bytes);
    static Result<Value> parse(std::string_view text);
    static Result<Value> readFile(const std::filesystem::path& path);

    static std::string writeXml(const Value& value);
    static std::vector<uint8_t> writeBinary(const Value& value);
};

} // namespace om
