// A population of registered plug-ins for the benchmarks that measure how lookups scale: count
// data plug-ins in 1,000 applications, 10 to each extension point, made on the fastest temporary
// directory at hand and registered in a workspace of their own, in batches of one commit each.
#pragma once

#include <unistd.h>

#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <memory>
#include <string>
#include <vector>

#include "platform/Registrar.h"
#include "platform/Vlist.h"

namespace om::bench {

class BenchPopulation {
public:
    static constexpr size_t kPerExtensionPoint = 10; // what one query by extension point selects
    static constexpr size_t kApplications = 1000;
    static constexpr size_t kBatch = 10'000;

    // Where the population lives: memory (fast, where fsync costs nothing) or the disk that
    // temporary files go to (where durability costs what it costs).
    enum class Medium : uint8_t { Memory, Disk };

    // Makes the bundles and opens the workspace; registerAll() registers them.
    explicit BenchPopulation(size_t count, Medium medium = Medium::Memory)
    {
        std::string pattern = (medium == Medium::Memory ? fastTemporaryDirectory() : diskTemporaryDirectory())
            + "/om-bench-population.XXXXXX";
        if (!::mkdtemp(pattern.data()))
            std::abort();
        m_root = pattern;
        // Complete applications (an Info.vlist naming an executable that exists), so that discovery
        // does not pass their plug-ins over as those of a placeholder.
        for (size_t app = 0; app < std::min(count, kApplications); ++app) {
            write(appPath(app) + "/Info.vlist",
                Value::dictionary({ { "VBBundleIdentifier", Value("com.orvex.bench.app" + std::to_string(app)) },
                    { "VBBundleExecutable", "App" } }));
            std::ofstream(appPath(app) + "/App") << "#!/bin/sh\n";
        }
        for (size_t i = 0; i < count; ++i) {
            const std::string identifier = "com.orvex.bench.plugin" + std::to_string(i);
            const std::string path = appPath(i % kApplications) + "/PlugIns/" + identifier + ".appex";
            m_declaredBytes += write(path + "/Info.vlist", info(identifier, pointOf(i)));
            m_paths.push_back(path);
        }
        m_configuration = { m_root + "/registrar.db", m_root + "/sdk", m_root + "/containers" };
        auto opened = RegistrarWorkspace::open(m_configuration, RegistrarWorkspace::Access::ReadWrite);
        if (!opened.ok())
            std::abort();
        m_workspace = opened.value();
    }

    ~BenchPopulation()
    {
        m_workspace.reset();
        std::error_code ignored;
        std::filesystem::remove_all(m_root, ignored);
    }

    void registerAll()
    {
        for (size_t start = 0; start < m_paths.size(); start += kBatch) {
            std::vector<std::string> batch(
                m_paths.begin() + long(start), m_paths.begin() + long(std::min(m_paths.size(), start + kBatch)));
            for (auto& result : m_workspace->registerPlugIns(batch)) {
                if (!result.ok())
                    std::abort();
                m_uuids.push_back(result.value()->uuid());
            }
        }
        m_workspace->waitForNotifications();
    }

    static std::string pointOf(size_t i) { return "com.orvex.bench.point" + std::to_string(i / kPerExtensionPoint); }

    static std::string fastTemporaryDirectory()
    {
        for (const char* candidate : { "/dev/shm", static_cast<const char*>(std::getenv("TMPDIR")), "/tmp" }) {
            if (candidate && *candidate && ::access(candidate, W_OK) == 0)
                return candidate;
        }
        return ".";
    }

    static std::string diskTemporaryDirectory()
    {
        const char* tmp = std::getenv("TMPDIR");
        return tmp && *tmp ? tmp : "/tmp";
    }

    const std::string& root() const { return m_root; }
    const RegistrarWorkspace::Configuration& configuration() const { return m_configuration; }
    const std::shared_ptr<RegistrarWorkspace>& workspace() const { return m_workspace; }
    const std::vector<Uuid>& uuids() const { return m_uuids; }
    const std::vector<std::string>& paths() const { return m_paths; }
    // The Info.vlist bytes the bundles declare, all together.
    size_t declaredBytes() const { return m_declaredBytes; }

private:
    std::string appPath(size_t app) const { return m_root + "/bundles/App" + std::to_string(app) + ".app"; }

    // A data plug-in: it needs no data container, and inside an application the daemon uses it.
    static Value info(const std::string& identifier, const std::string& point)
    {
        return Value::dictionary({
            { "VBBundleIdentifier", Value(identifier) },
            { "VBBundleVersion", "1" },
            { "VBBundleShortVersionString", "1.0" },
            { "VBBundleName", Value("Plug-in " + identifier) },
            { "QSExtension",
                Value::dictionary({ { "QSExtensionPointIdentifier", Value(point) }, { "QSExtensionProtocol", "#Data" },
                    { "QSExtensionAttributes",
                        Value::dictionary(
                            { { "QSExtensionActivationRule", Value::dictionary({ { "text/plain", 1 } }) } }) } }) },
        });
    }

    static size_t write(const std::string& path, const Value& value)
    {
        std::filesystem::create_directories(std::filesystem::path(path).parent_path());
        const std::string text = Vlist::writeXml(value);
        std::ofstream(path) << text;
        return text.size();
    }

    std::string m_root;
    RegistrarWorkspace::Configuration m_configuration;
    std::shared_ptr<RegistrarWorkspace> m_workspace;
    std::vector<Uuid> m_uuids;
    std::vector<std::string> m_paths;
    size_t m_declaredBytes = 0;
};

} // namespace om::bench
