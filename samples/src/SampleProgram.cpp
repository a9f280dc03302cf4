// The executable of every sample app and plug-in. Started by hand or as an app, it says which
// bundle it runs from and stays up until it is stopped. Launched by jobd as a plug-in instance
// (JOBD_INSTANCE_FD set), it answers its host's requests on that connection, each plug-in in its
// own words:
//   {"op": any other text}  -> {"plugin": identifier, "op": op, "answer": what it does}
//   {"op": "begin"}         -> the Filters plug-in declares itself busy and stays busy
//   {"op": "end"}           -> ... until this request, which declares it idle again
// "begin" and "end" answer {"plugin", "op", "busy": true/false, "status": jobd's status}.
// The Filters plug-in is also busy while it works on any other request. The instance exits 0
// when its host closes the connection.
#include <signal.h>
#include <unistd.h>

#include <cstdio>
#include <cstdlib>
#include <fstream>
#include <string>

#include "Ombrel/OMBundle.h"
#include "platform/Assertions.h"
#include "platform/JobManager.h"

namespace {

constexpr const char* kFilters = "com.example.photos.filters";

// The lines of a text file of the bundle's, without empty ones.
om::Value linesOf(const std::string& path)
{
    om::ArrayBuilder lines;
    std::ifstream file(path);
    for (std::string line; std::getline(file, line);) {
        if (!line.empty())
            lines.append(om::Value::string(line));
    }
    return lines.build();
}

// What each sample plug-in does with a request, read from its bundle where it ships the data.
om::Value answerFor(const std::string& identifier, const std::string& bundlePath)
{
    if (identifier == "com.example.notes.share")
        return om::Value::dictionary(
            { { "shares", "the text and links given, as a new note in Notes" }, { "accepts", "text/plain" } });
    if (identifier == kFilters)
        return om::Value::dictionary({ { "filters", linesOf(bundlePath + "/Presets/presets.txt") } });
    if (identifier == "com.example.photos.preview")
        return om::Value::dictionary({ { "previews", "image/png and image/jpeg files, at glance size" } });
    if (identifier == "com.example.photos.importer")
        return om::Value::dictionary({ { "imports from", "camera and card-reader" } });
    if (identifier == "com.example.keys.keyboard")
        return om::Value::dictionary({ { "layouts", linesOf(bundlePath + "/Layouts/layouts.txt") } });
    return om::Value::dictionary({ { "says", "hello from " + identifier } });
}

class Instance {
public:
    Instance(std::string identifier, std::string bundlePath)
        : m_identifier(std::move(identifier))
        , m_bundlePath(std::move(bundlePath))
    {
    }

    om::Value answer(const std::string& op)
    {
        const bool busySample = m_identifier == kFilters;
        if (busySample && (op == "begin" || op == "end"))
            return with(op, { { "busy", om::Value::boolean(op == "begin") }, { "status", declare(op == "begin") } });
        // The busy sample is busy while it works, unless a "begin" already keeps it busy.
        const bool declares = busySample && !m_held;
        if (declares)
            declare(true);
        om::Value answer = answerFor(m_identifier, m_bundlePath);
        if (declares)
            declare(false);
        return with(op, { { "answer", answer } });
    }

private:
    om::Value with(const std::string& op, std::vector<om::Value::Entry> entries) const
    {
        entries.insert(entries.begin(), { { "plugin", m_identifier }, { "op", om::Value::string(op) } });
        return om::Value::dictionary(std::move(entries));
    }

    int64_t declare(bool busy)
    {
        if (!m_assertions)
            m_assertions = om::Assertions::create();
        auto result = busy ? m_assertions->declareBusy() : m_assertions->declareIdle();
        if (result.ok())
            m_held = busy;
        return result.ok() ? 0 : result.error().code();
    }

    std::string m_identifier;
    std::string m_bundlePath;
    std::shared_ptr<om::Assertions> m_assertions;
    bool m_held = false;
};

} // namespace

int main()
{
    auto bundle = om::OMBundle::initForMainBundle();
    auto identifier = bundle->bundleIdentifier();
    const std::string name = identifier ? *identifier : "sample";
    Instance instance(name, bundle->path().value_or(""));
    const bool served = om::JobManagerServeInstance([&](const om::Value& request) {
        const std::string* op = request.stringFor("op");
        return instance.answer(op ? *op : "ping");
    });
    if (served)
        return 0;
    (void)std::printf("%s running (pid %d)\n", name.c_str(), static_cast<int>(::getpid()));
    (void)std::fflush(stdout);
    for (;;)
        ::pause();
}
