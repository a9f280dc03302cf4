#include "platform/RegistrarNotifier.h"

#include "platform/Registrar.h"

namespace om {

RegistrarNotifier::RegistrarNotifier()
    : m_observers(std::make_shared<Observers>())
    , m_queue(WorkQueue::create("com.orvex.platform.registrar.notifications", QualityOfService::Utility))
{
}

RegistrarNotifier::~RegistrarNotifier() = default;

std::vector<std::shared_ptr<RegistrarObserver>> RegistrarNotifier::Observers::live()
{
    std::lock_guard lock(mutex);
    std::erase_if(observers, [](const auto& observer) { return observer.expired(); });
    std::vector<std::shared_ptr<RegistrarObserver>> strong;
    strong.reserve(observers.size());
    for (const auto& observer : observers) {
        if (auto locked = observer.lock())
            strong.push_back(std::move(locked));
    }
    return strong;
}

void RegistrarNotifier::addObserver(std::weak_ptr<RegistrarObserver> observer)
{
    std::lock_guard lock(m_observers->mutex);
    m_observers->observers.push_back(std::move(observer));
}

void RegistrarNotifier::serialize(const std::function<void()>& work)
{
    if (m_queue->isCurrent())
        work();
    else
        m_queue->sync(work);
}

void RegistrarNotifier::announceInstall(RegistrarPlugInRecords records)
{
    m_queue->assertCurrent();
    if (records.empty())
        return;
    m_queue->async([observers = m_observers, records = std::move(records)] {
        for (const auto& observer : observers->live())
            observer->pluginsDidInstall(records);
    });
}

void RegistrarNotifier::announceUninstall(const RegistrarPlugInRecords& records)
{
    m_queue->assertCurrent();
    if (records.empty())
        return;
    for (const auto& observer : m_observers->live())
        observer->pluginsWillUninstall(records);
}

void RegistrarNotifier::waitForNotifications() const
{
    // On the queue itself there is nothing to wait for that could ever arrive first.
    if (!m_queue->isCurrent())
        m_queue->sync([] {});
}

} // namespace om
