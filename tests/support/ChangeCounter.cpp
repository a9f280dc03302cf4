#include "tests/support/ChangeCounter.h"

#include <gtest/gtest.h>

#include <utility>

namespace om::test {

ChangeCounter::ChangeCounter(const std::string& directory)
    : m_bus(directory)
{
    if (m_bus.address().empty())
        return;
    DaemonProcess::Options options;
    options.executable = std::string(OM_BINARY_DIR) + "/tests/om_test_listener";
    options.arguments = { kChange };
    options.logLevel.clear();
    options.privateDatabase = false;
    options.environment = { busSetting() };
    m_listener = std::make_unique<DaemonProcess>(options);
    m_listening = m_listener->waitForMessage("ready");
}

std::string ChangeCounter::failure() const
{
    if (m_bus.address().empty())
        return "dbus-daemon did not start: " + m_bus.log();
    if (!m_listening)
        return "the listener did not start: " + m_listener->stderrText();
    return {};
}

size_t ChangeCounter::announcedSince(RegistrarDaemon& omd)
{
    omd.readLogSoFar();
    const size_t posted = omd.daemon().countMessages(std::string("posting ") + kChange);
    EXPECT_TRUE(posted == 0 || m_listener->waitForMessageCount(kChange, posted)) << m_listener->stderrText();
    EXPECT_EQ(m_listener->countMessages(kChange), posted);
    return posted - std::exchange(m_announced, posted);
}

} // namespace om::test
