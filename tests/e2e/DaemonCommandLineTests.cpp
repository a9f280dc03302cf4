// The omd binary's command line, exit statuses and signal handling.
#include <gtest/gtest.h>
#include <signal.h>
#include <sys/wait.h>
#include <unistd.h>

#include <algorithm>
#include <filesystem>

#include "platform/Format.h"
#include "tests/support/DaemonProcess.h"

namespace om::test {
namespace {

constexpr std::string_view kUsage = "Usage: omd [-S servicename] [-v]\n";

DaemonProcess::Options withArguments(std::vector<std::string> arguments, std::string logLevel = "debug")
{
    DaemonProcess::Options options;
    options.executable = builtDaemonPath();
    options.arguments = std::move(arguments);
    options.logLevel = std::move(logLevel);
    // Nothing but the daemon's own arguments, for the command-line cases.
    options.privateDatabase = false;
    return options;
}

int exitCode(std::optional<int> status)
{
    if (!status || !WIFEXITED(*status))
        return -1;
    return WEXITSTATUS(*status);
}

// At the default log threshold the launch line is not shown, so a bad command line leaves
// exactly the usage text on standard error.
void expectUsage(std::vector<std::string> arguments)
{
    DaemonProcess daemon(withArguments(arguments, ""));
    EXPECT_EQ(exitCode(daemon.waitForExit()), 2);
    ASSERT_TRUE(daemon.waitForStderrClosed());
    EXPECT_EQ(daemon.stderrText(), kUsage);
    EXPECT_EQ(daemon.stderrText().size(), 33u);
}

TEST(DaemonCommandLine, UnknownOptionPrintsUsageAndExitsTwo)
{
    expectUsage({ "-x" });
    expectUsage({ "-S", "name", "-q" });
}

TEST(DaemonCommandLine, MissingArgumentPrintsUsageAndExitsTwo)
{
    expectUsage({ "-S" });
    expectUsage({ "-c" });
    expectUsage({ "-d" });
}

TEST(DaemonCommandLine, LeftoverOperandPrintsUsageAndExitsTwo)
{
    expectUsage({ "operand" });
    expectUsage({ "-S", "name", "extra" });
    expectUsage({ "--", "extra" });
}

TEST(DaemonCommandLine, UsageStillFollowsTheLaunchLine)
{
    DaemonProcess daemon(withArguments({ "-x" }, "info"));
    EXPECT_EQ(exitCode(daemon.waitForExit()), 2);
    ASSERT_TRUE(daemon.waitForStderrClosed());
    auto lines = daemon.lines();
    ASSERT_EQ(lines.size(), 2u);
    EXPECT_EQ(lines[0].message, "omd is launching");
    EXPECT_EQ(lines[0].level, "info");
    EXPECT_EQ(lines[0].subsystem, "com.orvex.Ombrel");
    EXPECT_EQ(lines[0].category, "ops");
    EXPECT_EQ(lines[1].raw + "\n", kUsage);
}

TEST(DaemonCommandLine, NoOptionsListensOnTheDefaultName)
{
    DaemonProcess daemon(withArguments({}));
    ASSERT_TRUE(daemon.waitForSocket()) << daemon.stderrText();
    EXPECT_EQ(daemon.serviceName(), "com.orvex.ombrel.omd");
    auto peer = DaemonPeer::connect(daemon);
    ASSERT_TRUE(peer);
    EXPECT_TRUE(peer->call(daemonRequest("hello")));
}

TEST(DaemonCommandLine, LastServiceNameWins)
{
    DaemonProcess daemon(withArguments({ "-S", "com.example.first", "-S", "com.example.second" }));
    ASSERT_TRUE(daemon.waitForSocket()) << daemon.stderrText();
    EXPECT_TRUE(std::filesystem::exists(daemon.conduitDirectory() + "/com.example.second"));
    EXPECT_FALSE(std::filesystem::exists(daemon.conduitDirectory() + "/com.example.first"));
}

TEST(DaemonCommandLine, EachVerboseOptionLogsOnceAndChangesNothing)
{
    DaemonProcess daemon(withArguments({ "-v", "-c", "abc", "-v" }));
    ASSERT_TRUE(daemon.waitForSocket()) << daemon.stderrText();
    auto peer = DaemonPeer::connect(daemon);
    ASSERT_TRUE(peer);
    EXPECT_TRUE(peer->call(daemonRequest("served")));

    auto lines = daemon.lines();
    size_t verbose = 0;
    for (const auto& line : lines) {
        if (line.message != "verbose option -v is ineffective; use log config --subsystem com.orvex.ombrel")
            continue;
        ++verbose;
        EXPECT_EQ(line.level, "error");
        EXPECT_EQ(line.subsystem, ""); // the platform's default handle
    }
    EXPECT_EQ(verbose, 2u);
}

TEST(DaemonCommandLine, SecondDaemonOnALiveNameExitsOne)
{
    DaemonProcess first(withArguments({}));
    ASSERT_TRUE(first.waitForSocket()) << first.stderrText();

    auto options = withArguments({}, "");
    options.conduitDirectory = first.conduitDirectory();
    DaemonProcess second(options);
    EXPECT_EQ(exitCode(second.waitForExit()), 1);
    ASSERT_TRUE(second.waitForStderrClosed());
    auto lines = second.lines();
    auto failure = std::find_if(lines.begin(), lines.end(),
        [](const DaemonLogLine& line) { return line.message == "unable to construct server"; });
    ASSERT_NE(failure, lines.end()) << second.stderrText();
    EXPECT_EQ(failure->level, "error");

    // The first one never noticed.
    auto peer = DaemonPeer::connect(first);
    ASSERT_TRUE(peer);
    EXPECT_TRUE(peer->call(daemonRequest("still-serving")));
}

TEST(DaemonCommandLine, SigtermTellsPeersTerminationIsImminentThenExitsZero)
{
    DaemonProcess daemon(withArguments({}));
    ASSERT_TRUE(daemon.waitForSocket()) << daemon.stderrText();
    auto peer = DaemonPeer::connect(daemon);
    ASSERT_TRUE(peer);
    ASSERT_TRUE(peer->call(daemonRequest("connected")));

    daemon.sendSignal(SIGTERM);
    auto frame = peer->raw().readFrame();
    ASSERT_TRUE(frame);
    EXPECT_EQ(frame->kind, RawConduitPeer::kTerminationImminent);
    EXPECT_EQ(frame->id, 0u);
    EXPECT_TRUE(frame->payload.empty());
    EXPECT_TRUE(peer->raw().waitForClose());
    EXPECT_EQ(exitCode(daemon.waitForExit()), 0);
}

} // namespace
} // namespace om::test
