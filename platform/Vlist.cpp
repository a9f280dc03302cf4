#include "platform/Vlist.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>

#include "platform/Cbor.h"
#include "platform/UniqueFd.h"
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

Result<std::vector<uint8_t>> readWholeFile(const std::filesystem::path& path)
{
    // O_NONBLOCK so that a FIFO in the way cannot stall the open; regular files ignore it.
    UniqueFd fd(::open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NOCTTY | O_NONBLOCK));
    if (!fd.valid())
        return OMError::fromErrno("open " + path.string(), errno);
    struct stat status { };
    if (::fstat(fd.get(), &status) != 0)
        return OMError::fromErrno("fstat " + path.string(), errno);
    if (!S_ISREG(status.st_mode))
        return OMError::platform(kPlatformErrorUnsupported, path.string() + ": not a regular file");
    if (static_cast<uint64_t>(status.st_size) > kMaxBytes)
        return withContext(tooLarge(static_cast<size_t>(status.st_size)), path.string());

    // Read to the end rather than to st_size: the file may change under us, and the limit holds
    // whatever it grows to.
    std::vector<uint8_t> bytes(static_cast<size_t>(status.st_size) + 1);
    size_t filled = 0;
    for (;;) {
        if (filled == bytes.size()) {
            if (bytes.size() > kMaxBytes)
                return withContext(tooLarge(bytes.size()), path.string());
            bytes.resize(std::min(bytes.size() * 2, kMaxBytes + 1));
        }
        const ssize_t n = ::read(fd.get(), bytes.data() + filled, bytes.size() - filled);
        if (n < 0) {
            if (errno == EINTR)
                continue;
            return OMError::fromErrno("read " + path.string(), errno);
        }
        if (n == 0)
            break;
        filled += static_cast<size_t>(n);
    }
    bytes.resize(filled);
    return bytes;
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
    auto bytes = OM_TRY(readWholeFile(path));
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
