// Privacy consent: which consent services the user granted to which application, one row per
// (bundle identifier, service identifier) with a granted flag, in a small SQLite file at
// CONSENT_DB. omctl writes it; the daemon reads it when it chooses a plug-in's sandbox.
#pragma once

#include <memory>
#include <string>
#include <vector>

#include "platform/Result.h"

struct sqlite3;

namespace om {

class Consent {
public:
    // The consent that lets a keyboard which asks for open access reach the network.
    static constexpr const char* kKeyboardNetworkService = "com.orvex.consent.keyboard-network";
    static constexpr const char* kErrorDomain = "com.orvex.consent";

    struct Entry {
        std::string service;
        bool granted = false;
    };

    enum class Access : uint8_t { ReadOnly, ReadWrite };

    // CONSENT_DB, else /var/lib/omd/consent.db for root and
    // ${XDG_DATA_HOME:-~/.local/share}/omd/consent.db for other users.
    static std::string defaultPath();

    // Opens the file, checking that it is an intact consent database; ReadWrite makes it (and its
    // directory) when missing. A file that is damaged or belongs to something else is refused.
    static Result<std::unique_ptr<Consent>> open(const std::string& path, Access access);
    // The entries of bundleIdentifier from the file at path, in the order they were first
    // recorded. A missing file holds no entries; it is not an error.
    static Result<std::vector<Entry>> informationForBundle(
        const std::string& path, const std::string& bundleIdentifier);

    ~Consent();
    Consent(const Consent&) = delete;
    Consent& operator=(const Consent&) = delete;

    Result<std::vector<Entry>> entries(const std::string& bundleIdentifier);
    // Records the flag, replacing an earlier one for the same pair; on disk when it returns.
    Result<void> set(const std::string& bundleIdentifier, const std::string& service, bool granted);

    const std::string& path() const { return m_path; }

private:
    Consent(std::string path, sqlite3* database);
    Result<void> verify(Access access);
    Result<void> execute(const char* sql);
    OMError failure(const std::string& what) const;

    std::string m_path;
    sqlite3* m_database;
};

} // namespace om
