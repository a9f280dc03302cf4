// PrivateBus: a dbus-daemon of a test's own, so that the notifications it counts are only those
// of the daemons it starts on this bus, whatever other tests run at the same time.
#pragma once

#include <memory>
#include <string>

#include "tests/support/DaemonProcess.h"

namespace om::test {

class PrivateBus {
public:
    // Starts the bus with its socket in directory; address() is empty when it did not come up.
    explicit PrivateBus(const std::string& directory);

    // The value for DBUS_SESSION_BUS_ADDRESS.
    const std::string& address() const { return m_address; }
    std::string log() const { return m_daemon->stderrText(); }

private:
    std::unique_ptr<DaemonProcess> m_daemon;
    std::string m_address;
};

} // namespace om::test
