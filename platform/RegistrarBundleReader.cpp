#include "platform/RegistrarBundleReader.h"

#include <fcntl.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>
#include <vector>

#include "platform/Bundle.h"
#include "platform/CodeSigning.h"
#include "platform/DictionaryMerge.h"
#include "platform/Registrar.h"
#include "platform/UniqueFd.h"
#include "platform/Vlist.h"

namespace om {

namespace {

constexpr std::string_view kInfoFile = "/Info.vlist";
constexpr std::string_view kDataProtocol = "#Data";

OMError refused(std::string description)
{
    return OMError(kRegistrarErrorDomain, kRegistrarErrorRefused, std::move(description));
}

OMError unreadableInfo(const std::string& where, const std::string& why)
{
    return refused("no readable Info.vlist in " + where + ": " + why);
}

// True when value nests no more than limit containers deep (a scalar is 0, {} is 1).
bool withinDepth(const Value& value, unsigned limit)
{
    if (!value.isDictionary() && !value.isArray())
        return true;
    if (limit == 0)
        return false;
    for (const Value& element : value.elements()) {
        if (!withinDepth(element, limit - 1))
            return false;
    }
    for (const auto& entry : value.entries()) {
        if (!withinDepth(entry.second, limit - 1))
            return false;
    }
    return true;
}

std::optional<std::string> optionalString(const Value& value)
{
    if (const std::string* text = value.asString())
        return *text;
    return std::nullopt;
}

// The plug-in dictionary of an Info value: current-style bundles declare "QSExtension", old-style
// ones only an "Ombrel" key (whose value is the dictionary when it is one). None: no plug-in.
std::optional<Value> declaredPlugInDictionary(const Value& info, bool currentStyle)
{
    if (currentStyle)
        return info["QSExtension"];
    if (!info.contains("Ombrel"))
        return std::nullopt;
    const Value& old = info["Ombrel"];
    return old.isDictionary() ? old : Value::dictionary({});
}

// Attributes always present, and always with a version, so that every reader sees one shape. None
// when plugIn already has that shape, so that it is shared rather than copied.
std::optional<Value> canonicalPlugInDictionary(const Value& plugIn, const Value& info)
{
    const Value& declared = plugIn["QSExtensionAttributes"];
    if (declared.isDictionary() && declared.contains("QSExtensionVersion"))
        return std::nullopt;
    DictionaryBuilder attributes(declared.isDictionary() ? declared : Value::dictionary({}));
    if (attributes.get("QSExtensionVersion").isNone()) {
        const Value& shortVersion = info["VBBundleShortVersionString"];
        attributes.set("QSExtensionVersion", shortVersion.isString() ? shortVersion : Value("1"));
    }
    return DictionaryBuilder(plugIn).set("QSExtensionAttributes", attributes.build()).build();
}

std::string lastComponent(const std::string& path)
{
    size_t slash = path.rfind('/');
    return slash == std::string::npos ? path : path.substr(slash + 1);
}

std::string withoutExtension(const std::string& name)
{
    size_t dot = name.rfind('.');
    return dot == std::string::npos || dot == 0 ? name : name.substr(0, dot);
}

} // namespace

Result<Value> RegistrarBundleReader::parseInfo(std::span<const uint8_t> bytes)
{
    if (bytes.size() > kMaxInfoBytes)
        return refused("Info.vlist is larger than " + std::to_string(kMaxInfoBytes) + " bytes");
    auto parsed = Vlist::parse(bytes);
    if (!parsed.ok())
        return refused("Info.vlist does not parse: " + parsed.error().localizedDescription());
    if (!parsed->isDictionary())
        return refused("Info.vlist is not a dictionary");
    if (!withinDepth(*parsed, kMaxInfoDepth))
        return refused("Info.vlist nests deeper than " + std::to_string(kMaxInfoDepth) + " levels");
    return std::move(parsed).releaseValue();
}

Result<RegistrarBundleReader::PlugInFacts> RegistrarBundleReader::plugInFacts(
    const std::string& canonicalPath, const Value& info, const Value& entitlements, const SdkLookup& sdk)
{
    if (!info.isDictionary())
        return unreadableInfo(canonicalPath, "not a dictionary");
    // The style is what the bundle itself declares: an SDK entry may carry a "QSExtension"
    // dictionary, which must not turn an old-style bundle into a current one.
    const bool currentStyle = info["QSExtension"].isDictionary();
    auto declared = declaredPlugInDictionary(info, currentStyle);
    if (!declared)
        return refused(
            canonicalPath + " is no plug-in: its Info.vlist has neither a QSExtension dictionary nor an Ombrel key");

    // Identity and names are what the bundle says of itself; the SDK only completes declarations.
    const std::string* identifier = info["QSExtension"].stringFor("QSExtensionIdentifier");
    const std::string* bundleIdentifier = info.stringFor("VBBundleIdentifier");
    if (!identifier)
        identifier = bundleIdentifier;
    if (!identifier)
        return refused(
            canonicalPath + " is no plug-in: it has neither a QSExtensionIdentifier nor a VBBundleIdentifier string");

    Value merged = info;
    if (const std::string* extensionPoint = declared->stringFor("QSExtensionPointIdentifier"); extensionPoint && sdk) {
        if (Value entry = sdk(*extensionPoint); entry.isDictionary())
            merged = DictionaryMerge::mergeDictionary(entry, info);
    }
    Value plugIn = *declaredPlugInDictionary(merged, currentStyle);
    auto canonical = canonicalPlugInDictionary(plugIn, merged);

    PlugInFacts facts;
    facts.identifier = *identifier;
    facts.originalIdentifier = bundleIdentifier ? *bundleIdentifier : *identifier;
    facts.bundleIdentifier = optionalString(info["VBBundleIdentifier"]);
    facts.bundleVersion = optionalString(info["VBBundleVersion"]);
    if (canonical)
        plugIn = std::move(*canonical);
    facts.infoDictionary
        = currentStyle && canonical ? DictionaryBuilder(merged).set("QSExtension", plugIn).build() : merged;
    facts.isDataPlugIn = plugIn["QSExtensionProtocol"] == Value(kDataProtocol);
    facts.plugInDictionary = std::move(plugIn);
    facts.entitlements = entitlements;
    AppFacts names = appFacts(canonicalPath, info);
    facts.displayName = std::move(names.displayName);
    const std::string* name = info.stringFor("VBBundleName");
    facts.shortDisplayName = name ? *name : facts.displayName;
    facts.onSystemPartition = canonicalPath.starts_with("/System/");
    return facts;
}

RegistrarBundleReader::AppFacts RegistrarBundleReader::appFacts(const std::string& canonicalPath, const Value& info)
{
    AppFacts facts;
    facts.bundleIdentifier = optionalString(info["VBBundleIdentifier"]);
    if (const std::string* display = info.stringFor("VBBundleDisplayName"))
        facts.displayName = *display;
    else if (const std::string* name = info.stringFor("VBBundleName"))
        facts.displayName = *name;
    else
        facts.displayName = withoutExtension(lastComponent(canonicalPath));
    return facts;
}

Result<std::string> RegistrarBundleReader::canonicalPath(std::string_view path)
{
    if (path.empty() || path.find('\0') != std::string_view::npos)
        return refused("not a bundle path: \"" + std::string(path.substr(0, path.find('\0'))) + "\"");
    if (path.size() > kMaxPathBytes)
        return refused("bundle path longer than " + std::to_string(kMaxPathBytes) + " bytes");
    if (path.front() != '/')
        return refused("bundle path is relative: " + std::string(path));
    const std::string given(path);
    char* resolved = ::realpath(given.c_str(), nullptr);
    if (!resolved)
        return OMError::fromErrno("realpath " + given, errno);
    std::string canonical(resolved);
    std::free(resolved);
    if (canonical.size() > kMaxPathBytes)
        return refused("canonical bundle path longer than " + std::to_string(kMaxPathBytes) + " bytes: " + canonical);
    return canonical;
}

Result<Value> RegistrarBundleReader::readInfo(const std::string& bundlePath)
{
    const std::string path = bundlePath + std::string(kInfoFile);
    // O_NONBLOCK: a FIFO planted in place of the file must not hang the registration.
    UniqueFd file(::open(path.c_str(), O_RDONLY | O_CLOEXEC | O_NONBLOCK | O_NOCTTY));
    if (!file.valid())
        return unreadableInfo(bundlePath, OMError::fromErrno("open", errno).localizedDescription());
    struct stat status;
    if (::fstat(file.get(), &status) < 0)
        return unreadableInfo(bundlePath, OMError::fromErrno("fstat", errno).localizedDescription());
    if (!S_ISREG(status.st_mode))
        return unreadableInfo(bundlePath, "not a regular file");
    if (status.st_size > off_t(kMaxInfoBytes))
        return unreadableInfo(bundlePath, "larger than " + std::to_string(kMaxInfoBytes) + " bytes");

    // One byte past the size tells a file that grew since fstat from one that did not.
    std::vector<uint8_t> bytes(size_t(status.st_size) + 1);
    size_t done = 0;
    while (done < bytes.size()) {
        ssize_t n = ::read(file.get(), bytes.data() + done, bytes.size() - done);
        if (n < 0 && errno == EINTR)
            continue;
        if (n < 0)
            return unreadableInfo(bundlePath, OMError::fromErrno("read", errno).localizedDescription());
        if (n == 0)
            break;
        done += size_t(n);
    }
    if (done > size_t(status.st_size))
        return unreadableInfo(bundlePath, "it changed while it was read");
    bytes.resize(done);
    auto info = parseInfo(bytes);
    if (!info.ok())
        return unreadableInfo(bundlePath, info.error().localizedDescription());
    return info;
}

Value RegistrarBundleReader::readEntitlements(const std::string& bundlePath, const Log& log)
{
    auto executable = Bundle::withPath(bundlePath)->executablePath();
    if (!executable) {
        log.info("%s names no executable inside the bundle; no entitlements", bundlePath);
        return {};
    }
    UniqueFd file(::open(executable->c_str(), O_RDONLY | O_CLOEXEC | O_NONBLOCK | O_NOCTTY));
    if (!file.valid()) {
        log.info("%s: no entitlements: %s", *executable, OMError::fromErrno("open", errno).localizedDescription());
        return {};
    }
    struct stat status;
    if (::fstat(file.get(), &status) < 0) {
        log.info("%s: no entitlements: %s", *executable, OMError::fromErrno("fstat", errno).localizedDescription());
        return {};
    }
    if (!CodeSigningTask::ownerMayGrant(status)) {
        log.info("%s: no entitlements: owner %u and mode %o may not grant any", *executable, unsigned(status.st_uid),
            unsigned(status.st_mode & 07777));
        return {};
    }
    auto entitlements = CodeSigningTask::readEntitlements(file.get());
    if (!entitlements.ok()) {
        log.error("%s: no entitlements: %s", *executable, entitlements.error().localizedDescription());
        return {};
    }
    return std::move(entitlements).releaseValue();
}

std::optional<std::string> RegistrarBundleReader::containingApplication(const std::string& canonicalPath)
{
    std::string directory = canonicalPath;
    for (size_t slash = directory.rfind('/'); slash != std::string::npos && slash > 0; slash = directory.rfind('/')) {
        directory.resize(slash);
        if (!directory.ends_with(".app"))
            continue;
        struct stat status;
        if (::stat((directory + std::string(kInfoFile)).c_str(), &status) == 0 && S_ISREG(status.st_mode))
            return directory;
    }
    return std::nullopt;
}

} // namespace om
