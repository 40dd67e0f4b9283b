#pragma once
// Collects the (finished, record) calls of one search from any number of threads, and lets a
// test wait for the final call.

#include <QVariantMap>

#include <chrono>
#include <condition_variable>
#include <functional>
#include <mutex>
#include <thread>
#include <vector>

class SearchRecorder
{
public:
    struct Call
    {
        bool finished;
        QVariantMap record;
        std::thread::id thread;
    };

    std::function<void(bool, const QVariantMap&)> callback()
    {
        return [this](bool finished, const QVariantMap& record) {
            if (onCall) {
                onCall(finished, record);
            }
            std::lock_guard<std::mutex> lock(m_mutex);
            m_calls.push_back({finished, record, std::this_thread::get_id()});
            m_changed.notify_all();
        };
    }

    bool waitFinished(int timeoutMs = 10000)
    {
        std::unique_lock<std::mutex> lock(m_mutex);
        return m_changed.wait_for(lock, std::chrono::milliseconds(timeoutMs),
                                  [this] { return finalsLocked() > 0; });
    }

    bool waitHits(int count, int timeoutMs = 10000)
    {
        std::unique_lock<std::mutex> lock(m_mutex);
        return m_changed.wait_for(lock, std::chrono::milliseconds(timeoutMs),
                                  [&] { return int(m_calls.size()) - finalsLocked() >= count; });
    }

    std::vector<Call> calls() const
    {
        std::lock_guard<std::mutex> lock(m_mutex);
        return m_calls;
    }

    std::vector<QVariantMap> hits() const
    {
        std::vector<QVariantMap> result;
        for (const Call& call : calls()) {
            if (!call.finished) {
                result.push_back(call.record);
            }
        }
        return result;
    }

    int finals() const
    {
        std::lock_guard<std::mutex> lock(m_mutex);
        return finalsLocked();
    }

    // The final call came last and carried an empty record.
    bool endsWithOneEmptyFinal() const
    {
        const std::vector<Call> all = calls();
        return finals() == 1 && !all.empty() && all.back().finished && all.back().record.isEmpty();
    }

    // Runs on the calling thread before the call is recorded (to block or observe).
    std::function<void(bool, const QVariantMap&)> onCall;

private:
    int finalsLocked() const
    {
        int count = 0;
        for (const Call& call : m_calls) {
            count += call.finished ? 1 : 0;
        }
        return count;
    }

    mutable std::mutex m_mutex;
    std::condition_variable m_changed;
    std::vector<Call> m_calls; // guarded by m_mutex
};
