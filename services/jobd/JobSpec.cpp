#include "services/jobd/JobSpec.h"

#include <sys/stat.h>
#include <unistd.h>

#include "platform/Bundle.h"
#include "platform/Sandbox.h"

namespace om {

namespace {

OMError invalid(std::string reason)
{
    return OMError::platform(kPlatformErrorMalformed, std::move(reason));
}

bool isProfileName(const std::string& name)
{
    if (name.empty() || name.size() > 64)
        return false;
    for (char c : name) {
        if (!((c >= 'a' && c <= 'z') || (c >= '0' && c <= '9') || c == '-'))
            return false;
    }
    return true;
}

Result<std::map<std::string, std::string>> readEnvironment(const Value& variables)
{
    std::map<std::string, std::string> environment;
    if (variables.isNone())
        return environment;
    if (variables.type() != Value::Type::Dictionary)
        return invalid("EnvironmentVariables is not a dictionary");
    if (variables.entries().size() > JobSpec::kMaxEnvironmentEntries)
        return invalid("more than " + std::to_string(JobSpec::kMaxEnvironmentEntries) + " environment variables");
    size_t bytes = 0;
    for (const auto& [name, value] : variables.entries()) {
        const auto* text = value.asString();
        if (!text)
            return invalid("environment variable " + name + " is not text");
        if (name.empty() || name.find('=') != std::string::npos || name.find('\0') != std::string::npos
            || text->find('\0') != std::string::npos)
            return invalid("malformed environment variable " + name);
        bytes += name.size() + text->size() + 2;
        if (bytes > JobSpec::kMaxEnvironmentBytes)
            return invalid("environment larger than " + std::to_string(JobSpec::kMaxEnvironmentBytes) + " bytes");
        environment[name] = *text;
    }
    return environment;
}

Result<std::vector<std::string>> readExtensions(const Value& tokens)
{
    std::vector<std::string> paths;
    if (tokens.isNone())
        return paths;
    if (tokens.type() != Value::Type::Array)
        return invalid("_SandboxExtensions is not an array");
    if (tokens.elements().size() > JobSpec::kMaxExtensions)
        return invalid("more than " + std::to_string(JobSpec::kMaxExtensions) + " sandbox extensions");
    for (const auto& token : tokens.elements()) {
        const auto* text = token.asString();
        if (!text)
            return invalid("a sandbox extension is not text");
        auto path = Sandbox::verify(*text);
        if (!path.ok())
            return invalid("sandbox extension refused: " + path.error().localizedDescription());
        paths.push_back(std::move(path).releaseValue());
    }
    return paths;
}

} // namespace

Result<JobSpec> JobSpec::fromOverlay(const std::string& executablePath, const Value& overlay)
{
    JobSpec job;
    if (executablePath.empty() || executablePath[0] != '/')
        return invalid("executable path is not absolute: " + executablePath);
    struct stat file { };
    if (::stat(executablePath.c_str(), &file) < 0 || !S_ISREG(file.st_mode)
        || ::access(executablePath.c_str(), X_OK) < 0)
        return invalid("not an executable file: " + executablePath);
    auto bundle = Bundle::containingExecutable(executablePath);
    if (!bundle || !bundle->bundlePath())
        return invalid("no bundle contains " + executablePath);
    const Value info = bundle->infoDictionary();
    const auto* identifier = info["VBBundleIdentifier"].asString();
    if (!identifier || identifier->empty())
        return invalid("bundle " + *bundle->bundlePath() + " has no identifier");
    job.executablePath = bundle->executablePath().value_or(executablePath);
    job.bundlePath = *bundle->bundlePath();
    job.bundleIdentifier = *identifier;
    const auto* version = info["VBBundleVersion"].asString();
    job.version = version ? *version : "1";

    if (overlay.type() != Value::Type::Dictionary)
        return invalid("overlay is not a dictionary");
    const Value& service = overlay["ConduitService"];
    if (service.type() != Value::Type::Dictionary)
        return invalid("overlay has no ConduitService dictionary");
    const auto* profile = service["_SandboxProfile"].asString();
    job.profile = profile ? *profile : "plugin";
    if (!isProfileName(job.profile))
        return invalid("malformed sandbox profile name");
    job.environment = OM_TRY(readEnvironment(service["EnvironmentVariables"]));
    job.readablePaths = OM_TRY(readExtensions(service["_SandboxExtensions"]));
    if (auto home = job.environment.find("HOME"); home != job.environment.end() && !home->second.empty()) {
        if (home->second[0] != '/')
            return invalid("HOME is not absolute");
        job.home = home->second;
    }
    return job;
}

} // namespace om
