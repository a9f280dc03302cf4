#include "services/jobd/SandboxProfile.h"

#include <sys/stat.h>

#include <algorithm>
#include <cstdlib>

#include "platform/Vlist.h"

#ifndef JOBD_PROFILES_DEFAULT
#define JOBD_PROFILES_DEFAULT "/usr/share/omd/jobd/profiles"
#endif

namespace om {

namespace {

const std::vector<std::string> kKnownNamespaces = { "user", "pid", "ipc", "uts", "cgroup" };

OMError malformed(const std::string& name, const std::string& reason)
{
    return OMError::platform(kPlatformErrorMalformed, "sandbox profile " + name + ": " + reason);
}

bool isAbsolute(const std::string& path)
{
    return !path.empty() && path[0] == '/' && path.find('\0') == std::string::npos;
}

Result<std::vector<std::string>> readStrings(const std::string& name, const Value& array, const char* key)
{
    std::vector<std::string> strings;
    if (array.isNone())
        return strings;
    if (!array.isArray())
        return malformed(name, std::string(key) + " is not an array");
    for (const auto& element : array.elements()) {
        const auto* text = element.asString();
        if (!text)
            return malformed(name, std::string(key) + " holds a value that is not text");
        strings.push_back(*text);
    }
    return strings;
}

bool exists(const std::string& path)
{
    struct stat info { };
    return ::lstat(path.c_str(), &info) == 0;
}

} // namespace

std::string SandboxProfile::directory()
{
    // NOLINTNEXTLINE(concurrency-mt-unsafe): jobd never changes its environment.
    const char* configured = std::getenv("JOBD_PROFILES_DIR");
    return configured && *configured ? configured : JOBD_PROFILES_DEFAULT;
}

Result<std::shared_ptr<const SandboxProfile>> SandboxProfile::load(
    const std::string& directory, const std::string& name)
{
    auto root = Vlist::readFile(directory + "/" + name + ".vlist");
    if (!root.ok())
        return malformed(name, root.error().localizedDescription());
    const Value& dictionary = root.value();
    if (!dictionary.isDictionary())
        return malformed(name, "not a dictionary");
    std::shared_ptr<SandboxProfile> profile(new SandboxProfile());
    profile->m_name = name;
    profile->m_unshare = OM_TRY(readStrings(name, dictionary["Unshare"], "Unshare"));
    for (const auto& space : profile->m_unshare) {
        if (std::find(kKnownNamespaces.begin(), kKnownNamespaces.end(), space) == kKnownNamespaces.end())
            return malformed(name, "unknown namespace " + space);
    }
    profile->m_systemPaths = OM_TRY(readStrings(name, dictionary["SystemPaths"], "SystemPaths"));
    for (const auto& path : profile->m_systemPaths) {
        if (!isAbsolute(path))
            return malformed(name, "system path is not absolute: " + path);
    }
    const Value& links = dictionary["Symlinks"];
    if (!links.isNone() && !links.isDictionary())
        return malformed(name, "Symlinks is not a dictionary");
    for (const auto& [link, target] : links.entries()) {
        if (!isAbsolute(link) || !target.asString())
            return malformed(name, "malformed symbolic link " + link);
        profile->m_symlinks[link] = *target.asString();
    }
    profile->m_network = dictionary["Network"].asBool().value_or(false);
    profile->m_proc = dictionary["Proc"].asBool().value_or(true);
    profile->m_dev = dictionary["Dev"].asBool().value_or(true);
    return std::shared_ptr<const SandboxProfile>(std::move(profile));
}

std::vector<std::string> SandboxProfile::arguments(const JobSpec& job, const std::string& jobdSocket) const
{
    std::vector<std::string> args;
    for (const auto& space : m_unshare)
        args.push_back("--unshare-" + space);
    if (!m_network)
        args.emplace_back("--unshare-net");
    args.insert(args.end(), { "--die-with-parent", "--new-session", "--cap-drop", "ALL" });
    for (const auto& path : m_systemPaths)
        args.insert(args.end(), { "--ro-bind-try", path, path });
    for (const auto& [link, target] : m_symlinks)
        args.insert(args.end(), { "--symlink", target, link });
    if (m_proc)
        args.insert(args.end(), { "--proc", "/proc" });
    if (m_dev)
        args.insert(args.end(), { "--dev", "/dev" });
    // The private /tmp first: the binds below may lie inside it and must land on top of it.
    args.insert(args.end(), { "--tmpfs", "/tmp" });
    args.insert(args.end(), { "--ro-bind", job.bundlePath, job.bundlePath });
    if (job.home && exists(*job.home))
        args.insert(args.end(), { "--bind", *job.home, *job.home, "--chdir", *job.home });
    for (const auto& path : job.readablePaths)
        args.insert(args.end(), { "--ro-bind-try", path, path });
    if (!jobdSocket.empty() && exists(jobdSocket))
        args.insert(args.end(), { "--ro-bind", jobdSocket, jobdSocket });
    args.insert(args.end(), { "--", job.executablePath });
    return args;
}

} // namespace om
