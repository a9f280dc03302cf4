// The instance side of the jobd tests: jobd runs it in a sandbox, and it answers its host's
// requests on the connection jobd gave it (descriptor $JOBD_INSTANCE_FD):
//   {"op": "ping"}                     -> {"pid": its pid, "home": $HOME}
//   {"op": "read", "path": P}          -> {"ok": whether P opened for reading, "errno": ...}
//   {"op": "write", "path": P}         -> {"ok": whether P could be created, "errno": ...}
//   {"op": "connect", "port": N}       -> {"ok": whether a TCP connection to 127.0.0.1:N opened}
//   {"op": "busy"} / {"op": "idle"}    -> {"status": what jobd answered the declaration}
//   {"op": "exit", "status": N}        exits with N
// With JOBD_TEST_IGNORE_TERM=1 it ignores SIGTERM. It exits 0 when the host closes the connection.
#include <fcntl.h>
#include <signal.h>
#include <sys/socket.h>
#include <unistd.h>

#include <cerrno>
#include <cstdlib>

#include "platform/Assertions.h"
#include "platform/JobManager.h"

#include <arpa/inet.h>
#include <netinet/in.h>

namespace {

om::Value outcome(bool ok, int error)
{
    return om::Value::dictionary({ { "ok", om::Value::boolean(ok) }, { "errno", int64_t(ok ? 0 : error) } });
}

om::Value tryRead(const std::string& path)
{
    om::UniqueFd fd(::open(path.c_str(), O_RDONLY | O_CLOEXEC));
    return outcome(fd.valid(), errno);
}

om::Value tryWrite(const std::string& path)
{
    om::UniqueFd fd(::open(path.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0600));
    return outcome(fd.valid(), errno);
}

om::Value tryConnect(int64_t port)
{
    om::UniqueFd fd(::socket(AF_INET, SOCK_STREAM | SOCK_CLOEXEC, 0));
    if (!fd.valid())
        return outcome(false, errno);
    sockaddr_in address {};
    address.sin_family = AF_INET;
    address.sin_port = htons(uint16_t(port));
    address.sin_addr.s_addr = htonl(INADDR_LOOPBACK);
    const bool ok = ::connect(fd.get(), reinterpret_cast<sockaddr*>(&address), sizeof address) == 0;
    return outcome(ok, errno);
}

om::Value declare(std::shared_ptr<om::Assertions>& assertions, bool busy)
{
    if (!assertions)
        assertions = om::Assertions::create();
    auto result = busy ? assertions->declareBusy() : assertions->declareIdle();
    return om::Value::dictionary({ { "status", int64_t(result.ok() ? 0 : result.error().code()) } });
}

} // namespace

int main()
{
    // NOLINTBEGIN(concurrency-mt-unsafe): read before any thread starts.
    if (const char* ignore = std::getenv("JOBD_TEST_IGNORE_TERM"); ignore && std::string(ignore) == "1")
        ::signal(SIGTERM, SIG_IGN);
    // NOLINTEND(concurrency-mt-unsafe)
    std::shared_ptr<om::Assertions> assertions;
    const bool served = om::JobManagerServeInstance([&](const om::Value& request) {
        const std::string op = request.stringFor("op") ? *request.stringFor("op") : "";
        om::Value reply;
        if (op == "ping") {
            const auto* home = std::getenv("HOME"); // NOLINT(concurrency-mt-unsafe): nothing sets it
            reply = om::Value::dictionary({ { "pid", int64_t(::getpid()) }, { "home", home ? home : "" } });
        } else if (op == "read") {
            reply = tryRead(request.stringFor("path") ? *request.stringFor("path") : "");
        } else if (op == "write") {
            reply = tryWrite(request.stringFor("path") ? *request.stringFor("path") : "");
        } else if (op == "connect") {
            reply = tryConnect(request["port"].asInt64().value_or(0));
        } else if (op == "busy" || op == "idle") {
            reply = declare(assertions, op == "busy");
        } else if (op == "exit") {
            std::_Exit(int(request["status"].asInt64().value_or(0)));
        } else {
            reply = om::Value::dictionary({ { "error", "unknown op" } });
        }
        return reply;
    });
    return served ? 0 : 2;
}
