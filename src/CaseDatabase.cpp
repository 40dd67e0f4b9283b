#include "CaseDatabase.h"

#include "DelvixKeys.h"
#include "LogFacility.h"

#include <QDateTime>
#include <QDir>
#include <QJsonArray>
#include <QJsonDocument>
#include <QSqlDatabase>
#include <QSqlError>
#include <QSqlQuery>
#include <QStringList>
#include <QUuid>
#include <algorithm>
#include <mutex>

namespace {

const QString CASE_FOLDER_NAME = QStringLiteral("PluginDelvix");
const QString CASE_FILE_NAME = QStringLiteral("CaseVault.db");
const QString SQLITE_DRIVER = QStringLiteral("QSQLITE");
const QString CASE_TABLE = QStringLiteral("Case");
const QString CASE_ITEM_TABLE = QStringLiteral("CaseItem");
// The cascade from a case to its items works only with enforcement on, and SQLite forgets the
// setting with every closing, so it is set at every opening.
const QString SQL_FOREIGN_KEYS_ON = QStringLiteral(" PRAGMA foreign_keys = ON; ");

// Every item read and the cascade of a case deletion select items by case; without this index
// each of them reads the whole item table. An index changes nothing in the tables, and files
// with or without it open in every version.
const QString SQL_CREATE_CASE_ITEM_INDEX =
    QStringLiteral("CREATE INDEX IF NOT EXISTS CaseItemByCaseId ON CaseItem (caseId)");
const QString SQL_SELECT_CASES = QStringLiteral(
    "SELECT id, name, number, reporter, description, createdTime FROM \"Case\" ORDER BY createdTime DESC");
const QString SQL_INSERT_CASE =
    QStringLiteral("INSERT INTO \"Case\" (name, number, reporter, createdTime) VALUES (?, ?, ?, ?)");
const QString SQL_INSERT_CASE_ITEM =
    QStringLiteral("INSERT INTO CaseItem (caseId, startTime, endTime, itemType, nodeId, locationId, "
                   "objectImage, trajectory, "
                   "faceImage, previewImage, showFacePhotoOnReport, showObjectPhotoOnReport, bookmarkId, "
                   "needBookmark) VALUES (?, "
                   "?, ?, ?, ?, ?, ?, ?, ?, ?, ?, ?, ?, ?)");
const QString SQL_UPDATE_CASE =
    QStringLiteral("UPDATE \"Case\" SET name = ?, number = ?, reporter = ?, description = ? WHERE id = ?");
const QString SQL_UPDATE_CASE_ITEM =
    QStringLiteral("UPDATE CaseItem SET showFacePhotoOnReport = ?, showObjectPhotoOnReport = ?, comment = ?, "
                   "emapImageScale = ?, emapAngle = ? WHERE id = ?");
const QString SQL_DELETE_CASE = QStringLiteral("DELETE FROM \"Case\" WHERE id = ?");
const QString SQL_DELETE_CASE_ITEM = QStringLiteral("DELETE FROM CaseItem WHERE id = ?");
const QString SQL_SELECT_CASE_ITEMS = QStringLiteral(
    "SELECT id, startTime, endTime, nodeId, locationId, objectImage, trajectory, faceImage, previewImage, "
    "showFacePhotoOnReport, showObjectPhotoOnReport, comment, emapImageScale, emapAngle, bookmarkId, "
    "needBookmark, "
    "itemType FROM CaseItem WHERE caseId = ?");
const QString SQL_SELECT_CASE_ITEM = QStringLiteral(
    "SELECT id, startTime, endTime, nodeId, locationId, objectImage, trajectory, faceImage, previewImage, "
    "showFacePhotoOnReport, showObjectPhotoOnReport, comment, emapImageScale, emapAngle, bookmarkId FROM "
    "CaseItem "
    "WHERE id = ?");
const QString SQL_SELECT_CASE_ITEM_IDS = QStringLiteral("SELECT id FROM CaseItem WHERE caseId = ?");
const QString SQL_SELECT_CASE_DURATION =
    QStringLiteral("SELECT MIN(startTime), MAX(endTime) FROM CaseItem WHERE caseId = ?");
const QString SQL_SELECT_COVER_IMAGES = QStringLiteral(
    "SELECT image, itemType, startTime FROM (%1 UNION ALL %2 UNION ALL %3) ORDER BY startTime");
const QString SQL_COVER_FACE_IMAGES = QStringLiteral(
    "SELECT faceImage AS image, itemType, startTime FROM CaseItem WHERE caseId = ? AND faceImage IS "
    "NOT NULL AND faceImage != '' AND itemType = 0");
const QString SQL_COVER_OBJECT_IMAGES = QStringLiteral(
    "SELECT objectImage AS image, itemType, startTime FROM CaseItem WHERE caseId = ? AND objectImage "
    "IS NOT NULL AND objectImage != '' AND (faceImage IS NULL OR faceImage == '') AND itemType = 0");
const QString SQL_COVER_RECORDING_IMAGES = QStringLiteral(
    "SELECT objectImage AS image, itemType, startTime FROM CaseItem WHERE caseId = ? AND objectImage "
    "IS NOT NULL AND objectImage != '' AND itemType = 1");

const QString DURATION_FORMAT = QStringLiteral("yyyy-MM-dd hh:mm");
const QString NO_DURATION = QStringLiteral("0");
const int COVER_IMAGE_SLOTS = 3;

QVariantList parseTrajectory(const QVariant& column)
{
    return QJsonDocument::fromJson(column.toString().toUtf8()).toVariant().toList();
}

// The item-level columns shared by both item reads, in the order of their SELECT lists.
QVariantMap readCaseItemColumns(const QSqlQuery& query)
{
    QVariantMap record;
    record.insert(KEY_ID, query.value(0).toInt());
    record.insert(KEY_START_TIMESTAMP, query.value(1).toLongLong());
    record.insert(KEY_END_TIMESTAMP, query.value(2).toLongLong());
    record.insert(KEY_NODE_ID, query.value(3).toString());
    record.insert(KEY_LOC_ID, query.value(4).toString());
    record.insert(KEY_OBJ_IMAGE, query.value(5).toString());
    record.insert(KEY_TRAJECTORY, parseTrajectory(query.value(6)));
    record.insert(KEY_FACE_IMAGE, query.value(7).toString());
    record.insert(KEY_PREVIEW_IMAGE, query.value(8).toString());
    record.insert(KEY_SHOW_FACE_PHOTO_ON_REPORT, query.value(9).toBool());
    record.insert(KEY_SHOW_OBJECT_PHOTO_ON_REPORT, query.value(10).toBool());
    record.insert(KEY_COMMENT, query.value(11).toString());
    record.insert(KEY_EMAP_IMAGE_SCALE, query.value(12).toDouble());
    record.insert(KEY_EMAP_ANGLE, query.value(13).toDouble());
    record.insert(KEY_BOOKMARK_ID, query.value(14).toString());
    return record;
}

QString durationText(const QVariant& milliseconds)
{
    const qint64 value = milliseconds.toLongLong();
    if (value == 0) {
        return NO_DURATION;
    }
    return QDateTime::fromMSecsSinceEpoch(value).toString(DURATION_FORMAT);
}

QByteArray trajectoryJson(const QVariant& value)
{
    const QJsonArray array = value.metaType() == QMetaType::fromType<QJsonArray>()
                                 ? value.toJsonArray()
                                 : QJsonArray::fromVariantList(value.toList());
    return QJsonDocument(array).toJson(QJsonDocument::Compact);
}

} // namespace

// What an instance shares with its copies. Destroyed with the last holder, which is when the
// connection may leave the driver's registry: removing it earlier would pull it from under the
// copies still using it.
struct CaseDatabase::Shared
{
    explicit Shared(const QString& name)
        : connectionName(name)
    {}
    ~Shared()
    {
        // The registry warns and keeps the driver while any handle to it is alive.
        database = QSqlDatabase();
        if (!connectionName.isEmpty()) {
            QSqlDatabase::removeDatabase(connectionName);
        }
    }
    Shared(const Shared&) = delete;
    Shared& operator=(const Shared&) = delete;

    const QString connectionName;
    // Held by every public operation for its whole length; guards the two members below and
    // the file's open state.
    // A standard mutex rather than Qt's: ThreadSanitizer sees its locking and so can vouch for
    // everything it guards.
    std::recursive_mutex mutex;
    QSqlDatabase database;          // guarded by mutex; invalid when there is no file
    QMap<int, QVariantMap> caseMap; // guarded by mutex; one entry per row of "Case"
};

// Opens the file for the length of one operation. Failures are logged and not acted upon: the
// statements that follow then fail at preparation, which gives the operation its failure value.
class CaseDatabase::ConnectionGuard
{
public:
    explicit ConnectionGuard(const QSqlDatabase& database)
        : m_database(database)
    {
        if (!m_database.isValid() || !m_database.open()) {
            DELVIX_LOG(LogFacility::LevelError, "%s, Open case vault database fail, %s",
                       "CaseDatabase::ConnectionGuard", qPrintable(m_database.lastError().text()));
        }
        QSqlQuery pragma(m_database);
        if (!pragma.exec(SQL_FOREIGN_KEYS_ON)) {
            DELVIX_LOG(LogFacility::LevelError, "%s, Enable foreign key failed. error[%s]",
                       "CaseDatabase::ConnectionGuard", qPrintable(pragma.lastError().text()));
        }
    }
    ~ConnectionGuard()
    {
        if (m_database.isOpen()) {
            m_database.close();
        }
    }
    ConnectionGuard(const ConnectionGuard&) = delete;
    ConnectionGuard& operator=(const ConnectionGuard&) = delete;

private:
    QSqlDatabase m_database;
};

CaseDatabase::CaseDatabase()
    : m_shared(std::make_shared<Shared>(QString()))
{}

CaseDatabase::CaseDatabase(const QString& path)
    : m_connectionName(QUuid::createUuid().toString())
    , m_shared(std::make_shared<Shared>(m_connectionName))
{
    std::lock_guard<std::recursive_mutex> locker(m_shared->mutex);
    if (path.isEmpty()) {
        // Without the server's database path the folder would land at the root of the file
        // system (or SQLite would make a throw-away database): keep no file at all instead.
        DELVIX_LOG(LogFacility::LevelError, "%s, no database path, the case vault has no file",
                   "CaseDatabase::CaseDatabase");
    } else {
        m_folderPath = path + QDir::separator() + CASE_FOLDER_NAME;
        m_filePath = m_folderPath + QDir::separator() + CASE_FILE_NAME;
        m_shared->database = QSqlDatabase::addDatabase(SQLITE_DRIVER, m_connectionName);
        QDir folder(m_folderPath);
        if (!folder.exists()) {
            // A failure shows at the first opening, which logs it.
            folder.mkdir(m_folderPath);
        }
        m_shared->database.setDatabaseName(m_filePath);
    }
    initialTable();
    initialCaseMap();
}

CaseDatabase::CaseDatabase(const CaseDatabase& other)
    : m_folderPath(other.m_folderPath)
    , m_filePath(other.m_filePath)
    , m_connectionName(other.m_connectionName)
    , m_shared(other.m_shared)
{}

CaseDatabase& CaseDatabase::operator=(const CaseDatabase& other)
{
    if (this != &other) {
        m_folderPath = other.m_folderPath;
        m_filePath = other.m_filePath;
        m_connectionName = other.m_connectionName;
        // Releasing the previous state may remove its connection, if this was its last holder.
        m_shared = other.m_shared;
    }
    return *this;
}

CaseDatabase::~CaseDatabase() = default;

bool CaseDatabase::executeSql(QSqlQuery& query, const QString& statement, const QList<QVariant>& values)
{
    if (!query.prepare(statement)) {
        DELVIX_LOG(LogFacility::LevelError, "%s, prepare failed, error: %s, stmt: %s",
                   "CaseDatabase::executeSql", qPrintable(query.lastError().text()), qPrintable(statement));
        return false;
    }
    for (const QVariant& value : values) {
        query.addBindValue(value, QSql::In);
    }
    if (!query.exec()) {
        DELVIX_LOG(LogFacility::LevelError, "%s, execute failed, error: %s, stmt: %s",
                   "CaseDatabase::executeSql", qPrintable(query.lastError().text()), qPrintable(statement));
        return false;
    }
    return true;
}

bool CaseDatabase::initialTable()
{
    std::lock_guard<std::recursive_mutex> locker(m_shared->mutex);
    ConnectionGuard guard(m_shared->database);
    const QStringList tables = m_shared->database.tables(QSql::Tables);
    if (!tables.contains(CASE_TABLE, Qt::CaseSensitive)) {
        QSqlQuery query(m_shared->database);
        if (!executeSql(query, SQL_CREATE_CASE_TABLE, {})) {
            return false;
        }
    }
    if (!tables.contains(CASE_ITEM_TABLE, Qt::CaseSensitive)) {
        QSqlQuery query(m_shared->database);
        if (!executeSql(query, SQL_CREATE_CASE_ITEM_TABLE, {})) {
            return false;
        }
    }
    // Only speed depends on the index: a file where it cannot be made (read-only) still works.
    QSqlQuery index(m_shared->database);
    executeSql(index, SQL_CREATE_CASE_ITEM_INDEX, {});
    return true;
}

void CaseDatabase::initialCaseMap()
{
    std::lock_guard<std::recursive_mutex> locker(m_shared->mutex);
    ConnectionGuard guard(m_shared->database);
    QSqlQuery query(m_shared->database);
    if (!executeSql(query, SQL_SELECT_CASES, {})) {
        return;
    }
    while (query.next()) {
        QVariantMap record;
        const int caseId = query.value(0).toInt();
        record.insert(KEY_CASE_ID, caseId);
        record.insert(KEY_CASE_NAME, query.value(1).toString());
        record.insert(KEY_CASE_NUMBER, query.value(2).toString());
        record.insert(KEY_REPORTER, query.value(3).toString());
        record.insert(KEY_DESCRIPTION, query.value(4).toString());
        record.insert(KEY_CREATED_TIME, query.value(5).toLongLong());
        m_shared->caseMap.insert(caseId, record);
    }
}

int CaseDatabase::addCase(const QString& name, const QString& number, const QString& reporter)
{
    std::lock_guard<std::recursive_mutex> locker(m_shared->mutex);
    ConnectionGuard guard(m_shared->database);
    const qint64 createdTime = QDateTime::currentSecsSinceEpoch();
    QSqlQuery query(m_shared->database);
    if (!executeSql(query, SQL_INSERT_CASE, {name, number, reporter, createdTime})) {
        return 0;
    }
    const int caseId = query.lastInsertId().toInt();
    QVariantMap record;
    record.insert(KEY_CASE_ID, caseId);
    record.insert(KEY_CASE_NAME, name);
    record.insert(KEY_CASE_NUMBER, number);
    record.insert(KEY_REPORTER, reporter);
    record.insert(KEY_DESCRIPTION, QString());
    record.insert(KEY_CREATED_TIME, createdTime);
    m_shared->caseMap.insert(caseId, record);
    return caseId;
}

int CaseDatabase::addCaseItem(int caseId, const QVariantMap& item)
{
    std::lock_guard<std::recursive_mutex> locker(m_shared->mutex);
    ConnectionGuard guard(m_shared->database);
    const QString faceImage = item.value(KEY_FACE_IMAGE).toString();
    const QString objectImage = item.value(KEY_OBJ_IMAGE).toString();
    const QList<QVariant> values{caseId,
                                 item.value(KEY_START_TIMESTAMP).toLongLong(),
                                 item.value(KEY_END_TIMESTAMP).toLongLong(),
                                 item.value(KEY_CASE_ITEM_TYPE).toInt(),
                                 item.value(KEY_NODE_ID).toString(),
                                 item.value(KEY_LOC_ID).toString(),
                                 objectImage,
                                 trajectoryJson(item.value(KEY_TRAJECTORY)),
                                 faceImage,
                                 item.value(KEY_PREVIEW_IMAGE).toString(),
                                 faceImage.isEmpty() ? 0 : 1,
                                 objectImage.isEmpty() ? 0 : 1,
                                 item.value(KEY_BOOKMARK_ID).toString(),
                                 item.value(KEY_NEED_BOOKMARK).toBool()};
    QSqlQuery query(m_shared->database);
    if (!executeSql(query, SQL_INSERT_CASE_ITEM, values)) {
        return 0;
    }
    return query.lastInsertId().toInt();
}

bool CaseDatabase::updateCase(int caseId, const QVariantMap& fields)
{
    std::lock_guard<std::recursive_mutex> locker(m_shared->mutex);
    ConnectionGuard guard(m_shared->database);
    const QString name = fields.value(KEY_CASE_NAME).toString();
    const QString number = fields.value(KEY_CASE_NUMBER).toString();
    const QString reporter = fields.value(KEY_REPORTER).toString();
    const QString description = fields.value(KEY_DESCRIPTION).toString();
    QSqlQuery query(m_shared->database);
    if (!executeSql(query, SQL_UPDATE_CASE, {name, number, reporter, description, caseId})) {
        return false;
    }
    if (query.numRowsAffected() == 0) {
        // The file has no such case (another program removed it): claiming the edit, or
        // keeping the case in the map, would tell callers of a case that is not stored.
        DELVIX_LOG(LogFacility::LevelError, "%s, case %d is not in the case vault",
                   "CaseDatabase::updateCase", caseId);
        m_shared->caseMap.remove(caseId);
        return false;
    }
    auto entry = m_shared->caseMap.find(caseId);
    if (entry != m_shared->caseMap.end()) {
        // The texts as stored, so that the map answers what a fresh load of the file would.
        entry->insert(KEY_CASE_NAME, name);
        entry->insert(KEY_CASE_NUMBER, number);
        entry->insert(KEY_REPORTER, reporter);
        entry->insert(KEY_DESCRIPTION, description);
    }
    return true;
}

bool CaseDatabase::updateCaseItem(int itemId, const QVariantMap& fields)
{
    std::lock_guard<std::recursive_mutex> locker(m_shared->mutex);
    ConnectionGuard guard(m_shared->database);
    QSqlQuery query(m_shared->database);
    if (!executeSql(query, SQL_UPDATE_CASE_ITEM,
                    {fields.value(KEY_SHOW_FACE_PHOTO_ON_REPORT).toInt(),
                     fields.value(KEY_SHOW_OBJECT_PHOTO_ON_REPORT).toInt(),
                     fields.value(KEY_COMMENT).toString(), fields.value(KEY_EMAP_IMAGE_SCALE).toDouble(),
                     fields.value(KEY_EMAP_ANGLE).toDouble(), itemId})) {
        return false;
    }
    return query.numRowsAffected() != 0;
}

bool CaseDatabase::deleteCase(int caseId)
{
    std::lock_guard<std::recursive_mutex> locker(m_shared->mutex);
    ConnectionGuard guard(m_shared->database);
    QSqlQuery query(m_shared->database);
    if (!executeSql(query, SQL_DELETE_CASE, {caseId})) {
        return false;
    }
    m_shared->caseMap.remove(caseId);
    return true;
}

bool CaseDatabase::deleteCaseItem(int itemId)
{
    std::lock_guard<std::recursive_mutex> locker(m_shared->mutex);
    ConnectionGuard guard(m_shared->database);
    QSqlQuery query(m_shared->database);
    return executeSql(query, SQL_DELETE_CASE_ITEM, {itemId});
}

bool CaseDatabase::containCase(int caseId)
{
    std::lock_guard<std::recursive_mutex> locker(m_shared->mutex);
    return m_shared->caseMap.contains(caseId);
}

std::unique_lock<std::recursive_mutex> CaseDatabase::lockSequence() const
{
    return std::unique_lock<std::recursive_mutex>(m_shared->mutex);
}

QVariantMap CaseDatabase::getCaseInfoMap(int caseId)
{
    std::lock_guard<std::recursive_mutex> locker(m_shared->mutex);
    const auto entry = m_shared->caseMap.constFind(caseId);
    if (entry == m_shared->caseMap.constEnd()) {
        return {};
    }
    QVariantMap detail = *entry;
    detail.insert(KEY_COVER_IMAGE, QVariant(getCaseCoverImage(caseId)));
    const std::pair<QString, QString> duration = getCaseDuration(caseId);
    detail.insert(KEY_START_TIMESTAMP, duration.first);
    detail.insert(KEY_END_TIMESTAMP, duration.second);
    return detail;
}

QVariantList CaseDatabase::getCaseList()
{
    std::lock_guard<std::recursive_mutex> locker(m_shared->mutex);
    QVariantList summaries;
    summaries.reserve(m_shared->caseMap.size());
    for (const QVariantMap& record : std::as_const(m_shared->caseMap)) {
        QVariantMap summary;
        summary.insert(KEY_CASE_ID, record.value(KEY_CASE_ID).toInt());
        summary.insert(KEY_CASE_NAME, record.value(KEY_CASE_NAME).toString());
        summary.insert(KEY_CREATED_TIME, record.value(KEY_CREATED_TIME).toUInt());
        summaries.append(summary);
    }
    std::stable_sort(summaries.begin(), summaries.end(), [](const QVariant& left, const QVariant& right) {
        return left.toMap().value(KEY_CREATED_TIME).toUInt() > right.toMap().value(KEY_CREATED_TIME).toUInt();
    });
    return summaries;
}

QVariantList CaseDatabase::getAllCase()
{
    std::lock_guard<std::recursive_mutex> locker(m_shared->mutex);
    QVariantList records;
    records.reserve(m_shared->caseMap.size());
    for (const QVariantMap& record : std::as_const(m_shared->caseMap)) {
        records.append(record);
    }
    return records;
}

QVariantList CaseDatabase::getCaseItemList(int caseId)
{
    std::lock_guard<std::recursive_mutex> locker(m_shared->mutex);
    ConnectionGuard guard(m_shared->database);
    QSqlQuery query(m_shared->database);
    if (!executeSql(query, SQL_SELECT_CASE_ITEMS, {caseId})) {
        return {};
    }
    QVariantList items;
    while (query.next()) {
        QVariantMap record = readCaseItemColumns(query);
        record.insert(KEY_NEED_BOOKMARK, query.value(15).toBool());
        record.insert(KEY_OBJ_TYPE, query.value(16).toInt());
        items.append(record);
    }
    return items;
}

QSet<int> CaseDatabase::getCaseItemIdSet(int caseId)
{
    std::lock_guard<std::recursive_mutex> locker(m_shared->mutex);
    ConnectionGuard guard(m_shared->database);
    QSqlQuery query(m_shared->database);
    if (!executeSql(query, SQL_SELECT_CASE_ITEM_IDS, {caseId})) {
        return {};
    }
    QSet<int> ids;
    while (query.next()) {
        ids.insert(query.value(0).toInt());
    }
    return ids;
}

QVariantMap CaseDatabase::getCaseItemInfoMap(int itemId)
{
    std::lock_guard<std::recursive_mutex> locker(m_shared->mutex);
    ConnectionGuard guard(m_shared->database);
    QSqlQuery query(m_shared->database);
    if (!executeSql(query, SQL_SELECT_CASE_ITEM, {itemId}) || !query.next()) {
        return {};
    }
    return readCaseItemColumns(query);
}

std::pair<QString, QString> CaseDatabase::getCaseDuration(int caseId)
{
    std::lock_guard<std::recursive_mutex> locker(m_shared->mutex);
    ConnectionGuard guard(m_shared->database);
    QSqlQuery query(m_shared->database);
    if (!executeSql(query, SQL_SELECT_CASE_DURATION, {caseId}) || !query.next()) {
        return {NO_DURATION, NO_DURATION};
    }
    return {durationText(query.value(0)), durationText(query.value(1))};
}

QList<QString> CaseDatabase::getCaseCoverImage(int caseId)
{
    std::lock_guard<std::recursive_mutex> locker(m_shared->mutex);
    ConnectionGuard guard(m_shared->database);
    QSqlQuery query(m_shared->database);
    const QString statement = SQL_SELECT_COVER_IMAGES.arg(SQL_COVER_FACE_IMAGES, SQL_COVER_OBJECT_IMAGES,
                                                          SQL_COVER_RECORDING_IMAGES);
    if (!executeSql(query, statement, {caseId, caseId, caseId})) {
        return {};
    }
    // A type-0 image takes one slot, any other two: a cover holds three object or face images,
    // or one recording image and one more.
    QList<QString> images;
    int slotsLeft = COVER_IMAGE_SLOTS;
    while (slotsLeft > 0 && images.size() < COVER_IMAGE_SLOTS && query.next()) {
        const int cost = query.value(1).toInt() == 0 ? 1 : 2;
        if (cost > slotsLeft) {
            continue;
        }
        slotsLeft -= cost;
        images.append(query.value(0).toString());
    }
    return images;
}
