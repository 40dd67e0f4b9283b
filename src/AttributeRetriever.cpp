#include "AttributeRetriever.h"

#include "LogFacility.h"
#include "ScopeTracer.h"

#include <exception>
#include <system_error>

namespace {

// A cancelled task's final callback, made after the scheduler mutex is released so that the
// callback may call back into the scheduler.
void answerCancelled(const AttributeRetriever::Callback& callback)
{
    if (!callback) {
        return;
    }
    try {
        callback(true, QVariantMap());
    } catch (...) {
        DELVIX_LOG(LogFacility::LevelError, "%s, callback of a cancelled search failed",
                   "AttributeRetriever::answerCancelled");
    }
}

} // namespace

AttributeRetriever::AttributeRetriever()
    : m_state(std::make_shared<State>())
{
    m_state->m_worker = std::make_shared<AttributeQueryWorker>();
}

AttributeRetriever::~AttributeRetriever()
{
    std::deque<std::pair<QueryID, QueryArg>> cancelled;
    std::thread thread;
    {
        std::lock_guard<std::mutex> lock(m_state->m_mutex);
        m_state->m_bShuttingDown = true;
        cancelled.swap(m_state->m_tasks);
        if (m_state->m_bThreadRunning && m_state->m_currentWorker) {
            m_state->m_currentWorker->stop(m_state->m_currentGeneration);
        }
        thread = std::move(m_state->m_thread);
    }
    for (const auto& task : cancelled) {
        answerCancelled(task.second.callback);
    }
    if (thread.joinable()) {
        if (thread.get_id() == std::this_thread::get_id()) {
            // Destroyed from one of its own callbacks: the thread cannot wait for itself. It
            // holds the state and the worker it runs, finds the queue empty and ends.
            thread.detach();
        } else {
            thread.join();
        }
    }
}

void AttributeRetriever::setAttributeRetriever(std::shared_ptr<AttributeQueryWorker> worker)
{
    if (!worker) {
        return;
    }
    std::lock_guard<std::mutex> lock(m_state->m_mutex);
    m_state->m_worker = std::move(worker);
}

AttributeRetriever::QueryArg AttributeRetriever::makeArg(bool reIdSearch, const QVariantMap& params,
                                                         const Callback& callback)
{
    std::shared_ptr<AttributeQueryWorker> worker;
    {
        std::lock_guard<std::mutex> lock(m_state->m_mutex);
        worker = m_state->m_worker;
    }
    QueryArg arg;
    if (reIdSearch) {
        arg.method = [worker](const QVariantMap& p, const Callback& c) { worker->reId(p, c); };
    } else {
        arg.method = [worker](const QVariantMap& p, const Callback& c) { worker->query(p, c); };
    }
    arg.params = params;
    arg.callback = callback;
    arg.worker = std::move(worker);
    return arg;
}

void AttributeRetriever::query(QueryID const& id, const QVariantMap& params, const Callback& callback)
{
    runTask(id, makeArg(false, params, callback));
}

void AttributeRetriever::reId(QueryID const& id, const QVariantMap& params, const Callback& callback)
{
    runTask(id, makeArg(true, params, callback));
}

void AttributeRetriever::stop(QueryID const& id)
{
    if (!id) {
        return;
    }
    QueryArg cancelled;
    bool bCancelled = false;
    {
        // Deciding and acting in one step: the task that is current when the stop is decided
        // is the one it reaches, and a finished search's stop is dropped by the worker.
        std::lock_guard<std::mutex> lock(m_state->m_mutex);
        if (m_state->m_bThreadRunning && m_state->m_currentQueryID == id && m_state->m_currentWorker) {
            m_state->m_currentWorker->stop(m_state->m_currentGeneration);
        } else {
            bCancelled = removeTask(*m_state, id, &cancelled);
        }
    }
    if (bCancelled) {
        answerCancelled(cancelled.callback);
    }
}

bool AttributeRetriever::hasNextTask()
{
    std::lock_guard<std::mutex> lock(m_state->m_mutex);
    return !m_state->m_tasks.empty();
}

void AttributeRetriever::runTask(QueryID const& id, QueryArg arg)
{
    std::unique_lock<std::mutex> lock(m_state->m_mutex);
    if (m_state->m_bShuttingDown) {
        lock.unlock();
        answerCancelled(arg.callback);
        return;
    }
    m_state->m_tasks.emplace_back(id, std::move(arg));
    if (m_state->m_bThreadRunning) {
        return; // the running thread reaches the task
    }
    try {
        manageThreadMode(std::thread(&AttributeRetriever::doQuery, m_state));
        m_state->m_bThreadRunning = true;
    } catch (const std::system_error& e) {
        // Without a thread the task would wait forever: answer it now. The queue held only
        // this task, since no thread ran.
        QueryArg failed = std::move(m_state->m_tasks.back().second);
        m_state->m_tasks.pop_back();
        lock.unlock();
        DELVIX_LOG(LogFacility::LevelError, "%s, thread start failed: %s", "AttributeRetriever::runTask",
                   e.what());
        answerCancelled(failed.callback);
    }
}

void AttributeRetriever::manageThreadMode(std::thread thread)
{
    // The previous thread has left doQuery (it cleared m_bThreadRunning under the mutex and
    // touches nothing after it), so joining it here is immediate.
    if (m_state->m_thread.joinable()) {
        m_state->m_thread.join();
    }
    m_state->m_thread = std::move(thread);
}

std::pair<AttributeRetriever::QueryID, AttributeRetriever::QueryArg>
AttributeRetriever::getNextTask(State& state)
{
    if (state.m_tasks.empty()) {
        return {nullptr, QueryArg()};
    }
    auto task = std::move(state.m_tasks.front());
    state.m_tasks.pop_front();
    return task;
}

bool AttributeRetriever::removeTask(State& state, QueryID const& id, QueryArg* removed)
{
    for (auto it = state.m_tasks.begin(); it != state.m_tasks.end(); ++it) {
        if (it->first == id) {
            *removed = std::move(it->second);
            state.m_tasks.erase(it);
            return true;
        }
    }
    return false;
}

AttributeRetriever::QueryID AttributeRetriever::getCurrentQueryID()
{
    std::lock_guard<std::mutex> lock(m_state->m_mutex);
    return m_state->m_currentQueryID;
}

void AttributeRetriever::setCurrentQueryID(State& state, QueryID id)
{
    state.m_currentQueryID = id;
}

void AttributeRetriever::doQuery(const std::shared_ptr<State>& state)
{
    for (;;) {
        QueryArg arg;
        {
            std::lock_guard<std::mutex> lock(state->m_mutex);
            if (state->m_tasks.empty()) {
                // Testing for work and leaving are one step, so no task is left behind.
                setCurrentQueryID(*state, nullptr);
                state->m_currentWorker.reset();
                state->m_bThreadRunning = false;
                return;
            }
            auto task = getNextTask(*state);
            arg = std::move(task.second);
            setCurrentQueryID(*state, task.first);
            state->m_currentWorker = arg.worker;
            // The worker runs one search at a time and the previous one has returned, so
            // this is the generation the task's search will run as.
            state->m_currentGeneration = arg.worker ? arg.worker->searchGeneration() : 0;
        }
        try {
            if (arg.method) {
                arg.method(arg.params, arg.callback);
            } else {
                answerCancelled(arg.callback);
            }
        } catch (const std::exception& e) {
            DELVIX_LOG(LogFacility::LevelError, "%s, search failed: %s", "AttributeRetriever::doQuery",
                       e.what());
        } catch (...) {
            DELVIX_LOG(LogFacility::LevelError, "%s, search failed", "AttributeRetriever::doQuery");
        }
    }
}
