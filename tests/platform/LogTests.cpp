#include <fcntl.h>
#include <gtest/gtest.h>
#include <sys/mman.h>
#include <sys/stat.h>
#include <unistd.h>

#include <cstdlib>
#include <regex>
#include <thread>
#include <vector>

#include "platform/Fatal.h"
#include "platform/Log.h"

using om::Log;
using om::LogLevel;

namespace {

bool journalPresent()
{
    struct stat info;
    return ::stat("/run/systemd/journal/socket", &info) == 0;
}

// Points fd 2 at an in-memory file for the life of the object.
class StderrRedirect {
public:
    StderrRedirect()
        : m_file(::memfd_create("stderr", MFD_CLOEXEC))
        , m_saved(::fcntl(STDERR_FILENO, F_DUPFD_CLOEXEC, 3))
    {
        // Appending makes each write land whole at the end, as on a pipe or a terminal.
        ::fcntl(m_file, F_SETFL, O_APPEND);
        ::dup2(m_file, STDERR_FILENO);
    }
    ~StderrRedirect()
    {
        ::dup2(m_saved, STDERR_FILENO);
        ::close(m_saved);
        ::close(m_file);
    }
    std::string text() const
    {
        std::string out;
        char buffer[4096];
        off_t offset = 0;
        for (ssize_t n; (n = ::pread(m_file, buffer, sizeof buffer, offset)) > 0; offset += n)
            out.append(buffer, static_cast<size_t>(n));
        return out;
    }

private:
    int m_file;
    int m_saved;
};

std::vector<std::string> lines(const std::string& text)
{
    std::vector<std::string> out;
    size_t start = 0;
    for (size_t end; (end = text.find('\n', start)) != std::string::npos; start = end + 1)
        out.push_back(text.substr(start, end - start));
    return out;
}

const std::regex kLinePattern(R"(\d{4}-\d\d-\d\dT\d\d:\d\d:\d\d\.\d{6}Z [^ \[]+\[\d+\] (.*))");

// Runs in a fresh process, where EVLOG_LEVEL has not been read yet. The exit status has one bit
// per record that reached stderr: 1 debug, 2 info, 4 notice, 8 error, 16 a debug record written
// after EVLOG_LEVEL changed, 32 when debug was enabled.
// The child is single-threaded until the first queue exists, so changing the environment is safe.
// NOLINTBEGIN(concurrency-mt-unsafe)
[[noreturn]] void logEveryLevelAndExit(const char* level)
{
    if (level)
        ::setenv("EVLOG_LEVEL", level, 1);
    else
        ::unsetenv("EVLOG_LEVEL");
    StderrRedirect redirect;
    Log& log = Log::defaultLog();
    int status = log.enabled(LogLevel::Debug) ? 32 : 0;
    log.debug("record-debug");
    log.info("record-info");
    log.notice("record-notice");
    log.error("record-error");
    ::setenv("EVLOG_LEVEL", "debug", 1);
    log.debug("record-late");
    std::string text = redirect.text();
    const char* names[] = { "record-debug", "record-info", "record-notice", "record-error", "record-late" };
    for (int i = 0; i < 5; ++i) {
        if (text.find(names[i]) != std::string::npos)
            status |= 1 << i;
    }
    ::_exit(status);
}
// NOLINTEND(concurrency-mt-unsafe)

} // namespace

TEST(Log, CreateRejectsEmptyNames)
{
    EXPECT_FALSE(Log::create("", "ops").ok());
    EXPECT_FALSE(Log::create("com.orvex.test", "").ok());
    auto created = Log::create("com.orvex.test", "ops");
    ASSERT_TRUE(created.ok());
    EXPECT_EQ((*created)->subsystem(), "com.orvex.test");
    EXPECT_EQ((*created)->category(), "ops");
}

TEST(Log, CreateRejectsControlCharactersAtTheBoundaries)
{
    EXPECT_FALSE(Log::create("com.orvex\x1f", "ops").ok());
    EXPECT_TRUE(Log::create("com.orvex ", "ops").ok());
    EXPECT_FALSE(Log::create("com.orvex", "o\nps").ok());
    EXPECT_FALSE(Log::create("com.orvex", "ops\x7f").ok());
    EXPECT_TRUE(Log::create("com.orvex", "ops~").ok());
    EXPECT_TRUE(Log::create("com.orvex", "caf\xc3\xa9").ok());
    auto refused = Log::create("com.orvex", std::string("o\0ps", 4));
    ASSERT_FALSE(refused.ok());
    EXPECT_EQ(refused.error().domain(), "Platform");
}

TEST(Log, DefaultLogIsOneHandleWithoutNames)
{
    EXPECT_EQ(&Log::defaultLog(), &Log::defaultLog());
    EXPECT_EQ(Log::defaultLog().subsystem(), "");
    EXPECT_EQ(Log::defaultLog().category(), "");
}

TEST(Log, PlatformHandlesAreOnePerCategoryForEveryThread)
{
    std::vector<const Log*> seen(4);
    std::vector<std::thread> threads;
    for (size_t i = 0; i < seen.size(); ++i)
        threads.emplace_back([&seen, i] { seen[i] = &Log::platform("shared-category"); });
    for (auto& thread : threads)
        thread.join();
    for (const Log* log : seen)
        EXPECT_EQ(log, seen[0]);
    EXPECT_EQ(seen[0]->subsystem(), "com.orvex.platform");
    EXPECT_EQ(seen[0]->category(), "shared-category");
    EXPECT_NE(&Log::platform("other-category"), seen[0]);
    EXPECT_EQ(&Log::platform("bad\ncategory"), &Log::defaultLog());
    EXPECT_EQ(&Log::platform(""), &Log::defaultLog());
}

TEST(Log, CaptureSeesEveryLevelWhateverTheThreshold)
{
    auto log = Log::create("com.orvex.test", "capture");
    ASSERT_TRUE(log.ok());
    Log::Capture capture;
    EXPECT_TRUE((*log)->enabled(LogLevel::Debug));
    (*log)->debug("d %d", 1);
    (*log)->info("i %s", "two");
    (*log)->notice("n");
    (*log)->error("e");

    auto records = capture.records();
    ASSERT_EQ(records.size(), 4u);
    EXPECT_EQ(records[0].message, "d 1");
    EXPECT_EQ(records[0].level, LogLevel::Debug);
    EXPECT_EQ(records[1].message, "i two");
    EXPECT_EQ(records[1].level, LogLevel::Info);
    EXPECT_EQ(records[2].level, LogLevel::Default);
    EXPECT_EQ(records[3].level, LogLevel::Error);
    EXPECT_EQ(records[3].subsystem, "com.orvex.test");
    EXPECT_EQ(records[3].category, "capture");
}

TEST(Log, NestedCapturesEachSeeRecordsWhileTheyLive)
{
    Log::Capture outer;
    {
        Log::Capture inner;
        Log::defaultLog().notice("both");
        EXPECT_EQ(inner.count("both"), 1u);
    }
    Log::defaultLog().notice("outer only");
    EXPECT_EQ(outer.count("both"), 1u);
    EXPECT_EQ(outer.count("outer only"), 1u);
    outer.clear();
    EXPECT_TRUE(outer.records().empty());
}

TEST(Log, CaptureWaitsForARecordFromAnotherThread)
{
    Log::Capture capture;
    std::thread writer([] { Log::defaultLog().info("from the writer"); });
    EXPECT_TRUE(capture.waitFor("from the writer"));
    writer.join();
    EXPECT_FALSE(capture.waitFor("never written", std::chrono::milliseconds(0)));
    EXPECT_TRUE(capture.waitUntil([](const auto& records) { return records.size() == 1; }));
}

TEST(Log, StderrLineCarriesTimeProgramNamesLevelAndMessage)
{
    if (journalPresent())
        GTEST_SKIP() << "records go to the journal on this machine";
    auto log = Log::create("com.orvex.test", "lines");
    ASSERT_TRUE(log.ok());
    StderrRedirect redirect;
    (*log)->error("first\nsecond");
    Log::defaultLog().error("from default");

    auto written = lines(redirect.text());
    ASSERT_EQ(written.size(), 2u);
    std::smatch match;
    ASSERT_TRUE(std::regex_match(written[0], match, kLinePattern)) << written[0];
    EXPECT_EQ(match[1], "com.orvex.test:lines error: first\\nsecond");
    ASSERT_TRUE(std::regex_match(written[1], match, kLinePattern)) << written[1];
    EXPECT_EQ(match[1], "error: from default");
    EXPECT_NE(written[0].find("[" + std::to_string(::getpid()) + "]"), std::string::npos);
}

TEST(Log, ConcurrentWritersProduceWholeLines)
{
    if (journalPresent())
        GTEST_SKIP() << "records go to the journal on this machine";
    constexpr int kThreads = 4;
    constexpr int kRecords = 200;
    std::string payload(300, 'x');
    StderrRedirect redirect;
    {
        std::vector<std::jthread> writers;
        for (int t = 0; t < kThreads; ++t) {
            writers.emplace_back([t, &payload] {
                for (int i = 0; i < kRecords; ++i)
                    Log::defaultLog().error("%d:%d:%s", t, i, payload);
            });
        }
    }
    auto written = lines(redirect.text());
    ASSERT_EQ(written.size(), size_t(kThreads * kRecords));
    const std::regex whole(R"(.* error: \d:\d+:x{300})");
    for (const auto& line : written)
        ASSERT_TRUE(std::regex_match(line, whole)) << line;
}

TEST(LogDeathTest, ThresholdComesFromEnvironmentAndIsReadOnce)
{
    if (journalPresent())
        GTEST_SKIP() << "records go to the journal on this machine";
    GTEST_FLAG_SET(death_test_style, "threadsafe");
    using testing::ExitedWithCode;
    EXPECT_EXIT(logEveryLevelAndExit(nullptr), ExitedWithCode(4 | 8), "");
    EXPECT_EXIT(logEveryLevelAndExit("default"), ExitedWithCode(4 | 8), "");
    EXPECT_EXIT(logEveryLevelAndExit("error"), ExitedWithCode(8), "");
    EXPECT_EXIT(logEveryLevelAndExit("info"), ExitedWithCode(2 | 4 | 8), "");
    EXPECT_EXIT(logEveryLevelAndExit("INFO"), ExitedWithCode(2 | 4 | 8), "");
    EXPECT_EXIT(logEveryLevelAndExit("debug"), ExitedWithCode(1 | 2 | 4 | 8 | 16 | 32), "");
    EXPECT_EXIT(logEveryLevelAndExit("verbose"), ExitedWithCode(4 | 8), "");
}

TEST(FatalDeathTest, InternalInconsistencyLogsTheMessageAndAborts)
{
    GTEST_FLAG_SET(death_test_style, "threadsafe");
    const char* expected = journalPresent() ? "" : "error: queue state torn";
    EXPECT_DEATH(om::internalInconsistency("queue state torn"), expected);
    EXPECT_DEATH(OM_ASSERT(1 + 1 == 3), journalPresent() ? "" : "assertion failed: 1 \\+ 1 == 3");
}
