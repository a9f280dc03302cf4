#include "platform/Log.h"

#include <strings.h>
#include <sys/stat.h>
#include <sys/uio.h>
#include <systemd/sd-journal.h>
#include <unistd.h>

#include <algorithm>
#include <atomic>
#include <cerrno>
#include <cstdio>
#include <cstdlib>
#include <ctime>
#include <map>

namespace om {

namespace {

constexpr const char* kJournalSocket = "/run/systemd/journal/socket";

// Live captures. Leaked on purpose: queue threads may still log while static destructors run.
struct CaptureRegistry {
    std::mutex mutex;
    std::vector<Log::Capture*> captures;
    std::atomic<size_t> active { 0 };
};

CaptureRegistry& captureRegistry()
{
    static auto* registry = new CaptureRegistry;
    return *registry;
}

LogLevel parseLevel(const char* text)
{
    if (!text)
        return LogLevel::Default;
    if (strcasecmp(text, "debug") == 0)
        return LogLevel::Debug;
    if (strcasecmp(text, "info") == 0)
        return LogLevel::Info;
    if (strcasecmp(text, "error") == 0)
        return LogLevel::Error;
    if (strcasecmp(text, "off") == 0)
        return LogLevel::Off;
    return LogLevel::Default;
}

LogLevel threshold()
{
    // Read once, under the static's guard; nothing in this process writes the environment.
    static const LogLevel level = parseLevel(std::getenv("EVLOG_LEVEL")); // NOLINT(concurrency-mt-unsafe)
    return level;
}

bool journalAvailable()
{
    static const bool available = [] {
        // EVLOG_STDERR=1 keeps records on stderr even where a journal runs (foreground demos).
        const char* forced = std::getenv("EVLOG_STDERR"); // NOLINT(concurrency-mt-unsafe)
        if (forced && std::string_view(forced) == "1")
            return false;
        struct stat info;
        return ::stat(kJournalSocket, &info) == 0 && S_ISSOCK(info.st_mode);
    }();
    return available;
}

bool hasControlCharacter(std::string_view text)
{
    return std::any_of(text.begin(), text.end(), [](char c) {
        auto byte = static_cast<unsigned char>(c);
        return byte < 0x20 || byte == 0x7f;
    });
}

int syslogPriority(LogLevel level)
{
    switch (level) {
    case LogLevel::Debug:
        return 7;
    case LogLevel::Info:
        return 6;
    case LogLevel::Default:
        return 5;
    case LogLevel::Error:
    case LogLevel::Off:
        return 3;
    }
    return 5;
}

const char* levelName(LogLevel level)
{
    switch (level) {
    case LogLevel::Debug:
        return "debug";
    case LogLevel::Info:
        return "info";
    case LogLevel::Default:
        return "notice";
    case LogLevel::Error:
    case LogLevel::Off:
        return "error";
    }
    return "notice";
}

bool sendToJournal(const Log& log, LogLevel level, std::string_view message)
{
    std::string fields[5] = {
        "MESSAGE=" + std::string(message),
        "PRIORITY=" + std::to_string(syslogPriority(level)),
        std::string("SYSLOG_IDENTIFIER=") + program_invocation_short_name,
        "OM_SUBSYSTEM=" + log.subsystem(),
        "OM_CATEGORY=" + log.category(),
    };
    // The default handle has no subsystem or category; it sends neither field.
    int count = log.subsystem().empty() ? 3 : 5;
    struct iovec vectors[5];
    for (int i = 0; i < count; ++i)
        vectors[i] = { fields[i].data(), fields[i].size() };
    return sd_journal_sendv(vectors, count) >= 0;
}

void appendTimestamp(std::string& line)
{
    struct timespec now;
    ::clock_gettime(CLOCK_REALTIME, &now);
    struct tm utc;
    ::gmtime_r(&now.tv_sec, &utc);
    char buffer[40];
    size_t length = std::strftime(buffer, sizeof buffer, "%Y-%m-%dT%H:%M:%S", &utc);
    line.append(buffer, length);
    (void)std::snprintf(buffer, sizeof buffer, ".%06ldZ", now.tv_nsec / 1000);
    line += buffer;
}

// One line per record: embedded line breaks are escaped so that a reader can split on '\n'.
void appendEscaped(std::string& line, std::string_view message)
{
    for (char c : message) {
        if (c == '\n')
            line += "\\n";
        else if (c == '\r')
            line += "\\r";
        else
            line += c;
    }
}

void writeToStderr(const Log& log, LogLevel level, std::string_view message)
{
    std::string line;
    line.reserve(message.size() + 96);
    appendTimestamp(line);
    line += ' ';
    line += program_invocation_short_name;
    line += '[';
    line += std::to_string(::getpid());
    line += "] ";
    if (!log.subsystem().empty()) {
        line += log.subsystem();
        line += ':';
        line += log.category();
        line += ' ';
    }
    line += levelName(level);
    line += ": ";
    appendEscaped(line, message);
    line += '\n';

    // A single write keeps records from different threads whole; the loop only matters when the
    // reader is a pipe and the line exceeds its atomic size.
    const char* data = line.data();
    size_t remaining = line.size();
    while (remaining > 0) {
        ssize_t written = ::write(STDERR_FILENO, data, remaining);
        if (written < 0) {
            if (errno == EINTR)
                continue;
            return;
        }
        data += written;
        remaining -= static_cast<size_t>(written);
    }
}

} // namespace

Log::Log(std::string subsystem, std::string category)
    : m_subsystem(std::move(subsystem))
    , m_category(std::move(category))
{
}

Result<std::shared_ptr<Log>> Log::create(std::string subsystem, std::string category)
{
    if (subsystem.empty() || category.empty())
        return OMError::platform(kPlatformErrorMalformed, "log subsystem and category must not be empty");
    if (hasControlCharacter(subsystem) || hasControlCharacter(category))
        return OMError::platform(
            kPlatformErrorMalformed, "log subsystem and category must not hold control characters");
    return std::shared_ptr<Log>(new Log(std::move(subsystem), std::move(category)));
}

const Log& Log::platform(std::string_view category)
{
    // Leaked on purpose, like the default handle: threads may log while the process exits.
    static std::mutex mutex;
    static auto* handles = new std::map<std::string, std::shared_ptr<Log>, std::less<>>;
    std::lock_guard lock(mutex);
    if (auto known = handles->find(category); known != handles->end())
        return *known->second;
    auto created = create("com.orvex.platform", std::string(category));
    if (!created.ok())
        return defaultLog();
    return *handles->emplace(std::string(category), std::move(created).releaseValue()).first->second;
}

Log& Log::defaultLog()
{
    static auto* log = new Log("", "");
    return *log;
}

bool Log::enabled(LogLevel level) const
{
    return level >= threshold() || captureRegistry().active.load(std::memory_order_relaxed) > 0;
}

void Log::write(LogLevel level, std::string_view message) const
{
    auto& registry = captureRegistry();
    if (registry.active.load(std::memory_order_relaxed) > 0) {
        Record record { m_subsystem, m_category, level, std::string(message) };
        std::lock_guard lock(registry.mutex);
        for (auto* capture : registry.captures)
            capture->add(record);
    }
    if (level < threshold())
        return;
    if (journalAvailable() && sendToJournal(*this, level, message))
        return;
    writeToStderr(*this, level, message);
}

Log::Capture::Capture()
{
    auto& registry = captureRegistry();
    std::lock_guard lock(registry.mutex);
    registry.captures.push_back(this);
    registry.active.fetch_add(1, std::memory_order_relaxed);
}

Log::Capture::~Capture()
{
    auto& registry = captureRegistry();
    std::lock_guard lock(registry.mutex);
    std::erase(registry.captures, this);
    registry.active.fetch_sub(1, std::memory_order_relaxed);
}

void Log::Capture::add(const Record& record)
{
    {
        std::lock_guard lock(m_mutex);
        m_records.push_back(record);
    }
    m_changed.notify_all();
}

std::vector<Log::Record> Log::Capture::records() const
{
    std::lock_guard lock(m_mutex);
    return m_records;
}

size_t Log::Capture::count(std::string_view message) const
{
    std::lock_guard lock(m_mutex);
    return static_cast<size_t>(
        std::count_if(m_records.begin(), m_records.end(), [&](const Record& r) { return r.message == message; }));
}

bool Log::Capture::waitFor(std::string_view message, std::chrono::milliseconds timeout) const
{
    return waitUntil(
        [&](const std::vector<Record>& records) {
            return std::any_of(records.begin(), records.end(), [&](const Record& r) { return r.message == message; });
        },
        timeout);
}

bool Log::Capture::waitUntil(
    const std::function<bool(const std::vector<Record>&)>& predicate, std::chrono::milliseconds timeout) const
{
    std::unique_lock lock(m_mutex);
    return m_changed.wait_for(lock, timeout, [&] { return predicate(m_records); });
}

void Log::Capture::clear()
{
    std::lock_guard lock(m_mutex);
    m_records.clear();
}

} // namespace om
