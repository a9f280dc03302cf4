#include <gtest/gtest.h>

#include <algorithm>
#include <cstdint>
#include <numeric>
#include <vector>

#include "platform/ByteQueue.h"

namespace om {
namespace {

std::vector<uint8_t> run(size_t count, uint8_t first)
{
    std::vector<uint8_t> bytes(count);
    std::iota(bytes.begin(), bytes.end(), first);
    return bytes;
}

std::vector<uint8_t> contents(const ByteQueue& queue)
{
    return { queue.data(), queue.data() + queue.size() };
}

// A model of the queue (a plain vector) driven through the same steps: whatever the queue does
// with its allocation, the bytes that come out are the bytes that went in, in order.
TEST(ByteQueue, KeepsOrderThroughGrowthAndReclaimedFronts)
{
    struct Step {
        size_t append;
        size_t consume;
    };
    const std::vector<Step> steps = {
        { 10, 0 },
        { 5000, 3 },
        { 1, 5000 },
        { 7000, 0 },
        { 0, 6000 },
        { 9000, 1 },
        { 3, 9000 },
        { 100, 1000 },
    };
    ByteQueue queue(0);
    std::vector<uint8_t> model;
    uint8_t next = 0;
    for (const auto& step : steps) {
        auto bytes = run(step.append, next);
        next = uint8_t(next + step.append);
        ASSERT_TRUE(queue.append(bytes));
        model.insert(model.end(), bytes.begin(), bytes.end());
        queue.consume(step.consume);
        model.erase(model.begin(), model.begin() + std::ptrdiff_t(std::min(step.consume, model.size())));
        ASSERT_EQ(contents(queue), model);
    }
}

TEST(ByteQueue, LimitBoundsTheAllocationNotOnlyTheBytes)
{
    struct Case {
        const char* name;
        size_t held; // appended first, within the limit
        size_t more;
        size_t limit;
        bool fits;
    };
    const std::vector<Case> cases = {
        { "ExactlyTheLimit", 6000, 4000, 10000, true },
        { "OneByteOver", 6000, 4001, 10000, false },
        { "EmptyQueueOverTheLimit", 0, 10001, 10000, false },
        { "NothingMoreAlwaysFits", 10000, 0, 10000, true },
    };
    for (const auto& c : cases) {
        ByteQueue queue(0);
        ASSERT_TRUE(queue.append(run(c.held, 0), c.limit)) << c.name;
        EXPECT_EQ(queue.append(run(c.more, 1), c.limit), c.fits) << c.name;
        EXPECT_EQ(queue.size(), c.fits ? c.held + c.more : c.held) << c.name << ": a refusal changes nothing";
        EXPECT_LE(queue.capacity(), std::max(c.limit, queue.size())) << c.name;
    }
}

// Doubling would take the allocation past the limit: it stops at the limit instead, and a queue
// full to its limit still takes bytes once the front is consumed, without growing.
TEST(ByteQueue, GrowthStopsAtTheLimitAndTheFrontIsReusedThere)
{
    ByteQueue queue(0);
    const size_t limit = 12000;
    ASSERT_TRUE(queue.append(run(8000, 0), limit));
    ASSERT_TRUE(queue.append(run(4000, 0), limit));
    EXPECT_EQ(queue.capacity(), limit);
    queue.consume(10);
    EXPECT_TRUE(queue.append(run(10, 7), limit));
    EXPECT_EQ(queue.capacity(), limit);
    EXPECT_EQ(queue.data()[queue.size() - 1], uint8_t(16));
    EXPECT_FALSE(queue.append(run(1, 0), limit));
}

TEST(ByteQueue, EmptiedQueueGivesBackWhatExceedsTheRetainedCapacity)
{
    struct Case {
        size_t retained;
        size_t filled;
        bool keepsAllocation;
    };
    for (const auto& c : std::vector<Case> { { 65536, 4096, true }, { 65536, 200000, false }, { 0, 1, false } }) {
        ByteQueue queue(c.retained);
        ASSERT_TRUE(queue.append(run(c.filled, 0)));
        queue.consume(c.filled / 2);
        EXPECT_GT(queue.capacity(), 0u) << "not empty yet";
        queue.consume(c.filled);
        EXPECT_TRUE(queue.empty());
        EXPECT_EQ(queue.capacity() > 0, c.keepsAllocation) << c.retained << " " << c.filled;
    }
}

TEST(ByteQueue, ClearAndMoveLeaveNothingBehind)
{
    ByteQueue queue(1 << 20);
    ASSERT_TRUE(queue.append(run(100, 0)));
    ByteQueue moved(std::move(queue));
    EXPECT_EQ(moved.size(), 100u);
    EXPECT_EQ(queue.capacity(), 0u); // NOLINT(bugprone-use-after-move): moved-from state is specified
    EXPECT_TRUE(queue.append(run(3, 9)));
    moved = std::move(queue);
    EXPECT_EQ(contents(moved), run(3, 9));
    moved.clear();
    EXPECT_EQ(moved.capacity(), 0u);
    EXPECT_TRUE(moved.empty());
}

} // namespace
} // namespace om
