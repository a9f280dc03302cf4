#include "tools/omctl/OmctlJobs.h"

#include <algorithm>
#include <ostream>

#include "platform/Format.h"
#include "tools/omctl/OmctlArguments.h"

namespace om {

const char* const OmctlJobs::kPsHelp = R"(usage: omctl [--json] ps

Lists the plug-in instances jobd is running, one a line: the pid of the host
that launched it, the plug-in's bundle identifier, the instance's pid, its
sandbox profile and whether it declared itself busy. Asks jobd (the service
JOBD_SERVICE_NAME names, default com.orvex.jobd) directly, not omd; jobd
answers root, its own user and entitled managers.
)";

namespace {

std::string padded(std::string text, size_t width)
{
    text.resize(std::max(text.size(), width), ' ');
    return text;
}

std::string row(const std::vector<std::string>& columns, const std::vector<size_t>& widths)
{
    std::string line;
    for (size_t i = 0; i < columns.size(); ++i)
        line += i + 1 < columns.size() ? padded(columns[i], widths[i]) + ' ' : columns[i];
    return line + '\n';
}

} // namespace

std::string OmctlJobs::table(const std::vector<JobInstanceInfo>& instances)
{
    if (instances.empty())
        return "no plug-in instances running\n";
    std::vector<std::vector<std::string>> rows { { "HOST", "PLUG-IN", "PID", "PROFILE", "BUSY" } };
    for (const JobInstanceInfo& instance : instances) {
        rows.push_back({ std::to_string(instance.hostPid), instance.bundleIdentifier, std::to_string(instance.pid),
            instance.profile, instance.busy ? "yes" : "no" });
    }
    std::vector<size_t> widths(rows.front().size(), 0);
    for (const auto& columns : rows) {
        for (size_t i = 0; i < columns.size(); ++i)
            widths[i] = std::max(widths[i], columns[i].size());
    }
    std::string text;
    for (const auto& columns : rows)
        text += row(columns, widths);
    return text;
}

Value OmctlJobs::value(const std::vector<JobInstanceInfo>& instances)
{
    ArrayBuilder list;
    for (const JobInstanceInfo& instance : instances) {
        list.append(Value::dictionary({ { "host", int64_t(instance.hostPid) }, { "plugin", instance.bundleIdentifier },
            { "pid", int64_t(instance.pid) }, { "profile", instance.profile },
            { "busy", Value::boolean(instance.busy) } }));
    }
    return Value::dictionary({ { "instances", list.build() } });
}

int OmctlJobs::ps(OmctlContext& context, const std::vector<std::string>& arguments)
{
    auto parsed = OmctlArguments::parse(arguments, {});
    if (!parsed.ok())
        return context.usage("ps: " + parsed.error().localizedDescription());
    if (!parsed->operands().empty())
        return context.usage("ps: takes no operands");
    auto listed = JobManagerList();
    if (!listed.ok()) {
        return context.failure(
            "ps", format("jobd (%s) did not list: %s", JobManagerServiceName(), listed.error().localizedDescription()));
    }
    if (context.json())
        context.print(value(*listed));
    else
        context.out() << table(*listed);
    return kOmctlSuccess;
}

} // namespace om
