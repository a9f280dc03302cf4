#include "tools/omctl/OmctlHost.h"

#include <fcntl.h>
#include <sys/stat.h>

#include <filesystem>

#include "Ombrel/OMBundle.h"
#include "platform/CodeSigning.h"
#include "platform/Format.h"
#include "platform/Process.h"
#include "platform/UniqueFd.h"

namespace om {

namespace {

constexpr const char* kUntrusted = "its executable is writable by group or others, or owned by neither root nor omd's "
                                   "user, so omd counts none of its entitlements";

} // namespace

bool OmctlHost::hasEntitlement(std::string_view key) const
{
    const Value& value = m_entitlements[key];
    return !value.isNone() && value != Value::boolean(false);
}

void OmctlHost::setBundleOf(const std::string& executable)
{
    if (auto bundle = OMBundle::initWithExecutablePath(executable))
        m_plugInsPath = bundle->plugInsPath();
}

Result<OmctlHost> OmctlHost::forExecutable(const std::string& path)
{
    std::error_code error;
    const std::string canonical = std::filesystem::canonical(path, error).string();
    if (error)
        return OMError::fromErrno("realpath " + path, error.value());
    UniqueFd fd(::open(canonical.c_str(), O_RDONLY | O_CLOEXEC));
    if (!fd.valid())
        return OMError::fromErrno("open " + canonical, errno);
    struct stat info;
    if (::fstat(fd.get(), &info) < 0)
        return OMError::fromErrno("fstat " + canonical, errno);
    auto entitlements = CodeSigningTask::readEntitlements(fd.get());
    if (!entitlements.ok())
        return OMError("omctl", 0, canonical + ": " + entitlements.error().localizedDescription());

    OmctlHost host;
    host.m_description = canonical;
    host.m_executable = canonical;
    if (CodeSigningTask::ownerMayGrant(info))
        host.m_entitlements = entitlements.value();
    else if (!entitlements->isNone())
        host.m_untrustedReason = kUntrusted;
    host.setBundleOf(canonical);
    return host;
}

Result<OmctlHost> OmctlHost::forProcess(pid_t pid)
{
    const AuditToken token { .pid = pid };
    auto executable = Process::executablePath(token);
    if (!executable.ok())
        return OMError("omctl", 0, format("process %d: %s", pid, executable.error().localizedDescription()));
    auto task = CodeSigningTask::create(token);
    if (!task)
        return OMError("omctl", 0, format("process %d cannot be examined", pid));

    OmctlHost host;
    host.m_description = format("process %d (%s)", pid, executable.value());
    host.m_executable = executable.value();
    if (task->trusted())
        host.m_entitlements = task->entitlements();
    else
        host.m_untrustedReason = kUntrusted;
    host.setBundleOf(executable.value());
    return host;
}

} // namespace om
