// Loads arbitrary bytes as the annotation database file, the way the daemon does at start-up.
// Whatever loads must save as the canonical table and load back unchanged; whatever does not load
// leaves an empty table that a change and a save still work on (keeping the bad file aside).
#include <sys/stat.h>
#include <unistd.h>

#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <filesystem>
#include <string>

#include "omd/OMDAnnotationStore.h"
#include "platform/Vlist.h"

using om::OMDAnnotationStore;
using om::Value;

namespace {

std::string g_directory;

[[noreturn]] void broken(const char* what)
{
    std::fprintf(stderr, "annotation database invariant broken: %s\n", what);
    std::abort();
}

void writeInput(const std::string& path, const uint8_t* data, size_t size)
{
    FILE* file = std::fopen(path.c_str(), "wb");
    if (!file || (size && std::fwrite(data, 1, size, file) != size) || std::fclose(file) != 0)
        broken("cannot write the input file");
}

// Compared as their XML text: a NaN equals no value, and XML cannot carry every string byte for
// byte, but the same table always writes the same text.
bool sameTable(const Value& a, const Value& b)
{
    return om::Vlist::writeXml(a) == om::Vlist::writeXml(b);
}

} // namespace

extern "C" int LLVMFuzzerInitialize(int*, char***)
{
    // A private directory on a memory file system where there is one: every save syncs.
    const char* base = ::access("/dev/shm", W_OK) == 0 ? "/dev/shm" : "/tmp";
    std::string pattern = std::string(base) + "/fuzz-annotations-XXXXXX";
    if (!::mkdtemp(pattern.data()))
        broken("mkdtemp");
    g_directory = pattern;
    // No shared table to migrate, no container outside the directory, and a quiet log.
    ::setenv("OMD_GLOBAL_ANNOTATIONS", (g_directory + "/no-global").c_str(), 1);
    ::setenv("XDG_DATA_HOME", g_directory.c_str(), 1);
    ::setenv("EVLOG_LEVEL", "off", 1);
    return 0;
}

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size)
{
    const std::string path = g_directory + "/db/Annotations";
    std::error_code ignored;
    std::filesystem::remove_all(g_directory + "/db", ignored);
    std::filesystem::create_directories(g_directory + "/db");
    writeInput(path, data, size);

    auto store = OMDAnnotationStore::initWithDatabase(path);
    if (!store)
        broken("no store");
    const Value loaded = store->annotations();
    for (const auto& [key, entry] : loaded.entries()) {
        if (!entry.isDictionary())
            broken("an entry that is no dictionary");
    }
    const bool readable = !store->loadDb(store->annotationsURL()).has_value();
    if (readable && !sameTable(store->annotations(), loaded))
        broken("loading twice");
    if (!readable && loaded.count() != 0)
        broken("a table from a file that does not load");

    // A change merges into the first entry (or makes one) and reaches the file whole.
    const std::string key = loaded.count() ? loaded.entries()[0].first : std::string("com.example.fuzz");
    store->setAnnotationForKey(Value::dictionary({ { "election", 1 } }), key);
    auto saved = om::Vlist::readFile(path);
    if (!saved.ok())
        broken("the saved file does not parse");
    const Value expected = Value::dictionary({ { "version", Value(16) }, { "data", store->annotations() } });
    if (!sameTable(*saved, expected))
        broken("the saved file is not the table");
    auto reloaded = OMDAnnotationStore::initWithDatabase(path);
    if (!sameTable(reloaded->annotations(), store->annotations()))
        broken("the saved table does not load back");
    if (!(reloaded->annotationForIdentifier(key)["election"] == Value(1)))
        broken("the change is not in its entry");
    return 0;
}
