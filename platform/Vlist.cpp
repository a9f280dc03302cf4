#include "platform/Vlist.h"

#include <cstring>

#include "platform/Cbor.h"
#include "platform/Storage.h"
#include "platform/VlistXmlReader.h"
#include "platform/VlistXmlWriter.h"

namespace om {

namespace {

constexpr std::string_view kBinaryMagic { "vlst1\0", 6 };
constexpr std::string_view kBinaryFamily = "vlst";
// Far above any bundle's Info.vlist or the daemon's own stores, well below a memory problem.
constexpr size_t kMaxBytes = size_t { 64 } << 20;

bool startsWith(std::span<const uint8_t> bytes, std::string_view prefix)
{
    return bytes.size() >= prefix.size() && std::memcmp(bytes.data(), prefix.data(), prefix.size()) == 0;
}

OMError tooLarge(size_t size)
{
    return OMError::platform(
        kPlatformErrorLimit, "vlist of " + std::to_string(size) + " bytes exceeds the limit of 64 MiB");
}

OMError withContext(const OMError& error, std::string_view context)
{
    return OMError(error.domain(), error.code(), std::string(context) + ": " + error.localizedDescription());
}

} // namespace

Result<Value> Vlist::parse(std::span<const uint8_t> bytes)
{
    if (bytes.size() > kMaxBytes)
        return tooLarge(bytes.size());
    if (startsWith(bytes, kBinaryMagic)) {
        auto value = Cbor::decode(bytes.subspan(kBinaryMagic.size()));
        if (!value.ok())
            return withContext(value.error(), "binary vlist");
        return value;
    }
    if (startsWith(bytes, kBinaryFamily))
        return OMError::platform(kPlatformErrorUnsupported, "unsupported binary vlist version");
    return VlistXmlReader::parse(bytes);
}

Result<Value> Vlist::parse(std::string_view text)
{
    return parse(std::span(reinterpret_cast<const uint8_t*>(text.data()), text.size()));
}

Result<Value> Vlist::readFile(const std::filesystem::path& path)
{
    auto bytes = OM_TRY(Storage::readFile(path.string(), kMaxBytes));
    auto value = parse(bytes);
    if (!value.ok())
        return withContext(value.error(), path.string());
    return value;
}

std::string Vlist::writeXml(const Value& value)
{
    return VlistXmlWriter::write(value);
}

std::vector<uint8_t> Vlist::writeBinary(const Value& value)
{
    std::vector<uint8_t> bytes(kBinaryMagic.begin(), kBinaryMagic.end());
    Cbor::encode(value, bytes);
    return bytes;
}

} // namespace om
