// Shared pieces of the transport tests: a private CONDUIT_DIR per test, a blocking mailbox for
// events, and an echo service that answers every request with {"echo": request}.
#pragma once

#include <gtest/gtest.h>
#include <stdlib.h>

#include <chrono>
#include <condition_variable>
#include <deque>
#include <filesystem>
#include <functional>
#include <memory>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

#include "platform/Conduit.h"
#include "platform/WorkQueue.h"

namespace om::test {

inline constexpr std::chrono::seconds kConduitTimeout { 30 };

// A queue that tests block on: pop() waits for the next item, bounded by a timeout that only a
// failing test reaches.
template <typename T> class Mailbox {
public:
    void push(T item)
    {
        std::lock_guard lock(m_mutex);
        m_items.push_back(std::move(item));
        m_changed.notify_all();
    }
    std::optional<T> pop(std::chrono::milliseconds timeout = kConduitTimeout)
    {
        std::unique_lock lock(m_mutex);
        if (!m_changed.wait_for(lock, timeout, [this] { return !m_items.empty(); }))
            return std::nullopt;
        T item = std::move(m_items.front());
        m_items.pop_front();
        return item;
    }
    size_t size() const
    {
        std::lock_guard lock(m_mutex);
        return m_items.size();
    }

private:
    mutable std::mutex m_mutex;
    std::condition_variable m_changed;
    std::deque<T> m_items;
};

// Each test gets its own CONDUIT_DIR, removed afterwards.
class ConduitDirectoryTest : public ::testing::Test {
protected:
    void SetUp() override
    {
        char pattern[] = "/tmp/conduit-test-XXXXXX";
        ASSERT_NE(::mkdtemp(pattern), nullptr);
        m_directory = pattern;
        ::setenv("CONDUIT_DIR", m_directory.c_str(), 1);
    }
    void TearDown() override
    {
        std::error_code ignored;
        std::filesystem::remove_all(m_directory, ignored);
    }
    const std::string& directory() const { return m_directory; }

private:
    std::string m_directory;
};

// A service for the tests: accepts every connection, records every event of every peer, and
// answers requests with {"echo": request} unless onRequest says otherwise. Destroying it cancels
// the listener and every connection it accepted.
class EchoService {
public:
    struct Received {
        std::shared_ptr<ConduitConnection> connection;
        ConduitEvent event;
    };
    using RequestHandler = std::function<void(const std::shared_ptr<ConduitConnection>&, const ConduitEvent&)>;

    // peerQueue null: the peers' events arrive on the I/O thread.
    explicit EchoService(
        std::string name, std::shared_ptr<WorkQueue> peerQueue = nullptr, RequestHandler onRequest = nullptr)
        : m_name(std::move(name))
        , m_shared(std::make_shared<Shared>())
    {
        m_shared->peerQueue = std::move(peerQueue);
        m_shared->onRequest = std::move(onRequest);
    }
    ~EchoService()
    {
        if (m_listener)
            m_listener->cancel();
        std::lock_guard lock(m_shared->mutex);
        for (const auto& weak : m_shared->connections) {
            if (auto connection = weak.lock())
                connection->cancel();
        }
    }

    ::testing::AssertionResult start()
    {
        auto created = ConduitListener::create(m_name, m_listenerQueue);
        if (!created.ok())
            return ::testing::AssertionFailure() << created.error().localizedDescription();
        m_listener = created.value();
        m_listener->setConnectionHandler([shared = m_shared](std::shared_ptr<ConduitConnection> connection) {
            {
                std::lock_guard lock(shared->mutex);
                shared->connections.push_back(connection);
            }
            shared->accepted.push(connection);
            std::weak_ptr<ConduitConnection> weak = connection;
            connection->setTargetQueue(shared->peerQueue);
            connection->setEventHandler([shared, weak](const ConduitEvent& event) {
                auto strong = weak.lock();
                if (event.kind == ConduitEvent::Kind::Message && event.expectsReply()) {
                    if (shared->onRequest)
                        shared->onRequest(strong, event);
                    else
                        strong->sendReply(event.requestId, Value::dictionary({ { "echo", event.message } }));
                }
                shared->events.push({ strong, event });
            });
            connection->resume();
        });
        m_listener->resume();
        return ::testing::AssertionSuccess();
    }

    const std::string& name() const { return m_name; }
    ConduitListener& listener() { return *m_listener; }
    Mailbox<std::shared_ptr<ConduitConnection>>& accepted() { return m_shared->accepted; }
    Mailbox<Received>& events() { return m_shared->events; }

private:
    // Shared with the handlers, which may outlive this object by the last event.
    struct Shared {
        std::shared_ptr<WorkQueue> peerQueue;
        RequestHandler onRequest;
        Mailbox<std::shared_ptr<ConduitConnection>> accepted;
        Mailbox<Received> events;
        std::mutex mutex;
        std::vector<std::weak_ptr<ConduitConnection>> connections;
    };

    std::string m_name;
    std::shared_ptr<Shared> m_shared;
    std::shared_ptr<WorkQueue> m_listenerQueue = WorkQueue::create("test.listener");
    std::shared_ptr<ConduitListener> m_listener;
};

// A client connection with its events in a mailbox.
struct TestClient {
    std::shared_ptr<ConduitConnection> connection;
    std::shared_ptr<Mailbox<ConduitEvent>> events = std::make_shared<Mailbox<ConduitEvent>>();

    explicit TestClient(const std::string& service, std::shared_ptr<WorkQueue> queue = nullptr)
        : connection(ConduitConnection::connectToService(service, std::move(queue)))
    {
        connection->setEventHandler([events = events](const ConduitEvent& event) { events->push(event); });
        connection->resume();
    }
    ~TestClient() { connection->cancel(); }
    TestClient(const TestClient&) = delete;
    TestClient& operator=(const TestClient&) = delete;

    // Sends request and blocks for its outcome.
    Result<Value> call(const Value& request)
    {
        Mailbox<Result<Value>> outcome;
        connection->sendWithReply(
            request, nullptr, [&outcome](Result<Value> result) { outcome.push(std::move(result)); });
        auto result = outcome.pop();
        if (!result)
            return OMError("Test", 0, "no reply within the timeout");
        return std::move(*result);
    }
};

} // namespace om::test
