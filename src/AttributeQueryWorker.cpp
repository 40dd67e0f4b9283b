#include "AttributeQueryWorker.h"

#include "DelvixKeys.h"
#include "JsonVariantReader.h"
#include "LogFacility.h"
#include "PlatformHelper.h"
#include "ScopeTracer.h"
#include "TamsaImplement.h"

#include <QJsonArray>
#include <QJsonDocument>
#include <QJsonObject>

#include <boost/asio/post.hpp>
#include <boost/asio/thread_pool.hpp>

#include <algorithm>
#include <cmath>
#include <cstring>
#include <exception>
#include <limits>

namespace {

const char* const kObjectTypeHuman = "Human";
const char* const kObjectTypeVehicle = "Vehicle";

// Closes the search and releases the database on every way out of a record loop.
class StoreSearch
{
public:
    explicit StoreSearch(TamsaWrapper& tamsa)
        : m_tamsa(tamsa)
    {}
    ~StoreSearch()
    {
        if (m_search) {
            m_tamsa.GetObjectMetaInfoClose(m_search);
        }
        m_tamsa.releaseDatabase(&m_database);
    }
    StoreSearch(const StoreSearch&) = delete;
    StoreSearch& operator=(const StoreSearch&) = delete;

    void* m_database = nullptr;
    void* m_search = nullptr;

private:
    TamsaWrapper& m_tamsa;
};

std::string compactJson(const QVariantList& numbers)
{
    if (numbers.isEmpty()) {
        return std::string();
    }
    return QJsonDocument(QJsonArray::fromVariantList(numbers)).toJson(QJsonDocument::Compact).toStdString();
}

uint32_t clampToSeconds(qint64 milliseconds)
{
    const qint64 seconds = milliseconds / 1000;
    return static_cast<uint32_t>(std::clamp<qint64>(seconds, 0, std::numeric_limits<uint32_t>::max()));
}

float variantToFloat(const QVariant& value)
{
    // The common case, numbers straight from the store's text, without the generic conversion.
    if (value.typeId() == QMetaType::Double) {
        return static_cast<float>(*static_cast<const double*>(value.constData()));
    }
    return value.toFloat();
}

std::vector<float> toFloatVector(const QVariant& value)
{
    const QVariantList list = value.toList();
    std::vector<float> vector;
    vector.reserve(list.size());
    for (const QVariant& element : list) {
        vector.push_back(variantToFloat(element));
    }
    return vector;
}

// The store's JSON text as a variant tree; a missing or bad text gives an invalid variant.
QVariant parseStoreJson(const char* text, AttributeQueryWorker::JsonRoute route)
{
    if (!text || !*text) {
        return QVariant();
    }
    const std::size_t length = std::strlen(text);
    if (route == AttributeQueryWorker::JsonRoute::Fast) {
        QVariant tree = JsonVariantReader::read(text, length);
        if (tree.isValid()) {
            return tree;
        }
    }
    const QJsonDocument document = QJsonDocument::fromJson(QByteArray::fromRawData(text, qsizetype(length)));
    if (document.isObject()) {
        return document.object().toVariantMap();
    }
    if (document.isArray()) {
        return document.array().toVariantList();
    }
    return QVariant();
}

// The first element of a crop array as a map: empty when the entry is missing, empty or
// not an array.
QVariantMap firstElement(const QVariant& entry)
{
    const QVariantList list = entry.toList();
    return list.isEmpty() ? QVariantMap() : list.constFirst().toMap();
}

} // namespace

AttributeQueryWorker::AttributeQueryWorker()
    : m_tamsa(std::make_shared<TamsaImplement>())
{
    const int cores = PlatformHelper::physicalCoreCount();
    m_periods = cores > 0 ? cores : 1;
}

AttributeQueryWorker::~AttributeQueryWorker() = default;

void AttributeQueryWorker::setTamsa(std::shared_ptr<TamsaWrapper> tamsa)
{
    if (tamsa) {
        m_tamsa = std::move(tamsa);
    }
}

void AttributeQueryWorker::setPeriods(int periods)
{
    // A pool without threads would never run the posted locations.
    m_periods = std::max(1, periods);
}

void AttributeQueryWorker::setParallel(bool parallel)
{
    m_bParallel = parallel;
}

quint64 AttributeQueryWorker::searchGeneration() const
{
    std::lock_guard<std::mutex> lock(m_mutex);
    return m_generation;
}

void AttributeQueryWorker::stop()
{
    std::lock_guard<std::mutex> lock(m_mutex);
    m_bStop = true;
    abortRegisteredSearches();
}

bool AttributeQueryWorker::stop(quint64 generation)
{
    std::lock_guard<std::mutex> lock(m_mutex);
    if (generation != m_generation) {
        return false;
    }
    m_bStop = true;
    abortRegisteredSearches();
    return true;
}

void AttributeQueryWorker::abortRegisteredSearches()
{
    for (const auto& entry : m_tamsaHandles) {
        m_tamsa->GetObjectMetaInfoAbort(entry.second);
    }
}

void AttributeQueryWorker::finishSearch()
{
    std::lock_guard<std::mutex> lock(m_mutex);
    m_bStop = false;
    ++m_generation;
}

void AttributeQueryWorker::setTamsaHandle(void* search)
{
    std::lock_guard<std::mutex> lock(m_mutex);
    m_tamsaHandles[std::this_thread::get_id()] = search;
}

void AttributeQueryWorker::removeTamsaHandle()
{
    std::lock_guard<std::mutex> lock(m_mutex);
    m_tamsaHandles.erase(std::this_thread::get_id());
}

bool AttributeQueryWorker::deliver(const Callback& callback, bool finished, const QVariantMap& record) const
{
    if (!callback) {
        return true;
    }
    // The callback is the request side's; whatever it throws must not unwind the search.
    try {
        callback(finished, record);
        return true;
    } catch (const std::exception& e) {
        DELVIX_LOG(LogFacility::LevelError, "%s, callback failed: %s", "AttributeQueryWorker::deliver",
                   e.what());
    } catch (...) {
        DELVIX_LOG(LogFacility::LevelError, "%s, callback failed", "AttributeQueryWorker::deliver");
    }
    return false;
}

TTAMSA_TZDS AttributeQueryWorker::makeTZDS(int standardBiasMinutes, bool daylight)
{
    TTAMSA_TZDS tzds;
    std::memset(&tzds, 0, sizeof tzds);
    tzds.wZone = static_cast<uint16_t>(48 + standardBiasMinutes / 15);
    tzds.wDaylight = daylight ? 1 : 0;
    return tzds;
}

TTAMSA_TZDS AttributeQueryWorker::getTamsaTZDS() const
{
    const PlatformHelper::LocalZone zone = PlatformHelper::localZone();
    return makeTZDS(zone.standardBiasMinutes, zone.daylightNow);
}

QStringList AttributeQueryWorker::extractAndRemoveKeyFromJson(const QString& json,
                                                              const QStringList& keys) const
{
    if (json.isEmpty()) {
        return {QString(), QString()};
    }
    // Not JSON, or not an object: both parts are empty objects, the object type still counts.
    QJsonObject rest = QJsonDocument::fromJson(json.toUtf8()).object();
    QJsonObject taken;
    for (const QString& key : keys) {
        const auto member = rest.constFind(key);
        if (member != rest.constEnd()) {
            taken.insert(key, member.value());
            rest.remove(key);
        }
    }
    return {QString::fromUtf8(QJsonDocument(rest).toJson(QJsonDocument::Compact)),
            QString::fromUtf8(QJsonDocument(taken).toJson(QJsonDocument::Compact))};
}

TTAMSA_OBJECTMETAINFO_QUERY AttributeQueryWorker::composeQueryCondition(
    qint64 startMs, qint64 endMs, const std::string& humanOther, const std::string& humanPrimary,
    const std::string& vehicleOther, const std::string& vehiclePrimary, bool loitering,
    const std::string& trace, uint32_t duration, int direction, const std::vector<uint32_t>& locations,
    bool descending, bool doNotSort, const std::string& feature, const std::string& faceFeature,
    const std::string& plateNumber) const
{
    TTAMSA_OBJECTMETAINFO_QUERY query;
    std::memset(&query, 0, sizeof query);
    query.wSize = sizeof(TTAMSA_OBJECTMETAINFO_QUERY);
    // Beyond 32 bits a time would wrap into an unrelated window; the edge is the closest.
    query.dwStartTime = clampToSeconds(startMs);
    query.dwEndTime = clampToSeconds(endMs);
    query.tzds = getTamsaTZDS();
    query.pdwLocationIds = locations.empty() ? nullptr : locations.data();
    if (!humanOther.empty() && !humanPrimary.empty()) {
        query.pszObjectType = kObjectTypeHuman;
        query.pszPrimaryAttributes = humanPrimary.c_str();
        query.pszOtherAttributes = humanOther.c_str();
    } else if (!vehicleOther.empty() && !vehiclePrimary.empty()) {
        query.pszObjectType = kObjectTypeVehicle;
        query.pszPrimaryAttributes = vehiclePrimary.c_str();
        query.pszOtherAttributes = vehicleOther.c_str();
    }
    query.pszTrace = trace.empty() ? nullptr : trace.c_str();
    query.dwDuration = duration;
    query.bLoitering = loitering ? 1 : 0;
    query.bDescending = descending ? 1 : 0;
    query.nDirection = direction;
    query.bDoNotSort = doNotSort ? 1 : 0;
    query.pszFeature = feature.empty() ? nullptr : feature.c_str();
    query.pszFaceFeature = faceFeature.empty() ? nullptr : faceFeature.c_str();
    if (!plateNumber.empty()) {
        // A plate is always a vehicle's, whatever the attribute texts chose.
        query.pszPlateNumber = plateNumber.c_str();
        query.pszObjectType = kObjectTypeVehicle;
    }
    return query;
}

std::vector<uint32_t> AttributeQueryWorker::locationNumbers(const QStringList& locationIds)
{
    std::vector<uint32_t> locations;
    for (const QString& locationId : locationIds) {
        if (locationId.isEmpty()) {
            continue;
        }
        QString digits = locationId;
        digits.remove(LOCATION_PREFIX);
        bool ok = false;
        const uint number = digits.toUInt(&ok);
        // An unparsable entry becomes 0 and so ends the store's list there.
        locations.push_back(ok ? number : 0);
    }
    if (!locations.empty()) {
        locations.push_back(0);
    }
    return locations;
}

AttributeQueryWorker::StoreRequest AttributeQueryWorker::readRequest(const QVariantMap& params) const
{
    StoreRequest request;
    // Timestamps are milliseconds since the epoch. One before it means its start (read as
    // unsigned it would turn into the far end of time and find nothing); anything beyond the
    // signed range is far beyond 32-bit seconds anyway and clamps the same way.
    const auto toSignedMs = [](const QVariant& value) -> qint64 {
        if (value.toDouble() < 0) {
            return 0;
        }
        const qulonglong ms = value.toULongLong();
        return ms > qulonglong(std::numeric_limits<qint64>::max()) ? std::numeric_limits<qint64>::max()
                                                                   : qint64(ms);
    };
    request.startMs = toSignedMs(params.value(KEY_START_TIMESTAMP));
    request.endMs = toSignedMs(params.value(KEY_END_TIMESTAMP));

    const QVariantMap rule = params.value(KEY_RULE_INFO).toMap();
    const QString ruleType = rule.value(KEY_TYPE).toString();
    request.loitering = ruleType == KEY_LOITERING;
    request.trace = rule.value(KEY_TRACE).toString().toStdString();
    request.duration = rule.value(KEY_DURATION).toUInt();
    request.direction = ruleType == KEY_LINE_CROSSING ? rule.value(KEY_DIRECTION).toInt() : 0;

    request.locations = locationNumbers(params.value(KEY_LOC_ID_LIST).toStringList());

    const QStringList human = extractAndRemoveKeyFromJson(
        params.value(KEY_HUMAN_INFO).toString(), {TAMSA_ATTR_AGE, TAMSA_ATTR_GENDER, TAMSA_ATTR_ACCESSORIES});
    const QStringList vehicle = extractAndRemoveKeyFromJson(params.value(KEY_VEHICLE_INFO).toString(),
                                                            {TAMSA_ATTR_TYPE, TAMSA_PLATE_NUMBER});
    request.humanOther = human.at(0).toStdString();
    request.humanPrimary = human.at(1).toStdString();
    request.vehicleOther = vehicle.at(0).toStdString();
    request.vehiclePrimary = vehicle.at(1).toStdString();
    request.descending = params.value(KEY_DESCENDING).toBool();
    request.doNotSort = params.value(KEY_DO_NOT_SORT).toBool();
    request.feature = compactJson(params.value(KEY_FEATURE).toList());
    request.faceFeature = compactJson(params.value(KEY_FACE_FEATURE).toList());
    request.plateNumber = params.value(KEY_PLATE_NUMBER).toString().toStdString();
    return request;
}

long AttributeQueryWorker::openSearch(const StoreRequest& request, const std::vector<uint32_t>& locations,
                                      void** database, void** search) const
{
    if (m_tamsa->initDatabase(database) != 0) {
        DELVIX_LOG(LogFacility::LevelError, "%s, m_tamsa->initDatabase failed",
                   "AttributeQueryWorker::getObjectMetaInfoFirst");
    }
    if (locations.empty()) {
        return kNoLocation;
    }
    const TTAMSA_OBJECTMETAINFO_QUERY query =
        composeQueryCondition(request.startMs, request.endMs, request.humanOther, request.humanPrimary,
                              request.vehicleOther, request.vehiclePrimary, request.loitering, request.trace,
                              request.duration, request.direction, locations, request.descending,
                              request.doNotSort, request.feature, request.faceFeature, request.plateNumber);
    return m_tamsa->GetObjectMetaInfoFirst(*database, &query, search);
}

long AttributeQueryWorker::getObjectMetaInfoFirst(const QVariantMap& params, void** database,
                                                  void** search) const
{
    const StoreRequest request = readRequest(params);
    return openSearch(request, request.locations, database, search);
}

QVariantMap AttributeQueryWorker::toSearchRecord(const TTAMSA_OBJECTMETAINFO_RESULT& result, JsonRoute route)
{
    QVariantMap record;
    record.insert(KEY_OBJECT_ID, qulonglong(result.qwObjectId));
    record.insert(KEY_OBJ_TYPE, QString::fromUtf8(result.pszObjectType));
    record.insert(KEY_START_TIMESTAMP, qint64(result.dwStartTime) * 1000);
    record.insert(KEY_END_TIMESTAMP, qint64(result.dwEndTime) * 1000);
    record.insert(KEY_LOC_ID, LOCATION_PREFIX + QString::number(result.dwLocationNumber));

    QVariantList trajectory;
    // A byte count without points would read from nowhere.
    if (result.pTrajectory) {
        const uint32_t points = result.dwTrajectoryBytes / 16;
        trajectory.reserve(points);
        for (uint32_t i = 0; i < points; ++i) {
            QVariantMap point;
            point.insert(KEY_X, result.pTrajectory[2 * i]);
            point.insert(KEY_Y, result.pTrajectory[2 * i + 1]);
            trajectory.append(point);
        }
    }
    record.insert(KEY_TRAJECTORY, trajectory);

    const QVariant thumbnails = parseStoreJson(result.pszThumbnails, route);
    const QVariantMap crops = thumbnails.toMap();
    // Older stores hand out the body thumbnail array alone.
    const auto bodyEntry = crops.constFind(TAMSA_THUMBNAIL);
    const QVariantMap body = firstElement(bodyEntry != crops.constEnd() ? bodyEntry.value() : thumbnails);
    record.insert(KEY_OBJ_IMAGE, body.value(TAMSA_IMAGE));
    record.insert(KEY_FEATURE, body.value(TAMSA_FEATURE));

    const auto faceEntry = crops.constFind(TAMSA_FACE_THUMBNAIL);
    if (faceEntry != crops.constEnd()) {
        const QVariantMap face = firstElement(faceEntry.value());
        if (!face.isEmpty() &&
            face.value(TAMSA_FACE_DETECTION_INFO).toMap().value(TAMSA_FILTERED).toInt() == 0) {
            record.insert(KEY_FACE_IMAGE, face.value(TAMSA_IMAGE));
            record.insert(KEY_FACE_FEATURE, face.value(TAMSA_FEATURE));
        }
    }
    const auto plateEntry = crops.constFind(TAMSA_LICENSE_PLATE_THUMBNAIL);
    if (plateEntry != crops.constEnd()) {
        const QVariantMap plate = firstElement(plateEntry.value());
        if (!plate.isEmpty() &&
            plate.value(TAMSA_DETECTION_INFO).toMap().value(TAMSA_FILTERED).toInt() == 0) {
            record.insert(KEY_PLATE_IMAGE, plate.value(TAMSA_IMAGE));
            record.insert(KEY_PLATE_NUMBER, plate.value(TAMSA_PLATE_NUMBER));
        }
    }

    const QVariantMap attributes = parseStoreJson(result.pszAttributes, route).toMap();
    record.insert(KEY_OBJECT_AGE, attributes.value(TAMSA_ATTR_AGE, QString()));
    record.insert(KEY_OBJECT_GENDER, attributes.value(TAMSA_ATTR_GENDER, QString()));
    record.insert(KEY_OBJECT_ACCESSORIES, attributes.value(TAMSA_ATTR_ACCESSORIES, QVariantList()));
    record.insert(KEY_OBJECT_UPPER_COLOR, attributes.value(TAMSA_ATTR_UPPER_COLOR, QVariantList()));
    record.insert(KEY_OBJECT_LOWER_COLOR, attributes.value(TAMSA_ATTR_LOWER_COLOR, QVariantList()));
    record.insert(KEY_OBJECT_VEHICLE_COLOR, attributes.value(TAMSA_ATTR_COLOR, QVariantList()));
    record.insert(KEY_OBJECT_VEHICLE_TYPE, attributes.value(TAMSA_ATTR_TYPE, QString()));
    return record;
}

void AttributeQueryWorker::query(const QVariantMap& params, const Callback& callback)
{
    DELVIX_SCOPE_TRACE("AttributeQueryWorker::query");
    try {
        StoreSearch store(*m_tamsa);
        const long status = getObjectMetaInfoFirst(params, &store.m_database, &store.m_search);
        if (status != 0) {
            DELVIX_LOG(LogFacility::LevelError, "%s, GetObjectMetaInfoFirst error: %x",
                       "AttributeQueryWorker::query", static_cast<unsigned>(status));
            store.m_search = nullptr; // nothing was opened, so nothing is closed
        } else {
            TTAMSA_OBJECTMETAINFO_RESULT result;
            std::memset(&result, 0, sizeof result);
            result.wSize = sizeof(TTAMSA_OBJECTMETAINFO_RESULT);
            for (int hits = 0; hits < kMaxHits && !m_bStop.load(); ++hits) {
                const long next = m_tamsa->GetObjectMetaInfoNext(store.m_search, &result);
                if (next != 0) {
                    if (next != kEndOfRecords) {
                        DELVIX_LOG(LogFacility::LevelError, "%s, GetObjectMetaInfoNext error: %x",
                                   "AttributeQueryWorker::query", static_cast<unsigned>(next));
                    }
                    break;
                }
                if (!deliver(callback, false, toSearchRecord(result))) {
                    break;
                }
            }
        }
    } catch (const std::exception& e) {
        DELVIX_LOG(LogFacility::LevelError, "%s, search failed: %s", "AttributeQueryWorker::query", e.what());
    } catch (...) {
        DELVIX_LOG(LogFacility::LevelError, "%s, search failed", "AttributeQueryWorker::query");
    }
    finishSearch();
    deliver(callback, true, QVariantMap());
}

void AttributeQueryWorker::reId(const QVariantMap& params, const Callback& callback)
{
    DELVIX_SCOPE_TRACE("AttributeQueryWorker::reId");
    try {
        const QStringList locations = params.value(KEY_LOC_ID_LIST).toStringList();
        // Everything but the location is the same for every location: read, and turn the
        // feature vectors into text, once.
        struct Shared
        {
            StoreRequest request;
            std::vector<float> body;
            std::vector<float> face;
        };
        auto shared = std::make_shared<Shared>();
        shared->request = readRequest(reIdStoreRequest(params));
        shared->body = toFloatVector(params.value(KEY_FEATURE));
        shared->face = toFloatVector(params.value(KEY_FACE_FEATURE));

        std::unique_ptr<boost::asio::thread_pool> pool;
        if (m_bParallel.load() && !locations.isEmpty()) {
            try {
                pool = std::make_unique<boost::asio::thread_pool>(static_cast<std::size_t>(m_periods.load()));
            } catch (const std::exception& e) {
                // No threads to be had: the locations are searched here instead.
                DELVIX_LOG(LogFacility::LevelError, "%s, thread pool failed: %s",
                           "AttributeQueryWorker::reId", e.what());
            }
        }
        for (const QString& location : locations) {
            std::vector<uint32_t> one = locationNumbers({location});
            if (pool) {
                boost::asio::post(*pool, [this, shared, one = std::move(one), callback]() {
                    searchLocation(shared->request, one, shared->body, shared->face, callback);
                });
            } else {
                searchLocation(shared->request, one, shared->body, shared->face, callback);
            }
        }
        if (pool) {
            pool->join();
        }
    } catch (const std::exception& e) {
        // Whatever ran has delivered its hits; the final call still follows.
        DELVIX_LOG(LogFacility::LevelError, "%s, search failed: %s", "AttributeQueryWorker::reId", e.what());
    }
    finishSearch();
    deliver(callback, true, QVariantMap());
}

QVariantMap AttributeQueryWorker::reIdStoreRequest(const QVariantMap& params)
{
    QVariantMap request = params;
    request.insert(KEY_HUMAN_INFO, QStringLiteral("{}"));
    request.insert(KEY_VEHICLE_INFO, QString());
    request.insert(KEY_RULE_INFO, QString());
    request.insert(KEY_DESCENDING, 1);
    request.insert(KEY_DO_NOT_SORT, true);
    return request;
}

void AttributeQueryWorker::partialReIdSearch(const QVariantMap& params, const Callback& callback)
{
    try {
        const StoreRequest request = readRequest(reIdStoreRequest(params));
        searchLocation(request, request.locations, toFloatVector(params.value(KEY_FEATURE)),
                       toFloatVector(params.value(KEY_FACE_FEATURE)), callback);
    } catch (const std::exception& e) {
        DELVIX_LOG(LogFacility::LevelError, "%s, search failed: %s",
                   "AttributeQueryWorker::partialReIdSearch", e.what());
    } catch (...) {
        DELVIX_LOG(LogFacility::LevelError, "%s, search failed", "AttributeQueryWorker::partialReIdSearch");
    }
}

void AttributeQueryWorker::searchLocation(const StoreRequest& request, const std::vector<uint32_t>& locations,
                                          const std::vector<float>& body, const std::vector<float>& face,
                                          const Callback& callback)
{
    // A stopped search opens nothing more.
    if (m_bStop.load()) {
        return;
    }
    try {
        StoreSearch store(*m_tamsa);
        if (openSearch(request, locations, &store.m_database, &store.m_search) != 0) {
            store.m_search = nullptr;
            return;
        }
        setTamsaHandle(store.m_search);
        struct Unregister
        {
            AttributeQueryWorker* worker;
            ~Unregister() { worker->removeTamsaHandle(); }
        } unregister{this};

        TTAMSA_OBJECTMETAINFO_RESULT result;
        std::memset(&result, 0, sizeof result);
        result.wSize = sizeof(TTAMSA_OBJECTMETAINFO_RESULT);
        while (!m_bStop.load()) {
            if (m_tamsa->GetObjectMetaInfoNext(store.m_search, &result) != 0) {
                break;
            }
            QVariantMap record = toSearchRecord(result);
            if (record.value(KEY_OBJ_TYPE).toString() == TAMSA_OBJECT_TYPE_HUMAN) {
                if (result.fScore == 0.0f && result.fFaceScore == 0.0f) {
                    calculateScore(face, body, record);
                } else {
                    // A score that is not a number must not pass the threshold test below.
                    const auto finite = [](float score) { return std::isfinite(score) ? score : 0.0f; };
                    record.insert(KEY_SCORE, finite(result.fScore));
                    record.insert(KEY_FACE_SCORE, finite(result.fFaceScore));
                }
                if (record.value(KEY_SCORE).toFloat() < kScoreThreshold &&
                    record.value(KEY_FACE_SCORE).toFloat() < kScoreThreshold) {
                    continue;
                }
            }
            if (!deliver(callback, false, record)) {
                break;
            }
        }
    } catch (const std::exception& e) {
        DELVIX_LOG(LogFacility::LevelError, "%s, search failed: %s", "AttributeQueryWorker::searchLocation",
                   e.what());
    } catch (...) {
        DELVIX_LOG(LogFacility::LevelError, "%s, search failed", "AttributeQueryWorker::searchLocation");
    }
}

void AttributeQueryWorker::calculateScore(std::vector<float> face, std::vector<float> body,
                                          QVariantMap& record) const
{
    float score = getScore(body, record.value(KEY_FEATURE).toList(), static_cast<int>(body.size()));
    record.insert(KEY_SCORE, score < kScoreThreshold ? 0.0f : score);
    if (!record.contains(KEY_FACE_FEATURE)) {
        record.insert(KEY_FACE_FEATURE, QVariant());
    }
    float faceScore = getScore(face, record.value(KEY_FACE_FEATURE).toList(), static_cast<int>(face.size()));
    record.insert(KEY_FACE_SCORE, faceScore < kScoreThreshold ? 0.0f : faceScore);
}

float AttributeQueryWorker::getScore(const std::vector<float>& a, const QVariantList& b, int n) const
{
    if (a.empty() || b.isEmpty() || n < 0 || a.size() < std::size_t(n) || b.size() < qsizetype(n)) {
        return 0.0f;
    }
    float dot = 0.0f;
    float normA = 0.0f;
    float normB = 0.0f;
    for (int i = 0; i < n; ++i) {
        const float ai = a[std::size_t(i)];
        const float bi = variantToFloat(b.at(i));
        dot += ai * bi;
        normA += ai * ai;
        normB += bi * bi;
    }
    if (normA == 0.0f && normB == 0.0f) {
        return 1.0f;
    }
    if (normA == 0.0f || normB == 0.0f) {
        return 0.0f;
    }
    const float score = dot / (std::sqrt(normB) * std::sqrt(normA));
    // NaN or infinite parts give no similarity rather than a NaN that passes every test.
    if (!std::isfinite(score)) {
        return 0.0f;
    }
    return std::max(0.0f, score);
}
