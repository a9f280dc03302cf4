#include <gtest/gtest.h>
#include <sys/resource.h>

#include <cstdlib>

#include "platform/ProcessResources.h"

namespace om {
namespace {

// Restores the test process's own limit, whatever a case did to it.
class DescriptorLimit : public ::testing::Test {
protected:
    void SetUp() override { ASSERT_EQ(::getrlimit(RLIMIT_NOFILE, &m_saved), 0); }
    void TearDown() override { ::setrlimit(RLIMIT_NOFILE, &m_saved); }

    static rlimit current()
    {
        rlimit limit {};
        ::getrlimit(RLIMIT_NOFILE, &limit);
        return limit;
    }

    rlimit m_saved {};
};

TEST_F(DescriptorLimit, SoftLimitIsRaisedToTheHardOne)
{
    const rlim_t hard = m_saved.rlim_max;
    if (hard == RLIM_INFINITY || hard < 128)
        GTEST_SKIP() << "needs a finite hard limit above 128";
    for (rlim_t soft : { rlim_t(64), hard - 1, hard }) {
        rlimit lowered { soft, hard };
        ASSERT_EQ(::setrlimit(RLIMIT_NOFILE, &lowered), 0);
        auto raised = ProcessResources::raiseDescriptorLimit();
        ASSERT_TRUE(raised.ok()) << raised.error().localizedDescription();
        EXPECT_EQ(raised.value(), uint64_t(hard)) << "from " << soft;
        EXPECT_EQ(current().rlim_cur, hard) << "from " << soft;
        EXPECT_EQ(current().rlim_max, hard) << "the hard limit is never touched";
    }
}

// Where the hard limit already binds (a daemon started under a strict limit), there is nothing to
// raise and nothing fails. In a child: a lowered hard limit cannot be raised again.
TEST_F(DescriptorLimit, HardLimitEqualToTheSoftOneIsKept)
{
    GTEST_FLAG_SET(death_test_style, "threadsafe");
    auto underAStrictLimit = [] {
        const rlimit strict { 64, 64 };
        if (::setrlimit(RLIMIT_NOFILE, &strict) != 0)
            std::_Exit(2);
        auto raised = ProcessResources::raiseDescriptorLimit();
        std::_Exit(raised.ok() && raised.value() == 64 && current().rlim_cur == 64 ? 0 : 1);
    };
    EXPECT_EXIT(underAStrictLimit(), ::testing::ExitedWithCode(0), "");
}

} // namespace
} // namespace om
