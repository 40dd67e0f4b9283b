#include "TamsaDatabase.h"

#include "TamsaQuery.h"
#include "TamsaSearch.h"
#include "TamsaStore.h"

#include <sqlite3.h>

#include <cstring>

namespace tamsa {

TamsaDatabase::~TamsaDatabase()
{
    sqlite3_close_v2(m_db);
}

int32_t TamsaDatabase::setStoragePath(const char* directoryUtf8)
{
    if (!directoryUtf8 || !*directoryUtf8) {
        return TAMSA_E_NO_STORAGE_PATH;
    }
    int32_t status = TAMSA_OK;
    std::shared_ptr<TamsaStore> store = TamsaStore::open(directoryUtf8, &status);
    if (!store) {
        return status;
    }
    sqlite3* db = store->connect(&status);
    if (!db) {
        return status;
    }
    sqlite3_close_v2(m_db);
    m_db = db;
    m_store = std::move(store);
    return TAMSA_OK;
}

int32_t TamsaDatabase::put(int32_t groupId, int32_t locationNumber, const char* json)
{
    if (!json || locationNumber <= 0) {
        return TAMSA_E_INVALID_ARGUMENT;
    }
    if (!m_store) {
        return TAMSA_E_NO_STORAGE_PATH;
    }
    if ((m_reconnect || !m_db || sqlite3_db_readonly(m_db, "main") != 0) && *m_openSearches == 0) {
        // SQLite keeps a connection opened on a read-only directory read-only for good, and with
        // it the WAL index all connections of the process to that file share: the old one goes
        // first, so that ingest resumes once the directory is writable and no other handle of
        // the process still reads through a read-only connection.
        sqlite3_close_v2(m_db);
        int32_t status = TAMSA_OK;
        m_db = m_store->connect(&status);
        if (!m_db) {
            m_reconnect = true;
            return status;
        }
    }
    const int32_t result =
        m_store->ingest(m_db, groupId, uint32_t(locationNumber), std::string_view(json, std::strlen(json)));
    m_reconnect = result == TAMSA_E_IO || result == TAMSA_E_BUSY;
    return result;
}

int32_t TamsaDatabase::openSearch(const TTAMSA_OBJECTMETAINFO_QUERY* query, TamsaSearch** search)
{
    if (!query) {
        return TAMSA_E_INVALID_ARGUMENT;
    }
    if (!m_store) {
        return TAMSA_E_NO_STORAGE_PATH;
    }
    if (!m_db) {
        int32_t status = TAMSA_OK;
        m_db = m_store->connect(&status); // lost when a reconnect for ingest failed
        if (!m_db) {
            return status;
        }
    }
    TamsaQuery compiled;
    const int32_t status = TamsaQuery::compile(*query, &compiled);
    if (status != TAMSA_OK) {
        return status;
    }
    *search = new TamsaSearch(m_store, m_db, std::move(compiled), m_openSearches);
    return TAMSA_OK;
}

} // namespace tamsa
