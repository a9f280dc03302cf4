// The per-user table of choices about plug-ins: per annotation key, the user's election and the
// values hosts keep. Held whole in memory, loaded once, and written whole to one vlist file after
// every change, before the change is acknowledged. The store has no lock: the database calls it on
// _sync, and the request queue reads it while nothing writes.
#pragma once

#include <map>
#include <memory>
#include <optional>
#include <string>
#include <string_view>

#include "omd/OMDAnnotationText.h"
#include "platform/OMError.h"
#include "platform/Value.h"

namespace om {

class OMDPlugIn;

class OMDAnnotationStore {
public:
    static constexpr int64_t kDatabaseVersion = 16;

    // Loads the table from path (a file), else from the default location; migrates the shared
    // table of a multi-user device. Stops the daemon when no location can be had.
    static std::shared_ptr<OMDAnnotationStore> initWithDatabase(const std::optional<std::string>& path);

    const std::string& annotationsURL() const { return m_annotationsURL; }
    // The whole table as a dictionary, annotation key to annotation dictionary.
    Value annotations() const;

    // The entry under key; none when there is none.
    Value annotationForIdentifier(std::string_view key) const;
    Value annotationForPlugIn(const OMDPlugIn& plugIn) const;
    // Merges annotation into the plug-in's entry (none removes the entry), then saves.
    void setAnnotation(const Value& annotation, const OMDPlugIn& plugIn);
    // Merges annotation into the entry under key (none removes it), then saves.
    void setAnnotationForKey(const Value& annotation, const std::string& key);

    // Replaces the table with the file's; an error leaves the table as it was.
    std::optional<OMError> loadDb(const std::string& url);
    std::optional<OMError> saveDb();

    // The file of a store made without a path: the per-user container's on a multi-user device,
    // the global file otherwise.
    static std::string defaultDatabaseURL();
    // /var/db/Ombrel-Annotations, or OMD_GLOBAL_ANNOTATIONS where a staging system moves it.
    static std::string globalURL();
    // The current user's data container of the daemon, made when missing.
    static std::string containerURL();

private:
    explicit OMDAnnotationStore(std::string annotationsURL);
    // Keeps a copy of the file that failed to load, once, before the first save replaces it.
    void preserveUnreadableFile();

    const std::string m_annotationsURL;
    std::map<std::string, Value> m_annotations;
    OMDAnnotationText m_text; // the file's text, entry by entry
    // The file at m_annotationsURL could not be read as a table; set until a save replaces it.
    bool m_unreadableOnDisk = false;
};

} // namespace om
