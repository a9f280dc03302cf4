// What the Registrar suites share: a private tree of bundles, databases and containers, a workspace
// opened on it, and an observer that records what it hears.
#pragma once

#include <gtest/gtest.h>

#include <condition_variable>
#include <filesystem>
#include <fstream>
#include <functional>
#include <mutex>
#include <sstream>
#include <string>
#include <vector>

#include "platform/Registrar.h"
#include "platform/Vlist.h"
#include "tests/support/BundleFixture.h"

namespace om::test {

// One event an observer heard: "+" install or "-" uninstall, with the records' identifiers.
struct HeardEvent {
    char kind;
    std::vector<std::string> identifiers;
    RegistrarPlugInRecords records;
};

class RecordingObserver : public RegistrarObserver {
public:
    // Run inside the notification, after it is recorded.
    std::function<void(const RegistrarPlugInRecords&)> onUninstall;
    std::function<void(const RegistrarPlugInRecords&)> onInstall;

    void pluginsDidInstall(const RegistrarPlugInRecords& records) override
    {
        record('+', records);
        if (onInstall)
            onInstall(records);
    }
    void pluginsWillUninstall(const RegistrarPlugInRecords& records) override
    {
        record('-', records);
        if (onUninstall)
            onUninstall(records);
    }

    std::vector<HeardEvent> events() const
    {
        std::lock_guard lock(m_mutex);
        return m_events;
    }
    // "+a -a +b": the events' kinds and identifiers, for comparing sequences at a glance.
    std::string transcript() const
    {
        std::string text;
        for (const HeardEvent& event : events()) {
            for (const std::string& identifier : event.identifiers)
                text += (text.empty() ? "" : " ") + std::string(1, event.kind) + identifier;
        }
        return text;
    }
    void clear()
    {
        std::lock_guard lock(m_mutex);
        m_events.clear();
    }

private:
    void record(char kind, const RegistrarPlugInRecords& records)
    {
        HeardEvent event { kind, {}, records };
        for (const auto& record : records)
            event.identifiers.push_back(record->identifier().value_or("?"));
        std::lock_guard lock(m_mutex);
        m_events.push_back(std::move(event));
    }

    mutable std::mutex m_mutex;
    std::vector<HeardEvent> m_events;
};

class RegistrarTest : public ::testing::Test {
protected:
    RegistrarWorkspace::Configuration configuration() const
    {
        return { .databasePath = m_bundles.root() + "/state/registrar.db",
            .sdkDirectory = m_bundles.root() + "/sdk",
            .containersDirectory = m_bundles.root() + "/containers" };
    }

    std::shared_ptr<RegistrarWorkspace> open(RegistrarWorkspace::Access access = RegistrarWorkspace::Access::ReadWrite)
    {
        auto opened = RegistrarWorkspace::open(configuration(), access);
        EXPECT_TRUE(opened.ok()) << (opened.ok() ? "" : opened.error().localizedDescription());
        return opened.ok() ? opened.value() : nullptr;
    }

    std::shared_ptr<RegistrarWorkspace> workspace()
    {
        if (!m_workspace)
            m_workspace = open();
        return m_workspace;
    }

    std::shared_ptr<RecordingObserver> observe()
    {
        auto observer = std::make_shared<RecordingObserver>();
        workspace()->addObserver(observer);
        m_observers.push_back(observer);
        return observer;
    }

    // A plug-in bundle at <root>/<relativePath> whose Info dictionary is info.
    std::string bundle(std::string_view relativePath, const Value& info)
    {
        return m_bundles.makeBundle(relativePath, info);
    }
    // A plug-in of extensionPoint with the given extra QSExtension keys and top-level keys.
    static Value plugIn(std::string_view identifier, std::string_view extensionPoint,
        const Value& extension = Value::dictionary({}), const Value& extra = Value::dictionary({}))
    {
        DictionaryBuilder plugInDictionary(extension);
        plugInDictionary.set("QSExtensionPointIdentifier", Value(extensionPoint));
        DictionaryBuilder info(BundleFixture::appInfo(identifier, "", extra));
        info.set("QSExtension", plugInDictionary.build());
        return info.build();
    }

    std::shared_ptr<const RegistrarPlugInRecord> registered(const std::string& path)
    {
        auto result = workspace()->registerPlugIn(path);
        EXPECT_TRUE(result.ok()) << path << ": " << (result.ok() ? "" : result.error().localizedDescription());
        return result.ok() ? result.value() : nullptr;
    }

    void writeSdkEntry(std::string_view extensionPoint, const Value& entry)
    {
        m_bundles.writeFile("sdk/" + std::string(extensionPoint) + ".vlist", Vlist::writeXml(entry));
    }

    static std::string contentsOf(const std::string& path)
    {
        std::ifstream file(path, std::ios::binary);
        std::stringstream bytes;
        bytes << file.rdbuf();
        return bytes.str();
    }

    BundleFixture m_bundles;
    std::shared_ptr<RegistrarWorkspace> m_workspace;
    std::vector<std::shared_ptr<RecordingObserver>> m_observers;
};

} // namespace om::test
