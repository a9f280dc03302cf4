#include "Ombrel/OMLog.h"

#include <mutex>

namespace om {

namespace {

constexpr const char* kSubsystem = "com.orvex.Ombrel";
constexpr std::array<const char*, 4> kCategories = { "ops", "traffic", "extension", "rg" };

} // namespace

OMLog::OMLog(const Factory& factory)
{
    for (size_t i = 0; i < kCategories.size(); ++i) {
        auto created = factory(kSubsystem, kCategories[i]);
        if (created.ok()) {
            m_owned[i] = std::move(created).releaseValue();
            m_handles[i] = m_owned[i].get();
        } else {
            Log::defaultLog().error("unable to create evlog for category %s", kCategories[i]);
            m_handles[i] = &Log::defaultLog();
        }
    }
}

const OMLog& OMLog::shared()
{
    static std::once_flag once;
    static const OMLog* handles = nullptr;
    // Never destroyed: queue threads may still log while static destructors run.
    std::call_once(once, [] { handles = new OMLog(&Log::create); });
    return *handles;
}

const Log& OMLog::ops()
{
    return shared().handle(Category::Ops);
}

const Log& OMLog::traffic()
{
    return shared().handle(Category::Traffic);
}

const Log& OMLog::extension()
{
    return shared().handle(Category::Extension);
}

const Log& OMLog::rg()
{
    return shared().handle(Category::Rg);
}

} // namespace om
