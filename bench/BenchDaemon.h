// Shared pieces of the end-to-end benchmarks: the real omd binary on a private directory, and
// blocking raw-frame I/O over its socket.
//
// The daemon is $OMD_BINARY, else <build>/omd/omd next to <build>/bench/, so that the same
// benchmark can measure an older build for comparison. It dies with the benchmark.
#pragma once

#include <fcntl.h>
#include <signal.h>
#include <stdlib.h>
#include <sys/prctl.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <sys/wait.h>
#include <time.h>
#include <unistd.h>

#include <algorithm>
#include <cerrno>
#include <cstdint>
#include <cstdio>
#include <cstring>
#include <filesystem>
#include <fstream>
#include <string>
#include <vector>

#include "platform/Cbor.h"

extern char** environ;

namespace om::bench {

inline constexpr size_t kFrameHeaderSize = 13;

// Calls step(done, left), a read or a write of the bytes after the first done, until size bytes
// have moved; false on an error or the end of the stream.
template <typename Step> bool moveAll(size_t size, Step step)
{
    for (size_t done = 0; done < size;) {
        ssize_t count = step(done, size - done);
        if (count < 0 && errno == EINTR)
            continue;
        if (count <= 0)
            return false;
        done += static_cast<size_t>(count);
    }
    return true;
}

inline bool writeAll(int fd, const uint8_t* bytes, size_t size)
{
    return moveAll(size, [&](size_t done, size_t left) { return ::write(fd, bytes + done, left); });
}

inline bool readAll(int fd, uint8_t* bytes, size_t size)
{
    return moveAll(size, [&](size_t done, size_t left) { return ::read(fd, bytes + done, left); });
}

inline uint32_t frameLengthOf(const uint8_t* header)
{
    return static_cast<uint32_t>(header[0]) | static_cast<uint32_t>(header[1]) << 8
        | static_cast<uint32_t>(header[2]) << 16 | static_cast<uint32_t>(header[3]) << 24;
}

// Reads one whole frame into buffer (header included).
inline bool readFrame(int fd, std::vector<uint8_t>& buffer)
{
    buffer.resize(kFrameHeaderSize);
    if (!readAll(fd, buffer.data(), kFrameHeaderSize))
        return false;
    uint32_t length = frameLengthOf(buffer.data());
    if (length < 9 || length > 9 + (16u << 20))
        return false;
    buffer.resize(4 + length);
    return readAll(fd, buffer.data() + kFrameHeaderSize, length - 9);
}

inline int connectTo(const std::string& path)
{
    int fd = ::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0);
    sockaddr_un address = {};
    address.sun_family = AF_UNIX;
    std::strncpy(address.sun_path, path.c_str(), sizeof address.sun_path - 1);
    if (fd >= 0 && ::connect(fd, reinterpret_cast<sockaddr*>(&address), sizeof address) == 0)
        return fd;
    if (fd >= 0)
        ::close(fd);
    return -1;
}

// A request frame (kind 2) carrying payload; the id is patched per request with setFrameId.
inline std::vector<uint8_t> requestFrame(const Value& payload)
{
    auto encoded = Cbor::encode(payload);
    uint32_t length = static_cast<uint32_t>(9 + encoded.size());
    std::vector<uint8_t> frame = { static_cast<uint8_t>(length), static_cast<uint8_t>(length >> 8),
        static_cast<uint8_t>(length >> 16), static_cast<uint8_t>(length >> 24), 2 };
    frame.resize(kFrameHeaderSize, 0);
    frame.insert(frame.end(), encoded.begin(), encoded.end());
    return frame;
}

// A request for "ping", version 3: a name omd answers at once, without handler work.
inline std::vector<uint8_t> pingFrame()
{
    return requestFrame(Value::dictionary({ { "request", "ping" }, { "version", 3u } }));
}

inline void setFrameId(std::vector<uint8_t>& frame, uint64_t id)
{
    for (int i = 0; i < 8; ++i)
        frame[5 + static_cast<size_t>(i)] = static_cast<uint8_t>(id >> (8 * i));
}

inline std::string daemonBinary()
{
    if (const char* path = ::getenv("OMD_BINARY"))
        return path;
    std::error_code error;
    auto self = std::filesystem::read_symlink("/proc/self/exe", error);
    return (self.parent_path().parent_path() / "omd" / "omd").string();
}

// The real daemon on a private directory under root, serving serviceName, asked to stop when the
// benchmark ends (and killed by the kernel should the benchmark die first). extraSettings
// ("NAME=value") override the environment.
class BenchDaemon {
public:
    BenchDaemon(const std::string& root, const std::string& serviceName, std::vector<std::string> extraSettings = {})
    {
        std::string conduit = root + "/conduit";
        std::filesystem::create_directories(conduit);
        m_socketPath = conduit + "/" + serviceName;

        std::vector<std::string> settings = {
            "CONDUIT_DIR=" + conduit,
            "HOME=" + root + "/home",
            "XDG_RUNTIME_DIR=" + root + "/runtime",
            "XDG_DATA_HOME=" + root + "/data",
            "XDG_CONFIG_HOME=" + root + "/config",
            "REGISTRAR_DB=" + root + "/registrar.db",
            "REGISTRAR_SDK_DIR=" + root + "/sdk",
            "REGISTRAR_CONTAINERS=" + root + "/containers",
            "CONSENT_DB=" + root + "/consent.db",
            "PREFS_DIR=" + root + "/prefs",
            "SANDBOX_KEY=" + root + "/sandbox.key",
            "OMD_GLOBAL_ANNOTATIONS=" + root + "/global-annotations",
        };
        settings.insert(settings.end(), extraSettings.begin(), extraSettings.end());
        for (char** entry = environ; *entry; ++entry) {
            std::string_view name(*entry);
            name = name.substr(0, name.find('='));
            bool ours = std::any_of(settings.begin(), settings.end(),
                [&](const std::string& setting) { return setting.starts_with(std::string(name) + "="); });
            if (!ours)
                settings.emplace_back(*entry);
        }
        std::string binary = daemonBinary();
        std::vector<std::string> arguments = { binary, "-S", serviceName };
        std::vector<char*> argv, envp;
        for (auto& argument : arguments)
            argv.push_back(argument.data());
        argv.push_back(nullptr);
        for (auto& setting : settings)
            envp.push_back(setting.data());
        envp.push_back(nullptr);
        std::string logPath = root + "/omd.log";
        int log = ::open(logPath.c_str(), O_WRONLY | O_CREAT | O_TRUNC | O_CLOEXEC, 0600);

        m_pid = ::fork();
        if (m_pid == 0)
            runChild(argv.data(), envp.data(), log);
        if (log >= 0)
            ::close(log);
        if (m_pid < 0 || !waitForSocket())
            std::fprintf(stderr, "cannot start %s (see %s)\n", binary.c_str(), logPath.c_str());
    }

    ~BenchDaemon()
    {
        if (m_pid <= 0)
            return;
        ::kill(m_pid, SIGTERM);
        int status;
        ::waitpid(m_pid, &status, 0);
    }

    BenchDaemon(const BenchDaemon&) = delete;
    BenchDaemon& operator=(const BenchDaemon&) = delete;

    const std::string& socketPath() const { return m_socketPath; }
    bool running() const { return m_running; }
    pid_t pid() const { return m_pid; }

    // VmRSS of the daemon in bytes; 0 when it cannot be read.
    size_t residentBytes() const
    {
        std::ifstream status("/proc/" + std::to_string(m_pid) + "/status");
        std::string line;
        while (std::getline(status, line)) {
            if (line.starts_with("VmRSS:"))
                return static_cast<size_t>(std::strtoull(line.c_str() + 6, nullptr, 10)) * 1024;
        }
        return 0;
    }

private:
    [[noreturn]] static void runChild(char** argv, char** envp, int log)
    {
        ::prctl(PR_SET_PDEATHSIG, SIGKILL);
        if (log >= 0) {
            ::dup2(log, 1);
            ::dup2(log, 2);
        }
        ::execve(argv[0], argv, envp);
        ::_exit(127);
    }

    // Polls: a benchmark may wait, and the daemon gives no other sign of readiness.
    bool waitForSocket()
    {
        for (int attempt = 0; attempt < 12000; ++attempt) { // a large Registrar takes a while to open
            int fd = connectTo(m_socketPath);
            if (fd >= 0) {
                ::close(fd);
                m_running = true;
                return true;
            }
            int status;
            if (::waitpid(m_pid, &status, WNOHANG) == m_pid) {
                m_pid = -1;
                return false;
            }
            timespec pause = { 0, 10'000'000 };
            ::nanosleep(&pause, nullptr);
        }
        return false;
    }

    std::string m_socketPath;
    pid_t m_pid = -1;
    bool m_running = false;
};

} // namespace om::bench
