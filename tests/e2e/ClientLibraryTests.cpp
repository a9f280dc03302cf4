// The client library against the real daemon: what a host program sees through OMDaemonClient.
#include <gtest/gtest.h>
#include <stdlib.h>

#include <future>
#include <memory>
#include <thread>

#include "Ombrel/OMDaemonClient.h"
#include "Ombrel/OMMakeError.h"
#include "platform/Log.h"
#include "tests/support/DaemonProcess.h"
#include "tests/support/RawConduitPeer.h"

using namespace om;
using om::test::DaemonProcess;

namespace {

constexpr auto kGenerous = std::chrono::seconds(30);

Result<Value> await(const std::function<void(OMDaemonClient::ReplyBlock)>& start)
{
    auto promise = std::make_shared<std::promise<Result<Value>>>();
    auto future = promise->get_future();
    start([promise](const Result<Value>& reply) { promise->set_value(reply); });
    if (future.wait_for(kGenerous) != std::future_status::ready)
        return OMError("test", -1, "no reply within the timeout");
    return future.get();
}

class ClientLibraryTest : public ::testing::Test {
protected:
    void SetUp() override
    {
        DaemonProcess::Options options;
        options.executable = om::test::builtDaemonPath();
        options.arguments = { "-S", "com.orvex.test.client-library" };
        m_daemon = std::make_unique<DaemonProcess>(options);
        ASSERT_TRUE(m_daemon->waitForSocket()) << m_daemon->stderrText();
        ::setenv("CONDUIT_DIR", m_daemon->conduitDirectory().c_str(), 1);
        m_client = OMDaemonClient::initWithServiceName(m_daemon->serviceName().c_str());
    }

    void TearDown() override
    {
        m_client.reset();
        m_daemon.reset();
    }

    std::optional<OMError> errorOf(const Value& request)
    {
        Result<Value> reply = await([&](auto block) { m_client->send(request, block); });
        EXPECT_TRUE(reply.ok()) << reply.error().localizedDescription();
        return OMDaemonClient::errorInReply(reply);
    }

    std::unique_ptr<DaemonProcess> m_daemon;
    std::shared_ptr<OMDaemonClient> m_client;
};

} // namespace

TEST_F(ClientLibraryTest, UnknownRequestIsAnsweredWithCodeFour)
{
    auto error = errorOf(m_client->request("ping").build());

    ASSERT_TRUE(error.has_value());
    EXPECT_EQ(*error, OMError(kOMErrorDomain, 4, "unrecognized request"));
}

TEST_F(ClientLibraryTest, NameDifferingOnlyInCaseIsUnknown)
{
    auto error = errorOf(m_client->request("MATCH").build());

    ASSERT_TRUE(error.has_value());
    EXPECT_EQ(error->code(), 4);
    EXPECT_EQ(error->description(), "unrecognized request");
}

TEST_F(ClientLibraryTest, RequestWithoutANameIsMalformed)
{
    auto error = errorOf(Value::dictionary({ { "version", 3u } }));

    ASSERT_TRUE(error.has_value());
    EXPECT_EQ(*error, OMError(kOMErrorDomain, 4, "invalid request format (missing type)"));
}

TEST_F(ClientLibraryTest, VersionsOutsideTwoAndThreeAreRefused)
{
    m_client->setProtocolVersion(4);
    auto four = errorOf(m_client->request("ping").build());
    m_client->setProtocolVersion(1);
    auto one = errorOf(m_client->request("ping").build());
    m_client->setProtocolVersion(2);
    auto two = errorOf(m_client->request("ping").build());

    ASSERT_TRUE(four && one && two);
    EXPECT_EQ(*four, OMError(kOMErrorDomain, 7, "unsupported protocol version 4 (current 3)"));
    EXPECT_EQ(*one, OMError(kOMErrorDomain, 7, "unsupported protocol version 1 (current 3)"));
    // Version 2 passes the check and reaches dispatch.
    EXPECT_EQ(*two, OMError(kOMErrorDomain, 4, "unrecognized request"));
}

TEST_F(ClientLibraryTest, PipelinedRequestsAreAnsweredInOrder)
{
    constexpr int kRequests = 64;
    struct Seen {
        std::mutex mutex;
        std::vector<int64_t> codes;
        std::promise<void> done;
    };
    auto seen = std::make_shared<Seen>();
    for (int i = 0; i < kRequests; ++i) {
        // Alternate two requests whose answers differ, so that a reordering shows.
        m_client->setProtocolVersion(i % 2 ? 4 : 3);
        m_client->send(m_client->request("ping").build(), [seen](const Result<Value>& reply) {
            auto error = OMDaemonClient::errorInReply(reply);
            std::lock_guard lock(seen->mutex);
            seen->codes.push_back(error ? error->code() : 0);
            if (seen->codes.size() == kRequests)
                seen->done.set_value();
        });
    }

    ASSERT_EQ(seen->done.get_future().wait_for(kGenerous), std::future_status::ready);
    std::lock_guard lock(seen->mutex);
    for (int i = 0; i < kRequests; ++i)
        EXPECT_EQ(seen->codes[static_cast<size_t>(i)], i % 2 ? 7 : 4) << "reply " << i;
}

TEST_F(ClientLibraryTest, AfterTheDaemonExitsRequestsGetTransportErrorCodeFour)
{
    ASSERT_TRUE(errorOf(m_client->request("ping").build()).has_value());
    Log::Capture capture;
    ASSERT_TRUE(m_daemon->stop().has_value());

    Result<Value> reply = await([&](auto block) { m_client->send(m_client->request("ping").build(), block); });
    ASSERT_FALSE(reply.ok());
    auto error = OMDaemonClient::errorInReply(reply);
    ASSERT_TRUE(error.has_value());
    EXPECT_EQ(error->domain(), kOMErrorDomain);
    EXPECT_EQ(error->code(), 4);
    EXPECT_EQ(error->description(), reply.error().localizedDescription());
    // The daemon said goodbye before leaving; the library only logs it.
    EXPECT_TRUE(capture.waitFor("Communications error: Termination imminent"));
}
