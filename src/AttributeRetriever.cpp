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
    : m_worker(std::make_shared<AttributeQueryWorker>())
{}

AttributeRetriever::~AttributeRetriever()
{
    std::deque<std::pair<QueryID, QueryArg>> cancelled;
    std::thread thread;
    {
        std::lock_guard<std::mutex> lock(m_mutex);
        m_bShuttingDown = true;
        cancelled.swap(m_tasks);
        if (m_bThreadRunning && m_currentWorker) {
            m_currentWorker->stop(m_currentGeneration);
        }
        thread = std::move(m_thread);
    }
    for (const auto& task : cancelled) {
        answerCancelled(task.second.callback);
    }
    if (thread.joinable()) {
        if (thread.get_id() == std::this_thread::get_id()) {
            // Destroyed from its own thread (a callback let go of the last owner): that thread
            // touches nothing of the scheduler once this destructor has returned.
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
    std::lock_guard<std::mutex> lock(m_mutex);
    m_worker = std::move(worker);
}

void AttributeRetriever::query(QueryID const& id, const QVariantMap& params, const Callback& callback)
{
    std::shared_ptr<AttributeQueryWorker> worker;
    {
        std::lock_guard<std::mutex> lock(m_mutex);
        worker = m_worker;
    }
    QueryArg arg;
    arg.method = [worker](const QVariantMap& p, const Callback& c) { worker->query(p, c); };
    arg.params = params;
    arg.callback = callback;
    arg.worker = worker;
    runTask(id, std::move(arg));
}

void AttributeRetriever::reId(QueryID const& id, const QVariantMap& params, const Callback& callback)
{
    std::shared_ptr<AttributeQueryWorker> worker;
    {
        std::lock_guard<std::mutex> lock(m_mutex);
        worker = m_worker;
    }
    QueryArg arg;
    arg.method = [worker](const QVariantMap& p, const Callback& c) { worker->reId(p, c); };
    arg.params = params;
    arg.callback = callback;
    arg.worker = worker;
    runTask(id, std::move(arg));
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
        std::lock_guard<std::mutex> lock(m_mutex);
        if (m_bThreadRunning && m_currentQueryID == id && m_currentWorker) {
            m_currentWorker->stop(m_currentGeneration);
        } else {
            bCancelled = removeTask(id, &cancelled);
        }
    }
    if (bCancelled) {
        answerCancelled(cancelled.callback);
    }
}

bool AttributeRetriever::hasNextTask()
{
    std::lock_guard<std::mutex> lock(m_mutex);
    return !m_tasks.empty();
}

void AttributeRetriever::runTask(QueryID const& id, QueryArg arg)
{
    std::unique_lock<std::mutex> lock(m_mutex);
    if (m_bShuttingDown) {
        lock.unlock();
        answerCancelled(arg.callback);
        return;
    }
    m_tasks.emplace_back(id, std::move(arg));
    if (m_bThreadRunning) {
        return; // the running thread reaches the task
    }
    try {
        manageThreadMode(std::thread(&AttributeRetriever::doQuery, this));
        m_bThreadRunning = true;
    } catch (const std::system_error& e) {
        // Without a thread the task would wait forever: answer it now. The queue held only
        // this task, since no thread ran.
        QueryArg failed = std::move(m_tasks.back().second);
        m_tasks.pop_back();
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
    if (m_thread.joinable()) {
        m_thread.join();
    }
    m_thread = std::move(thread);
}

std::pair<AttributeRetriever::QueryID, AttributeRetriever::QueryArg> AttributeRetriever::getNextTask()
{
    if (m_tasks.empty()) {
        return {nullptr, QueryArg()};
    }
    auto task = std::move(m_tasks.front());
    m_tasks.pop_front();
    return task;
}

bool AttributeRetriever::removeTask(QueryID const& id, QueryArg* removed)
{
    for (auto it = m_tasks.begin(); it != m_tasks.end(); ++it) {
        if (it->first == id) {
            *removed = std::move(it->second);
            m_tasks.erase(it);
            return true;
        }
    }
    return false;
}

AttributeRetriever::QueryID AttributeRetriever::getCurrentQueryID()
{
    std::lock_guard<std::mutex> lock(m_mutex);
    return m_currentQueryID;
}

void AttributeRetriever::setCurrentQueryID(QueryID id)
{
    m_currentQueryID = id;
}

void AttributeRetriever::doQuery()
{
    for (;;) {
        QueryArg arg;
        {
            std::lock_guard<std::mutex> lock(m_mutex);
            if (m_tasks.empty()) {
                // Testing for work and leaving are one step, so no task is left behind.
                setCurrentQueryID(nullptr);
                m_currentWorker.reset();
                m_bThreadRunning = false;
                return;
            }
            auto task = getNextTask();
            arg = std::move(task.second);
            setCurrentQueryID(task.first);
            m_currentWorker = arg.worker;
            // The worker runs one search at a time and the previous one has returned, so
            // this is the generation the task's search will run as.
            m_currentGeneration = arg.worker ? arg.worker->searchGeneration() : 0;
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
