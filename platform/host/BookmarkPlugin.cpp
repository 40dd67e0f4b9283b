#include "BookmarkPlugin.h"

#include <QDir>
#include <QFile>
#include <QFileInfo>
#include <QJsonDocument>
#include <QJsonObject>
#include <QSaveFile>
#include <QUuid>

BookmarkPlugin::BookmarkPlugin(const QString& strStoragePath)
    : m_strStoragePath(strStoragePath)
{
    registerHostMetaTypes();
    load();
    m_thread.setObjectName(QStringLiteral("bookmarkPlugin"));
    m_thread.start();
    moveToThread(&m_thread);
}

BookmarkPlugin::~BookmarkPlugin()
{
    // Requests already queued are still carried out, so a deletion acknowledged to a client
    // before shutdown is not lost with the thread.
    if (m_thread.isRunning()) {
        QMetaObject::invokeMethod(this, []() {}, Qt::BlockingQueuedConnection);
    }
    m_thread.quit();
    m_thread.wait();
}

void BookmarkPlugin::AddBookmark(const QVariant& request, const RequestSenderInfo&,
                                 const HDLR_DO_REQUEST_CB& hdlrDoRequestCB)
{
    ++m_requestCount;
    if (m_answerMode.load() == AnswerMode::Fail) {
        answer(hdlrDoRequestCB, false, QVariant());
        return;
    }
    const QVariantMap map = request.toMap();
    if (request.typeId() != QMetaType::QVariantMap ||
        map.value(QStringLiteral("CameraID")).toString().isEmpty()) {
        answer(hdlrDoRequestCB, false, QVariant());
        return;
    }
    QVariantMap bookmark;
    for (const char* key :
         {"CameraID", "LocationID", "StartTimestamp", "EndTimestamp", "Description", "Creator", "Group"}) {
        bookmark.insert(QLatin1String(key), map.value(QLatin1String(key)));
    }
    const QString id = QUuid::createUuid().toString(QUuid::WithoutBraces);
    bookmark.insert(QStringLiteral("BookmarkID"), id);
    bool bStored = false;
    {
        QMutexLocker lock(&m_mutex);
        QHash<QString, QVariantMap> next = m_bookmarks;
        next.insert(id, bookmark);
        if (save(next)) {
            m_bookmarks = next;
            bStored = true;
        }
    }
    answer(hdlrDoRequestCB, bStored,
           bStored ? QVariant(QVariantMap{{QStringLiteral("BookmarkID"), id}}) : QVariant());
}

void BookmarkPlugin::DeleteBookmark(const QVariant& request, const RequestSenderInfo&,
                                    const HDLR_DO_REQUEST_CB& hdlrDoRequestCB)
{
    ++m_requestCount;
    if (m_answerMode.load() == AnswerMode::Fail) {
        answer(hdlrDoRequestCB, false, QVariant());
        return;
    }
    const QString id = request.toMap().value(QStringLiteral("BookmarkID")).toString();
    bool bDeleted = false;
    {
        QMutexLocker lock(&m_mutex);
        if (!id.isEmpty() && m_bookmarks.contains(id)) {
            QHash<QString, QVariantMap> next = m_bookmarks;
            next.remove(id);
            if (save(next)) {
                m_bookmarks = next;
                bDeleted = true;
            }
        }
    }
    answer(hdlrDoRequestCB, bDeleted, QVariant());
}

QHash<QString, QVariantMap> BookmarkPlugin::bookmarks() const
{
    QMutexLocker lock(&m_mutex);
    return m_bookmarks;
}

void BookmarkPlugin::answer(const HDLR_DO_REQUEST_CB& hdlrDoRequestCB, bool bOk,
                            const QVariant& payload) const
{
    const AnswerMode mode = m_answerMode.load();
    if (!hdlrDoRequestCB || mode == AnswerMode::Never) {
        return;
    }
    const int times = mode == AnswerMode::Twice ? 2 : 1;
    for (int i = 0; i < times; ++i) {
        hdlrDoRequestCB(true, bOk ? QStringLiteral("0") : QStringLiteral("-1"), QString(), payload);
    }
}

bool BookmarkPlugin::load()
{
    QFile file(m_strStoragePath);
    if (!file.open(QIODevice::ReadOnly)) {
        return false;
    }
    const QJsonObject root = QJsonDocument::fromJson(file.readAll()).object();
    QMutexLocker lock(&m_mutex);
    for (auto it = root.begin(); it != root.end(); ++it) {
        m_bookmarks.insert(it.key(), it.value().toObject().toVariantMap());
    }
    return true;
}

bool BookmarkPlugin::save(const QHash<QString, QVariantMap>& bookmarks) const
{
    QDir().mkpath(QFileInfo(m_strStoragePath).absolutePath());
    QJsonObject root;
    for (auto it = bookmarks.begin(); it != bookmarks.end(); ++it) {
        root.insert(it.key(), QJsonObject::fromVariantMap(it.value()));
    }
    QSaveFile file(m_strStoragePath);
    if (!file.open(QIODevice::WriteOnly)) {
        return false;
    }
    file.write(QJsonDocument(root).toJson(QJsonDocument::Indented));
    return file.commit();
}
