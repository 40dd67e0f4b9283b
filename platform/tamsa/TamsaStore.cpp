#include "TamsaStore.h"

#include "JsonDom.h"
#include "Tamsa.h"
#include "TamsaCameraObject.h"

#include <sqlite3.h>

#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <deque>
#include <fcntl.h>
#include <filesystem>
#include <sys/file.h>
#include <unistd.h>
#include <unordered_set>

namespace tamsa {

namespace {

const char* const kSchema = R"sql(
CREATE TABLE IF NOT EXISTS objects(
  rid INTEGER PRIMARY KEY,
  location INTEGER NOT NULL,
  object_id INTEGER NOT NULL,
  group_id INTEGER NOT NULL,
  type TEXT NOT NULL,
  start_time INTEGER NOT NULL,
  end_time INTEGER NOT NULL,
  attributes TEXT NOT NULL,
  plate TEXT NOT NULL,
  trajectory BLOB,
  thumbnails TEXT NOT NULL,
  body_row INTEGER,
  face_row INTEGER);
CREATE UNIQUE INDEX IF NOT EXISTS objects_key ON objects(location, object_id);
CREATE INDEX IF NOT EXISTS objects_time ON objects(location, start_time);
CREATE TABLE IF NOT EXISTS meta(name TEXT PRIMARY KEY, value INTEGER NOT NULL);
)sql";

const char* const kUpsert = R"sql(
INSERT INTO objects(location, object_id, group_id, type, start_time, end_time, attributes, plate,
                    trajectory, thumbnails, body_row, face_row)
VALUES(?1, ?2, ?3, ?4, ?5, ?6, ?7, ?8, ?9, ?10, ?11, ?12)
ON CONFLICT(location, object_id) DO UPDATE SET
  group_id = excluded.group_id, type = excluded.type, start_time = excluded.start_time,
  end_time = excluded.end_time, attributes = excluded.attributes, plate = excluded.plate,
  trajectory = excluded.trajectory, thumbnails = excluded.thumbnails, body_row = excluded.body_row,
  face_row = excluded.face_row
RETURNING rid
)sql";

// The longest object stay seen so far lets a time query bound its index range from below.
const char* const kMaxDuration = R"sql(
INSERT INTO meta(name, value) VALUES('max_duration', ?1)
ON CONFLICT(name) DO UPDATE SET value = max(value, excluded.value)
)sql";

std::mutex g_registryMutex;
std::map<std::string, std::weak_ptr<TamsaStore>> g_registry; // guarded by g_registryMutex
// The last stores used stay open so that their mappings survive between handles.
std::deque<std::shared_ptr<TamsaStore>> g_warm; // guarded by g_registryMutex
constexpr size_t kWarmStores = 4;

bool exec(sqlite3* db, const char* sql)
{
    return sqlite3_exec(db, sql, nullptr, nullptr, nullptr) == SQLITE_OK;
}

// Ends a transaction that did not commit, whatever state it is in.
void rollback(sqlite3* db)
{
    if (!sqlite3_get_autocommit(db)) {
        exec(db, "ROLLBACK");
    }
}

class Statement
{
public:
    Statement(sqlite3* db, const char* sql) { sqlite3_prepare_v2(db, sql, -1, &m_statement, nullptr); }
    ~Statement() { sqlite3_finalize(m_statement); }
    sqlite3_stmt* get() const { return m_statement; }

private:
    sqlite3_stmt* m_statement = nullptr;
};

class WriteLock
{
public:
    explicit WriteLock(int fd)
        : m_fd(fd)
    {
        while (m_fd >= 0 && ::flock(m_fd, LOCK_EX) != 0 && errno == EINTR) {
        }
    }
    ~WriteLock()
    {
        if (m_fd >= 0) {
            ::flock(m_fd, LOCK_UN);
        }
    }

private:
    int m_fd;
};

// The lock serialises writers only, so a read-only descriptor (all a read-only directory
// allows) serves as well; -1 when the file can be neither made nor opened.
int openLockFile(const std::string& directory)
{
    const std::string path = directory + "/tamsa.lock";
    const int fd = ::open(path.c_str(), O_RDWR | O_CREAT | O_CLOEXEC, 0644);
    return fd >= 0 ? fd : ::open(path.c_str(), O_RDONLY | O_CLOEXEC);
}

// A file name as the path of an SQLite URI.
std::string uriPath(const std::string& path)
{
    std::string uri;
    for (char c : path) {
        if (c == '%' || c == '?' || c == '#') {
            char escaped[4];
            std::snprintf(escaped, sizeof escaped, "%%%02X", unsigned(static_cast<unsigned char>(c)));
            uri += escaped;
        } else {
            uri += c;
        }
    }
    return uri;
}

} // namespace

static bool fullSyncWanted()
{
    const char* mode = std::getenv("TAMSA_SYNC");
    return mode && std::strcmp(mode, "full") == 0;
}

TamsaStore::TamsaStore(std::string directory)
    : m_directory(std::move(directory))
    , m_fullSync(fullSyncWanted())
{}

TamsaStore::~TamsaStore()
{
    if (m_lockFd >= 0) {
        ::close(m_lockFd);
    }
}

std::shared_ptr<TamsaStore> TamsaStore::open(const std::string& directory, int32_t* status)
{
    std::error_code error;
    std::filesystem::create_directories(std::filesystem::path(directory) / "features", error);
    const std::filesystem::path canonical = std::filesystem::canonical(directory, error);
    if (error) {
        *status = TAMSA_E_IO;
        return nullptr;
    }
    const std::string key = canonical.string();

    std::lock_guard<std::mutex> registryLock(g_registryMutex);
    std::shared_ptr<TamsaStore> store = g_registry[key].lock();
    if (!store) {
        store.reset(new TamsaStore(key));
        store->m_lockFd = openLockFile(key);
        sqlite3* db = store->connect(status);
        if (!db) {
            *status = TAMSA_E_IO;
            return nullptr;
        }
        bool ok = false;
        if (sqlite3_db_readonly(db, "main") == 1) {
            // A read-only directory still serves searches from what it holds; ingest fails
            // until it is writable again (see ingest).
            ok = true;
        } else if (store->m_lockFd >= 0) {
            WriteLock lock(store->m_lockFd);
            ok = exec(db, "PRAGMA journal_mode=WAL") && exec(db, kSchema);
        }
        sqlite3_close(db);
        if (!ok) {
            *status = TAMSA_E_IO;
            return nullptr;
        }
        g_registry[key] = store;
    }
    for (auto it = g_warm.begin(); it != g_warm.end(); ++it) {
        if (*it == store) {
            g_warm.erase(it);
            break;
        }
    }
    g_warm.push_front(store);
    if (g_warm.size() > kWarmStores) {
        g_warm.pop_back();
    }
    *status = TAMSA_OK;
    return store;
}

sqlite3* TamsaStore::connect(int32_t* status) const
{
    sqlite3* db = nullptr;
    const std::string path = m_directory + "/tamsa.db";
    if (sqlite3_open_v2(path.c_str(), &db, SQLITE_OPEN_READWRITE | SQLITE_OPEN_CREATE | SQLITE_OPEN_NOMUTEX,
                        nullptr) != SQLITE_OK) {
        sqlite3_close(db);
        *status = TAMSA_E_IO;
        return nullptr;
    }
    // The log and its index outlive the last connection: a reader of a read-only directory
    // cannot create them, and without them SQLite cannot read a WAL database at all.
    int persistWal = 1;
    sqlite3_file_control(db, "main", SQLITE_FCNTL_PERSIST_WAL, &persistWal);
    if (sqlite3_db_readonly(db, "main") == 1 && !exec(db, "SELECT 1 FROM sqlite_master LIMIT 1")) {
        // Read-only and left without them (by an older writer): nobody can write there now,
        // so the file is read as it is.
        sqlite3_close(db);
        db = nullptr;
        if (sqlite3_open_v2(("file:" + uriPath(path) + "?immutable=1").c_str(), &db,
                            SQLITE_OPEN_READONLY | SQLITE_OPEN_URI | SQLITE_OPEN_NOMUTEX,
                            nullptr) != SQLITE_OK ||
            !exec(db, "SELECT 1 FROM sqlite_master LIMIT 1")) {
            sqlite3_close(db);
            *status = TAMSA_E_IO;
            return nullptr;
        }
    }
    sqlite3_busy_timeout(db, 30000);
    // With a persistent log, SQLite empties it after the last connection's checkpoint only when a
    // size limit is set; without one every later last close (each handle of the plug-in) copied
    // the same frames into the database again, for milliseconds per handle. The limit itself only
    // bounds what the log keeps between checkpoints.
    exec(db, "PRAGMA journal_size_limit=67108864");
    exec(db, m_fullSync ? "PRAGMA synchronous=FULL" : "PRAGMA synchronous=NORMAL");
    exec(db, "PRAGMA temp_store=MEMORY");
    exec(db, "PRAGMA cache_size=-65536");
    *status = TAMSA_OK;
    return db;
}

std::string TamsaStore::vectorPath(uint32_t location, FeatureKind kind) const
{
    return m_directory + "/features/L" + std::to_string(location) +
           (kind == FeatureKind::Body ? ".body" : ".face") + ".f32";
}

std::string TamsaStore::infoPath(uint32_t location, FeatureKind kind) const
{
    return m_directory + "/features/L" + std::to_string(location) +
           (kind == FeatureKind::Body ? ".body" : ".face") + ".rows";
}

std::string TamsaStore::compactPath(uint32_t location, FeatureKind kind) const
{
    return m_directory + "/features/L" + std::to_string(location) +
           (kind == FeatureKind::Body ? ".body" : ".face") + ".q8";
}

TamsaFeatureFile* TamsaStore::writer(uint32_t location, FeatureKind kind)
{
    std::unique_ptr<TamsaFeatureFile>& file = m_writers[{location, int(kind)}];
    if (!file) {
        file.reset(new TamsaFeatureFile(vectorPath(location, kind), infoPath(location, kind),
                                        compactPath(location, kind)));
    }
    return file.get();
}

int32_t TamsaStore::ingest(sqlite3* db, int32_t groupId, uint32_t location, std::string_view json)
{
    if (location == 0) {
        return TAMSA_E_INVALID_ARGUMENT; // 0 ends location lists: no object can live there
    }
    std::vector<TamsaCameraObject> objects;
    {
        simdjson::dom::parser parser; // freed with the parsed text, before writing
        simdjson::dom::element document;
        simdjson::dom::array list;
        if (JsonDom::parse(parser, json, &document) || document["ObjectMetaInfo"].get_array().get(list)) {
            return TAMSA_E_BAD_JSON;
        }
        objects.reserve(list.size());
        for (const simdjson::dom::element element : list) {
            TamsaCameraObject object;
            if (TamsaCameraObject::fromJson(element, &object)) {
                objects.push_back(std::move(object));
            }
        }
    }
    if (objects.empty()) {
        return 0;
    }

    std::lock_guard<std::mutex> writeLock(m_writeMutex);
    if (m_lockFd < 0) {
        m_lockFd = openLockFile(m_directory); // the directory was read-only when the store opened
        if (m_lockFd < 0) {
            return TAMSA_E_IO;
        }
    }
    WriteLock fileLock(m_lockFd);
    TamsaFeatureFile* bodyFile = writer(location, FeatureKind::Body);
    TamsaFeatureFile* faceFile = writer(location, FeatureKind::Face);
    if (!bodyFile->open() || !faceFile->open()) {
        return TAMSA_E_IO;
    }
    if (!exec(db, "BEGIN IMMEDIATE")) {
        return sqlite3_errcode(db) == SQLITE_BUSY ? TAMSA_E_BUSY : TAMSA_E_IO;
    }
    Statement upsert(db, kUpsert);
    Statement maxDuration(db, kMaxDuration);
    if (!upsert.get() || !maxDuration.get()) {
        rollback(db);
        return TAMSA_E_IO;
    }
    std::unordered_set<uint64_t> stored;
    uint32_t longest = 0;
    for (const TamsaCameraObject& object : objects) {
        sqlite3_stmt* s = upsert.get();
        sqlite3_reset(s);
        sqlite3_bind_int64(s, 1, location);
        sqlite3_bind_int64(s, 2, int64_t(object.m_id));
        sqlite3_bind_int64(s, 3, groupId);
        sqlite3_bind_text(s, 4, object.m_type.data(), int(object.m_type.size()), SQLITE_STATIC);
        sqlite3_bind_int64(s, 5, object.m_startTime);
        sqlite3_bind_int64(s, 6, object.m_endTime);
        sqlite3_bind_text(s, 7, object.m_attributes.data(), int(object.m_attributes.size()), SQLITE_STATIC);
        sqlite3_bind_text(s, 8, object.m_plate.data(), int(object.m_plate.size()), SQLITE_STATIC);
        if (object.m_trajectory.empty()) {
            sqlite3_bind_null(s, 9);
        } else {
            sqlite3_bind_blob(s, 9, object.m_trajectory.data(), int(object.m_trajectory.size() * 16),
                              SQLITE_STATIC);
        }
        sqlite3_bind_text(s, 10, object.m_thumbnails.data(), int(object.m_thumbnails.size()), SQLITE_STATIC);
        const int64_t bodyRow = object.m_body.empty() ? -1 : bodyFile->nextRow();
        const int64_t faceRow = object.m_face.empty() ? -1 : faceFile->nextRow();
        bodyRow < 0 ? sqlite3_bind_null(s, 11) : sqlite3_bind_int64(s, 11, bodyRow);
        faceRow < 0 ? sqlite3_bind_null(s, 12) : sqlite3_bind_int64(s, 12, faceRow);
        if (sqlite3_step(s) != SQLITE_ROW) {
            bodyFile->discard();
            faceFile->discard();
            rollback(db);
            return TAMSA_E_IO;
        }
        const int64_t rowId = sqlite3_column_int64(s, 0);
        sqlite3_step(s); // finishes the statement (RETURNING yields one row)
        const FeatureRowInfo info{rowId, object.m_startTime, object.m_endTime};
        if (bodyRow >= 0) {
            bodyFile->append(object.m_body.data(), info);
        }
        if (faceRow >= 0) {
            faceFile->append(object.m_face.data(), info);
        }
        longest = std::max(longest, object.m_endTime - object.m_startTime);
        stored.insert(object.m_id);
    }
    sqlite3_bind_int64(maxDuration.get(), 1, longest);
    const bool metaOk = sqlite3_step(maxDuration.get()) == SQLITE_DONE;
    // Vectors reach the disk before the commit that points at them.
    if (!metaOk || !bodyFile->flush(m_fullSync) || !faceFile->flush(m_fullSync)) {
        bodyFile->discard();
        faceFile->discard();
        rollback(db);
        return TAMSA_E_IO;
    }
    if (!exec(db, "COMMIT")) {
        rollback(db);
        return TAMSA_E_IO;
    }
    return int32_t(stored.size());
}

std::shared_ptr<const TamsaFeatureMap> TamsaStore::featureMap(uint32_t location, FeatureKind kind,
                                                              int64_t needRows)
{
    const std::string vectors = vectorPath(location, kind);
    const std::string infos = infoPath(location, kind);
    const std::string compact = compactPath(location, kind);
    std::lock_guard<std::mutex> lock(m_mapMutex);
    std::shared_ptr<const TamsaFeatureMap>& cached = m_maps[{location, int(kind)}];
    // A view whose compact rows lag (a store from before them) is renewed once a writer has
    // filled them in.
    if (cached && cached->rows() >= needRows &&
        cached->rows() == TamsaFeatureMap::rowsOnDisk(vectors, infos) &&
        (cached->compactRows() == cached->rows() ||
         cached->compactRows() == std::min(cached->rows(), TamsaFeatureMap::compactRowsOnDisk(compact)))) {
        return cached;
    }
    cached = TamsaFeatureMap::map(vectors, infos, compact, cached);
    return cached;
}

} // namespace tamsa
