#pragma once
// The query scheduler: searches arrive as tasks under a query identifier (the client's sender
// handle), wait in arrival order and run one at a time on a thread of the scheduler's own
// through its one worker. query and reId return at once; results come through the task's
// callback. A stop cancels a queued task (which then gets its final callback) or ends the
// running one.
//
// The thread runs while tasks remain and ends when it finds the queue empty. The destructor
// cancels what is queued (each task gets its final callback), stops what runs and waits for
// the thread; called on that thread itself, it leaves the thread to end on its own.

#include "AttributeQueryWorker.h"

#include <QVariantMap>

#include <deque>
#include <functional>
#include <memory>
#include <mutex>
#include <thread>
#include <utility>

class AttributeRetriever
{
public:
    using QueryID = void*;
    using Callback = AttributeQueryWorker::Callback;

    struct QueryArg
    {
        // The worker's query or reId, bound to worker.
        std::function<void(const QVariantMap&, const Callback&)> method;
        QVariantMap params;
        Callback callback;
        // The worker the method runs on, so that a stop reaches the one that runs it.
        std::shared_ptr<AttributeQueryWorker> worker;
    };

    AttributeRetriever();
    virtual ~AttributeRetriever();

    AttributeRetriever(const AttributeRetriever&) = delete;
    AttributeRetriever& operator=(const AttributeRetriever&) = delete;

    virtual void query(QueryID const& id, const QVariantMap& params, const Callback& callback);
    virtual void reId(QueryID const& id, const QVariantMap& params, const Callback& callback);
    // Ends the running search of id, or cancels its oldest queued one. A null id names no
    // search and stops nothing.
    virtual void stop(QueryID const& id);
    virtual bool hasNextTask();

    // Replaces the worker for the tasks queued from now on.
    void setAttributeRetriever(std::shared_ptr<AttributeQueryWorker> worker);

private:
    // Everything the scheduler thread uses. The thread holds it too, so that a scheduler
    // destroyed from inside one of its own callbacks leaves the thread valid state to find
    // the queue empty and end on.
    struct State
    {
        std::mutex m_mutex;
        std::deque<std::pair<QueryID, QueryArg>> m_tasks; // guarded by m_mutex; front = oldest
        QueryID m_currentQueryID = nullptr;               // guarded by m_mutex
        // Whether the scheduler thread runs. Kept apart from the identifier: a task may carry
        // a null identifier, and that must not start a second thread beside the first.
        bool m_bThreadRunning = false; // guarded by m_mutex
        bool m_bShuttingDown = false;  // guarded by m_mutex
        // The running task's worker and search generation, for its stop.
        std::shared_ptr<AttributeQueryWorker> m_currentWorker; // guarded by m_mutex
        quint64 m_currentGeneration = 0;                       // guarded by m_mutex
        std::shared_ptr<AttributeQueryWorker> m_worker;        // guarded by m_mutex
        std::thread m_thread;                                  // guarded by m_mutex
    };

    void runTask(QueryID const& id, QueryArg arg);
    static std::pair<QueryID, QueryArg> getNextTask(State& state); // REQUIRES: state.m_mutex held
    // Takes the oldest queued task of id out of the queue; false when there is none.
    static bool removeTask(State& state, QueryID const& id, QueryArg* removed); // REQUIRES: m_mutex held
    static void doQuery(const std::shared_ptr<State>& state);
    QueryID getCurrentQueryID();
    static void setCurrentQueryID(State& state, QueryID id); // REQUIRES: state.m_mutex held
    void manageThreadMode(std::thread thread);               // REQUIRES: m_state->m_mutex held
    QueryArg makeArg(bool reIdSearch, const QVariantMap& params, const Callback& callback);

    const std::shared_ptr<State> m_state;
};
