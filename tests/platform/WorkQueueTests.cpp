#include <gtest/gtest.h>
#include <pthread.h>
#include <sys/resource.h>
#include <sys/stat.h>
#include <unistd.h>

#include <atomic>
#include <future>
#include <mutex>
#include <ostream>
#include <string>
#include <thread>
#include <vector>

#include "platform/RunLoop.h"
#include "platform/WorkQueue.h"

using om::QualityOfService;
using om::WorkQueue;

namespace {

// Long enough that only a broken queue reaches it.
constexpr auto kGenerous = std::chrono::seconds(30);

template <typename T> bool arrives(std::future<T>& future)
{
    return future.wait_for(kGenerous) == std::future_status::ready;
}

// Regex for a death message, or anything when records go to the journal instead of stderr.
const char* onStderr(const char* pattern)
{
    struct stat info;
    return ::stat("/run/systemd/journal/socket", &info) == 0 ? "" : pattern;
}

int currentNice()
{
    return ::getpriority(PRIO_PROCESS, static_cast<id_t>(::gettid()));
}

} // namespace

TEST(WorkQueue, RunsItemsInSubmissionOrderAcrossSubmittingThreads)
{
    constexpr int kThreads = 4;
    constexpr int kItems = 1000;
    auto queue = WorkQueue::create("com.orvex.test.order");
    std::vector<std::pair<int, int>> ran; // touched only on the queue, read after a sync
    std::atomic<int> running { 0 };
    std::atomic<bool> overlapped { false };
    std::thread::id worker;
    std::atomic<bool> sameThread { true };

    {
        std::vector<std::jthread> submitters;
        for (int t = 0; t < kThreads; ++t) {
            submitters.emplace_back([&, t] {
                for (int i = 0; i < kItems; ++i) {
                    queue->async([&, t, i] {
                        if (running.fetch_add(1) != 0)
                            overlapped = true;
                        if (worker == std::thread::id())
                            worker = std::this_thread::get_id();
                        else if (worker != std::this_thread::get_id())
                            sameThread = false;
                        ran.emplace_back(t, i);
                        running.fetch_sub(1);
                    });
                }
            });
        }
    }
    queue->sync([] {});

    ASSERT_EQ(ran.size(), size_t(kThreads * kItems));
    std::vector<int> next(kThreads, 0);
    for (auto [t, i] : ran) {
        ASSERT_EQ(i, next[t]) << "items of submitter " << t << " ran out of order";
        ++next[t];
    }
    EXPECT_FALSE(overlapped);
    EXPECT_TRUE(sameThread);
}

TEST(WorkQueue, SyncWaitsForEverythingQueuedBeforeIt)
{
    auto queue = WorkQueue::create("com.orvex.test.sync");
    std::promise<void> gate;
    auto opened = gate.get_future().share();
    std::vector<int> ran;
    queue->async([opened] { opened.wait(); });
    for (int i = 0; i < 100; ++i)
        queue->async([&ran, i] { ran.push_back(i); });

    auto syncer = std::async(std::launch::async, [&] {
        size_t seen = 0;
        queue->sync([&] { seen = ran.size(); });
        return seen;
    });
    gate.set_value();
    ASSERT_TRUE(arrives(syncer));
    EXPECT_EQ(syncer.get(), 100u);
}

TEST(WorkQueue, SyncHoldsTheQueueUntilTheClosureReturns)
{
    auto queue = WorkQueue::create("com.orvex.test.hold");
    std::mutex mutex;
    std::vector<std::string> events;
    auto record = [&](std::string event) {
        std::lock_guard lock(mutex);
        events.push_back(std::move(event));
    };
    queue->sync([&] {
        EXPECT_TRUE(queue->isCurrent());
        queue->async([&] { record("queued during sync"); });
        std::this_thread::yield();
        record("closure end");
    });
    queue->sync([] {});
    ASSERT_EQ(events.size(), 2u);
    EXPECT_EQ(events[0], "closure end");
    EXPECT_EQ(events[1], "queued during sync");
    EXPECT_FALSE(queue->isCurrent());
}

// Callers that find the queue idle take it without its thread; the others wait their turn behind
// it. Either way no two closures or items overlap, which the unguarded counter (and TSan) check.
TEST(WorkQueue, SyncCallersAndItemsNeverOverlap)
{
    auto queue = WorkQueue::create("com.orvex.test.contend");
    int counter = 0;
    int inside = 0;
    bool overlapped = false;
    auto enter = [&] {
        overlapped = overlapped || inside++ != 0;
        ++counter;
        --inside;
    };
    std::vector<std::thread> callers;
    for (int t = 0; t < 4; ++t) {
        callers.emplace_back([&] {
            for (int i = 0; i < 2000; ++i) {
                if (i % 3 == 0)
                    queue->async(enter);
                else
                    queue->sync(enter);
            }
        });
    }
    for (auto& caller : callers)
        caller.join();
    queue->sync([] {});
    EXPECT_FALSE(overlapped);
    EXPECT_EQ(counter, 8000);
}

TEST(WorkQueue, NestedSyncMakesBothQueuesCurrent)
{
    auto outer = WorkQueue::create("com.orvex.test.outer");
    auto inner = WorkQueue::create("com.orvex.test.inner");
    bool innerSawBoth = false;
    bool outerStillCurrent = false;
    bool innerReleased = false;
    outer->sync([&] {
        inner->sync([&] { innerSawBoth = outer->isCurrent() && inner->isCurrent(); });
        outerStillCurrent = outer->isCurrent();
        innerReleased = !inner->isCurrent();
    });
    EXPECT_TRUE(innerSawBoth);
    EXPECT_TRUE(outerStillCurrent);
    EXPECT_TRUE(innerReleased);
    EXPECT_FALSE(outer->isCurrent());
}

TEST(WorkQueue, SyncFromAnotherQueuesItemSeesBothCurrent)
{
    auto service = WorkQueue::create("com.orvex.test.service");
    auto guard = WorkQueue::create("com.orvex.test.guard");
    std::promise<std::pair<bool, bool>> seen;
    service->async([&] { guard->sync([&] { seen.set_value({ service->isCurrent(), guard->isCurrent() }); }); });
    auto result = seen.get_future();
    ASSERT_TRUE(arrives(result));
    auto [serviceCurrent, guardCurrent] = result.get();
    EXPECT_TRUE(serviceCurrent);
    EXPECT_TRUE(guardCurrent);
}

TEST(WorkQueue, IsCurrentOnlyOnItsOwnThread)
{
    auto queue = WorkQueue::create("com.orvex.test.current");
    auto other = WorkQueue::create("com.orvex.test.other");
    std::promise<std::pair<bool, bool>> seen;
    queue->async([&] {
        queue->assertCurrent();
        other->assertNotCurrent();
        seen.set_value({ queue->isCurrent(), other->isCurrent() });
    });
    auto result = seen.get_future();
    ASSERT_TRUE(arrives(result));
    EXPECT_EQ(result.get(), std::make_pair(true, false));
    EXPECT_FALSE(queue->isCurrent());
    queue->assertNotCurrent();
}

TEST(WorkQueue, DestructorRunsEverythingQueued)
{
    std::atomic<int> ran { 0 };
    {
        auto queue = WorkQueue::create("com.orvex.test.drain");
        std::promise<void> gate;
        auto opened = gate.get_future().share();
        queue->async([opened] { opened.wait(); });
        for (int i = 0; i < 50; ++i)
            queue->async([&] { ran.fetch_add(1); });
        gate.set_value();
    }
    EXPECT_EQ(ran.load(), 50);
}

TEST(WorkQueue, ItemsQueuedByItemsDuringDestructionStillRun)
{
    std::atomic<bool> ranLate { false };
    {
        auto queue = WorkQueue::create("com.orvex.test.late");
        WorkQueue* raw = queue.get();
        queue->async([raw, &ranLate] { raw->async([&ranLate] { ranLate = true; }); });
    }
    EXPECT_TRUE(ranLate);
}

TEST(WorkQueue, LastReferenceDroppedAfterItsOwnItemReturns)
{
    auto queue = WorkQueue::create("com.orvex.test.selfdrop");
    std::promise<void> gate;
    auto opened = gate.get_future().share();
    std::promise<void> finished;
    WorkQueue* raw = queue.get();
    std::weak_ptr<WorkQueue> watcher = queue;

    raw->async([opened] { opened.wait(); });
    raw->async([keep = queue] {}); // its closure holds the last reference once the test lets go
    raw->async([&finished] { finished.set_value(); });
    queue.reset();
    gate.set_value();

    auto done = finished.get_future();
    ASSERT_TRUE(arrives(done)) << "items queued behind the last reference never ran";
    EXPECT_TRUE(watcher.expired());
}

TEST(WorkQueue, LastReferenceDroppedInsideItsOwnItem)
{
    auto holder = std::make_shared<std::shared_ptr<WorkQueue>>(WorkQueue::create("com.orvex.test.inside"));
    WorkQueue* raw = holder->get();
    std::weak_ptr<WorkQueue> watcher = *holder;
    std::promise<void> gate;
    auto opened = gate.get_future().share();
    std::promise<bool> after;
    std::promise<void> finished;

    raw->async([opened] { opened.wait(); });
    raw->async([holder, &after, watcher] {
        holder->reset(); // the queue is destroyed here, on its own thread, mid-item
        after.set_value(watcher.expired());
    });
    raw->async([&finished] { finished.set_value(); });
    gate.set_value();

    auto expired = after.get_future();
    ASSERT_TRUE(arrives(expired));
    EXPECT_TRUE(expired.get());
    auto done = finished.get_future();
    EXPECT_TRUE(arrives(done));
}

TEST(WorkQueue, SyncKeepsTheQueueAliveWhenTheClosureDropsTheLastReference)
{
    auto queue = WorkQueue::create("com.orvex.test.syncdrop");
    std::weak_ptr<WorkQueue> watcher = queue;
    WorkQueue* raw = queue.get();
    raw->sync([&] {
        queue.reset();
        EXPECT_FALSE(watcher.expired());
        EXPECT_TRUE(raw->isCurrent());
    });
    EXPECT_TRUE(watcher.expired());
}

TEST(WorkQueue, ThreadIsNamedAfterTheLabelTruncatedToFifteenBytes)
{
    auto queue = WorkQueue::create("com.orvex.ombrel.service");
    auto exact = WorkQueue::create("fifteen-bytes!!");
    auto nameOf = [](const std::shared_ptr<WorkQueue>& q) {
        std::promise<std::string> seen;
        q->async([&seen] {
            char buffer[32] = {};
            ::pthread_getname_np(::pthread_self(), buffer, sizeof buffer);
            seen.set_value(buffer);
        });
        return seen.get_future().get();
    };
    EXPECT_EQ(nameOf(queue), "com.orvex.ombre");
    EXPECT_EQ(nameOf(exact), "fifteen-bytes!!");
    EXPECT_EQ(queue->label(), "com.orvex.ombrel.service");
}

TEST(WorkQueue, QualityOfServiceSetsTheThreadsNiceValue)
{
    int callerNice = currentNice();
    auto niceOf = [](QualityOfService qos, int relative) {
        auto queue = WorkQueue::create("com.orvex.test.qos", qos, relative);
        std::promise<int> seen;
        queue->async([&seen] { seen.set_value(currentNice()); });
        return seen.get_future().get();
    };
    // Raising the nice value is always permitted; lowering it may be refused, never worsened.
    EXPECT_EQ(niceOf(QualityOfService::Background, 0), std::max(10, callerNice));
    EXPECT_EQ(niceOf(QualityOfService::Background, -15), std::max(15, callerNice));
    EXPECT_EQ(niceOf(QualityOfService::Utility, 0), std::max(5, callerNice));
    EXPECT_LE(niceOf(QualityOfService::UserInteractive, 0), callerNice);
    EXPECT_GE(niceOf(QualityOfService::UserInteractive, 0), -10);
    EXPECT_LE(niceOf(QualityOfService::UserInitiated, 0), callerNice);
    EXPECT_EQ(WorkQueue::create("q", QualityOfService::Utility)->qualityOfService(), QualityOfService::Utility);
}

TEST(WorkQueueDeathTest, SyncFromItsOwnSyncClosureAbortsNamingTheQueue)
{
    GTEST_FLAG_SET(death_test_style, "threadsafe");
    EXPECT_DEATH(
        {
            auto queue = WorkQueue::create("com.orvex.test.reentry");
            queue->sync([&] { queue->sync([] {}); });
        },
        onStderr("sync onto work queue \"com.orvex.test.reentry\""));
}

TEST(WorkQueueDeathTest, SyncFromItsOwnItemAborts)
{
    GTEST_FLAG_SET(death_test_style, "threadsafe");
    EXPECT_DEATH(
        {
            auto queue = WorkQueue::create("com.orvex.test.itemreentry");
            queue->async([&] { queue->sync([] {}); });
            queue->sync([] {});
        },
        onStderr("com.orvex.test.itemreentry"));
}

// Queues "chain.a", "chain.b" and "chain.c", and a way into a lock-order cycle through them. Each
// scenario would hang for ever without the check; with it, whichever thread closes the cycle
// aborts, naming a queue it already holds.
struct SyncCycle {
    const char* name;
    void (*enter)(WorkQueue& a, WorkQueue& b, WorkQueue& c);
};

void PrintTo(const SyncCycle& cycle, std::ostream* out)
{
    *out << cycle.name;
}

const SyncCycle kSyncCycles[] = {
    { "OneThreadThroughThreeQueues",
        [](WorkQueue& a, WorkQueue& b, WorkQueue& c) {
            a.sync([&] { b.sync([&] { c.sync([&] { a.sync([] {}); }); }); });
        } },
    { "QueueThreadThroughTwoOthers",
        [](WorkQueue& a, WorkQueue& b, WorkQueue& c) {
            a.async([&] { b.sync([&] { c.sync([&] { a.sync([] {}); }); }); });
            a.sync([] {});
        } },
    // The caller holds a and waits for b, whose thread is busy with an item that waits for a.
    { "AcrossTwoThreads",
        [](WorkQueue& a, WorkQueue& b, WorkQueue&) {
            a.sync([&] {
                b.async([&] { a.sync([] {}); });
                b.sync([] {});
            });
        } },
    // The caller holds a and waits for b; b's thread waits for c; c's thread waits for a.
    { "AcrossThreeThreads",
        [](WorkQueue& a, WorkQueue& b, WorkQueue& c) {
            a.sync([&] {
                c.async([&] { a.sync([] {}); });
                b.async([&] { c.sync([] {}); });
                b.sync([] {});
            });
        } },
};

class WorkQueueSyncCycleDeathTest : public ::testing::TestWithParam<SyncCycle> { };

TEST_P(WorkQueueSyncCycleDeathTest, AbortsNamingAQueueTheCallerHolds)
{
    GTEST_FLAG_SET(death_test_style, "threadsafe");
    EXPECT_DEATH(
        {
            auto a = WorkQueue::create("chain.a");
            auto b = WorkQueue::create("chain.b");
            auto c = WorkQueue::create("chain.c");
            GetParam().enter(*a, *b, *c);
        },
        onStderr("sync onto work queue \"chain\\.[abc]\" from code already running on it"));
}

INSTANTIATE_TEST_SUITE_P(Chains, WorkQueueSyncCycleDeathTest, ::testing::ValuesIn(kSyncCycles),
    [](const auto& info) { return std::string(info.param.name); });

// The other side of the check: waiting for a queue whose holder waits for nothing of ours, or
// holding a queue that someone waits for while we wait for nothing of theirs, is no cycle.
TEST(WorkQueue, SyncWaitsOutHoldersThatWaitForNothingOfOurs)
{
    auto a = WorkQueue::create("com.orvex.test.held");
    auto b = WorkQueue::create("com.orvex.test.busy");
    std::vector<std::string> events;
    std::mutex eventsMutex;
    auto note = [&](std::string event) {
        std::lock_guard lock(eventsMutex);
        events.push_back(std::move(event));
    };

    // b's thread is busy with an item that waits on something that is no queue, while this thread
    // holds a and waits for b.
    std::promise<void> itemStarted;
    std::promise<void> releaseItem;
    b->async([&, released = releaseItem.get_future().share()] {
        itemStarted.set_value();
        released.wait();
        note("b's item done");
    });
    itemStarted.get_future().wait();
    a->sync([&] {
        releaseItem.set_value();
        b->sync([&] { note("caller holds a and b"); });
    });

    // b's item waits for a, which this thread holds while it waits for nothing of b's.
    std::promise<void> itemWaitsForA;
    a->sync([&] {
        b->async([&] {
            itemWaitsForA.set_value();
            a->sync([&] { note("b's item holds a"); });
        });
        itemWaitsForA.get_future().wait();
        note("caller lets a go");
    });
    b->sync([] {});

    const std::vector<std::string> expected
        = { "b's item done", "caller holds a and b", "caller lets a go", "b's item holds a" };
    EXPECT_EQ(events, expected);
}

TEST(WorkQueueDeathTest, AssertCurrentOffTheQueueAborts)
{
    GTEST_FLAG_SET(death_test_style, "threadsafe");
    EXPECT_DEATH(WorkQueue::create("com.orvex.test.elsewhere")->assertCurrent(),
        onStderr("expected to run on work queue \"com.orvex.test.elsewhere\""));
}

TEST(WorkQueueDeathTest, AssertNotCurrentOnTheQueueAborts)
{
    GTEST_FLAG_SET(death_test_style, "threadsafe");
    EXPECT_DEATH(
        {
            auto queue = WorkQueue::create("com.orvex.test.here");
            queue->sync([&] { queue->assertNotCurrent(); });
        },
        onStderr("must not run on work queue \"com.orvex.test.here\""));
}

TEST(RunLoopDeathTest, ParksTheCallerWhileOtherThreadsWork)
{
    GTEST_FLAG_SET(death_test_style, "threadsafe");
    EXPECT_EXIT(
        {
            auto queue = WorkQueue::create("com.orvex.test.runloop");
            queue->async([] { ::_exit(7); });
            om::RunLoop::runForever();
        },
        testing::ExitedWithCode(7), "");
}
