#include <gtest/gtest.h>

#include <set>
#include <thread>

#include "Ombrel/OMLog.h"

using om::Log;
using om::OMError;
using om::OMLog;

TEST(OMLog, HandlesHaveTheDaemonsSubsystemAndTheirCategory)
{
    EXPECT_EQ(OMLog::ops().subsystem(), "com.orvex.Ombrel");
    EXPECT_EQ(OMLog::ops().category(), "ops");
    EXPECT_EQ(OMLog::traffic().category(), "traffic");
    EXPECT_EQ(OMLog::extension().category(), "extension");
    EXPECT_EQ(OMLog::rg().category(), "rg");
    EXPECT_EQ(OMLog::rg().subsystem(), "com.orvex.Ombrel");
}

TEST(OMLog, ConcurrentFirstUseYieldsOneSetOfHandles)
{
    constexpr int kThreads = 8;
    std::vector<const Log*> seen(kThreads * 2);
    {
        std::vector<std::jthread> threads;
        for (int i = 0; i < kThreads; ++i) {
            threads.emplace_back([&seen, i] {
                seen[2 * i] = &OMLog::traffic();
                seen[2 * i + 1] = &OMLog::ops();
            });
        }
    }
    for (int i = 0; i < kThreads; ++i) {
        EXPECT_EQ(seen[2 * i], &OMLog::traffic());
        EXPECT_EQ(seen[2 * i + 1], &OMLog::ops());
    }
    std::set<const Log*> distinct = { &OMLog::ops(), &OMLog::traffic(), &OMLog::extension(), &OMLog::rg() };
    EXPECT_EQ(distinct.size(), 4u);
}

TEST(OMLog, RefusedCategoryFallsBackToTheDefaultHandleAndSaysSo)
{
    Log::Capture capture;
    std::vector<std::string> asked;
    OMLog handles([&asked](std::string subsystem, std::string category) -> om::Result<std::shared_ptr<Log>> {
        asked.push_back(category);
        if (category == "traffic" || category == "rg")
            return OMError("Platform", 3, "refused");
        return Log::create(std::move(subsystem), std::move(category));
    });

    EXPECT_EQ(asked, (std::vector<std::string> { "ops", "traffic", "extension", "rg" }));
    EXPECT_EQ(&handles.handle(OMLog::Category::Traffic), &Log::defaultLog());
    EXPECT_EQ(&handles.handle(OMLog::Category::Rg), &Log::defaultLog());
    EXPECT_EQ(handles.handle(OMLog::Category::Ops).category(), "ops");
    EXPECT_EQ(handles.handle(OMLog::Category::Extension).category(), "extension");

    auto records = capture.records();
    ASSERT_EQ(records.size(), 2u);
    EXPECT_EQ(records[0].message, "unable to create evlog for category traffic");
    EXPECT_EQ(records[0].level, om::LogLevel::Error);
    EXPECT_EQ(records[0].subsystem, "");
    EXPECT_EQ(records[1].message, "unable to create evlog for category rg");
}
