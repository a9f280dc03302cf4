#include "omd/OMDatabase.h"

namespace om {

OMDatabase::OMDatabase(std::optional<std::string> databasePath)
    : _sync(WorkQueue::create("OMDatabase"))
    , m_databasePath(std::move(databasePath))
{
}

OMDatabase::~OMDatabase() = default;

std::shared_ptr<OMDatabase> OMDatabase::initWithDatabase(std::optional<std::string> databasePath)
{
    std::shared_ptr<OMDatabase> database(new OMDatabase(std::move(databasePath)));
    if (!database->openDatabase().ok())
        return nullptr;
    return database;
}

Result<void> OMDatabase::openDatabase()
{
    return {};
}

size_t OMDatabase::cachedRecordCount() const
{
    size_t count = 0;
    _sync->sync([&] { count = m_cache.size(); });
    return count;
}

} // namespace om
