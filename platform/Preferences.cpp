#include "platform/Preferences.h"

#include <sys/stat.h>

#include <cerrno>

#include "platform/Log.h"
#include "platform/Storage.h"
#include "platform/Vlist.h"

namespace om {

namespace {

constexpr std::string_view kExtension = ".vlist";

const Log& log()
{
    static const Log& log = Log::platform("prefs");
    return log;
}

int64_t nanoseconds(const timespec& time)
{
    return int64_t(time.tv_sec) * 1'000'000'000 + time.tv_nsec;
}

bool isMissing(const OMError& error)
{
    return error.domain() == "POSIX" && (error.code() == ENOENT || error.code() == ENOTDIR);
}

} // namespace

std::string Preferences::defaultDirectory()
{
    return Storage::location("PREFS_DIR", "/etc/omd/prefs", Storage::configHome() + "/omd/prefs");
}

Preferences::Preferences()
    : Preferences(defaultDirectory())
{
}

Preferences::Preferences(std::string directory)
    : m_directory(std::move(directory))
{
}

Preferences::~Preferences() = default;

std::optional<std::string> Preferences::pathOfDomain(std::string_view domain) const
{
    std::string file = std::string(domain) + std::string(kExtension);
    if (domain.empty() || !Storage::isSafeComponent(domain) || !Storage::isSafeComponent(file))
        return std::nullopt;
    return m_directory + "/" + file;
}

Result<void> Preferences::addSuiteNamed(std::string_view domain)
{
    auto path = pathOfDomain(domain);
    if (!path)
        return OMError::platform(kPlatformErrorUnsupported, "not a preference domain name: " + std::string(domain));
    std::lock_guard lock(m_mutex);
    for (const auto& known : m_domains) {
        if (known.name == domain)
            return {};
    }
    m_domains.push_back({ std::string(domain), std::move(*path), std::nullopt, Value::dictionary({}) });
    return {};
}

Preferences::Version Preferences::versionOf(const struct stat& info)
{
    return Version {
        .device = info.st_dev,
        .inode = info.st_ino,
        .size = info.st_size,
        .modified = nanoseconds(info.st_mtim),
        .changed = nanoseconds(info.st_ctim),
    };
}

Preferences::Version Preferences::versionOf(const std::string& path)
{
    struct stat info;
    if (::stat(path.c_str(), &info) < 0)
        return Version { .error = errno };
    return versionOf(info);
}

std::pair<Preferences::Version, Result<Value>> Preferences::load(const std::string& path)
{
    struct stat info { };
    auto bytes = Storage::readFile(path, kMaxFileSize, &info);
    // The version is that of the file actually read, so a replacement between the caller's stat()
    // and this read is read again next time rather than missed. When nothing could be opened
    // (missing, not permitted; st_ino stays 0) stat() says what is there.
    const Version version = info.st_ino ? versionOf(info) : versionOf(path);
    if (!bytes.ok())
        return { version, isMissing(bytes.error()) ? Result<Value>(Value::dictionary({})) : bytes.error() };
    auto parsed = Vlist::parse(std::span<const uint8_t>(*bytes));
    if (!parsed.ok())
        return { version,
            OMError(
                parsed.error().domain(), parsed.error().code(), path + ": " + parsed.error().localizedDescription()) };
    if (!parsed->isDictionary())
        return { version, OMError::platform(kPlatformErrorMalformed, path + ": not a dictionary") };
    return { version, std::move(parsed).releaseValue() };
}

// Only a version not seen before is read, so a damaged file is read, and logged, once per version.
void Preferences::refresh(Domain& domain)
{
    if (domain.version && *domain.version == versionOf(domain.path))
        return;
    auto [version, contents] = load(domain.path);
    domain.version = version;
    if (contents.ok()) {
        domain.contents = std::move(contents).releaseValue();
        return;
    }
    domain.contents = Value::dictionary({});
    log().error(
        "preference domain %s is damaged and read as empty: %s", domain.name, contents.error().localizedDescription());
}

void Preferences::synchronize()
{
    std::lock_guard lock(m_mutex);
    for (auto& domain : m_domains)
        refresh(domain);
}

Value Preferences::valueForKey(std::string_view key) const
{
    std::lock_guard lock(m_mutex);
    for (const auto& domain : m_domains) {
        if (const Value& value = domain.contents[key]; !value.isNone())
            return value;
    }
    return {};
}

Value Preferences::synchronizedValueForKey(std::string_view key)
{
    synchronize();
    return valueForKey(key);
}

Result<void> Preferences::setValue(std::string_view domain, std::string_view key, const Value& value)
{
    auto path = pathOfDomain(domain);
    if (!path)
        return OMError::platform(kPlatformErrorUnsupported, "not a preference domain name: " + std::string(domain));
    // Serialises this object's own writers; writers in other processes may still interleave.
    std::lock_guard lock(m_mutex);
    auto [version, contents] = load(*path);
    if (!contents.ok())
        return contents.error();
    DictionaryBuilder next(*contents);
    next.set(std::string(key), value);
    const std::string text = Vlist::writeXml(next.build());
    OM_TRY(Storage::makeDirectories(m_directory));
    return Storage::writeFileAtomically(*path, std::span(reinterpret_cast<const uint8_t*>(text.data()), text.size()));
}

} // namespace om
