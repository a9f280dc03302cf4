#include "platform/RegistrarAppRecord.h"

#include <sys/stat.h>

#include "platform/Bundle.h"

namespace om {

RegistrarAppRecord::RegistrarAppRecord(Facts facts)
    : m_facts(std::move(facts))
{
}

RegistrarAppRecord::~RegistrarAppRecord() = default;

std::shared_ptr<const Bundle> RegistrarAppRecord::bundle() const
{
    std::lock_guard lock(m_bundleMutex);
    // A handle made while the directory held no bundle answers nothing for ever; an installer may
    // have finished since, so such a handle is made again.
    if (!m_bundle || !m_bundle->bundlePath())
        m_bundle = Bundle::withPath(m_facts.path);
    return m_bundle;
}

bool RegistrarAppRecord::isPlaceholder() const
{
    auto handle = bundle();
    if (!handle->bundlePath() || handle->infoDictionary().isNone())
        return true;
    auto executable = handle->executablePath();
    struct stat info;
    return !executable || ::stat(executable->c_str(), &info) < 0;
}

std::string RegistrarAppRecord::description() const
{
    return "<RegistrarAppRecord " + m_facts.bundleIdentifier.value_or("(no identifier)") + " " + m_facts.path + ">";
}

} // namespace om
