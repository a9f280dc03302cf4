// "omctl ps" output without a jobd: the table's columns line up whatever the widths, and --json
// carries every field.
#include <gtest/gtest.h>

#include "tools/omctl/OmctlJobs.h"

namespace om {
namespace {

JobInstanceInfo instance(pid_t host, std::string identifier, pid_t pid, std::string profile, bool busy)
{
    JobInstanceInfo info;
    info.hostPid = host;
    info.bundleIdentifier = std::move(identifier);
    info.pid = pid;
    info.profile = std::move(profile);
    info.busy = busy;
    return info;
}

TEST(OmctlPs, TheTableAlignsEveryColumnToItsWidestCell)
{
    struct Row {
        const char* name;
        std::vector<JobInstanceInfo> instances;
        std::string table;
    };
    const std::vector<Row> rows {
        { "none", {}, "no plug-in instances running\n" },
        { "one, short identifier", { instance(7, "a.b", 1234, "plugin", false) },
            "HOST PLUG-IN PID  PROFILE BUSY\n"
            "7    a.b     1234 plugin  no\n" },
        { "two, wider cells than the header",
            { instance(100200, "com.example.photos.filters", 9, "plugin", true),
                instance(3, "com.example.keys.keyboard", 4000000, "keyboard", false) },
            "HOST   PLUG-IN                    PID     PROFILE  BUSY\n"
            "100200 com.example.photos.filters 9       plugin   yes\n"
            "3      com.example.keys.keyboard  4000000 keyboard no\n" },
    };
    for (const Row& row : rows) {
        SCOPED_TRACE(row.name);
        EXPECT_EQ(OmctlJobs::table(row.instances), row.table);
    }
}

TEST(OmctlPs, TheValueCarriesEachInstanceInOrder)
{
    const Value listed = OmctlJobs::value(
        { instance(1, "x.one", 2, "plugin", true), instance(3, "x.two", 4, "network-filter", false) });
    const Value expected = Value::dictionary({ { "instances",
        Value::array({ Value::dictionary({ { "host", int64_t(1) }, { "plugin", "x.one" }, { "pid", int64_t(2) },
                           { "profile", "plugin" }, { "busy", Value::boolean(true) } }),
            Value::dictionary({ { "host", int64_t(3) }, { "plugin", "x.two" }, { "pid", int64_t(4) },
                { "profile", "network-filter" }, { "busy", Value::boolean(false) } }) }) } });
    EXPECT_EQ(listed, expected);
    EXPECT_EQ(OmctlJobs::value({}), Value::dictionary({ { "instances", Value::array({}) } }));
}

} // namespace
} // namespace om
