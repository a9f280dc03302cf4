// The Registrar's notification thread and its observers.
//
// Every change of the registry runs while holding this thread's queue (serialize()), so changes
// and their announcements keep one order. Installs are queued and delivered after the change that
// made them; an uninstall is delivered at once, on the caller, still holding the queue, so that the
// caller can remove the registration only after every observer has returned. Code already running
// on the queue (an observer that registers or unregisters in turn) runs its change inline.
#pragma once

#include <functional>
#include <memory>
#include <mutex>
#include <vector>

#include "platform/RegistrarPlugInRecord.h"
#include "platform/WorkQueue.h"

namespace om {

class RegistrarObserver;

class RegistrarNotifier {
public:
    RegistrarNotifier();
    ~RegistrarNotifier();
    RegistrarNotifier(const RegistrarNotifier&) = delete;
    RegistrarNotifier& operator=(const RegistrarNotifier&) = delete;

    void addObserver(std::weak_ptr<RegistrarObserver> observer);

    // Runs work holding the queue: after every notification queued before, before any queued later.
    void serialize(const std::function<void()>& work);
    // Only within serialize().
    void announceInstall(RegistrarPlugInRecords records);
    void announceUninstall(const RegistrarPlugInRecords& records);

    void waitForNotifications() const;

private:
    // Shared with queued deliveries, which may outlive the notifier when the last reference to the
    // workspace is dropped on the notification thread itself.
    struct Observers {
        std::mutex mutex;
        std::vector<std::weak_ptr<RegistrarObserver>> observers;
        std::vector<std::shared_ptr<RegistrarObserver>> live();
    };

    std::shared_ptr<Observers> m_observers;
    std::shared_ptr<WorkQueue> m_queue;
};

} // namespace om
