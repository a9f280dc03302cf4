// ChangeCounter: counts omd's annotation-change notifications exactly. A listener program and the
// daemon meet on a bus of the test's own (PrivateBus), so that no other test's notifications are
// counted; omd logs each post before the reply that follows it, so the log says how many to expect.
#pragma once

#include <memory>
#include <string>

#include "tests/support/DaemonProcess.h"
#include "tests/support/PrivateBus.h"
#include "tests/support/RegistrarDaemon.h"

namespace om::test {

class ChangeCounter {
public:
    static constexpr const char* kChange = "com.orvex.ombrel.annotation-change";

    // Starts the bus (its socket in directory) and a listener on it.
    explicit ChangeCounter(const std::string& directory);

    // Empty when the bus or the listener did not come up; the text says which.
    std::string failure() const;
    // The DBUS_SESSION_BUS_ADDRESS setting that puts a daemon on this bus.
    std::pair<std::string, std::string> busSetting() const { return { "DBUS_SESSION_BUS_ADDRESS", m_bus.address() }; }

    // How many notifications omd posted since the last call, once the listener has received every
    // one of them.
    size_t announcedSince(RegistrarDaemon& omd);

private:
    PrivateBus m_bus;
    std::unique_ptr<DaemonProcess> m_listener;
    bool m_listening = false;
    size_t m_announced = 0;
};

} // namespace om::test
