// Descriptors on Conduit: what a well-behaved pair passes, and what a hostile peer cannot make
// the receiver keep. Leaks are checked on a pipe: once every copy of its write end is closed, its
// read end sees the end of the stream, and no descriptor of this process names it.
#include <fcntl.h>
#include <poll.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstring>
#include <filesystem>

#include "platform/Conduit.h"
#include "tests/platform/ConduitTestSupport.h"
#include "tests/support/RawConduitPeer.h"

namespace om::test {
namespace {

struct Pipe {
    UniqueFd read;
    UniqueFd write;
    static Pipe make()
    {
        int fds[2];
        EXPECT_EQ(::pipe2(fds, O_CLOEXEC), 0);
        return Pipe { UniqueFd(fds[0]), UniqueFd(fds[1]) };
    }
};

// Descriptors of this process that name the same file as fd.
size_t openCopies(int fd)
{
    struct stat wanted { };
    if (::fstat(fd, &wanted) < 0)
        return 0;
    size_t count = 0;
    for (const auto& entry : std::filesystem::directory_iterator("/proc/self/fd")) {
        struct stat info { };
        if (::stat(entry.path().c_str(), &info) == 0 && info.st_dev == wanted.st_dev && info.st_ino == wanted.st_ino)
            ++count;
    }
    return count;
}

// True once no write end of the pipe is open anywhere (its read end reports the end of stream).
bool writersGone(const UniqueFd& readEnd)
{
    pollfd entry { readEnd.get(), POLLIN, 0 };
    if (::poll(&entry, 1, int(std::chrono::milliseconds(kConduitTimeout).count())) <= 0)
        return false;
    char byte;
    return ::read(readEnd.get(), &byte, 1) == 0;
}

// Sends bytes with descriptors attached to their first byte.
bool sendWithRights(int socket, const std::vector<uint8_t>& bytes, const std::vector<int>& fds)
{
    std::vector<char> control(CMSG_SPACE(sizeof(int) * fds.size()));
    iovec vector { const_cast<uint8_t*>(bytes.data()), bytes.size() };
    msghdr message {};
    message.msg_iov = &vector;
    message.msg_iovlen = 1;
    message.msg_control = control.data();
    message.msg_controllen = control.size();
    cmsghdr* header = CMSG_FIRSTHDR(&message);
    header->cmsg_level = SOL_SOCKET;
    header->cmsg_type = SCM_RIGHTS;
    header->cmsg_len = CMSG_LEN(sizeof(int) * fds.size());
    std::memcpy(CMSG_DATA(header), fds.data(), sizeof(int) * fds.size());
    return ::sendmsg(socket, &message, MSG_NOSIGNAL) == ssize_t(bytes.size());
}

// A frame whose kind byte declares `declared` descriptors.
std::vector<uint8_t> frameDeclaring(uint8_t kind, uint64_t id, unsigned declared)
{
    auto bytes = RawConduitPeer::frame(kind, id, std::vector<uint8_t> { 0xa0 });
    bytes[4] = uint8_t(kind | declared << 4);
    return bytes;
}

class ConduitDescriptorPassing : public ConduitDirectoryTest { };

TEST_F(ConduitDescriptorPassing, RequestAndReplyCarryDescriptorsBothWays)
{
    auto replyPipe = Pipe::make();
    auto sharedReplyEnd = std::make_shared<UniqueFd>(std::move(replyPipe.write));
    EchoService service("descriptors", nullptr, [sharedReplyEnd](const auto& connection, const ConduitEvent& event) {
        Value body = Value::dictionary({ { "received", int64_t(event.descriptors ? event.descriptors->size() : 0) } });
        ConduitDescriptors back;
        back.push_back(std::move(*sharedReplyEnd));
        connection->sendReply(event.requestId, body, std::move(back));
    });
    ASSERT_TRUE(service.start());
    TestClient client("descriptors");

    std::vector<Pipe> sent;
    ConduitDescriptors outgoing;
    for (size_t i = 0; i < Conduit::kMaxDescriptors; ++i) {
        sent.push_back(Pipe::make());
        outgoing.push_back(std::move(sent.back().write));
    }
    Mailbox<std::pair<Result<Value>, ConduitDescriptors>> outcome;
    client.connection->sendWithReplyDescriptors(Value::dictionary({ { "hello", 1 } }), std::move(outgoing), nullptr,
        [&](Result<Value> reply, ConduitDescriptors fds) {
            outcome.push({ std::move(reply), std::move(fds) });
        });
    auto answer = outcome.pop();
    ASSERT_TRUE(answer);
    ASSERT_TRUE(answer->first.ok());
    EXPECT_EQ(answer->first.value()["received"], Value(int64_t(Conduit::kMaxDescriptors)));
    ASSERT_EQ(answer->second.size(), 1u);
    // The descriptor that came back is the service's pipe: what we write there arrives.
    ASSERT_EQ(::write(answer->second[0].get(), "x", 1), 1);
    char byte = 0;
    ASSERT_EQ(::read(replyPipe.read.get(), &byte, 1), 1);
    EXPECT_EQ(byte, 'x');
    EXPECT_TRUE(::fcntl(answer->second[0].get(), F_GETFD) & FD_CLOEXEC);
    // The service's handler ignored the descriptors it got: they close with the last copy of the
    // event, which the service's mailbox holds until we take it.
    ASSERT_TRUE(service.events().pop());
    for (auto& pipe : sent)
        EXPECT_TRUE(writersGone(pipe.read));
}

TEST_F(ConduitDescriptorPassing, MoreThanTheLimitIsRefusedBySender)
{
    EchoService service("descriptors");
    ASSERT_TRUE(service.start());
    TestClient client("descriptors");
    auto pipe = Pipe::make();
    ConduitDescriptors outgoing;
    outgoing.push_back(std::move(pipe.write));
    for (size_t i = 0; i < Conduit::kMaxDescriptors; ++i)
        outgoing.emplace_back(::dup(pipe.read.get()));
    Mailbox<Result<Value>> outcome;
    client.connection->sendWithReplyDescriptors(Value::dictionary({}), std::move(outgoing), nullptr,
        [&](Result<Value> reply, ConduitDescriptors) { outcome.push(std::move(reply)); });
    auto answer = outcome.pop();
    ASSERT_TRUE(answer);
    EXPECT_FALSE(answer->ok());
    EXPECT_TRUE(writersGone(pipe.read));
    EXPECT_EQ(openCopies(pipe.read.get()), 1u);
}

struct HostileDescriptors {
    const char* name;
    std::vector<uint8_t> first; // sent with the descriptors attached
    std::vector<uint8_t> rest; // sent afterwards, without
    size_t descriptors;
};

void PrintTo(const HostileDescriptors& hostile, std::ostream* out)
{
    *out << hostile.name;
}

std::vector<HostileDescriptors> hostileDescriptorCases()
{
    auto undeclared = frameDeclaring(1, 0, 0);
    auto declaresTwo = frameDeclaring(1, 0, 2);
    auto header = frameDeclaring(1, 0, 0);
    std::vector<uint8_t> headStart(header.begin(), header.begin() + 3);
    std::vector<uint8_t> headRest(header.begin() + 3, header.end());
    return {
        { "DescriptorWithAFrameThatDeclaresNone", undeclared, {}, 1 },
        { "FewerThanDeclared", declaresTwo, {}, 1 },
        { "MoreThanAllowedInOneMessage", frameDeclaring(1, 0, 4), {}, Conduit::kMaxDescriptors + 1 },
        { "CountBeyondTheLimit", frameDeclaring(1, 0, 5), {}, 1 },
        { "TerminationFrameWithDescriptors",
            [] {
                auto bytes = RawConduitPeer::header(9, 4, 0);
                bytes[4] = 4 | 1 << 4;
                return bytes;
            }(),
            {}, 1 },
        { "DescriptorsOnAPartialHeaderOfAFrameThatDeclaresNone", headStart, headRest, 1 },
    };
}

class ConduitHostileDescriptors : public ConduitDirectoryTest,
                                  public ::testing::WithParamInterface<HostileDescriptors> { };

TEST_P(ConduitHostileDescriptors, ClosesTheConnectionAndKeepsNothing)
{
    const auto& hostile = GetParam();
    EchoService service("hostile");
    ASSERT_TRUE(service.start());
    auto peer = RawConduitPeer::connectToService("hostile");
    ASSERT_TRUE(peer);

    auto pipe = Pipe::make();
    std::vector<UniqueFd> copies;
    copies.push_back(std::move(pipe.write));
    for (size_t i = 1; i < hostile.descriptors; ++i)
        copies.emplace_back(::dup(copies.front().get()));
    std::vector<int> fds;
    for (const auto& copy : copies)
        fds.push_back(copy.get());
    ASSERT_TRUE(sendWithRights(peer->fd(), hostile.first, fds));
    copies.clear(); // only the copies in flight remain
    if (!hostile.rest.empty())
        ASSERT_TRUE(peer->sendBytes(hostile.rest));

    EXPECT_TRUE(peer->waitForClose());
    EXPECT_TRUE(writersGone(pipe.read));
    EXPECT_EQ(openCopies(pipe.read.get()), 1u); // the read end alone
    // A frame that completed before the stray descriptors showed may have been delivered, but
    // never with them.
    while (auto received = service.events().pop(std::chrono::milliseconds(0)))
        EXPECT_FALSE(received->event.descriptors);
}

INSTANTIATE_TEST_SUITE_P(Frames, ConduitHostileDescriptors, ::testing::ValuesIn(hostileDescriptorCases()),
    [](const auto& info) { return std::string(info.param.name); });

TEST_F(ConduitDescriptorPassing, AdoptedSocketpairSpeaksConduit)
{
    int pair[2];
    ASSERT_EQ(::socketpair(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0, pair), 0);
    auto queue = WorkQueue::create("test.adopted");
    auto server = ConduitConnection::adoptSocket(UniqueFd(pair[0]), queue);
    std::weak_ptr<ConduitConnection> weak = server;
    server->setEventHandler([weak](const ConduitEvent& event) {
        if (auto self = weak.lock(); self && event.expectsReply())
            self->sendReply(event.requestId, Value::dictionary({ { "echo", event.message } }));
    });
    server->resume();
    auto client = ConduitConnection::adoptSocket(UniqueFd(pair[1]), nullptr);
    client->setEventHandler([](const ConduitEvent&) {});
    client->resume();
    Mailbox<Result<Value>> outcome;
    client->sendWithReply(Value::dictionary({ { "n", 7 } }), nullptr, [&](Result<Value> r) { outcome.push(r); });
    auto answer = outcome.pop();
    ASSERT_TRUE(answer && answer->ok());
    EXPECT_EQ(answer->value()["echo"]["n"], Value(7));
    client->cancel();
    server->cancel();
}

} // namespace
} // namespace om::test
