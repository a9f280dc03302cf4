#include "platform/Notify.h"

#include <systemd/sd-bus.h>

#include "platform/Log.h"
#include "platform/Storage.h"

namespace om {

namespace {

const Log& log()
{
    static const Log& log = Log::platform("notify");
    return log;
}

// Emits one signal on bus and waits until it has left the process. Whatever the bus sent us first
// is read and dropped, so that nothing piles up unread and a hang-up shows here, before the send.
Result<void> emit(sd_bus* bus, const std::string& name)
{
    int r;
    while ((r = sd_bus_process(bus, nullptr)) > 0) { }
    if (r < 0)
        return OMError::fromErrno("sd_bus_process", -r);
    r = sd_bus_emit_signal(bus, Notify::kObjectPath, Notify::kInterface, Notify::kMember, "s", name.c_str());
    if (r < 0)
        return OMError::fromErrno("sd_bus_emit_signal", -r);
    r = sd_bus_flush(bus);
    if (r < 0)
        return OMError::fromErrno("sd_bus_flush", -r);
    return {};
}

} // namespace

void NotifyBusRelease::operator()(sd_bus* bus) const
{
    // Not sd_bus_flush_close_unref: a bus that stopped reading must not hold us up here.
    sd_bus_close_unref(bus);
}

bool Notify::isValidName(std::string_view name)
{
    if (name.empty() || name.size() > kMaxNameLength)
        return false;
    for (const char c : name) {
        if (c <= ' ' || c > '~' || c == '\'' || c == '\\')
            return false;
    }
    return true;
}

Result<NotifyBus> Notify::openBus()
{
    const bool session = Storage::environment("DBUS_SESSION_BUS_ADDRESS") || Storage::isMultiUser();
    sd_bus* bus = nullptr;
    const int r = session ? sd_bus_open_user(&bus) : sd_bus_open_system(&bus);
    if (r < 0)
        return OMError::fromErrno(session ? "sd_bus_open_user" : "sd_bus_open_system", -r);
    return NotifyBus(bus);
}

Notify::Notify()
    : m_queue(WorkQueue::create("com.orvex.notify", QualityOfService::Utility))
{
}

Notify& Notify::shared()
{
    // Leaked on purpose: a post may still be on its way while the process exits, and static
    // destruction must not join a queue that waits for the bus.
    static Notify* notify = new Notify;
    return *notify;
}

void Notify::post(std::string_view name)
{
    if (!isValidName(name)) {
        log().error("not a notification name: %s", name);
        return;
    }
    shared().enqueue(name);
}

void Notify::flush()
{
    shared().m_queue->sync([] {});
}

void Notify::enqueue(std::string_view name)
{
    bool logOverflow = false;
    bool startDrain = false;
    {
        std::lock_guard lock(m_mutex);
        if (m_pending.size() >= kMaxPending) {
            const bool waiting = m_pendingCounts.contains(std::string(name));
            logOverflow = !waiting && !std::exchange(m_overflowLogged, true);
            if (!logOverflow)
                return;
        } else {
            m_overflowLogged = false;
            m_pending.emplace_back(name);
            ++m_pendingCounts[m_pending.back()];
            startDrain = !std::exchange(m_draining, true);
        }
    }
    if (logOverflow) {
        log().error("%u notifications wait for the message bus; %s and others are dropped until it takes them",
            unsigned(kMaxPending), name);
        return;
    }
    if (startDrain)
        m_queue->async([this] { drain(); });
}

void Notify::drain()
{
    for (;;) {
        std::string name;
        {
            std::lock_guard lock(m_mutex);
            if (m_pending.empty()) {
                m_draining = false;
                return;
            }
            name = std::move(m_pending.front());
            m_pending.pop_front();
            if (auto count = m_pendingCounts.find(name); --count->second == 0)
                m_pendingCounts.erase(count);
        }
        deliver(name);
    }
}

void Notify::deliver(const std::string& name)
{
    // A connection that served before may have died since (the bus restarted): one fresh attempt
    // is owed before this notification is given up.
    if (m_bus) {
        if (emit(m_bus.get(), name).ok())
            return;
        m_bus.reset();
    }
    auto bus = openBus();
    if (!bus.ok()) {
        log().debug("no message bus (%s); notification %s not posted", bus.error().localizedDescription(), name);
        return;
    }
    if (auto emitted = emit(bus->get(), name); !emitted.ok()) {
        log().debug("notification %s not posted: %s", name, emitted.error().localizedDescription());
        return;
    }
    m_bus = std::move(*bus);
}

} // namespace om
