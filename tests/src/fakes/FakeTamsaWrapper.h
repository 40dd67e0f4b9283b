#pragma once
// An in-memory store behind the wrapper interface: it hands out the objects it was given
// (those whose location is in the query's list), records every query and call, and can be
// slow or hold each Next until the search is aborted, so that stops can be tested with
// real threads. Configure it before a search starts; the observers are thread-safe.

#include "TamsaWrapper.h"

#include <atomic>
#include <condition_variable>
#include <cstdint>
#include <mutex>
#include <optional>
#include <string>
#include <vector>

struct FakeObject
{
    uint64_t id = 0;
    uint32_t location = 1;
    std::string type = "Human";
    std::string attributes = "{}";
    std::string thumbnails = "{}";
    uint32_t start = 0;
    uint32_t end = 0;
    std::vector<double> trajectory;          // x, y, x, y, ...
    std::optional<uint32_t> trajectoryBytes; // default: 8 per double
    bool nullTrajectory = false;
    float score = 0.0f;
    float faceScore = 0.0f;
};

// A query record as the store saw it, copied before First returned.
struct CapturedQuery
{
    uint16_t wSize = 0;
    uint32_t start = 0;
    uint32_t end = 0;
    TTAMSA_TZDS tzds{};
    bool zeroPadding = false;        // the reserved bytes were all zero
    std::vector<uint32_t> locations; // up to and including the 0 entry
    std::optional<std::string> objectType;
    std::optional<std::string> primaryAttributes;
    std::optional<std::string> otherAttributes;
    std::optional<std::string> trace;
    uint32_t duration = 0;
    uint32_t loitering = 0;
    uint32_t descending = 0;
    int32_t direction = 0;
    uint32_t doNotSort = 0;
    std::optional<std::string> feature;
    std::optional<std::string> faceFeature;
    std::optional<std::string> plateNumber;
};

class FakeTamsaWrapper : public TamsaWrapper
{
public:
    FakeTamsaWrapper() = default;
    ~FakeTamsaWrapper() override;

    // Configuration.
    std::vector<FakeObject> objects;
    long initStatus = 0;
    long firstStatus = 0;
    // Next fails with this status after that many records (-1: never).
    int failNextAfter = -1;
    long failNextStatus = TAMSA_E_IO;
    int nextDelayMs = 0;
    // Each Next waits until its search is aborted, then fails with TAMSA_E_ABORTED.
    bool holdUntilAbort = false;

    // Observers.
    std::vector<CapturedQuery> queries() const;
    int initCount() const { return m_initCount; }
    int firstCount() const { return m_firstCount; }
    int closeCount() const { return m_closeCount; }
    int releaseCount() const { return m_releaseCount; }
    int abortCount() const { return m_abortCount; }
    int openSearches() const { return m_openSearches; }
    int maxOpenSearches() const { return m_maxOpenSearches; }
    // Waits until that many searches are inside a held Next; false after timeoutMs.
    bool waitForHeldNext(int count, int timeoutMs);

    long initDatabase(void** database) override;
    long releaseDatabase(void** database) override;
    long GetObjectMetaInfoFirst(void* database, const TTAMSA_OBJECTMETAINFO_QUERY* query,
                                void** search) override;
    long GetObjectMetaInfoNext(void* search, TTAMSA_OBJECTMETAINFO_RESULT* result) override;
    void GetObjectMetaInfoClose(void* search) override;
    void GetObjectMetaInfoAbort(void* search) override;
    QString getStoragesDBPath() override { return QString(); }

private:
    struct Search;

    mutable std::mutex m_mutex;
    std::condition_variable m_changed;
    std::vector<CapturedQuery> m_queries; // guarded by m_mutex
    int m_heldNext = 0;                   // guarded by m_mutex
    std::atomic<int> m_initCount{0};
    std::atomic<int> m_firstCount{0};
    std::atomic<int> m_closeCount{0};
    std::atomic<int> m_releaseCount{0};
    std::atomic<int> m_abortCount{0};
    std::atomic<int> m_openSearches{0};
    std::atomic<int> m_maxOpenSearches{0};
};
