#include "Ombrel/OMBundle.h"

#include <strings.h>

#include "Ombrel/OMLog.h"
#include "platform/ValueTreeConversion.h"

namespace om {

namespace {

constexpr std::string_view kFileScheme = "file://";
constexpr std::string_view kLocalhost = "localhost";
constexpr std::string_view kNoPath = "(null)";

// RFC 3986 pchar without '%', plus '/': what a path may hold unescaped.
bool isPathCharacter(unsigned char c)
{
    if ((c >= 'A' && c <= 'Z') || (c >= 'a' && c <= 'z') || (c >= '0' && c <= '9'))
        return true;
    return std::string_view("-._~!$&'()*+,;=:@/").find(static_cast<char>(c)) != std::string_view::npos;
}

int hexDigit(char c)
{
    if (c >= '0' && c <= '9')
        return c - '0';
    if (c >= 'a' && c <= 'f')
        return c - 'a' + 10;
    if (c >= 'A' && c <= 'F')
        return c - 'A' + 10;
    return -1;
}

bool startsWithIgnoringCase(std::string_view text, std::string_view prefix)
{
    return text.size() >= prefix.size() && ::strncasecmp(text.data(), prefix.data(), prefix.size()) == 0;
}

} // namespace

OMBundle::OMBundle(std::shared_ptr<const Bundle> bundle)
    : _bundle(bundle ? std::move(bundle) : Bundle::withPath(""))
{
}

std::shared_ptr<OMBundle> OMBundle::initWithConduitBundle(std::shared_ptr<const Bundle> bundle)
{
    return std::shared_ptr<OMBundle>(new OMBundle(std::move(bundle)));
}

std::shared_ptr<OMBundle> OMBundle::initForMainBundle()
{
    return initWithConduitBundle(Bundle::mainBundle());
}

std::shared_ptr<OMBundle> OMBundle::initWithPath(std::string_view path)
{
    return initWithConduitBundle(Bundle::withPath(path));
}

std::shared_ptr<OMBundle> OMBundle::initWithURL(std::string_view url)
{
    return initWithPath(pathOfFileURL(url).value_or(""));
}

std::shared_ptr<OMBundle> OMBundle::initWithExecutablePath(std::string_view path)
{
    auto bundle = Bundle::containingExecutable(path);
    if (!bundle->bundlePath())
        bundle = Bundle::withPath(path);
    return initWithConduitBundle(std::move(bundle));
}

std::shared_ptr<OMBundle> OMBundle::initWithExecutableURL(std::string_view url)
{
    return initWithExecutablePath(pathOfFileURL(url).value_or(""));
}

std::optional<std::string> OMBundle::stringProperty(Property which) const
{
    switch (which) {
    case Property::BundlePath:
        return _bundle->bundlePath();
    case Property::ExecutablePath:
        return _bundle->executablePath();
    case Property::SupportFilesPath:
        return _bundle->supportFilesPath();
    }
    return std::nullopt;
}

std::optional<std::string> OMBundle::path() const
{
    return stringProperty(Property::BundlePath);
}

std::optional<std::string> OMBundle::url() const
{
    auto bundlePath = path();
    if (!bundlePath)
        return std::nullopt;
    return fileURL(*bundlePath);
}

std::optional<std::string> OMBundle::executablePath() const
{
    if (auto executable = stringProperty(Property::ExecutablePath))
        return executable;
    return stringProperty(Property::BundlePath);
}

std::optional<std::string> OMBundle::supportPath() const
{
    {
        std::lock_guard lock(m_supportPathMutex);
        if (m_supportPath)
            return m_supportPath;
    }
    // Absent stays unkept, so a later call asks the handle again.
    auto support = stringProperty(Property::SupportFilesPath);
    if (support) {
        std::lock_guard lock(m_supportPathMutex);
        m_supportPath = support;
    }
    return support;
}

std::optional<std::string> OMBundle::bundleDirectory(std::string_view name) const
{
    auto support = supportPath();
    if (!support)
        return std::nullopt;
    if (name.empty())
        return support;
    if (support->back() == '/')
        return *support + std::string(name);
    return *support + "/" + std::string(name);
}

std::optional<std::string> OMBundle::plugInsPath() const
{
    return bundleDirectory("PlugIns");
}

Value OMBundle::infoDictionary() const
{
    Value info = _bundle->infoDictionary();
    std::string bundlePath = path().value_or(std::string(kNoPath));
    if (info.isNone()) {
        OMLog::ops().info("failed to retrieve Info.vlist for %@ through %@", bundlePath, _bundle->description());
        return {};
    }
    auto converted = ValueTreeConversion::fromConduit(info);
    if (!converted || !converted->isDictionary()) {
        OMLog::ops().info("failed to convert Info.vlist to dictionary: %@ source=%@", bundlePath, info);
        return {};
    }
    return *converted;
}

std::optional<std::string> OMBundle::bundleIdentifier() const
{
    if (const std::string* identifier = _bundle->infoDictionary().stringFor("VBBundleIdentifier"))
        return *identifier;
    return std::nullopt;
}

std::string OMBundle::fileURL(std::string_view path)
{
    static constexpr char kHex[] = "0123456789ABCDEF";
    std::string url(kFileScheme);
    url.reserve(kFileScheme.size() + path.size());
    for (char c : path) {
        auto byte = static_cast<unsigned char>(c);
        if (isPathCharacter(byte)) {
            url += c;
        } else {
            url += '%';
            url += kHex[byte >> 4];
            url += kHex[byte & 0xf];
        }
    }
    return url;
}

std::optional<std::string> OMBundle::pathOfFileURL(std::string_view url)
{
    if (!startsWithIgnoringCase(url, kFileScheme))
        return std::nullopt;
    std::string_view rest = url.substr(kFileScheme.size());
    if (startsWithIgnoringCase(rest, kLocalhost))
        rest.remove_prefix(kLocalhost.size());
    if (rest.empty() || rest.front() != '/')
        return std::nullopt;
    rest = rest.substr(0, rest.find_first_of("?#"));

    std::string path;
    path.reserve(rest.size());
    for (size_t i = 0; i < rest.size(); ++i) {
        if (rest[i] != '%') {
            path += rest[i];
            continue;
        }
        if (i + 2 >= rest.size())
            return std::nullopt;
        int high = hexDigit(rest[i + 1]);
        int low = hexDigit(rest[i + 2]);
        if (high < 0 || low < 0 || (high == 0 && low == 0))
            return std::nullopt;
        path += static_cast<char>(high << 4 | low);
        i += 2;
    }
    return path;
}

} // namespace om
