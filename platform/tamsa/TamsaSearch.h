#pragma once
// One open enumeration. Plain searches stream rows from SQLite, one cursor per location merged by
// start time; feature searches scan the locations' vector files once (on the first Next, so that
// Abort can reach the scan), keep the objects scoring at least kScoreThreshold and hand them out
// best first. A scan reads only the time blocks that can overlap the window, and the compact
// copy of each row before (and mostly instead of) its float32 row.
//
// Thread use: next() on the thread that owns the database handle; abort() from any thread.

#include "Tamsa.h"
#include "TamsaQuery.h"
#include "TamsaStore.h"

#include <atomic>
#include <map>
#include <memory>
#include <string>
#include <vector>

struct sqlite3;
struct sqlite3_stmt;

namespace tamsa {

constexpr float kScoreThreshold = 0.5f;

class TamsaSearch
{
public:
    // `openCount`, when given, counts this search while it lives.
    TamsaSearch(std::shared_ptr<TamsaStore> store, sqlite3* db, TamsaQuery query,
                std::shared_ptr<std::atomic<int>> openCount = nullptr);
    ~TamsaSearch();
    TamsaSearch(const TamsaSearch&) = delete;
    TamsaSearch& operator=(const TamsaSearch&) = delete;

    int32_t next(TTAMSA_OBJECTMETAINFO_RESULT* result);
    // Whether feature scans may rule rows out by their compact copy (the default); off, every
    // row is scored in float32 (so also with TAMSA_SCAN=float32 in the environment). The results
    // are the same either way; benchmarks and tests compare the two.
    static void setCompactScan(bool enabled);
    void abort() { m_aborted.store(true, std::memory_order_relaxed); }
    bool aborted() const { return m_aborted.load(std::memory_order_relaxed); }

private:
    struct Cursor
    {
        sqlite3_stmt* statement = nullptr;
        bool hasRow = false;
        bool consumed = false;
        uint32_t location = 0;
    };
    struct Hit
    {
        int64_t rowId = 0;
        float score = 0;
        float faceScore = 0;
        uint32_t startTime = 0;
    };

    int32_t start();
    int32_t startCursors();
    int32_t openCursor(uint32_t location);
    int32_t advance(Cursor* cursor);
    int32_t nextFromCursors(TTAMSA_OBJECTMETAINFO_RESULT* result);
    int32_t runScan();
    int32_t nextHit(TTAMSA_OBJECTMETAINFO_RESULT* result);
    // Does the current row of `statement` (columns as in kColumns) meet the non-SQL conditions?
    bool rowMatches(sqlite3_stmt* statement) const;
    // Copies the row into the search's buffers and points the result at them.
    void fill(sqlite3_stmt* statement, float score, float faceScore, TTAMSA_OBJECTMETAINFO_RESULT* result);
    const float* vectorOf(uint32_t location, FeatureKind kind, int64_t row);
    float score(const std::vector<float>& query, float queryNorm2, const float* row) const;

    const std::shared_ptr<TamsaStore> m_store;
    sqlite3* const m_db;
    const TamsaQuery m_query;
    const std::shared_ptr<std::atomic<int>> m_openCount;
    std::atomic<bool> m_aborted{false};

    bool m_started = false;
    bool m_finished = false;
    std::vector<Cursor> m_cursors;
    std::string m_cursorSql;
    int64_t m_lowestStart = 0;
    std::vector<Hit> m_hits;
    size_t m_nextHit = 0;
    sqlite3_stmt* m_byRowId = nullptr;
    std::map<std::pair<uint32_t, int>, std::shared_ptr<const TamsaFeatureMap>> m_maps;

    // What the last result points to; valid until the next call.
    std::string m_type;
    std::string m_attributes;
    std::string m_thumbnails;
    std::vector<double> m_trajectory;
};

} // namespace tamsa
