#include <elf.h>
#include <fcntl.h>
#include <gtest/gtest.h>
#include <poll.h>
#include <sys/socket.h>
#include <sys/stat.h>
#include <sys/un.h>
#include <unistd.h>

#include <cstring>
#include <filesystem>
#include <optional>

#include "platform/CodeSigning.h"
#include "platform/Process.h"
#include "platform/UniqueFd.h"
#include "platform/Vlist.h"
#include "tests/support/BundleFixture.h"
#include "tests/support/ChildProcess.h"

using om::CodeSigningTask;
using om::UniqueFd;
using om::Value;
using om::test::BundleFixture;
using om::test::ChildProcess;

namespace {

constexpr int kGenerousTimeoutMs = 30'000;
const std::string kEntitle = std::string(OM_SOURCE_DIR) + "/scripts/entitle";
const std::string kPeer = std::string(OM_BINARY_DIR) + "/tests/om_test_peer";

bool waitReadable(int fd)
{
    pollfd entry { .fd = fd, .events = POLLIN, .revents = 0 };
    return ::poll(&entry, 1, kGenerousTimeoutMs) == 1;
}

class CodeSigningTaskTest : public ::testing::Test {
protected:
    // A private copy of the peer program, which tests then entitle, chmod and chown at will.
    std::string copyPeer(const std::string& name = "peer")
    {
        std::string copy = m_fixture.root() + "/" + name;
        std::filesystem::copy_file(kPeer, copy);
        ::chmod(copy.c_str(), 0755);
        return copy;
    }

    std::string entitle(const std::string& peer, const std::string& contents)
    {
        EXPECT_EQ(ChildProcess::run(
                      { kEntitle, peer, m_fixture.writeFile("entitlements" + std::to_string(m_files++), contents) }),
            0);
        return peer;
    }
    std::string entitled(const Value& entitlements) { return entitle(copyPeer(), om::Vlist::writeXml(entitlements)); }

    // Starts the program, takes its connection's token, and lets it go: -1 in *exitStatus when it
    // never connected.
    std::optional<om::AuditToken> tokenOf(const std::string& program, int* exitStatus)
    {
        std::string socketPath = m_fixture.root() + "/peer" + std::to_string(m_files++) + ".sock";
        UniqueFd listener(::socket(AF_UNIX, SOCK_STREAM | SOCK_CLOEXEC, 0));
        sockaddr_un address { .sun_family = AF_UNIX, .sun_path = {} };
        std::strncpy(address.sun_path, socketPath.c_str(), sizeof address.sun_path - 1);
        if (::bind(listener.get(), reinterpret_cast<sockaddr*>(&address), sizeof address) < 0
            || ::listen(listener.get(), 1) < 0 || (m_pid = ChildProcess::spawn({ program, socketPath })) < 0)
            return std::nullopt;
        *exitStatus = -1;
        if (!waitReadable(listener.get())) {
            ::kill(m_pid, SIGKILL);
            ChildProcess::exitStatusOf(m_pid);
            return std::nullopt;
        }
        UniqueFd connection(::accept4(listener.get(), nullptr, nullptr, SOCK_CLOEXEC));
        char byte;
        EXPECT_TRUE(waitReadable(connection.get()) && ::read(connection.get(), &byte, 1) == 1);
        auto token = om::Process::peerOf(connection.get());
        EXPECT_TRUE(token.ok());
        m_task = token.ok() ? CodeSigningTask::create(token.value()) : nullptr;
        connection.reset(); // the peer's cue to exit
        *exitStatus = ChildProcess::exitStatusOf(m_pid);
        return token.ok() ? std::optional(token.value()) : std::nullopt;
    }

    std::shared_ptr<CodeSigningTask> taskOf(const std::string& program)
    {
        int exitStatus = -1;
        EXPECT_TRUE(tokenOf(program, &exitStatus));
        EXPECT_EQ(exitStatus, 0);
        return m_task;
    }

    BundleFixture m_fixture;
    int m_files = 0;
    pid_t m_pid = -1;
    std::shared_ptr<CodeSigningTask> m_task;
};

TEST_F(CodeSigningTaskTest, ExecutableWithoutSectionHoldsNothing)
{
    auto task = taskOf(copyPeer());
    ASSERT_TRUE(task);
    EXPECT_TRUE(task->trusted());
    auto value = task->entitlementValue("com.orvex.private.ombrel.manager");
    ASSERT_TRUE(value.ok());
    EXPECT_TRUE(value->isNone());
    EXPECT_TRUE(task->entitlements().isNone());
}

TEST_F(CodeSigningTaskTest, EntitlementValuesComeBackAsWritten)
{
    Value allowed
        = Value::array({ Value::dictionary({ { "QSExtensionPointIdentifier", "com.orvex.share-services" } }) });
    Value entitlements = Value::dictionary(
        { { "com.orvex.private.ombrel.manager", "yes" }, { "com.orvex.developer.auto-elect-plugin", false },
            { "com.orvex.developer.replace-plugin", 0 }, { "com.orvex.developer.ombrel.allowedplugins", allowed },
            { "nested", Value::dictionary({ { "inner", Value::dictionary({ { "n", -5 } }) } }) } });
    auto task = taskOf(entitled(entitlements));
    ASSERT_TRUE(task);

    EXPECT_EQ(task->entitlements(), entitlements);
    EXPECT_EQ(*task->entitlementValue("com.orvex.private.ombrel.manager")->asString(), "yes");
    EXPECT_EQ(task->entitlementValue("com.orvex.developer.auto-elect-plugin")->asBool(), false);
    EXPECT_EQ(task->entitlementValue("com.orvex.developer.replace-plugin")->asInt64(), 0);
    EXPECT_EQ(task->entitlementValue("com.orvex.developer.ombrel.allowedplugins").value(), allowed);
    EXPECT_EQ(task->entitlementValue("nested").value()["inner"]["n"].asInt64(), -5);
    EXPECT_TRUE(task->entitlementValue("com.orvex.unheld")->isNone());
}

TEST_F(CodeSigningTaskTest, EntitlingAgainReplacesTheSectionInEitherForm)
{
    std::string peer = entitled(Value::dictionary({ { "first", true } }));
    auto binary = om::Vlist::writeBinary(Value::dictionary({ { "second", true } }));
    entitle(peer, std::string(binary.begin(), binary.end()));

    auto task = taskOf(peer);
    ASSERT_TRUE(task);
    EXPECT_EQ(task->entitlements(), Value::dictionary({ { "second", true } }));
}

TEST_F(CodeSigningTaskTest, ExecutableWritableByGroupOrOthersGrantsNothing)
{
    for (mode_t mode : { 0775, 0757 }) {
        std::string peer = entitled(Value::dictionary({ { "com.orvex.private.ombrel.manager", true } }));
        ::chmod(peer.c_str(), mode);
        auto task = taskOf(peer);
        ASSERT_TRUE(task);
        EXPECT_FALSE(task->trusted()) << std::oct << mode;
        auto value = task->entitlementValue("com.orvex.private.ombrel.manager");
        ASSERT_TRUE(value.ok());
        EXPECT_TRUE(value->isNone()) << std::oct << mode;
        std::filesystem::remove(peer);
    }
}

TEST_F(CodeSigningTaskTest, ExecutableOwnedBySomeoneElseGrantsNothing)
{
    if (::geteuid() != 0)
        GTEST_SKIP() << "only root can give a file away";
    std::string peer = entitled(Value::dictionary({ { "com.orvex.private.ombrel.manager", true } }));
    ASSERT_EQ(::chown(peer.c_str(), 65534, 65534), 0);

    auto task = taskOf(peer);
    ASSERT_TRUE(task);
    EXPECT_FALSE(task->trusted());
    EXPECT_TRUE(task->entitlements().isNone());
}

TEST_F(CodeSigningTaskTest, DamagedSectionIsAnError)
{
    for (const char* contents : { "<vlist version=\"1\"><dict><key>a</key></dict></vlist>",
             "<vlist version=\"1\"><array><string>a</string></array></vlist>" }) {
        std::string peer = entitle(copyPeer("peer" + std::to_string(m_files)), contents);
        auto task = taskOf(peer);
        ASSERT_TRUE(task);
        auto value = task->entitlementValue("a");
        ASSERT_FALSE(value.ok()) << contents;
        EXPECT_EQ(value.error().code(), om::kPlatformErrorMalformed);
        EXPECT_TRUE(task->entitlements().isNone());
    }
}

TEST_F(CodeSigningTaskTest, ProcessThatExitedGivesNoTask)
{
    int exitStatus = -1;
    auto token = tokenOf(entitled(Value::dictionary({ { "com.orvex.private.ombrel.manager", true } })), &exitStatus);
    ASSERT_TRUE(token);
    ASSERT_EQ(exitStatus, 0); // reaped: the pid names nothing now

    EXPECT_FALSE(CodeSigningTask::create(*token));
}

TEST(EntitleScript, RefusesWhatItCannotUse)
{
    BundleFixture fixture;
    std::string peer = fixture.root() + "/peer";
    std::filesystem::copy_file(kPeer, peer);
    std::string good = fixture.writeFile("good.vlist", om::Vlist::writeXml(Value::dictionary({ { "a", true } })));
    std::string empty = fixture.writeFile("empty.vlist", "");
    std::string junk = fixture.writeFile("junk.vlist", "{\"a\": true}");
    std::string script = fixture.writeFile("script", "#!/bin/sh\n", 0755);

    EXPECT_EQ(ChildProcess::run({ kEntitle }), 2);
    EXPECT_EQ(ChildProcess::run({ kEntitle, peer }), 2);
    EXPECT_EQ(ChildProcess::run({ kEntitle, peer, empty }), 1);
    EXPECT_EQ(ChildProcess::run({ kEntitle, peer, junk }), 1);
    EXPECT_EQ(ChildProcess::run({ kEntitle, peer, fixture.root() + "/missing.vlist" }), 1);
    EXPECT_EQ(ChildProcess::run({ kEntitle, script, good }), 1);
    EXPECT_EQ(ChildProcess::run({ kEntitle, fixture.root() + "/missing", good }), 1);
    EXPECT_EQ(ChildProcess::run({ kEntitle, peer, good }), 0);
}

// Hostile executables: the reader must refuse a table that points outside the file, never read
// past it, and tell "no entitlements" from "damaged entitlements".
class EntitlementReader : public CodeSigningTaskTest {
protected:
    void SetUp() override
    {
        m_file = entitled(Value::dictionary({ { "com.orvex.private.ombrel.manager", true } }));
        UniqueFd fd(::open(m_file.c_str(), O_RDONLY | O_CLOEXEC));
        ASSERT_TRUE(fd.valid());
        ASSERT_EQ(::pread(fd.get(), &m_header, sizeof m_header, 0), static_cast<ssize_t>(sizeof m_header));
        m_sections.resize(m_header.e_shnum);
        ASSERT_EQ(::pread(fd.get(), m_sections.data(), m_sections.size() * sizeof(Elf64_Shdr), m_header.e_shoff),
            static_cast<ssize_t>(m_sections.size() * sizeof(Elf64_Shdr)));
        std::vector<char> names(m_sections[m_header.e_shstrndx].sh_size);
        ASSERT_EQ(::pread(fd.get(), names.data(), names.size(), m_sections[m_header.e_shstrndx].sh_offset),
            static_cast<ssize_t>(names.size()));
        for (size_t i = 0; i < m_sections.size(); ++i) {
            if (std::strcmp(names.data() + m_sections[i].sh_name, ".entitlements") == 0)
                m_entitlements = i;
        }
        ASSERT_NE(m_entitlements, 0u);
        ASSERT_TRUE(read().ok());
    }

    om::Result<Value> read() const
    {
        UniqueFd fd(::open(m_file.c_str(), O_RDONLY | O_CLOEXEC));
        return CodeSigningTask::readEntitlements(fd.get());
    }

    void writeHeader(const Elf64_Ehdr& header) { write(&header, sizeof header, 0); }
    void writeSection(size_t index, const Elf64_Shdr& section)
    {
        write(&section, sizeof section, m_header.e_shoff + index * sizeof(Elf64_Shdr));
    }
    void write(const void* bytes, size_t size, uint64_t offset)
    {
        UniqueFd fd(::open(m_file.c_str(), O_WRONLY | O_CLOEXEC));
        ASSERT_EQ(::pwrite(fd.get(), bytes, size, static_cast<off_t>(offset)), static_cast<ssize_t>(size));
    }

    static bool isError(const om::Result<Value>& result, int64_t code = om::kPlatformErrorMalformed)
    {
        return !result.ok() && result.error().code() == code;
    }
    static bool holdsNothing(const om::Result<Value>& result) { return result.ok() && result->isNone(); }

    std::string m_file;
    Elf64_Ehdr m_header {};
    std::vector<Elf64_Shdr> m_sections;
    size_t m_entitlements = 0;
};

TEST_F(EntitlementReader, FilesThatAreNotOurKindOfElfHoldNothing)
{
    Elf64_Ehdr header = m_header;
    header.e_ident[EI_CLASS] = ELFCLASS32;
    writeHeader(header);
    EXPECT_TRUE(holdsNothing(read()));

    header = m_header;
    header.e_ident[EI_DATA] = ELFDATA2MSB;
    writeHeader(header);
    EXPECT_TRUE(holdsNothing(read()));

    m_file = m_fixture.writeFile("script", "#!/bin/sh\nexit 0\n", 0755);
    EXPECT_TRUE(holdsNothing(read()));
    m_file = m_fixture.writeFile("tiny",
        "\x7f"
        "ELF",
        0755);
    EXPECT_TRUE(holdsNothing(read()));
}

TEST_F(EntitlementReader, SectionTableOutsideTheFileIsRefused)
{
    Elf64_Ehdr header = m_header;
    header.e_shoff = std::filesystem::file_size(m_file) - sizeof(Elf64_Shdr) + 1;
    writeHeader(header);
    EXPECT_TRUE(isError(read()));

    header.e_shoff = UINT64_MAX - 8;
    writeHeader(header);
    EXPECT_TRUE(isError(read()));

    std::filesystem::resize_file(m_file, m_header.e_shoff + 2 * sizeof(Elf64_Shdr));
    writeHeader(m_header);
    EXPECT_TRUE(isError(read()));
}

TEST_F(EntitlementReader, ImplausibleHeaderFieldsAreRefused)
{
    Elf64_Ehdr header = m_header;
    header.e_shnum = 0xfff0; // 4 MiB of section headers
    writeHeader(header);
    EXPECT_TRUE(isError(read(), om::kPlatformErrorLimit));

    header = m_header;
    header.e_shentsize = sizeof(Elf64_Shdr) + 8;
    writeHeader(header);
    EXPECT_TRUE(isError(read()));

    header = m_header;
    header.e_shstrndx = header.e_shnum;
    writeHeader(header);
    EXPECT_TRUE(isError(read()));

    header.e_shstrndx = static_cast<uint16_t>(m_entitlements); // not a string table
    writeHeader(header);
    EXPECT_TRUE(isError(read()));
}

TEST_F(EntitlementReader, SectionPointingOutsideTheFileIsRefused)
{
    Elf64_Shdr section = m_sections[m_entitlements];
    section.sh_offset = UINT64_MAX - 4; // offset + size wraps around
    writeSection(m_entitlements, section);
    EXPECT_TRUE(isError(read()));

    section = m_sections[m_entitlements];
    section.sh_size = std::filesystem::file_size(m_file) - section.sh_offset + 1; // one byte too many
    writeSection(m_entitlements, section);
    EXPECT_TRUE(isError(read()));

    section = m_sections[m_entitlements];
    section.sh_type = SHT_NOBITS;
    writeSection(m_entitlements, section);
    EXPECT_TRUE(isError(read()));
}

TEST_F(EntitlementReader, NameOutsideTheNameTableMatchesNothing)
{
    Elf64_Shdr section = m_sections[m_entitlements];
    section.sh_name = static_cast<uint32_t>(m_sections[m_header.e_shstrndx].sh_size);
    writeSection(m_entitlements, section);
    EXPECT_TRUE(holdsNothing(read()));
}

TEST_F(EntitlementReader, TwoSectionsOfTheNameAreRefused)
{
    size_t other = m_entitlements == 1 ? 2 : 1;
    Elf64_Shdr section = m_sections[other];
    section.sh_name = m_sections[m_entitlements].sh_name;
    writeSection(other, section);
    EXPECT_TRUE(isError(read()));
}

TEST_F(EntitlementReader, SectionOfOneMebibyteIsReadAndOneByteMoreIsRefused)
{
    const std::string head = "<vlist version=\"1\"><dict><key>k</key><string>";
    const std::string tail = "</string></dict></vlist>";
    const size_t overhead = head.size() + tail.size();
    for (size_t size : { size_t(1) << 20, (size_t(1) << 20) + 1 }) {
        m_file = entitle(copyPeer("big" + std::to_string(size)), head + std::string(size - overhead, 'x') + tail);
        auto value = read();
        if (size == size_t(1) << 20) {
            ASSERT_TRUE(value.ok()) << value.error().localizedDescription();
            EXPECT_EQ(value->stringFor("k")->size(), size - overhead);
        } else {
            EXPECT_TRUE(isError(value, om::kPlatformErrorLimit));
        }
    }
}

} // namespace
