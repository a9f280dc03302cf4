// PrivateBus: a message bus of the test's own, so that a test run by hand needs no session bus and
// a test run under dbus-run-session does not share one. It runs dbus-daemon with the session
// configuration on a socket in a temporary directory, and stops it when destroyed.
#pragma once

#include <sys/types.h>

#include <string>

namespace om::test {

class PrivateBus {
public:
    // Starts the bus and waits until it has printed its address (it listens from then on).
    PrivateBus();
    ~PrivateBus();
    PrivateBus(const PrivateBus&) = delete;
    PrivateBus& operator=(const PrivateBus&) = delete;

    // The bus's address, for DBUS_SESSION_BUS_ADDRESS; empty when it did not start.
    const std::string& address() const { return m_address; }
    // A temporary directory that goes with the bus, for the test's own files.
    const std::string& root() const { return m_root; }
    // Ends the bus now: its connections see it hang up.
    void stop();

private:
    std::string m_root;
    std::string m_address;
    pid_t m_pid = -1;
};

} // namespace om::test
