#include <gtest/gtest.h>
#include <poll.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

#include <algorithm>
#include <chrono>
#include <condition_variable>
#include <cstdlib>
#include <cstring>
#include <future>
#include <map>
#include <mutex>
#include <optional>
#include <string>
#include <thread>
#include <vector>

#include "platform/Log.h"
#include "platform/Notify.h"
#include "platform/NotifyListener.h"
#include "platform/Storage.h"
#include "platform/UniqueFd.h"
#include "platform/WorkQueue.h"
#include "tests/support/BundleFixture.h"
#include "tests/support/DaemonProcess.h"

using om::Log;
using om::LogLevel;
using om::Notify;
using om::NotifyListener;

namespace {

// Long enough that only a broken bus or a lost notification reaches it.
constexpr auto kGenerous = std::chrono::seconds(60);

// What the handlers of a test received, in order.
class Received {
public:
    NotifyListener::Handler handler()
    {
        return [this](const std::string& name) {
            std::lock_guard lock(m_mutex);
            m_names.push_back(name);
            m_changed.notify_all();
        };
    }
    bool waitForCount(size_t count)
    {
        std::unique_lock lock(m_mutex);
        return m_changed.wait_for(lock, kGenerous, [&] { return m_names.size() >= count; });
    }
    std::vector<std::string> names() const
    {
        std::lock_guard lock(m_mutex);
        return m_names;
    }

private:
    mutable std::mutex m_mutex;
    std::condition_variable m_changed;
    std::vector<std::string> m_names;
};

// Records of the notify category at level, or (level none) saying that name was not posted.
size_t lines(const Log::Capture& capture, std::optional<LogLevel> level, const std::string& name = {})
{
    const std::string phrase = "notification " + name + " not posted";
    size_t count = 0;
    for (const auto& record : capture.records()) {
        count += record.category == "notify"
            && (level ? record.level == *level : record.message.find(phrase) != std::string::npos);
    }
    return count;
}

// Each test has a message bus of its own: dbus-daemon with the session configuration on a socket in
// the test's directory, so that a test run by hand needs no session bus and a run under
// dbus-run-session shares none. The poster reads the bus address only while it connects, so the
// environment changes only once the poster is idle (flush()).
class NotifyTest : public ::testing::Test {
protected:
    void SetUp() override
    {
        m_address = startBus(m_bus, "bus");
        ASSERT_FALSE(m_address.empty()) << "dbus-daemon did not start";
        m_savedAddress = om::Storage::environment("DBUS_SESSION_BUS_ADDRESS");
        moveBusTo(m_address);
    }
    void TearDown() override
    {
        Notify::flush();
        if (m_savedAddress)
            ::setenv("DBUS_SESSION_BUS_ADDRESS", m_savedAddress->c_str(), 1);
        else
            ::unsetenv("DBUS_SESSION_BUS_ADDRESS");
    }

    // The address the bus prints on standard error once it listens; empty when it did not start.
    std::string startBus(std::unique_ptr<om::test::DaemonProcess>& bus, const std::string& socketName)
    {
        bus = std::make_unique<om::test::DaemonProcess>(om::test::DaemonProcess::Options {
            .executable = "/usr/bin/dbus-daemon",
            .arguments = { "--session", "--nofork", "--address=unix:path=" + m_fixture.root() + "/" + socketName,
                "--print-address=2" },
            .logLevel = "",
            .privateDatabase = false,
        });
        std::string address;
        bus->waitForLines([&](const auto& lines) {
            for (const auto& line : lines) {
                if (line.raw.starts_with("unix:"))
                    address = line.raw;
            }
            return !address.empty();
        });
        return address;
    }

    void moveBusTo(const std::string& address)
    {
        Notify::flush();
        ::setenv("DBUS_SESSION_BUS_ADDRESS", address.c_str(), 1);
    }

    std::unique_ptr<NotifyListener> listen(std::vector<std::string> names, Received& received)
    {
        auto listener = NotifyListener::create(std::move(names), m_queue, received.handler());
        EXPECT_TRUE(listener.ok()) << listener.error().localizedDescription();
        return listener.ok() ? std::move(listener).releaseValue() : nullptr;
    }

    om::test::BundleFixture m_fixture;
    std::unique_ptr<om::test::DaemonProcess> m_bus;
    std::string m_address;
    std::optional<std::string> m_savedAddress;
    const std::shared_ptr<om::WorkQueue> m_queue = om::WorkQueue::create("com.orvex.test.notify");
};

} // namespace

// The poster sends in order and the bus delivers in order, so by the time the wanted name has
// arrived, the ones posted before it would have too.
TEST_F(NotifyTest, NamesNotSubscribedAreNotDelivered)
{
    Received wanted;
    Received others;
    auto wantedListener = listen({ "com.orvex.test.wanted" }, wanted);
    auto otherListener = listen({ "com.orvex.test.other", "com.orvex.test.wanted.longer" }, others);
    ASSERT_TRUE(wantedListener && otherListener);

    Notify::post("com.orvex.test.other");
    Notify::post("com.orvex.test.wanted.longer");
    Notify::post("com.orvex.test.Wanted");
    Notify::post("com.orvex.test.wanted");

    ASSERT_TRUE(wanted.waitForCount(1));
    ASSERT_TRUE(others.waitForCount(2)); // they were posted, to someone else
    EXPECT_EQ(wanted.names(), std::vector<std::string> { "com.orvex.test.wanted" });
    EXPECT_EQ(others.names(), (std::vector<std::string> { "com.orvex.test.other", "com.orvex.test.wanted.longer" }));
}

TEST_F(NotifyTest, ManyPostsArriveInTheOrderPosted)
{
    const std::vector<std::string> names { "com.orvex.test.a", "com.orvex.test.b", "com.orvex.test.c" };
    std::vector<std::string> posted;
    for (size_t i = 0; i < 300; ++i)
        posted.push_back(names[(i * i + i / 7) % names.size()]);
    Received received;
    auto listener = listen(names, received);
    ASSERT_TRUE(listener);

    for (const auto& name : posted)
        Notify::post(name);

    ASSERT_TRUE(received.waitForCount(posted.size()));
    EXPECT_EQ(received.names(), posted);
}

TEST_F(NotifyTest, PostsFromManyThreadsAllArrive)
{
    constexpr size_t kThreads = 8;
    constexpr size_t kPostsEach = 50;
    std::vector<std::string> names;
    for (size_t i = 0; i < kThreads; ++i)
        names.push_back("com.orvex.test.thread" + std::to_string(i));
    Received received;
    auto listener = listen(names, received);
    ASSERT_TRUE(listener);

    std::vector<std::thread> posters;
    for (const auto& name : names) {
        posters.emplace_back([&name] {
            for (size_t i = 0; i < kPostsEach; ++i)
                Notify::post(name);
        });
    }
    for (auto& poster : posters)
        poster.join();

    ASSERT_TRUE(received.waitForCount(kThreads * kPostsEach));
    std::map<std::string, size_t> counts;
    for (const auto& name : received.names())
        ++counts[name];
    for (const auto& name : names)
        EXPECT_EQ(counts[name], kPostsEach) << name;
}

TEST_F(NotifyTest, WithoutABusEachPostIsLoggedOnceAtDebugLevel)
{
    moveBusTo("unix:path=" + m_fixture.root() + "/no-such-socket");
    Log::Capture capture;

    for (const char* name : { "com.orvex.test.one", "com.orvex.test.two", "com.orvex.test.three" })
        Notify::post(name);
    Notify::flush();

    for (const char* name : { "com.orvex.test.one", "com.orvex.test.two", "com.orvex.test.three" })
        EXPECT_EQ(lines(capture, std::nullopt, name), 1u) << name;
    EXPECT_EQ(lines(capture, LogLevel::Debug), 3u);
    EXPECT_EQ(lines(capture, LogLevel::Error), 0u);

    Received received; // the same poster reaches a bus again once there is one
    moveBusTo(m_address);
    auto listener = listen({ "com.orvex.test.back" }, received);
    Notify::post("com.orvex.test.back");
    EXPECT_TRUE(received.waitForCount(1));
}

// A bus that accepts the connection and never answers holds the poster, never the caller. What
// waits meanwhile is bounded: a name already waiting is not queued twice, and past the bound the
// rest is dropped with one error line.
TEST_F(NotifyTest, AStalledBusHoldsOnlyThePosterAndABoundedQueue)
{
    const std::string socketPath = m_fixture.root() + "/stalled";
    om::UniqueFd server(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
    sockaddr_un address {};
    address.sun_family = AF_UNIX;
    std::strncpy(address.sun_path, socketPath.c_str(), sizeof address.sun_path - 1);
    ASSERT_EQ(::bind(server.get(), reinterpret_cast<sockaddr*>(&address), sizeof address), 0);
    ASSERT_EQ(::listen(server.get(), 4), 0);
    moveBusTo("unix:path=" + socketPath);
    Log::Capture capture;

    Notify::post("com.orvex.test.first");
    // Once the poster has connected, "first" has left the queue and the poster waits on us.
    pollfd connecting { server.get(), POLLIN, 0 };
    ASSERT_EQ(::poll(&connecting, 1, int(std::chrono::milliseconds(kGenerous).count())), 1);
    om::UniqueFd connection(::accept4(server.get(), nullptr, nullptr, SOCK_CLOEXEC));
    ASSERT_TRUE(connection.valid());

    for (size_t i = 0; i < Notify::kMaxPending; ++i)
        Notify::post("com.orvex.test.n" + std::to_string(i));
    Notify::post("com.orvex.test.n7");
    Notify::post("com.orvex.test.dropped1");
    Notify::post("com.orvex.test.dropped2");
    EXPECT_EQ(lines(capture, LogLevel::Error), 1u);

    connection.reset(); // the poster sees the hang-up; everything after finds no bus
    server.reset();
    ASSERT_EQ(::unlink(socketPath.c_str()), 0);
    Notify::flush();

    EXPECT_EQ(lines(capture, std::nullopt, "com.orvex.test.first"), 1u);
    EXPECT_EQ(lines(capture, std::nullopt, "com.orvex.test.n0"), 1u);
    EXPECT_EQ(lines(capture, std::nullopt, "com.orvex.test.n7"), 1u);
    EXPECT_EQ(lines(capture, std::nullopt, "com.orvex.test.n" + std::to_string(Notify::kMaxPending - 1)), 1u);
    EXPECT_EQ(lines(capture, std::nullopt, "com.orvex.test.dropped1"), 0u);
    EXPECT_EQ(lines(capture, std::nullopt, "com.orvex.test.dropped2"), 0u);
    EXPECT_EQ(lines(capture, LogLevel::Debug), 1 + Notify::kMaxPending);
    EXPECT_EQ(lines(capture, LogLevel::Error), 1u);
}

// The poster keeps its connection between posts; when the bus behind it went away, the next post
// goes out on a new connection instead of being lost. A listener on the old bus says once that it
// lost it and stops.
TEST_F(NotifyTest, ThePosterReconnectsAfterTheBusRestarts)
{
    Received before;
    auto oldListener = listen({ "com.orvex.test.restart" }, before);
    Notify::post("com.orvex.test.restart");
    ASSERT_TRUE(before.waitForCount(1));
    Log::Capture capture;

    ASSERT_TRUE(m_bus->stop().has_value());
    ASSERT_TRUE(capture.waitUntil([](const auto& records) {
        return std::any_of(records.begin(), records.end(), [](const auto& record) {
            return record.message.starts_with("notification listener lost the message bus");
        });
    }));
    std::unique_ptr<om::test::DaemonProcess> restarted;
    const std::string address = startBus(restarted, "restarted");
    ASSERT_FALSE(address.empty());
    moveBusTo(address);
    Received after;
    auto listener = listen({ "com.orvex.test.restart" }, after);
    Notify::post("com.orvex.test.restart");

    ASSERT_TRUE(after.waitForCount(1));
    EXPECT_EQ(lines(capture, std::nullopt, "com.orvex.test.restart"), 0u);
    EXPECT_EQ(lines(capture, LogLevel::Error), 1u);
    EXPECT_EQ(before.names().size(), 1u);
}

TEST_F(NotifyTest, AListenerMayEndItselfFromItsHandler)
{
    std::mutex mutex; // the handler runs on the queue's thread
    std::unique_ptr<NotifyListener> listener;
    std::promise<void> ended;
    auto created = NotifyListener::create("com.orvex.test.once", m_queue, [&](const std::string&) {
        std::lock_guard lock(mutex);
        listener.reset();
        ended.set_value();
    });
    ASSERT_TRUE(created.ok());
    {
        std::lock_guard lock(mutex);
        listener = std::move(created).releaseValue();
    }

    Notify::post("com.orvex.test.once");

    auto done = ended.get_future();
    ASSERT_EQ(done.wait_for(kGenerous), std::future_status::ready);
    std::lock_guard lock(mutex);
    EXPECT_FALSE(listener);
}

TEST_F(NotifyTest, ListenersRefuseWhatCannotBeSubscribed)
{
    Received received;
    std::vector<std::string> names;
    while (names.size() < NotifyListener::kMaxNames)
        names.push_back("com.orvex.test.n" + std::to_string(names.size()));
    EXPECT_TRUE(NotifyListener::create(names, m_queue, received.handler()).ok());
    names.push_back("com.orvex.test.one-too-many");
    EXPECT_FALSE(NotifyListener::create(names, m_queue, received.handler()).ok());
    EXPECT_FALSE(NotifyListener::create(std::vector<std::string> {}, m_queue, received.handler()).ok());
    EXPECT_FALSE(NotifyListener::create("has space", m_queue, received.handler()).ok());

    moveBusTo("unix:path=" + m_fixture.root() + "/no-such-socket");
    auto unreachable = NotifyListener::create("com.orvex.test.ok", m_queue, received.handler());
    ASSERT_FALSE(unreachable.ok());
    EXPECT_NE(unreachable.error().localizedDescription().find("sd_bus_open"), std::string::npos);
}

TEST(NotifyNames, AreMatchRuleValuesAsTheyStand)
{
    const std::string longest(Notify::kMaxNameLength, 'n');
    const struct {
        std::string name;
        bool valid;
    } cases[] = {
        { "com.orvex.ombrel.annotation-change", true },
        { longest, true },
        { longest + "n", false },
        { "", false },
        { "with space", false },
        { "quote'd", false },
        { "back\\slash", false },
        { "caf\xc3\xa9", false },
        { "~!#$%&()*+,-./:;<=>?@[]^_`{|}", true },
    };
    for (const auto& test : cases)
        EXPECT_EQ(Notify::isValidName(test.name), test.valid) << test.name;

    Log::Capture capture;
    Notify::post("not valid");
    Notify::flush();
    EXPECT_EQ(lines(capture, LogLevel::Error), 1u);
    EXPECT_EQ(lines(capture, std::nullopt, "not valid"), 0u);
}
