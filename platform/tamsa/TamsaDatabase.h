#pragma once
// One database handle: a storage directory and an SQLite connection of its own, used by one
// thread at a time (searches on it included).

#include "Tamsa.h"

#include <atomic>
#include <memory>
#include <string>

struct sqlite3;

namespace tamsa {

class TamsaSearch;
class TamsaStore;

class TamsaDatabase
{
public:
    TamsaDatabase() = default;
    ~TamsaDatabase();
    TamsaDatabase(const TamsaDatabase&) = delete;
    TamsaDatabase& operator=(const TamsaDatabase&) = delete;

    int32_t setStoragePath(const char* directoryUtf8);
    int32_t put(int32_t groupId, int32_t locationNumber, const char* json);
    // On success *search is a new search the caller frees with delete.
    int32_t openSearch(const TTAMSA_OBJECTMETAINFO_QUERY* query, TamsaSearch** search);

private:
    std::shared_ptr<TamsaStore> m_store;
    sqlite3* m_db = nullptr;
    // Searches open on m_db (they use it until closed); shared with them, so a search closed
    // after its handle (against the rules) still finds it.
    // Atomic: a search may be closed on another thread than the one that ingests.
    const std::shared_ptr<std::atomic<int>> m_openSearches = std::make_shared<std::atomic<int>>(0);
    // The last ingest failed or m_db could not be made: the next one starts on a new connection.
    bool m_reconnect = false;
};

} // namespace tamsa
