#include "platform/NotifyListener.h"

#include <poll.h>
#include <sys/eventfd.h>
#include <systemd/sd-bus.h>

#include <algorithm>
#include <array>
#include <cerrno>
#include <climits>
#include <ctime>

#include "platform/Format.h"
#include "platform/Log.h"

namespace om {

namespace {

const Log& log()
{
    static const Log& log = Log::platform("notify");
    return log;
}

// sd-bus gives its next deadline as an absolute CLOCK_MONOTONIC time in microseconds.
int pollTimeout(sd_bus* bus)
{
    uint64_t deadline = 0;
    if (sd_bus_get_timeout(bus, &deadline) < 0 || deadline == UINT64_MAX)
        return -1;
    timespec now {};
    ::clock_gettime(CLOCK_MONOTONIC, &now);
    const uint64_t current = uint64_t(now.tv_sec) * 1'000'000 + uint64_t(now.tv_nsec) / 1'000;
    if (deadline <= current)
        return 0;
    return int(std::min<uint64_t>((deadline - current + 999) / 1'000, INT_MAX));
}

} // namespace

Result<std::unique_ptr<NotifyListener>> NotifyListener::create(
    std::string name, std::shared_ptr<WorkQueue> queue, Handler handler)
{
    return create(std::vector<std::string> { std::move(name) }, std::move(queue), std::move(handler));
}

Result<std::unique_ptr<NotifyListener>> NotifyListener::create(
    std::vector<std::string> names, std::shared_ptr<WorkQueue> queue, Handler handler)
{
    if (names.empty() || names.size() > kMaxNames)
        return OMError::platform(kPlatformErrorLimit, format("a listener takes 1 to %u names", unsigned(kMaxNames)));
    for (const auto& name : names) {
        if (!Notify::isValidName(name))
            return OMError::platform(kPlatformErrorMalformed, "not a notification name: " + name);
    }
    if (!queue || !handler)
        return OMError::platform(kPlatformErrorUnsupported, "a listener needs a queue and a handler");
    auto bus = OM_TRY(Notify::openBus());
    UniqueFd stop(::eventfd(0, EFD_CLOEXEC | EFD_NONBLOCK));
    if (!stop.valid())
        return OMError::fromErrno("eventfd", errno);
    auto delivery = std::make_shared<Delivery>();
    delivery->queue = std::move(queue);
    delivery->handler = std::move(handler);
    std::unique_ptr<NotifyListener> listener(new NotifyListener(std::move(bus), std::move(stop),
        std::unordered_set<std::string>(names.begin(), names.end()), std::move(delivery)));
    OM_TRY(listener->subscribe());
    listener->m_thread = std::thread([raw = listener.get()] { raw->run(); });
    return listener;
}

NotifyListener::NotifyListener(
    NotifyBus bus, UniqueFd stop, std::unordered_set<std::string> names, std::shared_ptr<Delivery> delivery)
    : m_bus(std::move(bus))
    , m_stop(std::move(stop))
    , m_names(std::move(names))
    , m_delivery(std::move(delivery))
{
}

NotifyListener::~NotifyListener()
{
    m_delivery->cancelled = true;
    if (m_thread.joinable()) {
        const uint64_t one = 1;
        (void)::write(m_stop.get(), &one, sizeof one); // an eventfd write of 1 cannot fail here
        m_thread.join();
    }
    // A handler running on another thread is waited for. On the delivery queue itself nothing else
    // runs: either we are inside this listener's own handler, or no handler of it is running.
    if (!m_delivery->queue->isCurrent())
        std::lock_guard wait(m_delivery->running);
}

// AddMatch is a method call that sd_bus_add_match waits for, so the bus filters for us on return.
Result<void> NotifyListener::subscribe()
{
    auto callback = [](sd_bus_message* message, void* userdata, sd_bus_error*) -> int {
        const char* name = nullptr;
        if (sd_bus_message_read(message, "s", &name) >= 0 && name)
            static_cast<NotifyListener*>(userdata)->received(name);
        return 0;
    };
    for (const auto& name : m_names) {
        const std::string rule = format("type='signal',path='%s',interface='%s',member='%s',arg0='%s'",
            Notify::kObjectPath, Notify::kInterface, Notify::kMember, name);
        // No slot: the match lives as long as the connection, which is as long as we do.
        if (const int r = sd_bus_add_match(m_bus.get(), nullptr, rule.c_str(), callback, this); r < 0)
            return OMError::fromErrno("sd_bus_add_match", -r);
    }
    return {};
}

void NotifyListener::received(const char* name)
{
    // The bus filtered already; a rule of ours that the bus did not apply must not leak others in.
    if (!m_names.contains(name))
        return;
    m_delivery->queue->async([delivery = m_delivery, name = std::string(name)] {
        if (delivery->cancelled)
            return;
        std::lock_guard lock(delivery->running);
        if (!delivery->cancelled)
            delivery->handler(name);
    });
}

void NotifyListener::run()
{
    sd_bus* bus = m_bus.get();
    for (;;) {
        const int processed = sd_bus_process(bus, nullptr);
        if (processed > 0)
            continue;
        const int events = processed < 0 ? processed : sd_bus_get_events(bus);
        if (events < 0) {
            // The bus went away (or never let us in); nothing will arrive on this connection again.
            log().error("notification listener lost the message bus: %s",
                OMError::fromErrno("sd_bus_process", -events).localizedDescription());
            return;
        }
        std::array<pollfd, 2> fds { { { sd_bus_get_fd(bus), short(events), 0 }, { m_stop.get(), POLLIN, 0 } } };
        if (::poll(fds.data(), fds.size(), pollTimeout(bus)) < 0 && errno != EINTR) {
            log().error("notification listener: %s", OMError::fromErrno("poll", errno).localizedDescription());
            return;
        }
        if (fds[1].revents)
            return;
    }
}

} // namespace om
