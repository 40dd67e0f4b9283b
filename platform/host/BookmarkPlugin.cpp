#include "BookmarkPlugin.h"

#include <QDir>
#include <QFile>
#include <QFileInfo>
#include <QJsonDocument>
#include <QJsonObject>
#include <QSaveFile>
#include <QUuid>
#include <unistd.h>

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
        QMetaObject::invokeMethod(
            this, []() {}, Qt::BlockingQueuedConnection);
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
        if (append(QJsonObject{{QStringLiteral("add"), QJsonObject::fromVariantMap(bookmark)}})) {
            m_bookmarks.insert(id, bookmark);
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
        if (!id.isEmpty() && m_bookmarks.contains(id) &&
            append(QJsonObject{{QStringLiteral("delete"), id}})) {
            m_bookmarks.remove(id);
            bDeleted = true;
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
    const QByteArray text = file.readAll();
    file.close();
    QMutexLocker lock(&m_mutex);
    const QJsonObject whole = QJsonDocument::fromJson(text).object();
    bool compact = true;
    if (!whole.isEmpty() && !whole.contains(QStringLiteral("add")) &&
        !whole.contains(QStringLiteral("delete"))) {
        for (auto it = whole.begin(); it != whole.end(); ++it) { // the older form
            m_bookmarks.insert(it.key(), it.value().toObject().toVariantMap());
        }
    } else {
        qsizetype changes = 0;
        for (const QByteArray& line : text.split('\n')) {
            // A line torn by a crash reads as nothing; rewriting the journal drops it.
            const QJsonObject change = QJsonDocument::fromJson(line).object();
            const QVariantMap added = change.value(QStringLiteral("add")).toObject().toVariantMap();
            if (const QString id = added.value(QStringLiteral("BookmarkID")).toString(); !id.isEmpty()) {
                m_bookmarks.insert(id, added);
            } else {
                m_bookmarks.remove(change.value(QStringLiteral("delete")).toString());
            }
            changes += line.isEmpty() ? 0 : 1;
        }
        compact = changes != m_bookmarks.size();
    }
    return !compact || rewrite();
}

bool BookmarkPlugin::append(const QJsonObject& change) const
{
    QDir().mkpath(QFileInfo(m_strStoragePath).absolutePath());
    QFile file(m_strStoragePath);
    if (!file.open(QIODevice::WriteOnly | QIODevice::Append)) {
        return false;
    }
    const qint64 before = file.size();
    const QByteArray line = QJsonDocument(change).toJson(QJsonDocument::Compact) + '\n';
    if (file.write(line) == line.size() && file.flush() && ::fsync(file.handle()) == 0) {
        return true;
    }
    file.resize(before); // no torn line for the next change to be appended to
    return false;
}

bool BookmarkPlugin::rewrite() const
{
    QSaveFile file(m_strStoragePath);
    if (!file.open(QIODevice::WriteOnly)) {
        return false;
    }
    for (const QVariantMap& bookmark : m_bookmarks) {
        const QJsonObject change{{QStringLiteral("add"), QJsonObject::fromVariantMap(bookmark)}};
        file.write(QJsonDocument(change).toJson(QJsonDocument::Compact) + '\n');
    }
    return file.commit();
}
