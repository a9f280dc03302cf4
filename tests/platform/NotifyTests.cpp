#include <gtest/gtest.h>
#include <poll.h>
#include <sys/socket.h>
#include <sys/un.h>
#include <unistd.h>

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
#include "tests/platform/PrivateBus.h"

using om::Log;
using om::LogLevel;
using om::Notify;
using om::NotifyListener;

namespace {

// Long enough that only a broken bus or a lost notification reaches it.
constexpr auto kGenerous = std::chrono::seconds(60);

// Sets an environment variable for the life of the object, then puts back what was there. The
// poster reads the bus address only while it connects; callers make sure it is idle (flush()).
class ScopedEnvironment {
public:
    ScopedEnvironment(const char* name, const std::string& value)
        : m_name(name)
        , m_saved(om::Storage::environment(name))
    {
        set(value);
    }
    ~ScopedEnvironment()
    {
        if (m_saved)
            ::setenv(m_name, m_saved->c_str(), 1);
        else
            ::unsetenv(m_name);
    }
    ScopedEnvironment(const ScopedEnvironment&) = delete;
    ScopedEnvironment& operator=(const ScopedEnvironment&) = delete;

    void set(const std::string& value) { ::setenv(m_name, value.c_str(), 1); }

private:
    const char* m_name;
    std::optional<std::string> m_saved;
};

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

// Counts the records of the notify category that say name was not posted.
size_t notPostedLines(const Log::Capture& capture, const std::string& name)
{
    const std::string phrase = "notification " + name + " not posted";
    size_t count = 0;
    for (const auto& record : capture.records())
        count += record.category == "notify" && record.message.find(phrase) != std::string::npos;
    return count;
}

size_t linesAt(const Log::Capture& capture, LogLevel level)
{
    size_t count = 0;
    for (const auto& record : capture.records())
        count += record.category == "notify" && record.level == level;
    return count;
}

class NotifyTest : public ::testing::Test {
protected:
    void SetUp() override
    {
        ASSERT_FALSE(m_bus.address().empty()) << "dbus-daemon did not start";
        Notify::flush(); // the poster is idle before the environment changes
        m_environment.emplace("DBUS_SESSION_BUS_ADDRESS", m_bus.address());
    }
    void TearDown() override
    {
        Notify::flush();
        m_environment.reset();
    }

    std::unique_ptr<NotifyListener> listen(std::vector<std::string> names, Received& received)
    {
        auto listener = NotifyListener::create(std::move(names), m_queue, received.handler());
        EXPECT_TRUE(listener.ok()) << listener.error().localizedDescription();
        return listener.ok() ? std::move(listener).releaseValue() : nullptr;
    }

    // Points the poster at another address, once it has finished what it was doing.
    void moveBusTo(const std::string& address)
    {
        Notify::flush();
        m_environment->set(address);
    }

    om::test::PrivateBus m_bus;
    std::optional<ScopedEnvironment> m_environment;
    const std::shared_ptr<om::WorkQueue> m_queue = om::WorkQueue::create("com.orvex.test.notify");
};

} // namespace

TEST_F(NotifyTest, AListenerReceivesAPostedName)
{
    Received received;
    auto listener = listen({ "com.orvex.test.changed" }, received);
    ASSERT_TRUE(listener);

    Notify::post("com.orvex.test.changed");

    ASSERT_TRUE(received.waitForCount(1));
    EXPECT_EQ(received.names(), std::vector<std::string> { "com.orvex.test.changed" });
}

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
    moveBusTo("unix:path=" + m_bus.root() + "/no-such-socket");
    Log::Capture capture;

    for (const char* name : { "com.orvex.test.one", "com.orvex.test.two", "com.orvex.test.three" })
        Notify::post(name);
    Notify::flush();

    for (const char* name : { "com.orvex.test.one", "com.orvex.test.two", "com.orvex.test.three" })
        EXPECT_EQ(notPostedLines(capture, name), 1u) << name;
    EXPECT_EQ(linesAt(capture, LogLevel::Debug), 3u);
    EXPECT_EQ(linesAt(capture, LogLevel::Error), 0u);

    Received received; // the same poster reaches a bus again once there is one
    moveBusTo(m_bus.address());
    auto listener = listen({ "com.orvex.test.back" }, received);
    Notify::post("com.orvex.test.back");
    EXPECT_TRUE(received.waitForCount(1));
}

// A bus that accepts the connection and never answers holds the poster, never the caller. What
// waits meanwhile is bounded: a name already waiting is not queued twice, and past the bound the
// rest is dropped with one error line.
TEST_F(NotifyTest, AStalledBusHoldsOnlyThePosterAndABoundedQueue)
{
    const std::string socketPath = m_bus.root() + "/stalled";
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
    EXPECT_EQ(linesAt(capture, LogLevel::Error), 1u);

    connection.reset(); // the poster sees the hang-up; everything after finds no bus
    server.reset();
    ASSERT_EQ(::unlink(socketPath.c_str()), 0);
    Notify::flush();

    EXPECT_EQ(notPostedLines(capture, "com.orvex.test.first"), 1u);
    EXPECT_EQ(notPostedLines(capture, "com.orvex.test.n0"), 1u);
    EXPECT_EQ(notPostedLines(capture, "com.orvex.test.n7"), 1u);
    EXPECT_EQ(notPostedLines(capture, "com.orvex.test.n" + std::to_string(Notify::kMaxPending - 1)), 1u);
    EXPECT_EQ(notPostedLines(capture, "com.orvex.test.dropped1"), 0u);
    EXPECT_EQ(notPostedLines(capture, "com.orvex.test.dropped2"), 0u);
    EXPECT_EQ(linesAt(capture, LogLevel::Debug), 1 + Notify::kMaxPending);
    EXPECT_EQ(linesAt(capture, LogLevel::Error), 1u);
}

// The poster keeps its connection between posts; when the bus behind it went away, the next post
// goes out on a new connection instead of being lost.
TEST_F(NotifyTest, ThePosterReconnectsAfterTheBusRestarts)
{
    Received before;
    {
        auto listener = listen({ "com.orvex.test.restart" }, before);
        Notify::post("com.orvex.test.restart");
        ASSERT_TRUE(before.waitForCount(1));
    }
    Notify::flush();
    m_bus.stop();
    om::test::PrivateBus restarted;
    ASSERT_FALSE(restarted.address().empty());
    moveBusTo(restarted.address());
    Log::Capture capture;

    Received after;
    auto listener = NotifyListener::create("com.orvex.test.restart", m_queue, after.handler());
    ASSERT_TRUE(listener.ok());
    Notify::post("com.orvex.test.restart");

    ASSERT_TRUE(after.waitForCount(1));
    EXPECT_EQ(notPostedLines(capture, "com.orvex.test.restart"), 0u);
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
    std::vector<std::string> tooMany;
    for (size_t i = 0; i <= NotifyListener::kMaxNames; ++i)
        tooMany.push_back("com.orvex.test.n" + std::to_string(i));
    const std::vector<std::string> justEnough(tooMany.begin(), tooMany.end() - 1);

    EXPECT_TRUE(NotifyListener::create(justEnough, m_queue, received.handler()).ok());
    EXPECT_FALSE(NotifyListener::create(tooMany, m_queue, received.handler()).ok());
    EXPECT_FALSE(NotifyListener::create(std::vector<std::string> {}, m_queue, received.handler()).ok());
    EXPECT_FALSE(NotifyListener::create("has space", m_queue, received.handler()).ok());
    EXPECT_FALSE(NotifyListener::create("com.orvex.test.ok", nullptr, received.handler()).ok());
    EXPECT_FALSE(NotifyListener::create("com.orvex.test.ok", m_queue, nullptr).ok());

    moveBusTo("unix:path=" + m_bus.root() + "/no-such-socket");
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
        { "x", true },
        { "with space", false },
        { "quote'd", false },
        { "back\\slash", false },
        { "tab\there", false },
        { "caf\xc3\xa9", false },
        { std::string("nul\0", 4), false },
        { "~!#$%&()*+,-./:;<=>?@[]^_`{|}", true },
    };
    for (const auto& test : cases)
        EXPECT_EQ(Notify::isValidName(test.name), test.valid) << test.name;
}

TEST(NotifyNames, AnInvalidNameIsLoggedAndNotPosted)
{
    Log::Capture capture;
    Notify::post("not valid");
    Notify::flush();
    EXPECT_EQ(linesAt(capture, LogLevel::Error), 1u);
    EXPECT_EQ(notPostedLines(capture, "not valid"), 0u);
}
