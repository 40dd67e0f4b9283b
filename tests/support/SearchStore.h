#pragma once
// The plug-in's store wrapper over a real store folder, able to fail, slow down or hold calls, and
// counting them: the stops and failures a store alone never stages. Header-only.

#include "TamsaWrapper.h"

#include <atomic>
#include <chrono>
#include <condition_variable>
#include <map>
#include <mutex>
#include <string>
#include <thread>

class SearchStore : public TamsaWrapper
{
public:
    explicit SearchStore(const std::string& folder)
        : m_folder(QString::fromStdString(folder))
    {}
    QString getStoragesDBPath() override { return m_folder; }

    // Set before a search starts.
    long initStatus = 0;         // initDatabase reports this when not 0 (the store is opened anyway)
    long firstStatus = 0;        // First fails with this, opening nothing, when not 0
    int failNextAfter = -1;      // Next of a search fails with TAMSA_E_IO after that many records
    int nextDelayMs = 0;         // each Next takes this long first
    bool holdUntilAbort = false; // each Next waits until its search is aborted

    std::atomic<int> firsts{0}, opens{0}, closes{0}, releases{0}, aborts{0}, held{0};
    std::atomic<int> staleAborts{0}; // aborts of searches that were closed or never opened
    std::string counts() const
    {
        return "firsts " + std::to_string(firsts) + " opens " + std::to_string(opens) + " closes " +
               std::to_string(closes) + " releases " + std::to_string(releases) + " aborts " +
               std::to_string(aborts) + " stale " + std::to_string(staleAborts);
    }

    long initDatabase(void** database) override
    {
        const long status = TamsaWrapper::initDatabase(database);
        return initStatus != 0 ? initStatus : status;
    }
    long releaseDatabase(void** database) override
    {
        return ++releases, TamsaWrapper::releaseDatabase(database);
    }
    long GetObjectMetaInfoFirst(void* database, const TTAMSA_OBJECTMETAINFO_QUERY* query,
                                void** search) override
    {
        ++firsts;
        const long status =
            firstStatus ? firstStatus : TamsaWrapper::GetObjectMetaInfoFirst(database, query, search);
        std::lock_guard<std::mutex> lock(m_mutex);
        opens += status == 0 && m_open.emplace(*search, State{}).second;
        return status;
    }
    long GetObjectMetaInfoNext(void* search, TTAMSA_OBJECTMETAINFO_RESULT* result) override
    {
        std::this_thread::sleep_for(std::chrono::milliseconds(nextDelayMs));
        std::unique_lock<std::mutex> lock(m_mutex);
        State& state = m_open[search];
        ++held;
        m_changed.wait(lock, [&] { return state.aborted || !holdUntilAbort; });
        --held;
        if (failNextAfter >= 0 && state.delivered++ >= failNextAfter) {
            return TAMSA_E_IO;
        }
        lock.unlock();
        return TamsaWrapper::GetObjectMetaInfoNext(search, result);
    }
    void GetObjectMetaInfoClose(void* search) override
    {
        std::unique_lock<std::mutex> lock(m_mutex);
        m_open.erase(search);
        ++closes;
        lock.unlock();
        TamsaWrapper::GetObjectMetaInfoClose(search);
    }
    void GetObjectMetaInfoAbort(void* search) override
    {
        ++aborts;
        std::lock_guard<std::mutex> lock(m_mutex);
        const auto state = m_open.find(search);
        staleAborts += state == m_open.end(); // forwarding it would hand the store a freed handle
        if (state != m_open.end()) {
            state->second.aborted = true;
            m_changed.notify_all();
            TamsaWrapper::GetObjectMetaInfoAbort(search);
        }
    }

private:
    struct State
    {
        int delivered = 0;
        bool aborted = false;
    };
    QString m_folder;
    std::mutex m_mutex;
    std::condition_variable m_changed;
    std::map<void*, State> m_open; // guarded by m_mutex
};
