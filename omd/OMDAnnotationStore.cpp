#include "omd/OMDAnnotationStore.h"

#include <unistd.h>

#include <cerrno>
#include <cmath>
#include <cstring>
#include <ctime>
#include <filesystem>

#include "Ombrel/OMBundle.h"
#include "Ombrel/OMLog.h"
#include "Ombrel/OMMakeError.h"
#include "omd/OMDPlugIn.h"
#include "platform/Fatal.h"
#include "platform/OMError.h"
#include "platform/Probes.h"
#include "platform/Storage.h"
#include "platform/Vlist.h"

namespace om {

namespace {

constexpr const char* kContainerIdentifier = "com.orvex.omd";

std::string pathOf(const std::string& url)
{
    return OMBundle::pathOfFileURL(url).value_or(url);
}

bool isMissingFile(const OMError& error)
{
    return error.domain() == "POSIX" && error.code() == ENOENT;
}

Value describe(const OMError& error)
{
    return Value::string(error.localizedDescription());
}

int64_t versionOf(const Value& root)
{
    const Value& version = root["version"];
    if (auto integer = version.asInt64())
        return *integer;
    // A real version is truncated; one out of range (or NaN) is no version we know, and a plain
    // cast of it would be undefined.
    if (auto number = version.asDouble(); number && std::fabs(*number) < 9.0e18)
        return static_cast<int64_t>(*number);
    return version.isNumber() ? -1 : 0;
}

// A relative path names a file under the working directory; a file URL is always absolute.
std::string absolute(const std::string& path)
{
    if (path.starts_with('/'))
        return path;
    std::error_code failed;
    const auto resolved = std::filesystem::absolute(path, failed);
    return failed ? path : resolved.lexically_normal().string();
}

std::string timestamp()
{
    char text[32];
    const std::time_t now = std::time(nullptr);
    std::tm utc {};
    if (::gmtime_r(&now, &utc) == nullptr)
        return std::to_string(now);
    const size_t length = std::strftime(text, sizeof text, "%Y%m%dT%H%M%SZ", &utc);
    return std::string(text, length);
}

} // namespace

OMDAnnotationStore::OMDAnnotationStore(std::string annotationsURL)
    : m_annotationsURL(std::move(annotationsURL))
{
}

std::shared_ptr<OMDAnnotationStore> OMDAnnotationStore::initWithDatabase(const std::optional<std::string>& path)
{
    std::shared_ptr<OMDAnnotationStore> store(
        new OMDAnnotationStore(path ? OMBundle::fileURL(absolute(*path)) : defaultDatabaseURL()));
    auto failure = store->loadDb(store->m_annotationsURL);
    if (!failure)
        return store;
    if (!isMissingFile(*failure)) {
        OMLog::ops().error("unable to load annotation database:%{public}@ error:%{public}@ (resetting)",
            store->m_annotationsURL, describe(*failure));
        store->m_unreadableOnDisk = true;
    }
    if (Storage::isMultiUser() && !store->loadDb(globalURL())) {
        OMLog::ops().info("migrating shared annotations");
        if (auto saved = store->saveDb()) {
            OMLog::ops().error("unable to save migrated annotations to %{public}@ error:%{public}@",
                store->m_annotationsURL, describe(*saved));
        }
    }
    return store;
}

Value OMDAnnotationStore::annotations() const
{
    std::vector<Value::Entry> entries(m_annotations.begin(), m_annotations.end());
    return Value::dictionary(std::move(entries));
}

Value OMDAnnotationStore::annotationForIdentifier(std::string_view key) const
{
    auto found = m_annotations.find(std::string(key));
    return found == m_annotations.end() ? Value() : found->second;
}

Value OMDAnnotationStore::annotationForPlugIn(const OMDPlugIn& plugIn) const
{
    return annotationForIdentifier(plugIn.annotationKey());
}

void OMDAnnotationStore::setAnnotation(const Value& annotation, const OMDPlugIn& plugIn)
{
    setAnnotationForKey(annotation, plugIn.annotationKey());
}

void OMDAnnotationStore::setAnnotationForKey(const Value& annotation, const std::string& key)
{
    m_text.forget(key);
    if (annotation.isNone()) {
        m_annotations.erase(key);
    } else {
        // A shallow merge: named keys replace theirs whole, the others stay.
        DictionaryBuilder merged(annotationForIdentifier(key));
        for (const auto& [name, value] : annotation.entries())
            merged.set(name, value);
        m_annotations[key] = merged.build();
    }
    if (auto failure = saveDb()) {
        OMLog::ops().error(
            "unable to save annotations:%{public}@ error:%{public}@", m_annotationsURL, describe(*failure));
    }
}

std::optional<OMError> OMDAnnotationStore::loadDb(const std::string& url)
{
    auto fail = [](OMError error) {
        OM_PROBE2(db__load, error.domain().c_str(), static_cast<uint64_t>(error.code()));
        return error;
    };
    auto root = Vlist::readFile(pathOf(url));
    if (!root.ok())
        return fail(root.error());
    if (!root->isDictionary())
        return fail(OMError::platform(kPlatformErrorMalformed, "the database is not a dictionary"));
    const int64_t version = versionOf(*root);
    if (version != kDatabaseVersion) {
        return fail(OMMakeErrorWithFormat(7, "found database version %d needed version %d", static_cast<int>(version),
            static_cast<int>(kDatabaseVersion)));
    }
    m_annotations.clear();
    m_text.clear();
    // Every reader of an entry takes it for a dictionary; anything else in a damaged file is dropped.
    for (const auto& [key, annotation] : (*root)["data"].entries()) {
        if (annotation.isDictionary())
            m_annotations.emplace(key, annotation);
    }
    return std::nullopt;
}

std::optional<OMError> OMDAnnotationStore::saveDb()
{
    const std::string& text = m_text.compose(m_annotations, kDatabaseVersion);
    if (m_unreadableOnDisk)
        preserveUnreadableFile();
    auto written = Storage::writeFileAtomically(
        pathOf(m_annotationsURL), { reinterpret_cast<const uint8_t*>(text.data()), text.size() }, 0600);
    if (!written.ok())
        return written.error();
    m_unreadableOnDisk = false;
    return std::nullopt;
}

void OMDAnnotationStore::preserveUnreadableFile()
{
    const std::string path = pathOf(m_annotationsURL);
    const std::string copy = path + ".unreadable-" + timestamp();
    // A second name for the old file: the save then replaces only the database's own name.
    if (::link(path.c_str(), copy.c_str()) == 0 || errno == EEXIST)
        OMLog::ops().notice("kept the unreadable annotation database as %{public}@", copy);
    else if (errno != ENOENT)
        OMLog::ops().error("cannot keep the unreadable annotation database %{public}@: %{public}s; it is replaced",
            path, OMError::errnoDescription(errno));
    m_unreadableOnDisk = false;
}

std::string OMDAnnotationStore::globalURL()
{
    return OMBundle::fileURL(Storage::environment("OMD_GLOBAL_ANNOTATIONS").value_or("/var/db/Ombrel-Annotations"));
}

std::string OMDAnnotationStore::containerURL()
{
    const std::string container = Storage::userDataContainer(kContainerIdentifier);
    auto made = Storage::makeDirectories(container, 0700);
    if (!made.ok()) {
        const auto code = static_cast<unsigned long long>(made.error().code());
        OMLog::ops().error("failed to get storage container: error=%llu", code);
        internalInconsistency(format("unable to locate user container: error %llu", code));
    }
    return OMBundle::fileURL(container);
}

std::string OMDAnnotationStore::defaultDatabaseURL()
{
    if (!Storage::isMultiUser())
        return globalURL();
    const std::string directory = pathOf(containerURL()) + "/com.orvex.ombrel";
    auto made = Storage::makeDirectories(directory, 0700);
    if (!made.ok()) {
        OMLog::ops().error("failed to create storage directory at %{public}@ - error=%{public}@",
            OMBundle::fileURL(directory + "/"), describe(made.error()));
        internalInconsistency(
            format("unable to create plugin annotations directory:%@ error:%@", directory, describe(made.error())));
    }
    const std::string file = directory + "/Annotations";
    OMLog::ops().debug("annotations are stored at %{public}@", file);
    return OMBundle::fileURL(file);
}

} // namespace om
