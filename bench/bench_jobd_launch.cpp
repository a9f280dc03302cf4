// Launch of a sandboxed instance to its first reply: through jobd (JobManagerLaunch, the host's
// connection handed over, one request answered) against running bwrap directly with the same
// profile and the same program, in the same run. The ratio (lower is better) is what jobd adds:
// the request, the grant check, the fork and the descriptor passing.
//
// jobd is the real binary (<build>/services/jobd/jobd) on a private CONDUIT_DIR; the instance is
// <build>/tests/jobd_test_instance in a bundle made for the run; an entitled copy of
// <build>/tests/jobd_test_client records the grant.
#include <benchmark/benchmark.h>
#include <signal.h>
#include <stdlib.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/wait.h>
#include <unistd.h>

#include <condition_variable>
#include <cstdio>
#include <filesystem>
#include <fstream>
#include <mutex>
#include <optional>

#include "bench/BenchRatios.h"
#include "platform/Conduit.h"
#include "platform/JobManager.h"
#include "platform/Vlist.h"
#include "services/jobd/JobLauncher.h"
#include "services/jobd/JobSpec.h"
#include "services/jobd/SandboxProfile.h"

namespace {

namespace fs = std::filesystem;
constexpr const char* kService = "com.orvex.bench.jobd";

struct Setup {
    std::string root;
    std::string build;
    std::string executable;
    om::Value overlay;
    pid_t jobd = -1;
    bool ready = false;

    Setup()
    {
        build = fs::canonical("/proc/self/exe").parent_path().parent_path();
        char pattern[] = "/tmp/bench-jobd-XXXXXX";
        if (!::mkdtemp(pattern))
            return;
        root = pattern;
        ::setenv("CONDUIT_DIR", (root + "/conduit").c_str(), 1);
        ::setenv("JOBD_SERVICE_NAME", kService, 1);
        ::setenv("SANDBOX_KEY", (root + "/sandbox.key").c_str(), 1);
        ::setenv("JOBD_PROFILES_DIR", (fs::path(OM_SOURCE_DIR) / "services/jobd/profiles").c_str(), 1);
        ::setenv("EVLOG_LEVEL", "error", 1);
        const std::string bundle = root + "/Bench.appex";
        fs::create_directories(bundle);
        fs::create_directories(root + "/home");
        std::ofstream(bundle + "/Info.vlist") << om::Vlist::writeXml(om::Value::dictionary(
            { { "VBBundleIdentifier", "com.example.bench" }, { "VBBundleExecutable", "instance" } }));
        executable = bundle + "/instance";
        fs::copy_file(build + "/tests/jobd_test_instance", executable);
        ::chmod(executable.c_str(), 0755);
        overlay = om::Value::dictionary({ { "ConduitService",
            om::Value::dictionary({ { "EnvironmentVariables", om::Value::dictionary({ { "HOME", root + "/home" } }) },
                { "_SandboxProfile", "plugin" } }) } });
        jobd = ::fork();
        if (jobd == 0) {
            ::execl((build + "/services/jobd/jobd").c_str(), "jobd", "-S", kService, nullptr);
            ::_exit(127);
        }
        const std::string socket = root + "/conduit/" + kService;
        // The socket appears once jobd listens; wait on the directory rather than guess a delay.
        for (int tries = 0; tries < 20000 && !fs::exists(socket); ++tries)
            ::sched_yield();
        const std::string manager = root + "/manager";
        fs::copy_file(build + "/tests/jobd_test_client", manager);
        const std::string entitlements = root + "/manager.vlist";
        std::ofstream(entitlements) << om::Vlist::writeXml(
            om::Value::dictionary({ { om::kJobManagerEntitlement, true } }));
        const std::string overlayFile = root + "/overlay.vlist";
        std::ofstream(overlayFile) << om::Vlist::writeXml(overlay);
        const std::string entitle = std::string(OM_SOURCE_DIR) + "/scripts/entitle " + manager + " " + entitlements;
        const std::string add = manager + " add " + std::to_string(::getpid()) + " " + executable + " " + overlayFile;
        ready = std::system(entitle.c_str()) == 0 && std::system(add.c_str()) == 0; // NOLINT(cert-env33-c)
    }
    ~Setup()
    {
        if (jobd > 0) {
            ::kill(jobd, SIGKILL);
            ::waitpid(jobd, nullptr, 0);
        }
        std::error_code ignored;
        fs::remove_all(root, ignored);
    }
};

Setup& setup()
{
    static Setup instance;
    return instance;
}

// One request on a fresh instance connection, answered.
bool pingOver(om::UniqueFd socket)
{
    auto connection = om::ConduitConnection::adoptSocket(std::move(socket), nullptr);
    connection->setEventHandler([](const om::ConduitEvent&) {});
    connection->resume();
    std::mutex mutex;
    std::condition_variable done;
    std::optional<bool> answered;
    connection->sendWithReply(om::Value::dictionary({ { "op", "ping" } }), nullptr, [&](om::Result<om::Value> reply) {
        std::lock_guard lock(mutex);
        answered = reply.ok();
        done.notify_all();
    });
    std::unique_lock lock(mutex);
    done.wait(lock, [&] { return answered.has_value(); });
    connection->cancel();
    return *answered;
}

void BM_LaunchViaJobd(benchmark::State& state)
{
    if (!setup().ready) {
        state.SkipWithError("jobd setup failed");
        return;
    }
    for (auto _ : state) {
        auto launched = om::JobManagerLaunch(setup().executable);
        if (!launched.ok() || !pingOver(std::move(launched->connection))) {
            state.SkipWithError("launch failed");
            return;
        }
    }
}
BENCHMARK(BM_LaunchViaJobd)->UseRealTime()->Unit(benchmark::kMillisecond)->MinTime(2);

void BM_LaunchBwrapDirectly(benchmark::State& state)
{
    if (!setup().ready) {
        state.SkipWithError("jobd setup failed");
        return;
    }
    auto job = om::JobSpec::fromOverlay(setup().executable, setup().overlay);
    auto profile = om::SandboxProfile::load(om::SandboxProfile::directory(), "plugin");
    if (!job.ok() || !profile.ok()) {
        state.SkipWithError("no job or profile");
        return;
    }
    const auto arguments = profile.value()->arguments(job.value(), {});
    std::map<std::string, std::string> environment = job->environment;
    environment["JOBD_INSTANCE_FD"] = "3";
    environment["PATH"] = "/usr/bin:/bin";
    for (auto _ : state) {
        int pair[2];
        ::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, pair);
        om::UniqueFd instanceEnd(pair[1]);
        auto child = om::JobLauncher::spawn(om::JobLauncher::bwrapPath(), arguments, environment, instanceEnd, 3);
        instanceEnd.reset();
        if (!child.ok() || !pingOver(om::UniqueFd(pair[0]))) {
            state.SkipWithError("bwrap failed");
            return;
        }
        ::waitpid(child->pid, nullptr, 0); // the instance ends when its connection closes
    }
}
BENCHMARK(BM_LaunchBwrapDirectly)->UseRealTime()->Unit(benchmark::kMillisecond)->MinTime(2);

class Reporter : public om::bench::RatioReporter {
    void printRatios() override
    {
        const double jobd = realMedian("BM_LaunchViaJobd/min_time:2.000/real_time");
        const double direct = realMedian("BM_LaunchBwrapDirectly/min_time:2.000/real_time");
        if (jobd > 0 && direct > 0)
            std::printf("launch to first reply, jobd / bwrap directly: %.2f (%.1f ms vs %.1f ms)\n", jobd / direct,
                jobd * 1e3, direct * 1e3);
    }
};

} // namespace

int main(int argc, char** argv)
{
    return om::bench::runWithRatios<Reporter>(argc, argv);
}
