// "ready" of one plug-in against "bulk", the bare envelope that omd answers without work, in the
// same run and over the same connection. The ratio is what readying costs a host beyond a round
// trip: the UUID lookup, the hold and access checks, the overlay, and the synchronous grant that
// omd records with jobd on a connection of its own.
//
// omd is an entitled copy of the real binary (so that jobd records its grants) and jobd the real
// one (<build>/services/jobd/jobd), both on one private CONDUIT_DIR; this process is the host.
#include <benchmark/benchmark.h>
#include <signal.h>
#include <stdlib.h>
#include <sys/wait.h>
#include <unistd.h>

#include <cstdio>
#include <filesystem>
#include <fstream>
#include <memory>

#include "bench/BenchDaemon.h"
#include "bench/BenchRatios.h"
#include "platform/JobManager.h"
#include "platform/Registrar.h"
#include "platform/Vlist.h"

namespace om::bench {
namespace {

namespace fs = std::filesystem;
constexpr const char* kOmdService = "com.orvex.bench.ready";
constexpr const char* kJobdService = "com.orvex.bench.ready.jobd";

void writeVlist(const std::string& path, const Value& value)
{
    fs::create_directories(fs::path(path).parent_path());
    std::ofstream(path) << Vlist::writeXml(value);
}

// One registered plug-in, jobd, and omd serving it; a raw connection to omd.
class Setup {
public:
    Setup()
    {
        char pattern[] = "/tmp/bench-ready-XXXXXX";
        if (!::mkdtemp(pattern))
            return;
        m_root = pattern;
        const std::string build = fs::canonical("/proc/self/exe").parent_path().parent_path();
        const std::string conduit = m_root + "/conduit";
        fs::create_directories(conduit);
        ::setenv("CONDUIT_DIR", conduit.c_str(), 1);
        ::setenv("SANDBOX_KEY", (m_root + "/sandbox.key").c_str(), 1);
        JobManagerSetServiceName(kJobdService);

        // Host.app/PlugIns/Task.appex, a plug-in with an executable.
        const std::string app = m_root + "/Host.app";
        writeVlist(app + "/Info.vlist",
            Value::dictionary({ { "VBBundleIdentifier", "com.example.host" }, { "VBBundleVersion", "1" },
                { "VBBundleExecutable", "Host" } }));
        std::ofstream(app + "/Host") << "#!/bin/sh\n";
        const std::string plugIn = app + "/PlugIns/Task.appex";
        writeVlist(plugIn + "/Info.vlist",
            Value::dictionary({ { "VBBundleIdentifier", "com.example.task" }, { "VBBundleVersion", "1" },
                { "VBBundleExecutable", "Task" },
                { "QSExtension", Value::dictionary({ { "QSExtensionPointIdentifier", "com.example.point" } }) } }));
        std::ofstream(plugIn + "/Task") << "#!/bin/sh\n";
        fs::permissions(plugIn + "/Task", fs::perms::owner_all, fs::perm_options::add);
        const RegistrarWorkspace::Configuration configuration
            = { m_root + "/registrar.db", m_root + "/sdk", m_root + "/containers" };
        {
            auto workspace = RegistrarWorkspace::open(configuration, RegistrarWorkspace::Access::ReadWrite);
            if (!workspace.ok())
                return;
            auto registered = workspace.value()->registerPlugIns({ plugIn });
            if (registered.size() != 1 || !registered.front().ok())
                return;
            m_uuid = registered.front().value()->uuid();
            workspace.value()->waitForNotifications();
        }

        // jobd first, so that omd's first grant finds it; its log is kept quiet.
        m_jobd = ::fork();
        if (m_jobd == 0) {
            ::setenv("JOBD_PROFILES_DIR", (fs::path(OM_SOURCE_DIR) / "services/jobd/profiles").c_str(), 1);
            ::setenv("EVLOG_LEVEL", "error", 1);
            ::execl((build + "/services/jobd/jobd").c_str(), "jobd", "-S", kJobdService, nullptr);
            ::_exit(127);
        }
        const std::string jobdSocket = conduit + "/" + kJobdService;
        for (int tries = 0; tries < 20000 && !fs::exists(jobdSocket); ++tries)
            ::sched_yield();

        // omd, entitled to manage jobd.
        const std::string omd = m_root + "/bin/omd";
        fs::create_directories(m_root + "/bin");
        fs::copy_file(daemonBinary(), omd);
        writeVlist(m_root + "/omd-entitlements.vlist", Value::dictionary({ { kJobManagerEntitlement, true } }));
        const std::string entitle
            = std::string(OM_SOURCE_DIR) + "/scripts/entitle " + omd + " " + m_root + "/omd-entitlements.vlist";
        if (std::system(entitle.c_str()) != 0) // NOLINT(cert-env33-c)
            return;
        ::setenv("OMD_BINARY", omd.c_str(), 1);
        m_omd = std::make_unique<BenchDaemon>(m_root, kOmdService,
            std::vector<std::string> { "REGISTRAR_DB=" + configuration.databasePath,
                "REGISTRAR_SDK_DIR=" + configuration.sdkDirectory,
                "REGISTRAR_CONTAINERS=" + configuration.containersDirectory,
                std::string("JOBD_SERVICE_NAME=") + kJobdService });
        m_fd = m_omd->running() ? connectTo(m_omd->socketPath()) : -1;
    }

    ~Setup()
    {
        if (m_fd >= 0)
            ::close(m_fd);
        m_omd.reset();
        if (m_jobd > 0) {
            ::kill(m_jobd, SIGTERM);
            ::waitpid(m_jobd, nullptr, 0);
        }
        std::error_code ignored;
        fs::remove_all(m_root, ignored);
    }

    bool ready() const { return m_fd >= 0; }
    const Uuid& uuid() const { return m_uuid; }

    // One request on the connection; the reply's payload, or none.
    Result<Value> call(std::vector<uint8_t>& frame)
    {
        setFrameId(frame, ++m_lastId);
        if (!writeAll(m_fd, frame.data(), frame.size()) || !readFrame(m_fd, m_reply))
            return OMError("bench", 1, "no reply");
        return Cbor::decode(std::span<const uint8_t>(m_reply).subspan(kFrameHeaderSize));
    }

private:
    std::string m_root;
    Uuid m_uuid;
    pid_t m_jobd = -1;
    std::unique_ptr<BenchDaemon> m_omd;
    int m_fd = -1;
    uint64_t m_lastId = 0;
    std::vector<uint8_t> m_reply;
};

Setup& setup()
{
    static Setup instance;
    return instance;
}

void run(benchmark::State& state, Value request)
{
    if (!setup().ready())
        return state.SkipWithError("setup failed");
    auto frame = requestFrame(request);
    auto first = setup().call(frame);
    if (!first.ok() || first.value().contains("errorcode"))
        return state.SkipWithError(("refused: " + (first.ok() ? first.value().description() : "")).c_str());
    for (auto _ : state)
        benchmark::DoNotOptimize(setup().call(frame));
}

void readyOne(benchmark::State& state)
{
    run(state,
        Value::dictionary(
            { { "request", "ready" }, { "version", 3u }, { "uuids", Value::array({ Value::uuid(setup().uuid()) }) },
                { "flags", Value::unsignedInteger(uint64_t { 0 }) } }));
}
BENCHMARK(readyOne)->Repetitions(3)->UseRealTime()->Unit(benchmark::kMicrosecond);

void bulk(benchmark::State& state)
{
    run(state, Value::dictionary({ { "request", "bulk" }, { "version", 3u } }));
}
BENCHMARK(bulk)->Repetitions(3)->UseRealTime()->Unit(benchmark::kMicrosecond);

class ReadyRatios : public RatioReporter {
protected:
    void printRatios() override
    {
        const double ready = realMedian("readyOne/repeats:3/real_time");
        const double envelope = realMedian("bulk/repeats:3/real_time");
        if (ready > 0 && envelope > 0)
            std::printf("\n\"ready\" of one plug-in / \"bulk\" (wall clock, median of 3): %.2f (%.1f us vs %.1f us)\n",
                ready / envelope, ready * 1e6, envelope * 1e6);
    }
};

} // namespace
} // namespace om::bench

int main(int argc, char** argv)
{
    return om::bench::runWithRatios<om::bench::ReadyRatios>(argc, argv);
}
