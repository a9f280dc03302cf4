#include "platform/Conduit.h"

#include <pthread.h>
#include <signal.h>

#include <cstdlib>

#include "platform/ConduitIoThread.h"

namespace om {

namespace {

constexpr size_t kDefaultMaxPending = size_t(64) << 20;

size_t maxPendingFromEnvironment()
{
    const char* text = std::getenv("CONDUIT_MAX_PENDING");
    if (!text || !*text)
        return kDefaultMaxPending;
    char* end = nullptr;
    const unsigned long long value = std::strtoull(text, &end, 10);
    if (*end != '\0' || value == 0) {
        ConduitIoThread::log().error(
            "CONDUIT_MAX_PENDING \"%s\" is not a byte count; using %llu", text, uint64_t(kDefaultMaxPending));
        return kDefaultMaxPending;
    }
    return size_t(value);
}

std::atomic<size_t>& maxPendingSetting()
{
    static std::atomic<size_t> setting { maxPendingFromEnvironment() };
    return setting;
}

} // namespace

std::string Conduit::directory()
{
    if (const char* directory = std::getenv("CONDUIT_DIR"); directory && *directory)
        return directory;
    if (const char* runtime = std::getenv("XDG_RUNTIME_DIR"); runtime && *runtime)
        return std::string(runtime) + "/conduit";
    return "/run/conduit";
}

std::string Conduit::socketPath(const std::string& serviceName)
{
    return directory() + "/" + serviceName;
}

bool Conduit::isValidServiceName(const std::string& serviceName)
{
    return !serviceName.empty() && serviceName != "." && serviceName != ".."
        && serviceName.find('/') == std::string::npos && serviceName.find('\0') == std::string::npos;
}

size_t Conduit::maxPendingBytes()
{
    return maxPendingSetting().load(std::memory_order_relaxed);
}

void Conduit::setMaxPendingBytesForTesting(size_t bytes)
{
    maxPendingSetting().store(bytes, std::memory_order_relaxed);
}

void Conduit::exitOnTermination()
{
    sigset_t signals;
    sigemptyset(&signals);
    sigaddset(&signals, SIGTERM);
    ::pthread_sigmask(SIG_BLOCK, &signals, nullptr);
    ConduitIoThread::shared().exitOnTermination();
}

} // namespace om
