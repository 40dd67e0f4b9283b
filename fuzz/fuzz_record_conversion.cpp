// Fuzz target: one store result record into a search record (AttributeQueryWorker::toSearchRecord),
// every text and the trajectory byte count taken from the input:
//   byte 0       which pointers are null: 1 type, 2 attributes, 4 thumbnails, 8 trajectory
//   bytes 1..4   trajectory byte count (little-endian), reduced to at most the bytes given
//   bytes 5..24  location number, start, end (32 bits each), object ID (64 bits)
//   then         type, attributes text, thumbnails text and the trajectory bytes, split at NUL
// The fast JSON route must give the very record the QJsonDocument route gives, the fast reader
// must agree with QJsonDocument on every text it accepts, and the record must carry the fields
// and the trajectory of the store record; anything else is a crash.
#include "AttributeQueryWorker.h"
#include "DelvixKeys.h"
#include "JsonVariantReader.h"

#include <QCoreApplication>
#include <QJsonArray>
#include <QJsonDocument>
#include <QJsonObject>
#include <cstdint>
#include <cstdlib>
#include <cstring>
#include <string>
#include <vector>

namespace {

void check(bool condition)
{
    if (!condition) {
        std::abort();
    }
}

template <typename T>
T readLittleEndian(const uint8_t* data)
{
    T value = 0;
    for (std::size_t i = 0; i < sizeof(T); ++i) {
        value |= T(data[i]) << (8 * i);
    }
    return value;
}

// Equal values of equal types all the way down; numbers bit for bit (NaN from the trajectory
// bytes included), since both routes read the same text.
bool sameTree(const QVariant& a, const QVariant& b)
{
    if (a.typeId() != b.typeId()) {
        return false;
    }
    if (a.typeId() == QMetaType::QVariantMap) {
        const QVariantMap ma = a.toMap();
        const QVariantMap mb = b.toMap();
        if (ma.keys() != mb.keys()) {
            return false;
        }
        for (auto it = ma.cbegin(); it != ma.cend(); ++it) {
            if (!sameTree(it.value(), mb.value(it.key()))) {
                return false;
            }
        }
        return true;
    }
    if (a.typeId() == QMetaType::QVariantList) {
        const QVariantList la = a.toList();
        const QVariantList lb = b.toList();
        if (la.size() != lb.size()) {
            return false;
        }
        for (qsizetype i = 0; i < la.size(); ++i) {
            if (!sameTree(la[i], lb[i])) {
                return false;
            }
        }
        return true;
    }
    if (a.typeId() == QMetaType::Double) {
        const double da = a.toDouble();
        const double db = b.toDouble();
        return std::memcmp(&da, &db, sizeof da) == 0;
    }
    return a == b;
}

// Whatever the fast reader accepts, QJsonDocument reads to the same tree.
void checkReaderAgreement(const std::string& text)
{
    const QVariant fast = JsonVariantReader::read(text.data(), text.size());
    if (!fast.isValid()) {
        return;
    }
    const QJsonDocument document = QJsonDocument::fromJson(QByteArray::fromStdString(text));
    check(document.isObject() || document.isArray());
    check(sameTree(fast, document.isObject() ? QVariant(document.object().toVariantMap())
                                             : QVariant(document.array().toVariantList())));
}

} // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size)
{
    constexpr size_t kHeader = 25;
    if (size < kHeader) {
        return 0;
    }
    static int argc = 1;
    static char name[] = "fuzz";
    static char* argv[] = {name, nullptr};
    static QCoreApplication* app = QCoreApplication::instance() ? nullptr : new QCoreApplication(argc, argv);
    (void)app;

    const uint8_t nulls = data[0];
    const uint32_t countWanted = readLittleEndian<uint32_t>(data + 1);
    const uint32_t location = readLittleEndian<uint32_t>(data + 5);
    const uint32_t start = readLittleEndian<uint32_t>(data + 9);
    const uint32_t end = readLittleEndian<uint32_t>(data + 13);
    const uint64_t id = readLittleEndian<uint64_t>(data + 17);

    // type, attributes, thumbnails: up to the next NUL each; the trajectory: all that remains.
    std::string texts[3];
    size_t at = kHeader;
    for (std::string& text : texts) {
        const uint8_t* nul =
            at < size ? static_cast<const uint8_t*>(std::memchr(data + at, 0, size - at)) : nullptr;
        const size_t stop = nul ? size_t(nul - data) : size;
        text.assign(reinterpret_cast<const char*>(data + at), stop - at);
        at = nul ? stop + 1 : size;
    }
    const size_t trajectoryBytes = size - at;
    // Aligned as the store's doubles are; the byte count never promises more than is there.
    std::vector<double> trajectory((trajectoryBytes + sizeof(double) - 1) / sizeof(double));
    if (trajectoryBytes > 0) {
        std::memcpy(trajectory.data(), data + at, trajectoryBytes);
    }
    const uint32_t count = uint32_t(countWanted % (uint64_t(trajectoryBytes) + 1));

    TTAMSA_OBJECTMETAINFO_RESULT result{};
    result.wSize = 80;
    result.qwObjectId = id;
    result.dwLocationNumber = location;
    result.pszObjectType = (nulls & 1) ? nullptr : texts[0].c_str();
    result.pszAttributes = (nulls & 2) ? nullptr : texts[1].c_str();
    result.pszThumbnails = (nulls & 4) ? nullptr : texts[2].c_str();
    result.dwStartTime = start;
    result.dwEndTime = end;
    result.pTrajectory = (nulls & 8) ? nullptr : trajectory.data();
    result.dwTrajectoryBytes = count;

    checkReaderAgreement(texts[1]);
    checkReaderAgreement(texts[2]);

    const QVariantMap fast =
        AttributeQueryWorker::toSearchRecord(result, AttributeQueryWorker::JsonRoute::Fast);
    const QVariantMap document =
        AttributeQueryWorker::toSearchRecord(result, AttributeQueryWorker::JsonRoute::QtDocument);
    check(sameTree(fast, document));

    check(fast.value(KEY_OBJECT_ID).toULongLong() == id);
    check(fast.value(KEY_LOC_ID).toString() == LOCATION_PREFIX + QString::number(location));
    check(fast.value(KEY_START_TIMESTAMP).toLongLong() == qint64(start) * 1000);
    check(fast.value(KEY_END_TIMESTAMP).toLongLong() == qint64(end) * 1000);
    check(fast.value(KEY_OBJ_TYPE).toString() ==
          ((nulls & 1) ? QString() : QString::fromUtf8(texts[0].c_str())));
    const QVariantList points = fast.value(KEY_TRAJECTORY).toList();
    check(points.size() == ((nulls & 8) ? 0 : qsizetype(count / 16)));
    for (qsizetype i = 0; i < points.size(); ++i) {
        const QVariantMap point = points[i].toMap();
        check(point.size() == 2);
        const double x = point.value(KEY_X).toDouble();
        const double y = point.value(KEY_Y).toDouble();
        check(std::memcmp(&x, &trajectory[2 * size_t(i)], sizeof x) == 0);
        check(std::memcmp(&y, &trajectory[2 * size_t(i) + 1], sizeof y) == 0);
    }
    // The fixed fields and attributes always, each crop's pair together or not at all.
    check(fast.contains(KEY_OBJ_IMAGE) && fast.contains(KEY_FEATURE));
    check(fast.contains(KEY_FACE_IMAGE) == fast.contains(KEY_FACE_FEATURE));
    check(fast.contains(KEY_PLATE_IMAGE) == fast.contains(KEY_PLATE_NUMBER));
    for (const QString& key :
         {KEY_OBJECT_AGE, KEY_OBJECT_GENDER, KEY_OBJECT_ACCESSORIES, KEY_OBJECT_UPPER_COLOR,
          KEY_OBJECT_LOWER_COLOR, KEY_OBJECT_VEHICLE_COLOR, KEY_OBJECT_VEHICLE_TYPE}) {
        check(fast.contains(key));
    }
    check(fast.size() ==
          15 + (fast.contains(KEY_FACE_IMAGE) ? 2 : 0) + (fast.contains(KEY_PLATE_IMAGE) ? 2 : 0));
    return 0;
}
