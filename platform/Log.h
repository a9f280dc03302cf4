// Structured log ("evlog"). Each handle is a (subsystem, category) pair. Records go to the systemd
// journal when its socket exists (fields SYSLOG_IDENTIFIER, OM_SUBSYSTEM, OM_CATEGORY, PRIORITY),
// otherwise one line per record on stderr. The threshold comes from EVLOG_LEVEL (debug, info,
// default, error, off; default "default") and is read once. Tests install a Log::Capture, which sees
// every record, whatever the threshold, while it lives.
#pragma once

#include <chrono>
#include <condition_variable>
#include <functional>
#include <memory>
#include <mutex>
#include <string>
#include <string_view>
#include <vector>

#include "platform/Format.h"
#include "platform/Result.h"

namespace om {

// Off is only a threshold (EVLOG_LEVEL=off): no record is written anywhere but to captures.
enum class LogLevel : uint8_t { Debug, Info, Default, Error, Off };

class Log {
public:
    // Fails when subsystem or category is empty or holds a control character.
    static Result<std::shared_ptr<Log>> create(std::string subsystem, std::string category);
    // The platform's default handle (subsystem and category empty).
    static Log& defaultLog();
    // The handle of category in the platform layer's own subsystem, "com.orvex.platform", made on
    // first use and kept for the life of the process; the default handle for an invalid category.
    static const Log& platform(std::string_view category);

    const std::string& subsystem() const { return m_subsystem; }
    const std::string& category() const { return m_category; }

    // True when a record at this level would be written anywhere (threshold or an active capture).
    bool enabled(LogLevel level) const;
    void write(LogLevel level, std::string_view message) const;

    template <typename... Args> void debug(std::string_view fmt, const Args&... args) const
    {
        emit(LogLevel::Debug, fmt, args...);
    }
    template <typename... Args> void info(std::string_view fmt, const Args&... args) const
    {
        emit(LogLevel::Info, fmt, args...);
    }
    template <typename... Args> void notice(std::string_view fmt, const Args&... args) const
    {
        emit(LogLevel::Default, fmt, args...);
    }
    template <typename... Args> void error(std::string_view fmt, const Args&... args) const
    {
        emit(LogLevel::Error, fmt, args...);
    }

    struct Record {
        std::string subsystem;
        std::string category;
        LogLevel level;
        std::string message;
    };

    // In-process sink for tests. Captures nest; every live capture sees every record.
    class Capture {
    public:
        Capture();
        ~Capture();
        Capture(const Capture&) = delete;
        Capture& operator=(const Capture&) = delete;

        std::vector<Record> records() const;
        size_t count(std::string_view message) const;
        // Blocks until a record with exactly this message exists or the timeout passes.
        bool waitFor(std::string_view message, std::chrono::milliseconds timeout = std::chrono::seconds(30)) const;
        // Blocks until predicate holds over the records or the timeout passes.
        bool waitUntil(const std::function<bool(const std::vector<Record>&)>& predicate,
            std::chrono::milliseconds timeout = std::chrono::seconds(30)) const;
        void clear();

    private:
        friend class Log;
        void add(const Record& record);
        mutable std::mutex m_mutex;
        mutable std::condition_variable m_changed;
        std::vector<Record> m_records;
    };

private:
    Log(std::string subsystem, std::string category);

    template <typename... Args> void emit(LogLevel level, std::string_view fmt, const Args&... args) const
    {
        if (enabled(level))
            write(level, format(fmt, args...));
    }

    std::string m_subsystem;
    std::string m_category;
};

} // namespace om
