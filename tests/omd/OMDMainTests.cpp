// The daemon's command line and the start-up failure path, called in-process.
#include <gtest/gtest.h>

#include <initializer_list>
#include <string>
#include <vector>

#include "omd/OMDMain.h"
#include "platform/Log.h"
#include "tests/omd/InProcessServer.h"

namespace om::test {
namespace {

std::optional<OMDOptions> parse(std::initializer_list<const char*> arguments)
{
    std::vector<std::string> storage { "omd" };
    storage.insert(storage.end(), arguments.begin(), arguments.end());
    std::vector<char*> argv;
    for (auto& argument : storage)
        argv.push_back(argument.data());
    argv.push_back(nullptr);
    return parseOMDOptions(static_cast<int>(storage.size()), argv.data());
}

TEST(OMDOptionParsing, DefaultsWithoutOptions)
{
    auto options = parse({});
    ASSERT_TRUE(options);
    EXPECT_EQ(options->serviceName, "com.orvex.ombrel.omd");
    EXPECT_EQ(options->cacheLimit, 1000000u);
    EXPECT_FALSE(options->databasePath);
}

TEST(OMDOptionParsing, EachOptionIsTaken)
{
    auto options = parse({ "-c", "42", "-d", "/tmp/a.vlist", "-S", "com.example.svc" });
    ASSERT_TRUE(options);
    EXPECT_EQ(options->cacheLimit, 42u);
    EXPECT_EQ(options->databasePath, std::optional<std::string>("/tmp/a.vlist"));
    EXPECT_EQ(options->serviceName, "com.example.svc");
}

TEST(OMDOptionParsing, LaterOptionsReplaceEarlier)
{
    auto options = parse({ "-c", "5", "-S", "first", "-d", "/a", "-c", "7", "-S", "second", "-d", "/b" });
    ASSERT_TRUE(options);
    EXPECT_EQ(options->cacheLimit, 7u);
    EXPECT_EQ(options->serviceName, "second");
    EXPECT_EQ(options->databasePath, std::optional<std::string>("/b"));
}

TEST(OMDOptionParsing, CountReadsLikeAtoi)
{
    EXPECT_EQ(parse({ "-c", "abc" })->cacheLimit, 0u);
    EXPECT_EQ(parse({ "-c", "" })->cacheLimit, 0u);
    EXPECT_EQ(parse({ "-c", " 12x" })->cacheLimit, 12u);
    EXPECT_EQ(parse({ "-c", "+8" })->cacheLimit, 8u);
    EXPECT_EQ(parse({ "-c", "0012" })->cacheLimit, 12u);
    EXPECT_EQ(parse({ "-c", "2147483647" })->cacheLimit, 2147483647u);
    // A negative count wraps, as the integer's conversion to the unsigned limit does.
    EXPECT_EQ(parse({ "-c", "-1" })->cacheLimit, 4294967295u);
    EXPECT_EQ(parse({ "-c12" })->cacheLimit, 12u);
}

TEST(OMDOptionParsing, EachVerboseOptionLogsOnceOnTheDefaultHandle)
{
    Log::Capture log;
    auto options = parse({ "-v", "-S", "name", "-v" });
    ASSERT_TRUE(options);
    EXPECT_EQ(options->serviceName, "name");
    auto records = log.records();
    ASSERT_EQ(records.size(), 2u);
    for (const auto& record : records) {
        EXPECT_EQ(record.message, "verbose option -v is ineffective; use log config --subsystem com.orvex.ombrel");
        EXPECT_EQ(record.level, LogLevel::Error);
        EXPECT_EQ(record.subsystem, "");
    }
    // Bundled letters count one by one.
    Log::Capture bundled;
    ASSERT_TRUE(parse({ "-vv" }));
    EXPECT_EQ(bundled.records().size(), 2u);
}

TEST(OMDOptionParsing, BadCommandLinesAreRefused)
{
    EXPECT_FALSE(parse({ "-x" })); // unknown letter
    EXPECT_FALSE(parse({ "-V" })); // letters are case-sensitive
    EXPECT_FALSE(parse({ "-S" })); // missing argument
    EXPECT_FALSE(parse({ "-c" }));
    EXPECT_FALSE(parse({ "-d" }));
    EXPECT_FALSE(parse({ "operand" })); // leftover operand
    EXPECT_FALSE(parse({ "-S", "name", "extra" }));
    EXPECT_FALSE(parse({ "operand", "-v" })); // options stop at the first operand
    EXPECT_FALSE(parse({ "--", "operand" }));
    EXPECT_FALSE(parse({ "--verbose" }));
}

TEST(OMDOptionParsing, EndOfOptionsMarkerAloneIsFine)
{
    auto options = parse({ "-S", "name", "--" });
    ASSERT_TRUE(options);
    EXPECT_EQ(options->serviceName, "name");
}

TEST(OMDOptionParsing, EveryCallStartsAfresh)
{
    EXPECT_FALSE(parse({ "-c", "1", "-x" }));
    auto options = parse({ "-c", "3" });
    ASSERT_TRUE(options);
    EXPECT_EQ(options->cacheLimit, 3u);
}

TEST(OMDOptionParsing, UsageTextIsThirtyThreeBytes)
{
    EXPECT_EQ(kOMDUsageText.size(), 33u);
    EXPECT_EQ(kOMDUsageText, "Usage: omd [-S servicename] [-v]\n");
}

using OMDStartup = InProcessServer;

TEST_F(OMDStartup, ServiceNameOwnedByALiveServerFailsWithStatusOne)
{
    std::string databasePath = m_root + "/other.vlist";
    std::vector<std::string> storage { "omd", "-S", m_serviceName, "-d", databasePath };
    std::vector<char*> argv;
    for (auto& argument : storage)
        argv.push_back(argument.data());
    argv.push_back(nullptr);

    EXPECT_EQ(omdMain(static_cast<int>(storage.size()), argv.data()), 1);
    EXPECT_EQ(m_log.count("omd is launching"), 1u);
    EXPECT_EQ(m_log.count("unable to construct server"), 1u);
    auto records = m_log.records();
    auto failure = std::find_if(
        records.begin(), records.end(), [](const auto& r) { return r.message == "unable to construct server"; });
    ASSERT_NE(failure, records.end());
    EXPECT_EQ(failure->level, LogLevel::Error);
    EXPECT_EQ(failure->category, "ops");
}

} // namespace
} // namespace om::test
