// A daemon server running inside the test process, on a private CONDUIT_DIR, with clients that
// talk to it through the real transport. Each test gets its own service name and log capture.
#pragma once

#include <gtest/gtest.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <chrono>
#include <cstdlib>
#include <filesystem>
#include <future>
#include <memory>
#include <optional>
#include <string>
#include <vector>

#include "omd/OMDConduitClient.h"
#include "omd/OMDServer.h"
#include "omd/Transaction.h"
#include "platform/Conduit.h"
#include "platform/Format.h"
#include "platform/Log.h"
#include "platform/Registrar.h"
#include "platform/Value.h"

namespace om::test {

inline constexpr auto kReplyTimeout = std::chrono::seconds(60);

// A peer of the server, made with the platform's own client connection.
class InProcessClient {
public:
    explicit InProcessClient(const std::string& serviceName)
        : m_connection(ConduitConnection::connectToService(serviceName, nullptr))
    {
        m_connection->setEventHandler([](const ConduitEvent&) {});
        m_connection->resume();
    }
    ~InProcessClient() { m_connection->cancel(); }

    // Sends request and blocks for its reply; none when none came (or the connection failed).
    std::optional<Value> call(const Value& request)
    {
        auto reply = std::make_shared<std::promise<Result<Value>>>();
        auto arrived = reply->get_future();
        m_connection->sendWithReply(
            request, nullptr, [reply](Result<Value> result) { reply->set_value(std::move(result)); });
        if (arrived.wait_for(kReplyTimeout) != std::future_status::ready)
            return std::nullopt;
        auto result = arrived.get();
        if (!result.ok())
            return std::nullopt;
        return result.value();
    }
    // Sends request without awaiting anything.
    void sendWithoutWaiting(const Value& request)
    {
        m_connection->sendWithReply(request, nullptr, [](Result<Value>) {});
    }
    void send(const Value& message) { m_connection->send(message); }
    void close() { m_connection->cancel(); }
    ConduitConnection& connection() { return *m_connection; }

private:
    std::shared_ptr<ConduitConnection> m_connection;
};

// Makes a Registrar of its own under root the process's workspace, so that whatever a server of
// the test registers stays in the test's directory and no earlier test's registrations show.
inline std::shared_ptr<RegistrarWorkspace> useFreshRegistrar(const std::string& root)
{
    RegistrarWorkspace::Configuration configuration { root + "/registrar.db", root + "/sdk", root + "/containers" };
    auto workspace = RegistrarWorkspace::open(configuration, RegistrarWorkspace::Access::ReadWrite);
    EXPECT_TRUE(workspace.ok()) << workspace.error().localizedDescription();
    auto opened = workspace.ok() ? workspace.value() : nullptr;
    RegistrarWorkspace::setDefaultWorkspace(opened);
    return opened;
}

class InProcessServer : public ::testing::Test {
protected:
    void SetUp() override
    {
        m_root = std::filesystem::temp_directory_path() / ("omd-unit-" + std::to_string(::getpid()));
        std::filesystem::create_directories(m_root);
        ::setenv("CONDUIT_DIR", m_root.c_str(), 1);
        static std::atomic<int> serial { 0 };
        m_serviceName = "com.orvex.ombrel.omd.test" + std::to_string(++serial);
        for (const char* suffix : { "", "-wal", "-shm" })
            std::filesystem::remove(m_root + "/registrar.db" + suffix);
        m_registrar = useFreshRegistrar(m_root);
        m_server = OMDServer::initForService(m_serviceName, m_root + "/annotations.vlist");
        ASSERT_TRUE(m_server);
        m_server->startListening();
    }

    void TearDown() override
    {
        // Every peer of this test is closed by now; waiting for each record to see its end keeps
        // this test's events out of the next test's log, where the same pid would confuse them.
        EXPECT_TRUE(m_log.waitUntil([&](const std::vector<Log::Record>& records) {
            return countOf(records, format("new client %d ", ::getpid()), Match::Prefix)
                == countOf(records, format("client %d is dead", ::getpid()), Match::Whole);
        }));
        m_server.reset();
        std::error_code ignored;
        std::filesystem::remove_all(m_root, ignored);
    }

    std::unique_ptr<InProcessClient> connect() { return std::make_unique<InProcessClient>(m_serviceName); }

    enum class Match : uint8_t { Whole, Prefix };
    static size_t countOf(const std::vector<Log::Record>& records, const std::string& text, Match match)
    {
        size_t count = 0;
        for (const auto& record : records)
            count += match == Match::Whole ? record.message == text : record.message.starts_with(text);
        return count;
    }

    // Blocks until the server has made the record of the n-th client of this test.
    bool waitForClients(size_t count)
    {
        return m_log.waitUntil([&](const std::vector<Log::Record>& records) {
            return countOf(records, format("new client %d ", ::getpid()), Match::Prefix) >= count;
        });
    }

    static Value request(std::string_view name, uint64_t version = 3)
    {
        return Value::dictionary({ { "request", Value::string(std::string(name)) }, { "version", Value(version) } });
    }

    std::string requested(std::string_view name) const { return format("client %d requested %s", ::getpid(), name); }

    Log::Capture m_log;
    std::string m_root;
    std::string m_serviceName;
    std::shared_ptr<RegistrarWorkspace> m_registrar;
    std::shared_ptr<OMDServer> m_server;
};

// One peer connected to a listener of the test's own, whose record the test holds. The peer's
// requests are arrays, which the record leaves unanswered; the test makes the transaction for each
// one itself. (Request ids count up from 1 on a fresh connection.)
class InProcessRecord : public InProcessServer {
protected:
    void SetUp() override
    {
        InProcessServer::SetUp();
        auto listener = ConduitListener::create(m_serviceName + ".direct", m_server->conduitQueue());
        ASSERT_TRUE(listener.ok());
        m_listener = std::move(listener).releaseValue();
        auto made = std::make_shared<std::promise<std::shared_ptr<OMDConduitClient>>>();
        auto record = made->get_future();
        std::weak_ptr<OMDServer> server = m_server;
        m_listener->setConnectionHandler([made, server](std::shared_ptr<ConduitConnection> connection) {
            made->set_value(OMDConduitClient::initWithConnection(std::move(connection), server.lock()));
        });
        m_listener->resume();
        m_peer = std::make_unique<InProcessClient>(m_serviceName + ".direct");
        ASSERT_EQ(record.wait_for(kReplyTimeout), std::future_status::ready);
        m_record = record.get();
    }
    void TearDown() override
    {
        m_peer.reset();
        m_record.reset();
        if (m_listener)
            m_listener->cancel();
        InProcessServer::TearDown();
    }

    // A transaction for the peer's next request, which the peer sends now.
    std::shared_ptr<Transaction> nextTransaction(std::future<Result<Value>>& reply)
    {
        auto promise = std::make_shared<std::promise<Result<Value>>>();
        reply = promise->get_future();
        auto message = Value::array({ "anything" });
        m_peer->connection().sendWithReply(
            message, nullptr, [promise](Result<Value> result) { promise->set_value(std::move(result)); });
        return std::make_shared<Transaction>(
            ConduitEvent { ConduitEvent::Kind::Message, message, ++m_lastId }, m_record);
    }

    std::shared_ptr<ConduitListener> m_listener;
    std::shared_ptr<OMDConduitClient> m_record;
    std::unique_ptr<InProcessClient> m_peer;
    uint64_t m_lastId = 0;
};

} // namespace om::test
