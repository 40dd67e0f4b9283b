#pragma once
// The replies of one request, recorded from any thread.

#include "HostCallbacks.h"
#include "TestWait.h"

#include <QMutex>
#include <QVariant>

#include <algorithm>
#include <vector>

struct Reply
{
    bool final = false;
    QString code;
    QString message;
    QVariant payload;
};

class ReplyRecorder
{
public:
    HDLR_DO_REQUEST_CB callback()
    {
        return [this](bool final, const QString& code, const QString& message, const QVariant& payload) {
            QMutexLocker lock(&m_mutex);
            m_replies.push_back({final, code, message, payload});
        };
    }
    std::vector<Reply> replies() const
    {
        QMutexLocker lock(&m_mutex);
        return m_replies;
    }
    int finalCount() const
    {
        const std::vector<Reply> all = replies();
        return int(std::count_if(all.begin(), all.end(), [](const Reply& reply) { return reply.final; }));
    }
    // The last reply, or an empty one before any came.
    Reply last() const
    {
        const std::vector<Reply> all = replies();
        return all.empty() ? Reply{} : all.back();
    }
    // The payloads of the replies that are not final (a search's hits, a batch's progress).
    std::vector<QVariant> progress() const
    {
        std::vector<QVariant> payloads;
        for (const Reply& reply : replies()) {
            reply.final ? void() : payloads.push_back(reply.payload);
        }
        return payloads;
    }
    bool waitFinal(int limitMs = 10000)
    {
        return waitFor([this] { return finalCount() > 0; }, limitMs);
    }

private:
    mutable QMutex m_mutex;
    std::vector<Reply> m_replies; // guarded by m_mutex
};
