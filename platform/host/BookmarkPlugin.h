#pragma once
// The host's bookmark plug-in: keeps bookmarks of recording clips for one server.
//
// Threads: the object lives on a thread of its own (started by the constructor, stopped by
// the destructor); "AddBookmark" and "DeleteBookmark" are invoked by name, usually queued from
// other threads, and answer through the given reply callback from that thread. Bookmarks are
// kept in a journal file, one JSON line per change ({"add": BOOKMARK} or {"delete": ID}) appended
// and synced before the change is answered, so they survive a restart and a change costs what it
// writes, not what is stored. Loading rewrites the journal compactly; it also reads the older
// form, one JSON object of every bookmark by id. Memory: the bookmarks, about 1.6 KB each.
// The answer mode lets tests make the plug-in fail, stay silent or answer twice.

#include "HostCallbacks.h"

#include <QHash>
#include <QJsonObject>
#include <QMutex>
#include <QObject>
#include <QThread>
#include <QVariantMap>
#include <atomic>

class BookmarkPlugin : public QObject
{
    Q_OBJECT
public:
    static const char* pluginId() { return "2F6394EE90434A7190D7511370AFAE17"; }

    enum class AnswerMode
    {
        Normal, // answer once, with the outcome
        Fail,   // answer once with "-1" and change nothing
        Never,  // take the request and never answer
        Twice,  // answer twice with the same outcome
    };

    // strStoragePath: the journal holding the bookmarks (created on first change).
    explicit BookmarkPlugin(const QString& strStoragePath);
    ~BookmarkPlugin() override;

    // request: {"CameraID", "LocationID", "StartTimestamp", "EndTimestamp", "Description",
    // "Creator", "Group"}; answers "0" with {"BookmarkID"} or "-1" when the request is unusable
    // or cannot be stored.
    Q_INVOKABLE void AddBookmark(const QVariant& request, const RequestSenderInfo& senderInfo,
                                 const HDLR_DO_REQUEST_CB& hdlrDoRequestCB);
    // request: {"BookmarkID"}; answers "0" when it was there and is gone, "-1" otherwise.
    Q_INVOKABLE void DeleteBookmark(const QVariant& request, const RequestSenderInfo& senderInfo,
                                    const HDLR_DO_REQUEST_CB& hdlrDoRequestCB);

    // Snapshot of the stored bookmarks, by id. Callable from any thread.
    QHash<QString, QVariantMap> bookmarks() const;
    void setAnswerMode(AnswerMode mode) { m_answerMode.store(mode); }
    // Number of AddBookmark and DeleteBookmark calls taken so far.
    int requestCount() const { return m_requestCount.load(); }

private:
    void answer(const HDLR_DO_REQUEST_CB& hdlrDoRequestCB, bool bOk, const QVariant& payload) const;
    bool load();
    bool append(const QJsonObject& change) const;
    bool rewrite() const;

    QString m_strStoragePath;
    QThread m_thread;
    mutable QMutex m_mutex;                  // guards m_bookmarks and the file
    QHash<QString, QVariantMap> m_bookmarks; // guarded by m_mutex
    std::atomic<AnswerMode> m_answerMode{AnswerMode::Normal};
    std::atomic<int> m_requestCount{0};
};
