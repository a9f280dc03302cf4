// DaemonProcess: runs the real omd binary for end-to-end tests, in a private temporary directory
// (its CONDUIT_DIR and every other location the daemon reads from the environment), captures its
// standard error line by line, and stops it with SIGTERM. Every wait blocks on the awaited event
// with a generous timeout that only a failure reaches.
#pragma once

#include <sys/types.h>

#include <chrono>
#include <condition_variable>
#include <cstdint>
#include <functional>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <string_view>
#include <thread>
#include <utility>
#include <vector>

#include "platform/UniqueFd.h"
#include "platform/Value.h"
#include "tests/support/RawConduitPeer.h"

namespace om::test {

inline constexpr std::chrono::milliseconds kDaemonTimeout = std::chrono::seconds(60);

// One line the daemon wrote on standard error. Log records are split into their parts; any other
// line (the usage text) has only raw and message set.
struct DaemonLogLine {
    std::string raw;
    std::string subsystem; // empty for the platform's default handle
    std::string category;
    std::string level; // "debug", "info", "notice" or "error"; empty when not a log record
    std::string message;

    static DaemonLogLine parse(std::string_view line);
};

class DaemonProcess {
public:
    struct Options {
        std::string executable; // required: the binary to run
        std::vector<std::string> arguments; // after argv[0]
        std::string logLevel = "debug"; // EVLOG_LEVEL; empty leaves it unset
        // Shared with another daemon to make two of them meet; default <root>/conduit.
        std::optional<std::string> conduitDirectory;
        // Run as this user and group (through setpriv) instead of the test's own.
        std::optional<uid_t> user;
        // Set last, so they override the private defaults.
        std::vector<std::pair<std::string, std::string>> environment;
        // Puts "-d <root>/annotations.vlist" ahead of the arguments, so that the daemon's
        // annotation database is private too (a "-d" among the arguments still wins).
        bool privateDatabase = true;
        // RLIMIT_NOFILE, soft and hard alike, so that the daemon cannot raise it.
        std::optional<uint64_t> descriptorLimit;
    };

    // Starts the process. A binary that cannot be started exits with status 127.
    explicit DaemonProcess(Options options);
    // Kills the process if it still runs, and removes the temporary directory.
    ~DaemonProcess();
    DaemonProcess(const DaemonProcess&) = delete;
    DaemonProcess& operator=(const DaemonProcess&) = delete;

    pid_t pid() const { return m_pid; }
    const std::string& root() const { return m_root; }
    const std::string& conduitDirectory() const { return m_conduitDirectory; }
    // The name given with -S, else the daemon's default service name.
    const std::string& serviceName() const { return m_serviceName; }
    std::string socketPath() const { return m_conduitDirectory + "/" + m_serviceName; }

    // True once the service's socket exists, made by this process rather than left behind by a
    // predecessor on a shared directory; false when the process exits first or time runs out.
    bool waitForSocket(std::chrono::milliseconds timeout = kDaemonTimeout);

    std::vector<DaemonLogLine> lines() const;
    // Everything written on standard error so far, byte for byte.
    std::string stderrText() const;
    size_t countMessages(std::string_view message) const;
    // Blocks until a line with exactly this message exists (true), or standard error closes or
    // time runs out (false).
    bool waitForMessage(std::string_view message, std::chrono::milliseconds timeout = kDaemonTimeout);
    // The same for the n-th such line (counting from 1).
    bool waitForMessageCount(
        std::string_view message, size_t count, std::chrono::milliseconds timeout = kDaemonTimeout);
    // The predicate runs under the lock that guards the lines: it must not call back into this.
    bool waitForLines(const std::function<bool(const std::vector<DaemonLogLine>&)>& predicate,
        std::chrono::milliseconds timeout = kDaemonTimeout);
    // Blocks until the process has closed standard error (usually: it has exited).
    bool waitForStderrClosed(std::chrono::milliseconds timeout = kDaemonTimeout);

    // User plus system CPU time the process has used, in clock ticks (/proc/<pid>/stat).
    std::optional<uint64_t> cpuTicks() const;
    // Its resident memory (VmRSS) in bytes.
    std::optional<uint64_t> residentBytes() const;

    void sendSignal(int signal);
    // Sends SIGTERM and waits for the exit. The wait status, or none when it did not end in time.
    std::optional<int> stop(std::chrono::milliseconds timeout = kDaemonTimeout);
    // Waits for the process to end on its own.
    std::optional<int> waitForExit(std::chrono::milliseconds timeout = kDaemonTimeout);
    bool running() const { return !m_status.has_value(); }

    // Stops one of the daemon's threads, found by its name (a work queue's label), until the
    // returned object is destroyed. Only a thread idle in a futex wait is left stopped, so it holds
    // no lock that other threads need. Null when the thread cannot be traced (no ptrace permission)
    // or does not exist.
    class FrozenThread {
    public:
        ~FrozenThread();
        FrozenThread(const FrozenThread&) = delete;
        FrozenThread& operator=(const FrozenThread&) = delete;
        pid_t tid() const { return m_tid; }

    private:
        friend class DaemonProcess;
        explicit FrozenThread(pid_t tid)
            : m_tid(tid)
        {
        }
        pid_t m_tid;
    };
    std::unique_ptr<FrozenThread> freezeThread(std::string_view name);

private:
    void readStderr();

    std::string m_root;
    std::string m_conduitDirectory;
    std::string m_serviceName;
    pid_t m_pid = -1;
    UniqueFd m_pidfd;
    UniqueFd m_stderr;
    UniqueFd m_stopReader; // eventfd: tells the reader thread to give up
    std::optional<int> m_status;
    std::optional<std::pair<dev_t, ino_t>> m_staleSocket; // the socket file found before the start

    mutable std::mutex m_mutex;
    std::condition_variable m_changed;
    std::string m_stderrText;
    std::string m_partialLine;
    std::vector<DaemonLogLine> m_lines;
    bool m_stderrClosed = false;
    std::thread m_reader;
};

// A raw peer of a running daemon that numbers its own requests (ids must rise per connection).
class DaemonPeer {
public:
    static std::optional<DaemonPeer> connect(const DaemonProcess& daemon);

    // Sends a request (frame kind 2) and returns its id.
    uint64_t send(const Value& request);
    // Sends a message that awaits no reply (frame kind 1).
    bool sendMessage(const Value& message);
    // The next frame, which must be the reply to id; none otherwise.
    std::optional<Value> replyTo(uint64_t id);
    std::optional<Value> call(const Value& request) { return replyTo(send(request)); }
    RawConduitPeer& raw() { return m_peer; }

private:
    explicit DaemonPeer(RawConduitPeer peer)
        : m_peer(std::move(peer))
    {
    }
    RawConduitPeer m_peer;
    uint64_t m_lastId = 0;
};

// {"request": name, "version": version}
Value daemonRequest(std::string_view name, uint64_t version = 3);

// The omd binary built with the test suites (they are compiled with OM_BINARY_DIR).
#ifdef OM_BINARY_DIR
inline std::string builtDaemonPath()
{
    return std::string(OM_BINARY_DIR) + "/omd/omd";
}
#endif

} // namespace om::test
