#include <fcntl.h>
#include <gtest/gtest.h>
#include <unistd.h>

#include <cerrno>
#include <cstring>
#include <filesystem>

#include "Ombrel/OMSandboxExtension.h"
#include "platform/Log.h"
#include "platform/Sandbox.h"
#include "tests/support/BundleFixture.h"

using om::Log;
using om::LogLevel;
using om::OMSandboxExtension;
using om::Sandbox;
using om::Value;

namespace {

bool isOpen(int64_t handle)
{
    return ::fcntl(static_cast<int>(handle), F_GETFD) >= 0;
}

size_t openDescriptors()
{
    auto entries = std::filesystem::directory_iterator("/proc/self/fd");
    return static_cast<size_t>(std::distance(entries, std::filesystem::directory_iterator()));
}

// A plug-in bundle inside its app, with a neighbour whose name its own is a prefix of.
class OMSandboxExtensionTest : public ::testing::Test {
protected:
    void SetUp() override
    {
        ::setenv("SANDBOX_KEY", (m_fixture.root() + "/sandbox.key").c_str(), 1);
        m_fixture.writeFile("Notes.app/PlugIns/Share.appex/Resources/icon.png", "png");
        m_fixture.writeFile("Notes.app/PlugIns/Share.appexed/neighbour.txt", "not ours");
        m_fixture.writeFile("Notes.app/secret.txt", "secret");
    }
    void TearDown() override { ::unsetenv("SANDBOX_KEY"); }

    std::shared_ptr<OMSandboxExtension> holder()
    {
        auto token = Sandbox::issueFileExtension(Sandbox::kReadOnlyFileClass, m_bundle, Sandbox::kCanonicalPath);
        EXPECT_TRUE(token.ok());
        return OMSandboxExtension::initWithExtension(token.ok() ? *token : std::string());
    }

    // The path a token grants; empty when it grants nothing.
    static std::string grantOf(const Value& token)
    {
        auto path = Sandbox::verify(token.asString() ? *token.asString() : "");
        return path.ok() ? *path : std::string();
    }

    // One info record of the "ops" log per failure, naming the resource, the plug-in and errno.
    void expectFailureLogged(const Log::Capture& capture, const std::string& resource, int error) const
    {
        const std::string message = "failed to make extension for " + m_bundle + resource + " in plug-in at " + m_bundle
            + ": " + std::strerror(error);
        size_t found = 0;
        for (const auto& record : capture.records()) {
            if (record.message == message && record.category == "ops" && record.level == LogLevel::Info)
                ++found;
        }
        EXPECT_EQ(found, 1u) << message;
    }

    om::test::BundleFixture m_fixture;
    std::string m_bundle = m_fixture.root() + "/Notes.app/PlugIns/Share.appex";
};

} // namespace

TEST_F(OMSandboxExtensionTest, ConsumesOnceAndExpelsOnce)
{
    auto extension = holder();
    EXPECT_EQ(extension->handle(), 0);
    const size_t before = openDescriptors();
    extension->expel();
    EXPECT_EQ(openDescriptors(), before);

    extension->consume();
    const int64_t handle = extension->handle();
    extension->consume();
    EXPECT_GE(handle, 3);
    EXPECT_EQ(extension->handle(), handle);
    EXPECT_EQ(openDescriptors(), before + 1);

    extension->expel();
    EXPECT_EQ(extension->handle(), 0);
    EXPECT_FALSE(isOpen(handle));
    // The number is anyone's now; a second expel must not close it again.
    const int reused = ::open("/dev/null", O_RDONLY | O_CLOEXEC);
    extension->expel();
    EXPECT_TRUE(isOpen(reused));
    ::close(reused);
}

TEST_F(OMSandboxExtensionTest, DestructionEndsTheAccess)
{
    auto extension = holder();
    extension->consume();
    const int64_t handle = extension->handle();
    ASSERT_TRUE(isOpen(handle));

    extension.reset();

    EXPECT_FALSE(isOpen(handle));
}

TEST_F(OMSandboxExtensionTest, RefusedTokenKeepsThePlatformsAnswerUntilExpelled)
{
    auto extension = OMSandboxExtension::initWithExtension("forged;0;00;/etc/passwd");
    EXPECT_EQ(extension->token(), "forged;0;00;/etc/passwd");

    extension->consume();
    EXPECT_EQ(extension->handle(), -1);
    extension->expel();
    EXPECT_EQ(extension->handle(), 0);
}

TEST_F(OMSandboxExtensionTest, IssuesOneTokenPerNamedResource)
{
    Log::Capture capture;

    const Value dot = OMSandboxExtension::issueForResources(m_bundle, ".");
    const Value single = OMSandboxExtension::issueForResources(m_bundle, "Resources");
    const Value mixed = OMSandboxExtension::issueForResources(
        m_bundle, Value::array({ "Resources/../Resources/icon.png", 7, Value::dictionary({}), "." }));

    EXPECT_EQ(dot, Value::dictionary({ { ".", dot["."] } }));
    EXPECT_EQ(grantOf(dot["."]), m_bundle);
    EXPECT_EQ(single.count(), 1u);
    EXPECT_EQ(grantOf(single["Resources"]), m_bundle + "/Resources");
    EXPECT_EQ(mixed.count(), 2u);
    EXPECT_EQ(grantOf(mixed["Resources/../Resources/icon.png"]), m_bundle + "/Resources/icon.png");
    EXPECT_EQ(grantOf(mixed["."]), m_bundle);
    EXPECT_TRUE(capture.records().empty());
}

TEST_F(OMSandboxExtensionTest, GrantsNothingMissingOrOutsideTheBundle)
{
    std::filesystem::create_symlink(m_fixture.root() + "/Notes.app/secret.txt", m_bundle + "/Resources/link");
    Log::Capture capture;

    const Value tokens = OMSandboxExtension::issueForResources(
        m_bundle, Value::array({ "Missing", "../../secret.txt", "Resources/link", "../Share.appexed/neighbour.txt" }));

    EXPECT_EQ(tokens, Value::dictionary({}));
    expectFailureLogged(capture, "/Missing", ENOENT);
    expectFailureLogged(capture, "/../../secret.txt", EACCES);
    expectFailureLogged(capture, "/Resources/link", EACCES);
    expectFailureLogged(capture, "/../Share.appexed/neighbour.txt", EACCES);

    m_bundle = m_fixture.root() + "/Gone.appex";
    EXPECT_EQ(OMSandboxExtension::issueForResources(m_bundle, "."), Value::dictionary({}));
    expectFailureLogged(capture, "", ENOENT);
}
