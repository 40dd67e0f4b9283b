#include "ObjectGenerator.h"

#include <QJsonArray>
#include <QJsonDocument>
#include <QtEndian>
#include <cmath>
#include <cstdio>

namespace {

quint64 mix(quint64 x)
{
    // splitmix64 finaliser: cheap, well spread, the same on every platform.
    x += 0x9e3779b97f4a7c15ULL;
    x = (x ^ (x >> 30)) * 0xbf58476d1ce4e5b9ULL;
    x = (x ^ (x >> 27)) * 0x94d049bb133111ebULL;
    return x ^ (x >> 31);
}

quint64 mix(quint64 a, quint64 b)
{
    return mix(a ^ mix(b));
}

// Uniform in [-1, 1).
float unit(quint64 h)
{
    return float(double(h >> 11) * (2.0 / 9007199254740992.0) - 1.0);
}

QVector<float> randomUnitVector(quint64 key)
{
    QVector<float> v(ObjectGenerator::kFeatureLength);
    double norm = 0;
    for (int i = 0; i < v.size(); ++i) {
        v[i] = unit(mix(key, quint64(i)));
        norm += double(v[i]) * v[i];
    }
    const float scale = float(1.0 / std::sqrt(norm));
    for (float& x : v) {
        x *= scale;
    }
    return v;
}

quint32 crc32(const QByteArray& data)
{
    static quint32 table[256] = {};
    static const bool ready = [] {
        for (quint32 n = 0; n < 256; ++n) {
            quint32 c = n;
            for (int k = 0; k < 8; ++k) {
                c = (c & 1) ? 0xedb88320u ^ (c >> 1) : c >> 1;
            }
            table[n] = c;
        }
        return true;
    }();
    Q_UNUSED(ready);
    quint32 c = 0xffffffffu;
    for (char byte : data) {
        c = table[(c ^ quint8(byte)) & 0xff] ^ (c >> 8);
    }
    return c ^ 0xffffffffu;
}

void appendChunk(QByteArray& png, const char* type, const QByteArray& data)
{
    char length[4];
    qToBigEndian<quint32>(quint32(data.size()), length);
    png.append(length, 4);
    const QByteArray typed = QByteArray(type, 4) + data;
    png.append(typed);
    char crc[4];
    qToBigEndian<quint32>(crc32(typed), crc);
    png.append(crc, 4);
}

// A small valid PNG (8-bit RGB) of one colour with a darker band, so thumbnails are real images.
QByteArray solidPng(int width, int height, quint8 r, quint8 g, quint8 b)
{
    QByteArray png("\x89PNG\r\n\x1a\n", 8);
    QByteArray header(13, '\0');
    qToBigEndian<quint32>(quint32(width), header.data());
    qToBigEndian<quint32>(quint32(height), header.data() + 4);
    header[8] = 8; // bit depth
    header[9] = 2; // colour type: RGB
    appendChunk(png, "IHDR", header);
    QByteArray raw;
    for (int y = 0; y < height; ++y) {
        raw.append('\0'); // filter: none
        const bool band = y >= height / 2 && y < height / 2 + 2;
        for (int x = 0; x < width; ++x) {
            raw.append(char(band ? r / 2 : r)).append(char(band ? g / 2 : g)).append(char(band ? b / 2 : b));
        }
    }
    // qCompress gives a zlib stream behind a 4-byte length, which PNG does not want.
    appendChunk(png, "IDAT", qCompress(raw).mid(4));
    appendChunk(png, "IEND", QByteArray());
    return png;
}

void appendNumber(QByteArray& out, qint64 value)
{
    out.append(QByteArray::number(value));
}

void appendFeature(QByteArray& out, const QVector<float>& base, quint64 noiseKey)
{
    // Noise of about a third of each component's spread, then back to unit length.
    float values[ObjectGenerator::kFeatureLength];
    double norm = 0;
    for (int i = 0; i < ObjectGenerator::kFeatureLength; ++i) {
        values[i] = base[i] + 0.6f * unit(mix(noiseKey, quint64(i))) / 22.6f;
        norm += double(values[i]) * values[i];
    }
    const float scale = float(1.0 / std::sqrt(norm));
    out.append('[');
    char buffer[32];
    for (int i = 0; i < ObjectGenerator::kFeatureLength; ++i) {
        const int n = std::snprintf(buffer, sizeof buffer, i ? ",%.5f" : "%.5f", double(values[i] * scale));
        out.append(buffer, n);
    }
    out.append(']');
}

const char kPlateLetters[] = "ABCDEFGHJKLMNPRSTUVWXYZ";

// A code the vocabulary holds for this attribute, drawn from bits of the object's traits.
qint64 codeOf(const AttributeVocabulary& vocabulary, const char* attribute, quint64 bits)
{
    return qint64(bits % quint64(qMax(1, vocabulary.size(QLatin1String(attribute)))));
}

// A word of a site file as a JSON text (it may hold quotes).
QByteArray jsonText(const QString& text)
{
    const QByteArray array = QJsonDocument(QJsonArray{text}).toJson(QJsonDocument::Compact);
    return array.mid(1, array.size() - 2);
}

} // namespace

ObjectGenerator::ObjectGenerator(quint64 seed, int people, int vehicles, AttributeVocabulary vocabulary)
    : m_seed(seed)
    , m_vocabulary(std::move(vocabulary))
    , m_people(qMax(1, people))
    , m_vehicles(qMax(1, vehicles))
{
    for (int identity = 0; identity < populationSize(); ++identity) {
        const quint64 key = mix(m_seed, quint64(identity));
        m_bodyFeatures.append(randomUnitVector(mix(key, 1)));
        m_faceFeatures.append(randomUnitVector(mix(key, 2)));
        const quint64 colour = mix(key, 3);
        m_thumbnails.append(
            solidPng(8, 16, quint8(colour), quint8(colour >> 8), quint8(colour >> 16)).toBase64());
    }
}

quint64 ObjectGenerator::cameraHash(const QString& camera)
{
    quint64 h = 1469598103934665603ULL; // FNV-1a: stable across runs, unlike qHash
    for (QChar c : camera) {
        h = (h ^ c.unicode()) * 1099511628211ULL;
    }
    return h;
}

QVector<ObjectGenerator::Slot> ObjectGenerator::objectSlots(const QString& camera, qint64 start, qint64 end,
                                                            int objectsPerMinute) const
{
    QVector<Slot> result;
    const qint64 rate = qBound(0, objectsPerMinute, 255 * 60);
    if (rate == 0 || end <= start) {
        return result;
    }
    // Objects appear evenly: second t holds floor((t+1)r/60) - floor(t r/60) of them, shifted by a
    // per-camera phase so that cameras do not all see their objects in the same second.
    const qint64 phase = qint64(cameraHash(camera) % 60);
    auto before = [rate, phase](qint64 t) {
        const qint64 x = (t + phase) * rate;
        return x >= 0 ? x / 60 : -((-x + 59) / 60);
    };
    for (qint64 t = start; t < end; ++t) {
        const qint64 n = before(t + 1) - before(t);
        for (int k = 0; k < n; ++k) {
            result.append(Slot{t, k});
        }
    }
    return result;
}

int ObjectGenerator::objectCount(const QString& camera, qint64 start, qint64 end, int objectsPerMinute) const
{
    return int(objectSlots(camera, start, end, objectsPerMinute).size());
}

int ObjectGenerator::identityOf(const QString& camera, qint64 start, qint64 end, int objectsPerMinute,
                                int index) const
{
    const QVector<Slot> all = objectSlots(camera, start, end, objectsPerMinute);
    if (index < 0 || index >= all.size()) {
        return -1;
    }
    return int(
        mix(mix(m_seed, cameraHash(camera)), quint64(all[index].second) * 256 + quint64(all[index].k)) %
        quint64(populationSize()));
}

QByteArray ObjectGenerator::answer(const QString& camera, qint64 start, qint64 end,
                                   int objectsPerMinute) const
{
    const QVector<Slot> all = objectSlots(camera, start, end, objectsPerMinute);
    const quint64 cameraKey = mix(m_seed, cameraHash(camera));
    QByteArray out;
    out.reserve(all.size() * 12000 + 32);
    out.append("{\"ObjectMetaInfo\":[");
    for (int i = 0; i < all.size(); ++i) {
        if (i) {
            out.append(',');
        }
        appendObject(out, cameraKey, all[i]);
    }
    out.append("]}");
    return out;
}

void ObjectGenerator::appendObject(QByteArray& out, quint64 cameraKey, const Slot& slot) const
{
    const quint64 objectKey = mix(cameraKey, quint64(slot.second) * 256 + quint64(slot.k));
    const int identity = int(objectKey % quint64(populationSize()));
    const quint64 traits = mix(m_seed, quint64(identity) + 1000);
    const bool person = isPerson(identity);
    const qint64 duration = 2 + qint64(mix(objectKey, 7) % 20);

    out.append("{\"ID\":");
    appendNumber(out, qint64(quint64(slot.second) * 256 + quint64(slot.k)));
    out.append(person ? ",\"ObjectType\":\"Human\"" : ",\"ObjectType\":\"Vehicle\"");
    out.append(",\"StartTime\":");
    appendNumber(out, slot.second);
    out.append(",\"EndTime\":");
    appendNumber(out, slot.second + duration);
    if (person) {
        const QStringList& ages = m_vocabulary.words(QStringLiteral("Age"));
        out.append(",\"Attributes\":{\"Age\":")
            .append(jsonText(ages.value(int(traits % quint64(qMax<qsizetype>(1, ages.size()))))))
            .append(",\"Gender\":");
        appendNumber(out, codeOf(m_vocabulary, "Gender", traits >> 4));
        out.append(",\"Accessories\":[");
        appendNumber(out, codeOf(m_vocabulary, "Accessories", traits >> 8));
        out.append("],\"UpperColor\":[");
        appendNumber(out, codeOf(m_vocabulary, "UpperColor", traits >> 12));
        out.append("],\"LowerColor\":[");
        appendNumber(out, codeOf(m_vocabulary, "LowerColor", traits >> 16));
        out.append("]}");
    } else {
        QByteArray plate;
        for (int i = 0; i < 3; ++i) {
            plate.append(kPlateLetters[(traits >> (8 * i)) % (sizeof kPlateLetters - 1)]);
        }
        plate.append(QByteArray::number(100 + int((traits >> 24) % 900)));
        out.append(",\"Attributes\":{\"Type\":");
        appendNumber(out, codeOf(m_vocabulary, "Type", traits >> 4));
        out.append(",\"Color\":[");
        appendNumber(out, codeOf(m_vocabulary, "Color", traits >> 12));
        out.append("],\"PlateNumber\":\"").append(plate).append("\"}");
        out.append(",\"LicensePlateThumbnail\":[{\"image\":\"").append(m_thumbnails[identity]);
        out.append("\",\"PlateNumber\":\"").append(plate).append("\",\"detection_info\":{\"filtered\":0}}]");
    }
    // A straight walk across the picture, direction fixed per object.
    out.append(",\"Trajectory\":[");
    const double x0 = (unit(mix(objectKey, 11)) + 1) / 2, y0 = (unit(mix(objectKey, 12)) + 1) / 2;
    const double x1 = (unit(mix(objectKey, 13)) + 1) / 2, y1 = (unit(mix(objectKey, 14)) + 1) / 2;
    char buffer[64];
    for (int p = 0; p < 4; ++p) {
        const double f = p / 3.0;
        const int n = std::snprintf(buffer, sizeof buffer, "%s{\"x\":%.3f,\"y\":%.3f}", p ? "," : "",
                                    x0 + (x1 - x0) * f, y0 + (y1 - y0) * f);
        out.append(buffer, n);
    }
    out.append("],\"Thumbnail\":[{\"image\":\"").append(m_thumbnails[identity]).append("\",\"feature\":");
    appendFeature(out, m_bodyFeatures[identity], mix(objectKey, 21));
    out.append("}]");
    if (person && (objectKey >> 40) % 2 == 0) {
        out.append(",\"FaceThumbnail\":[{\"image\":\"")
            .append(m_thumbnails[identity])
            .append("\",\"feature\":");
        appendFeature(out, m_faceFeatures[identity], mix(objectKey, 22));
        out.append(",\"face_detection_info\":{\"filtered\":0}}]");
    }
    out.append('}');
}
