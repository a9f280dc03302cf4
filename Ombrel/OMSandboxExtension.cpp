#include "Ombrel/OMSandboxExtension.h"

#include <cerrno>
#include <cstring>

#include "Ombrel/OMLog.h"
#include "platform/Sandbox.h"

namespace om {

namespace {

bool isWithin(const std::string& path, const std::string& directory)
{
    if (directory == "/")
        return true;
    return path == directory || (path.starts_with(directory) && path[directory.size()] == '/');
}

// A token for resourcePath that grants nothing outside the bundle (canonical): a plug-in names its
// shared resources itself, and "../" or a link inside the bundle must not carry a grant elsewhere.
// The checked canonical path is what goes into the token, so nothing can change it in between.
// The bundle itself (".") is its own canonical path, resolved once for all its resources.
Result<std::string> issueWithin(const Result<std::string>& canonicalBundle, const std::string& resourcePath, bool whole)
{
    if (!canonicalBundle.ok())
        return canonicalBundle.error();
    const std::string& bundle = *canonicalBundle;
    const std::string resource = whole ? bundle : OM_TRY(Sandbox::canonicalPath(resourcePath));
    if (!isWithin(resource, bundle))
        return OMError("POSIX", EACCES, resource + " lies outside " + bundle);
    return Sandbox::issueFileExtension(Sandbox::kReadOnlyFileClass, resource, 0);
}

// The system's message for the error number behind a failure; failures of other domains (a key
// directory that is a file, say) have none and read as an I/O error.
std::string systemMessageOf(const OMError& error)
{
    char buffer[256];
    return ::strerror_r(error.domain() == "POSIX" ? static_cast<int>(error.code()) : EIO, buffer, sizeof buffer);
}

} // namespace

std::shared_ptr<OMSandboxExtension> OMSandboxExtension::initWithExtension(std::string token)
{
    return std::shared_ptr<OMSandboxExtension>(new OMSandboxExtension(std::move(token)));
}

OMSandboxExtension::~OMSandboxExtension()
{
    expel();
}

void OMSandboxExtension::consume()
{
    if (m_handle.load() != 0)
        return;
    const int64_t handle = Sandbox::consume(m_token);
    int64_t unconsumed = 0;
    // Two parties consuming at once: the one that stores second gives its handle back.
    if (!m_handle.compare_exchange_strong(unconsumed, handle))
        Sandbox::release(handle);
}

void OMSandboxExtension::expel()
{
    const int64_t handle = m_handle.exchange(0);
    if (handle != 0)
        Sandbox::release(handle);
}

Value OMSandboxExtension::issueForResources(const std::string& bundlePath, const Value& resources)
{
    const Value names = resources.isString() ? Value::array({ resources }) : resources;
    const auto bundle = Sandbox::canonicalPath(bundlePath);
    DictionaryBuilder tokens;
    for (const Value& element : names.elements()) {
        const std::string* name = element.asString();
        if (!name)
            continue;
        const std::string resourcePath = *name == "." ? bundlePath : bundlePath + "/" + *name;
        auto token = issueWithin(bundle, resourcePath, *name == ".");
        if (!token.ok()) {
            OMLog::ops().info("failed to make extension for %@ in plug-in at %@: %{public}s", Value(resourcePath),
                Value(bundlePath), systemMessageOf(token.error()));
            continue;
        }
        tokens.set(*name, std::move(token).releaseValue());
    }
    return tokens.build();
}

} // namespace om
