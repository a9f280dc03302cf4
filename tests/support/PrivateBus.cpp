#include "tests/support/PrivateBus.h"

namespace om::test {

PrivateBus::PrivateBus(const std::string& directory)
{
    DaemonProcess::Options options;
    options.executable = "/usr/bin/dbus-daemon";
    options.arguments = { "--session", "--nofork", "--address=unix:path=" + directory + "/bus", "--print-address=2" };
    options.logLevel.clear();
    options.privateDatabase = false;
    m_daemon = std::make_unique<DaemonProcess>(options);
    // The address is printed once the bus listens.
    m_daemon->waitForLines([&](const auto& lines) {
        for (const auto& line : lines) {
            if (line.raw.starts_with("unix:"))
                m_address = line.raw;
        }
        return !m_address.empty();
    });
}

} // namespace om::test
