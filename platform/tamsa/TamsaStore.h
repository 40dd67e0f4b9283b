#pragma once
// The state one storage directory shares between all database handles of the process: the
// feature files (one writer each) and the read-only mappings the scans use. Handles find it by
// path, so opening a handle per search (as the plug-in does) keeps the mappings warm.
//
// Files in the directory: tamsa.db (SQLite, WAL; its -wal and -shm files stay after the last
// connection, so that the store can be read where it cannot be written),
// features/L<location>.<body|face>.f32, .rows and .q8 (see TamsaFeatureFile), tamsa.lock.
//
// Durability: an ingest returns after its data is written to the files (WAL, synchronous NORMAL),
// so it survives a crash or kill of the process; a device sync per ingest costs tens of
// milliseconds here and would cap the ingest rate far below what cameras deliver. With the
// environment variable TAMSA_SYNC=full every ingest also syncs (survives a power loss).
//
// Thread use: every member function may be called from any thread. Ingests are serialised by
// m_writeMutex in the process and by a lock on tamsa.lock between processes.

#include "TamsaFeatureFile.h"

#include <cstdint>
#include <map>
#include <memory>
#include <mutex>
#include <string>
#include <string_view>

struct sqlite3;

namespace tamsa {

enum class FeatureKind
{
    Body = 0,
    Face = 1
};

class TamsaStore
{
public:
    // The store of a directory (created with its files when missing). Null with *status set on failure.
    static std::shared_ptr<TamsaStore> open(const std::string& directory, int32_t* status);
    ~TamsaStore();

    const std::string& directory() const { return m_directory; }
    // A new connection to the store's SQLite file; the caller closes it with sqlite3_close and
    // uses it from one thread at a time (it has no mutex of its own).
    sqlite3* connect(int32_t* status) const;

    // Stores a camera answer under `location`: the count stored or a negative status.
    int32_t ingest(sqlite3* db, int32_t groupId, uint32_t location, std::string_view json);

    // The current rows of a location's vectors of one kind; null when there are none.
    // `needRows`: a mapping with fewer rows is refreshed.
    std::shared_ptr<const TamsaFeatureMap> featureMap(uint32_t location, FeatureKind kind,
                                                      int64_t needRows = 0);

private:
    explicit TamsaStore(std::string directory);
    std::string vectorPath(uint32_t location, FeatureKind kind) const;
    std::string infoPath(uint32_t location, FeatureKind kind) const;
    std::string compactPath(uint32_t location, FeatureKind kind) const;
    TamsaFeatureFile* writer(uint32_t location, FeatureKind kind); // REQUIRES: m_writeMutex held

    const std::string m_directory;
    const bool m_fullSync;
    int m_lockFd = -1; // -1 while the directory allows no lock file; retried under m_writeMutex

    std::mutex m_writeMutex;
    std::map<std::pair<uint32_t, int>, std::unique_ptr<TamsaFeatureFile>>
        m_writers; // guarded by m_writeMutex

    std::mutex m_mapMutex;
    std::map<std::pair<uint32_t, int>, std::shared_ptr<const TamsaFeatureMap>>
        m_maps; // guarded by m_mapMutex
};

} // namespace tamsa
