#include "TamsaSearch.h"

#include "TamsaCameraObject.h"
#include "TamsaCosine.h"

#include <sqlite3.h>

#include <algorithm>
#include <cstdlib>
#include <cstring>
#include <thread>

namespace tamsa {

namespace {

enum Column
{
    ColRowId,
    ColObjectId,
    ColType,
    ColStart,
    ColEnd,
    ColAttributes,
    ColPlate,
    ColTrajectory,
    ColThumbnails,
    ColBodyRow,
    ColFaceRow,
    ColLocation
};

const char* const kColumns =
    "SELECT rid, object_id, type, start_time, end_time, attributes, plate, trajectory, "
    "thumbnails, body_row, face_row, location FROM objects ";

// Rows per unit of scan work: a few MB, so Abort is noticed within a millisecond or so.
constexpr int64_t kScanChunkRows = 2048;
// Below this many rows one thread scans (starting threads would cost more than it saves).
constexpr int64_t kParallelScanRows = 32768;

std::atomic<bool> g_compactScan{true};

// TAMSA_SCAN=float32 turns the compact copy off, read at every scan (benchmarks compare both ways).
bool compactScanWanted()
{
    const char* mode = std::getenv("TAMSA_SCAN");
    return g_compactScan.load(std::memory_order_relaxed) && !(mode && std::strcmp(mode, "float32") == 0);
}

int progressHandler(void* search)
{
    return static_cast<const TamsaSearch*>(search)->aborted() ? 1 : 0;
}

std::string_view columnText(sqlite3_stmt* statement, int column)
{
    const auto* text = reinterpret_cast<const char*>(sqlite3_column_text(statement, column));
    return text ? std::string_view(text, size_t(sqlite3_column_bytes(statement, column)))
                : std::string_view();
}

struct RawHit
{
    int64_t rowId;
    uint32_t location;
    int kind;
    int64_t row;
    float score;
};

} // namespace

TamsaSearch::TamsaSearch(std::shared_ptr<TamsaStore> store, sqlite3* db, TamsaQuery query,
                         std::shared_ptr<std::atomic<int>> openCount)
    : m_store(std::move(store))
    , m_db(db)
    , m_query(std::move(query))
    , m_openCount(std::move(openCount))
{
    if (m_openCount) {
        ++*m_openCount;
    }
}

TamsaSearch::~TamsaSearch()
{
    // The handler goes first: finalizing the last statement of a connection already closed by
    // a caller that broke the order frees the connection.
    sqlite3_progress_handler(m_db, 0, nullptr, nullptr);
    for (Cursor& cursor : m_cursors) {
        sqlite3_finalize(cursor.statement);
    }
    sqlite3_finalize(m_byRowId);
    if (m_openCount) {
        --*m_openCount;
    }
}

int32_t TamsaSearch::next(TTAMSA_OBJECTMETAINFO_RESULT* result)
{
    if (!result || result->wSize != sizeof(TTAMSA_OBJECTMETAINFO_RESULT)) {
        return TAMSA_E_INVALID_ARGUMENT;
    }
    if (aborted()) {
        return TAMSA_E_ABORTED;
    }
    if (m_finished) {
        return TAMSA_E_NO_MORE_RECORDS;
    }
    // Long SQLite steps (a selective condition over many rows) must notice Abort too.
    sqlite3_progress_handler(m_db, 4096, progressHandler, this);
    int32_t status = TAMSA_OK;
    if (!m_started) {
        m_started = true;
        status = start();
    }
    if (status == TAMSA_OK) {
        status = m_query.isFeatureSearch() ? nextHit(result) : nextFromCursors(result);
    }
    if (aborted()) {
        status = TAMSA_E_ABORTED;
    }
    if (status == TAMSA_E_NO_MORE_RECORDS) {
        m_finished = true;
    }
    return status;
}

int32_t TamsaSearch::start()
{
    if (sqlite3_prepare_v2(m_db, (std::string(kColumns) + "WHERE rid = ?1").c_str(), -1, &m_byRowId,
                           nullptr) != SQLITE_OK) {
        return TAMSA_E_IO;
    }
    if (m_query.m_locations.empty() || m_query.m_startTime > m_query.m_endTime) {
        return TAMSA_OK; // matches nothing: the first Next reports the end
    }
    return m_query.isFeatureSearch() ? runScan() : startCursors();
}

int32_t TamsaSearch::startCursors()
{
    // Objects overlap the window when start <= window end and end >= window start; the longest
    // stay stored bounds the start from below, so the index range stays tight.
    int64_t longest = 0;
    sqlite3_stmt* meta = nullptr;
    if (sqlite3_prepare_v2(m_db, "SELECT value FROM meta WHERE name = 'max_duration'", -1, &meta, nullptr) !=
        SQLITE_OK) {
        return TAMSA_E_IO;
    }
    if (sqlite3_step(meta) == SQLITE_ROW) {
        longest = sqlite3_column_int64(meta, 0);
    }
    sqlite3_finalize(meta);
    const int64_t lowest = std::max<int64_t>(0, int64_t(m_query.m_startTime) - longest);

    std::string sql =
        std::string(kColumns) + "WHERE location = ?1 AND start_time BETWEEN ?2 AND ?3 AND end_time >= ?4";
    if (!m_query.m_objectType.empty()) {
        sql += " AND type = ?5";
    }
    if (m_query.m_hasPlate) {
        sql += " AND plate <> ''";
    }
    sql += m_query.m_descending ? " ORDER BY start_time DESC" : " ORDER BY start_time";
    m_cursorSql = sql;
    m_cursors.reserve(m_query.m_locations.size());
    m_lowestStart = lowest;
    for (uint32_t location : m_query.m_locations) {
        const int32_t status = openCursor(location);
        if (status != TAMSA_OK) {
            return status;
        }
        if (m_query.m_doNotSort && m_cursors.back().hasRow) {
            break; // unsorted: the other locations are opened when this one is done
        }
    }
    return TAMSA_OK;
}

int32_t TamsaSearch::openCursor(uint32_t location)
{
    Cursor cursor;
    cursor.location = location;
    if (sqlite3_prepare_v2(m_db, m_cursorSql.c_str(), -1, &cursor.statement, nullptr) != SQLITE_OK) {
        return TAMSA_E_IO;
    }
    sqlite3_bind_int64(cursor.statement, 1, location);
    sqlite3_bind_int64(cursor.statement, 2, m_lowestStart);
    sqlite3_bind_int64(cursor.statement, 3, m_query.m_endTime);
    sqlite3_bind_int64(cursor.statement, 4, m_query.m_startTime);
    if (!m_query.m_objectType.empty()) {
        sqlite3_bind_text(cursor.statement, 5, m_query.m_objectType.c_str(), -1, SQLITE_STATIC);
    }
    m_cursors.push_back(cursor);
    return advance(&m_cursors.back());
}

int32_t TamsaSearch::advance(Cursor* cursor)
{
    cursor->consumed = false;
    for (;;) {
        if (aborted()) {
            return TAMSA_E_ABORTED;
        }
        const int rc = sqlite3_step(cursor->statement);
        if (rc == SQLITE_DONE) {
            cursor->hasRow = false;
            return TAMSA_OK;
        }
        if (rc != SQLITE_ROW) {
            cursor->hasRow = false;
            return aborted() ? TAMSA_E_ABORTED : TAMSA_E_IO;
        }
        if (rowMatches(cursor->statement)) {
            cursor->hasRow = true;
            return TAMSA_OK;
        }
    }
}

int32_t TamsaSearch::nextFromCursors(TTAMSA_OBJECTMETAINFO_RESULT* result)
{
    for (Cursor& cursor : m_cursors) {
        if (cursor.consumed) {
            const int32_t status = advance(&cursor);
            if (status != TAMSA_OK) {
                return status;
            }
        }
    }
    Cursor* best = nullptr;
    if (m_query.m_doNotSort) {
        // Location after location; the next location's cursor opens once this one is drained.
        while (!best) {
            for (Cursor& cursor : m_cursors) {
                if (cursor.hasRow) {
                    best = &cursor;
                    break;
                }
            }
            if (best || m_cursors.size() == m_query.m_locations.size()) {
                break;
            }
            const int32_t status = openCursor(m_query.m_locations[m_cursors.size()]);
            if (status != TAMSA_OK) {
                return status;
            }
        }
    } else {
        int64_t bestStart = 0;
        for (Cursor& cursor : m_cursors) {
            if (!cursor.hasRow) {
                continue;
            }
            const int64_t start = sqlite3_column_int64(cursor.statement, ColStart);
            if (!best || (m_query.m_descending ? start > bestStart : start < bestStart)) {
                best = &cursor;
                bestStart = start;
            }
        }
    }
    if (!best) {
        return TAMSA_E_NO_MORE_RECORDS;
    }
    fill(best->statement, 0, 0, result);
    best->consumed = true;
    return TAMSA_OK;
}

bool TamsaSearch::rowMatches(sqlite3_stmt* statement) const
{
    const bool needsRow = m_query.needsAttributes() || m_query.m_hasPlate || !m_query.m_trace.empty();
    if (!needsRow) {
        return true;
    }
    const auto* points = static_cast<const TrajectoryPoint*>(sqlite3_column_blob(statement, ColTrajectory));
    const size_t pointCount =
        size_t(sqlite3_column_bytes(statement, ColTrajectory)) / sizeof(TrajectoryPoint);
    return m_query.matchesObject(columnText(statement, ColAttributes), columnText(statement, ColPlate),
                                 points, points ? pointCount : 0,
                                 uint32_t(sqlite3_column_int64(statement, ColStart)),
                                 uint32_t(sqlite3_column_int64(statement, ColEnd)));
}

const float* TamsaSearch::vectorOf(uint32_t location, FeatureKind kind, int64_t row)
{
    std::shared_ptr<const TamsaFeatureMap>& map = m_maps[{location, int(kind)}];
    if (!map || map->rows() <= row) {
        map = m_store->featureMap(location, kind, row + 1);
    }
    return map && row >= 0 && row < map->rows() ? map->vector(row) : nullptr;
}

float TamsaSearch::score(const std::vector<float>& query, float queryNorm2, const float* row) const
{
    if (query.empty() || !row || query.size() > kFeatureDim) {
        return 0; // a query longer than the stored vectors scores 0, as the plug-in's own rule says
    }
    float dot = 0;
    float norm2 = 0;
    dotNormBest()(query.data(), row, query.size(), &dot, &norm2);
    return cosineFromParts(dot, queryNorm2, norm2);
}

void TamsaSearch::setCompactScan(bool enabled)
{
    g_compactScan.store(enabled, std::memory_order_relaxed);
}

int32_t TamsaSearch::runScan()
{
    struct Task
    {
        std::shared_ptr<const TamsaFeatureMap> map;
        uint32_t location;
        FeatureKind kind;
        int64_t begin;
        int64_t end;
    };
    float queryNorm2[2] = {0, 0};
    const std::vector<float>* queries[2] = {&m_query.m_body, &m_query.m_face};
    // Compact scores only rule rows out; whatever they cannot rule out is scored in float32 below.
    std::vector<CompactQuery> compactQueries(2);
    std::vector<Task> tasks;
    int64_t totalRows = 0;
    for (int kind = 0; kind < 2; ++kind) {
        const std::vector<float>& query = *queries[kind];
        if (query.empty() || query.size() > kFeatureDim) {
            continue;
        }
        float dot = 0;
        dotNormScalar()(query.data(), query.data(), query.size(), &dot, &queryNorm2[kind]);
        if (compactScanWanted()) {
            encodeCompactQuery(query, kScoreThreshold, &compactQueries[size_t(kind)]);
        }
        for (uint32_t location : m_query.m_locations) {
            std::shared_ptr<const TamsaFeatureMap> map = m_store->featureMap(location, FeatureKind(kind));
            if (!map) {
                continue;
            }
            m_maps[{location, kind}] = map;
            // Runs of time blocks that can hold rows overlapping the window, cut into chunks.
            const std::vector<TimeBlock>& blocks = map->timeBlocks();
            for (size_t b = 0; b < blocks.size();) {
                if (blocks[b].firstStart > m_query.m_endTime || blocks[b].lastEnd < m_query.m_startTime) {
                    ++b;
                    continue;
                }
                size_t last = b;
                while (last + 1 < blocks.size() && blocks[last + 1].firstStart <= m_query.m_endTime &&
                       blocks[last + 1].lastEnd >= m_query.m_startTime) {
                    ++last;
                }
                const int64_t runEnd = std::min(map->rows(), int64_t(last + 1) * kTimeBlockRows);
                for (int64_t begin = int64_t(b) * kTimeBlockRows; begin < runEnd; begin += kScanChunkRows) {
                    tasks.push_back(
                        {map, location, FeatureKind(kind), begin, std::min(runEnd, begin + kScanChunkRows)});
                }
                totalRows += runEnd - int64_t(b) * kTimeBlockRows;
                b = last + 1;
            }
        }
    }

    const DotNormFn kernel = dotNormBest();
    const CompactFilterFn compactFilter = compactFilterBest();
    std::atomic<size_t> nextTask{0};
    auto work = [&](std::vector<RawHit>* hits) {
        std::vector<uint32_t> kept(static_cast<size_t>(kScanChunkRows));
        for (size_t t = nextTask++; t < tasks.size() && !aborted(); t = nextTask++) {
            const Task& task = tasks[t];
            const std::vector<float>& query = *queries[int(task.kind)];
            const float qn2 = queryNorm2[int(task.kind)];
            auto scoreRow = [&](int64_t row) {
                const FeatureRowInfo& info = task.map->info(row);
                if (info.startTime > m_query.m_endTime || info.endTime < m_query.m_startTime) {
                    return;
                }
                float dot = 0;
                float norm2 = 0;
                kernel(query.data(), task.map->vector(row), query.size(), &dot, &norm2);
                const float cosine = cosineFromParts(dot, qn2, norm2);
                if (cosine >= kScoreThreshold) {
                    hits->push_back({info.objectRowId, task.location, int(task.kind), row, cosine});
                }
            };
            // Rows with a compact copy are scored in float32 only when it cannot rule them out.
            const CompactQuery& compactQuery = compactQueries[size_t(task.kind)];
            const int64_t compactEnd = compactQuery.usable
                                           ? std::max(task.begin, std::min(task.end, task.map->compactRows()))
                                           : task.begin;
            const size_t count = compactEnd > task.begin
                                     ? compactFilter(compactQuery, &task.map->compact(task.begin),
                                                     size_t(compactEnd - task.begin), kept.data())
                                     : 0;
            for (size_t k = 0; k < count; ++k) {
                scoreRow(task.begin + int64_t(kept[k]));
            }
            for (int64_t row = compactEnd; row < task.end; ++row) {
                scoreRow(row);
            }
        }
    };
    const unsigned threadCount =
        totalRows >= kParallelScanRows ? std::max(1u, std::min(4u, std::thread::hardware_concurrency())) : 1u;
    std::vector<std::vector<RawHit>> perThread(threadCount);
    std::vector<std::thread> threads;
    for (unsigned i = 1; i < threadCount; ++i) {
        threads.emplace_back(work, &perThread[i]);
    }
    work(&perThread[0]);
    for (std::thread& thread : threads) {
        thread.join();
    }
    if (aborted()) {
        return TAMSA_E_ABORTED;
    }
    std::vector<RawHit> raw;
    for (std::vector<RawHit>& hits : perThread) {
        raw.insert(raw.end(), hits.begin(), hits.end());
    }
    // Scan order (location, kind, row) is the cheap order kept for bDoNotSort.
    std::stable_sort(raw.begin(), raw.end(), [](const RawHit& a, const RawHit& b) {
        return std::tie(a.location, a.kind, a.row) < std::tie(b.location, b.kind, b.row);
    });

    // Check each hit against its object: still current (not replaced), and every other condition.
    std::map<int64_t, size_t> seen;
    for (const RawHit& hit : raw) {
        if (aborted()) {
            return TAMSA_E_ABORTED;
        }
        if (seen.count(hit.rowId)) {
            continue;
        }
        sqlite3_reset(m_byRowId);
        sqlite3_bind_int64(m_byRowId, 1, hit.rowId);
        if (sqlite3_step(m_byRowId) != SQLITE_ROW) {
            continue; // a row left by a crashed ingest
        }
        sqlite3_stmt* s = m_byRowId;
        const int rowColumn = hit.kind == 0 ? ColBodyRow : ColFaceRow;
        if (uint32_t(sqlite3_column_int64(s, ColLocation)) != hit.location ||
            sqlite3_column_type(s, rowColumn) == SQLITE_NULL ||
            sqlite3_column_int64(s, rowColumn) != hit.row) {
            continue; // the object was replaced; its current row is scanned separately
        }
        if (uint32_t(sqlite3_column_int64(s, ColStart)) > m_query.m_endTime ||
            uint32_t(sqlite3_column_int64(s, ColEnd)) < m_query.m_startTime) {
            continue;
        }
        if (!m_query.m_objectType.empty() && columnText(s, ColType) != m_query.m_objectType) {
            continue;
        }
        if (m_query.m_hasPlate && columnText(s, ColPlate).empty()) {
            continue;
        }
        if (!rowMatches(s)) {
            continue;
        }
        Hit kept;
        kept.rowId = hit.rowId;
        kept.startTime = uint32_t(sqlite3_column_int64(s, ColStart));
        const int otherColumn = hit.kind == 0 ? ColFaceRow : ColBodyRow;
        const FeatureKind otherKind = hit.kind == 0 ? FeatureKind::Face : FeatureKind::Body;
        float other = 0;
        if (sqlite3_column_type(s, otherColumn) != SQLITE_NULL) {
            const std::vector<float>& query = *queries[int(otherKind)];
            other = score(query, queryNorm2[int(otherKind)],
                          query.empty()
                              ? nullptr
                              : vectorOf(hit.location, otherKind, sqlite3_column_int64(s, otherColumn)));
        }
        kept.score = hit.kind == 0 ? hit.score : other;
        kept.faceScore = hit.kind == 0 ? other : hit.score;
        seen[hit.rowId] = m_hits.size();
        m_hits.push_back(kept);
    }
    sqlite3_reset(m_byRowId);
    if (!m_query.m_doNotSort) {
        std::stable_sort(m_hits.begin(), m_hits.end(), [](const Hit& a, const Hit& b) {
            const float bestA = std::max(a.score, a.faceScore);
            const float bestB = std::max(b.score, b.faceScore);
            if (bestA != bestB) {
                return bestA > bestB;
            }
            return a.startTime < b.startTime;
        });
    }
    return TAMSA_OK;
}

int32_t TamsaSearch::nextHit(TTAMSA_OBJECTMETAINFO_RESULT* result)
{
    while (m_nextHit < m_hits.size()) {
        const Hit& hit = m_hits[m_nextHit++];
        sqlite3_reset(m_byRowId);
        sqlite3_bind_int64(m_byRowId, 1, hit.rowId);
        if (sqlite3_step(m_byRowId) == SQLITE_ROW) {
            fill(m_byRowId, hit.score, hit.faceScore, result);
            sqlite3_reset(m_byRowId);
            return TAMSA_OK;
        }
    }
    return TAMSA_E_NO_MORE_RECORDS;
}

void TamsaSearch::fill(sqlite3_stmt* s, float score, float faceScore, TTAMSA_OBJECTMETAINFO_RESULT* result)
{
    const uint32_t location = uint32_t(sqlite3_column_int64(s, ColLocation));
    m_type.assign(columnText(s, ColType));
    m_attributes.assign(columnText(s, ColAttributes));
    const auto* blob = static_cast<const double*>(sqlite3_column_blob(s, ColTrajectory));
    const size_t blobBytes = size_t(sqlite3_column_bytes(s, ColTrajectory));
    m_trajectory.assign(blob, blob ? blob + blobBytes / sizeof(double) : blob);

    // Vectors live in the feature files; they become text only here, for the records handed out,
    // spliced in where the stored text holds their marker.
    const std::string_view stored = columnText(s, ColThumbnails);
    m_thumbnails.clear();
    m_thumbnails.reserve(stored.size() + 2 * 512 * 13);
    size_t from = 0;
    for (size_t at = 0; at < stored.size(); ++at) {
        const char c = stored[at];
        if (c != kBodyMarker && c != kFaceMarker) {
            continue;
        }
        m_thumbnails.append(stored, from, at - from);
        from = at + 1;
        const int rowColumn = c == kBodyMarker ? ColBodyRow : ColFaceRow;
        const FeatureKind kind = c == kBodyMarker ? FeatureKind::Body : FeatureKind::Face;
        const float* vector = sqlite3_column_type(s, rowColumn) == SQLITE_NULL
                                  ? nullptr
                                  : vectorOf(location, kind, sqlite3_column_int64(s, rowColumn));
        if (vector) {
            appendFloatArray(&m_thumbnails, vector, kFeatureDim);
        } else {
            m_thumbnails.append("null"); // a row lost with a power failure (see TamsaStore)
        }
    }
    m_thumbnails.append(stored, from, std::string_view::npos);

    std::memset(reinterpret_cast<char*>(result) + 2, 0, sizeof(*result) - 2);
    result->qwObjectId = uint64_t(sqlite3_column_int64(s, ColObjectId));
    result->dwLocationNumber = location;
    result->pszObjectType = m_type.c_str();
    result->pszAttributes = m_attributes.c_str();
    result->dwStartTime = uint32_t(sqlite3_column_int64(s, ColStart));
    result->dwEndTime = uint32_t(sqlite3_column_int64(s, ColEnd));
    result->pTrajectory = m_trajectory.empty() ? nullptr : m_trajectory.data();
    result->dwTrajectoryBytes = uint32_t(m_trajectory.size() * sizeof(double));
    result->pszThumbnails = m_thumbnails.c_str();
    result->fScore = score;
    result->fFaceScore = faceScore;
}

} // namespace tamsa
