#pragma once
// The real object store in a folder of the test's, filled through the store's own ingest entry
// point and reached through the plug-in's TamsaWrapper. On top of the store the wrapper can fail,
// slow down or hold calls and counts them, for the stops and failures a store alone never stages.
// Header-only; tests that use it link the plug-in core.

#include "TamsaWrapper.h"
#include "TestWait.h"

#include <atomic>
#include <chrono>
#include <condition_variable>
#include <map>
#include <mutex>
#include <thread>

class SearchStore : public TamsaWrapper
{
public:
    explicit SearchStore(const QString& folder)
        : m_folder(folder)
    {}
    QString getStoragesDBPath() override { return m_folder; }

    // Stores the objects of one camera answer (a JSON array) under `location`; the count stored.
    int put(int location, const QByteArray& objects)
    {
        void* database = nullptr;
        initDatabase(&database);
        const QByteArray answer = "{\"ObjectMetaInfo\":" + objects + "}";
        const int stored = Tamsa_PutObjectMetaInfo(database, 1, location, answer.constData());
        releaseDatabase(&database);
        return stored;
    }

    // Set before a search starts.
    long initStatus = 0;         // initDatabase reports this when not 0 (the store is opened anyway)
    long firstStatus = 0;        // First fails with this, opening nothing, when not 0
    int failNextAfter = -1;      // Next of a search fails with TAMSA_E_IO after that many records
    int nextDelayMs = 0;         // each Next takes this long first
    bool holdUntilAbort = false; // each Next waits until its search is aborted

    std::atomic<int> firsts{0};
    std::atomic<int> releases{0};
    std::atomic<int> closes{0};
    std::atomic<int> aborts{0};
    std::atomic<int> staleAborts{0}; // aborts of searches that were closed or never opened
    std::atomic<int> maxOpen{0};

    int open() const
    {
        std::lock_guard<std::mutex> lock(m_mutex);
        return int(m_open.size());
    }
    // Waits (up to 10 s, scaled) until `count` searches are inside a held Next.
    bool waitHeld(int count)
    {
        std::unique_lock<std::mutex> lock(m_mutex);
        return m_changed.wait_for(lock, std::chrono::milliseconds(scaledMs(10000)),
                                  [&] { return m_held >= count; });
    }

    long initDatabase(void** database) override
    {
        const long status = TamsaWrapper::initDatabase(database);
        return initStatus != 0 ? initStatus : status;
    }
    long releaseDatabase(void** database) override
    {
        ++releases;
        return TamsaWrapper::releaseDatabase(database);
    }
    long GetObjectMetaInfoFirst(void* database, const TTAMSA_OBJECTMETAINFO_QUERY* query,
                                void** search) override
    {
        ++firsts;
        if (firstStatus != 0) {
            *search = nullptr;
            return firstStatus;
        }
        const long status = TamsaWrapper::GetObjectMetaInfoFirst(database, query, search);
        if (status == 0) {
            std::lock_guard<std::mutex> lock(m_mutex);
            m_open[*search] = {};
            maxOpen = std::max(maxOpen.load(), int(m_open.size()));
        }
        return status;
    }
    long GetObjectMetaInfoNext(void* search, TTAMSA_OBJECTMETAINFO_RESULT* result) override
    {
        if (nextDelayMs > 0) {
            std::this_thread::sleep_for(std::chrono::milliseconds(nextDelayMs));
        }
        {
            std::unique_lock<std::mutex> lock(m_mutex);
            State& state = m_open[search];
            if (holdUntilAbort) {
                ++m_held;
                m_changed.notify_all();
                m_changed.wait(lock, [&] { return state.aborted; });
                --m_held;
            }
            if (failNextAfter >= 0 && state.delivered++ >= failNextAfter) {
                return TAMSA_E_IO;
            }
        }
        return TamsaWrapper::GetObjectMetaInfoNext(search, result);
    }
    void GetObjectMetaInfoClose(void* search) override
    {
        ++closes;
        {
            std::lock_guard<std::mutex> lock(m_mutex);
            m_open.erase(search);
        }
        TamsaWrapper::GetObjectMetaInfoClose(search);
    }
    void GetObjectMetaInfoAbort(void* search) override
    {
        ++aborts;
        std::lock_guard<std::mutex> lock(m_mutex);
        const auto state = m_open.find(search);
        if (state == m_open.end()) {
            ++staleAborts; // forwarding it would hand the store a freed handle
            return;
        }
        state->second.aborted = true;
        m_changed.notify_all();
        TamsaWrapper::GetObjectMetaInfoAbort(search);
    }

private:
    struct State
    {
        int delivered = 0;
        bool aborted = false;
    };
    QString m_folder;
    mutable std::mutex m_mutex;
    std::condition_variable m_changed;
    std::map<void*, State> m_open; // guarded by m_mutex
    int m_held = 0;                // guarded by m_mutex
};
