// The fast reader of the store's texts against QJsonDocument: on every text it accepts it must
// give the very same variant tree (types included), and the search records of both routes must
// be identical.
#include "JsonVariantParser.h"
#include "AttributeQueryWorker.h"

#include <QJsonArray>
#include <QJsonDocument>
#include <QJsonObject>
#include <QRandomGenerator>

#include <gtest/gtest.h>

namespace {

QVariant reference(const QByteArray& text)
{
    const QJsonDocument document = QJsonDocument::fromJson(text);
    if (document.isObject()) {
        return document.object().toVariantMap();
    }
    if (document.isArray()) {
        return document.array().toVariantList();
    }
    return QVariant();
}

// Equal values of equal types, all the way down (QVariant's == converts numbers).
bool sameTree(const QVariant& a, const QVariant& b, QString* where, const QString& path = QStringLiteral("$"))
{
    if (a.typeId() != b.typeId()) {
        *where = path + QStringLiteral(": ") + a.typeName() + QStringLiteral(" vs ") + b.typeName();
        return false;
    }
    if (a.typeId() == QMetaType::QVariantMap) {
        const QVariantMap ma = a.toMap();
        const QVariantMap mb = b.toMap();
        if (ma.keys() != mb.keys()) {
            *where = path + QStringLiteral(": keys differ");
            return false;
        }
        for (auto it = ma.cbegin(); it != ma.cend(); ++it) {
            if (!sameTree(it.value(), mb.value(it.key()), where, path + QLatin1Char('.') + it.key())) {
                return false;
            }
        }
        return true;
    }
    if (a.typeId() == QMetaType::QVariantList) {
        const QVariantList la = a.toList();
        const QVariantList lb = b.toList();
        if (la.size() != lb.size()) {
            *where = path + QStringLiteral(": lengths differ");
            return false;
        }
        for (qsizetype i = 0; i < la.size(); ++i) {
            if (!sameTree(la[i], lb[i], where, path + QStringLiteral("[%1]").arg(i))) {
                return false;
            }
        }
        return true;
    }
    if (a.typeId() == QMetaType::Double) {
        // Bit for bit: the same parse, not merely a close one.
        const double da = a.toDouble();
        const double db = b.toDouble();
        if (std::memcmp(&da, &db, sizeof da) != 0) {
            *where = path + QStringLiteral(": %1 vs %2").arg(da, 0, 'g', 17).arg(db, 0, 'g', 17);
            return false;
        }
        return true;
    }
    if (a != b) {
        *where = path + QStringLiteral(": values differ");
        return false;
    }
    return true;
}

// Either the fast reader refuses the text, or it agrees with QJsonDocument.
void expectAgreement(const QByteArray& text)
{
    bool ok = false;
    const QVariant fast = JsonVariantParser::parse(text.constData(), std::size_t(text.size()), &ok);
    if (!ok) {
        EXPECT_FALSE(fast.isValid());
        return;
    }
    const QVariant expected = reference(text);
    ASSERT_TRUE(expected.isValid()) << "accepted what QJsonDocument refuses: " << text.left(200).constData();
    QString where;
    EXPECT_TRUE(sameTree(fast, expected, &where))
        << text.left(200).constData() << " at " << qPrintable(where);
}

QByteArray randomNumber(QRandomGenerator& random)
{
    switch (random.bounded(6)) {
    case 0:
        return QByteArray::number(random.bounded(-1000, 1000));
    case 1:
        return QByteArray::number(qint64(random.generate64()));
    case 2:
        return QByteArray::number(random.generateDouble() * 2 - 1, 'g', 17);
    case 3:
        return QByteArray::number((random.generateDouble() - 0.5) * 1e6, 'f', int(random.bounded(0, 6)));
    case 4:
        return QByteArray::number(random.generateDouble() * 9, 'e', int(random.bounded(0, 17)))
            .replace("e+", random.bounded(2) ? "E" : "e+");
    default:
        return QByteArray::number(float(random.generateDouble()), 'g', 9);
    }
}

QByteArray randomString(QRandomGenerator& random)
{
    static const QList<QByteArray> pieces = {"a",       "Zz09+/=",     "\\n",          "\\\"",
                                             "\\\\",    "\\/",         "\\u00e9",      "\\uD83D\\uDE00",
                                             "\\ud800", "\xc3\xa9",    "\xe6\x97\xa5", "\xf0\x9f\x98\x80",
                                             " ",       "\\t\\b\\f\\r"};
    QByteArray text = "\"";
    const int count = int(random.bounded(0, 8));
    for (int i = 0; i < count; ++i) {
        text += pieces[int(random.bounded(pieces.size()))];
    }
    return text + "\"";
}

QByteArray randomValue(QRandomGenerator& random, int depth)
{
    const int kind = int(random.bounded(depth > 3 ? 5 : 7));
    switch (kind) {
    case 0:
        return randomNumber(random);
    case 1:
        return randomString(random);
    case 2:
        return random.bounded(2) ? "true" : "false";
    case 3:
        return "null";
    case 4:
        return randomNumber(random);
    case 5: {
        QByteArray text = "[";
        const int count = int(random.bounded(0, 6));
        for (int i = 0; i < count; ++i) {
            text +=
                (i ? "," : "") + QByteArray(random.bounded(2) ? " " : "") + randomValue(random, depth + 1);
        }
        return text + "]";
    }
    default: {
        QByteArray text = "{";
        const int count = int(random.bounded(0, 6));
        for (int i = 0; i < count; ++i) {
            // Few distinct names, so that repeated members occur.
            text += (i ? ",\n" : "") + QByteArray("\"k") + QByteArray::number(random.bounded(4)) +
                    "\" : " + randomValue(random, depth + 1);
        }
        return text + "}";
    }
    }
}

} // namespace

TEST(JsonVariantParserTest, AgreesWithQJsonDocumentOnEdgeCases)
{
    const QList<QByteArray> texts = {
        "{}", "[]", " [1] ", "[1, 1.5, 1.0, -0, -0.0, 1e2, 1E0, 0.1, 1.5e1]",
        "[9223372036854775807, 9223372036854775808, -9223372036854775808, -9223372036854775809]",
        "[99999999999999999999, 9.2233720368547758e18, 12345678901234567.0, 4503599627370497.5]",
        "[1e308, 1e-300, 2.2250738585072014e-308, 4.9e-324, 1e-400, 1e400]", R"({"a":1,"a":2,"b":{"a":[]}})",
        R"(["\u00e9\ud800x", "\"\\\/\b\f\n\r\t"])", "[\"\xc3\xa9\xe6\x97\xa5\xf0\x9f\x98\x80\"]",
        "[true,false,null]",
        // Refused by the fast reader, or by both.
        "", "5", "\"text\"", "[1.]", "[.5]", "[01]", "[+1]", "[-]", "[1e]", "{}x", "[1,]", "{\"a\":1,}",
        "[\"\x01\"]", "[\"\xff\"]", "[\"\xc0\xaf\"]", "[\"\\x\"]", "[\"\\u12\"]", "\xEF\xBB\xBF[1]", "[tru]",
        "[nul]", "{\"a\" 1}", "{1:2}", "[\"open",
        "[[[[[[[[[[[[[[[[[[[[[[[[[[[[[[[[[[[[[[[[[[[[[[[[[[[[[[[[[[[[[["
        "[[[[[[[[[[1]]]]]]]]]]]]]]]]]]]]]]]]]]]]]]]]]]]]]]]]]]]]]]]]]]]]]]]]]]]]]]]]]]]]]]]]]]]]]]]]]]]]]]]"
        "]"};
    for (const QByteArray& text : texts) {
        SCOPED_TRACE(text.constData());
        expectAgreement(text);
    }
    // Raw control characters inside texts, with and without escapes beside them.
    for (char control = 1; control < 0x20; ++control) {
        expectAgreement(QByteArray("[\"a") + control + "b\"]");
        expectAgreement(QByteArray("[\"\\n") + control + "\"]");
    }
    for (const char* number : {"0e500", "0.0e-500", "-0e0", "1.0000000000000000000001", "123456789012345678",
                               "1234567890123456789", "0.1234567890123456789", "9007199254740993",
                               "9007199254740993.0", "1e22", "1e23", "-1e-22", "0.000001"}) {
        expectAgreement(QByteArray("[") + number + "]");
    }
    bool ok = true;
    EXPECT_FALSE(JsonVariantParser::parse(nullptr, 0, &ok).isValid());
    EXPECT_FALSE(ok);
}

TEST(JsonVariantParserTest, AgreesWithQJsonDocumentOnRandomDocuments)
{
    QRandomGenerator random(20261206);
    int accepted = 0;
    for (int round = 0; round < 3000; ++round) {
        const QByteArray text =
            random.bounded(2) ? "[" + randomValue(random, 1) + "]" : "{\"v\":" + randomValue(random, 1) + "}";
        bool ok = false;
        JsonVariantParser::parse(text.constData(), std::size_t(text.size()), &ok);
        accepted += ok ? 1 : 0;
        expectAgreement(text);
    }
    // The reader must take on the common texts itself, not leave them all to the fallback.
    EXPECT_GT(accepted, 2500);
}

TEST(JsonVariantParserTest, BothRoutesGiveIdenticalSearchRecords)
{
    QRandomGenerator random(7);
    for (int round = 0; round < 50; ++round) {
        QJsonArray feature;
        for (int i = 0; i < 512; ++i) {
            feature.append(random.generateDouble() * 2 - 1);
        }
        QByteArray image(int(random.bounded(100, 4000)), 'A');
        for (char& c : image) {
            c = "ABCDEFGHIJKLMNOPQRSTUVWXYZabcdefghijklmnopqrstuvwxyz0123456789+/"[random.bounded(64)];
        }
        QJsonObject face{{"image", QString::fromLatin1(image.left(100))},
                         {"feature", feature},
                         {"face_detection_info", QJsonObject{{"filtered", int(random.bounded(2))}}}};
        QJsonObject plate{{"image", "p"},
                          {"PlateNumber", "\xe4\xba\xac"
                                          "A12345"},
                          {"detection_info", QJsonObject{{"filtered", 0}}}};
        QJsonObject thumbnails{{"Thumbnail", QJsonArray{QJsonObject{{"image", QString::fromLatin1(image)},
                                                                    {"feature", feature}}}}};
        if (round % 2) {
            thumbnails.insert("FaceThumbnail", QJsonArray{face});
        }
        if (round % 3) {
            thumbnails.insert("LicensePlateThumbnail", QJsonArray{plate});
        }
        const QByteArray thumbnailText =
            QJsonDocument(thumbnails).toJson(round % 4 ? QJsonDocument::Compact : QJsonDocument::Indented);
        const QByteArray attributeText = QJsonDocument(QJsonObject{{"Age", "adult"},
                                                                   {"Gender", int(random.bounded(3))},
                                                                   {"UpperColor", QJsonArray{1, 2.5}},
                                                                   {"Accessories", QJsonArray{}},
                                                                   {"Type", QJsonValue::Null}})
                                             .toJson(QJsonDocument::Compact);
        const std::vector<double> trajectory{0.25, 0.5, 0.75, 1.0};

        TTAMSA_OBJECTMETAINFO_RESULT result{};
        result.wSize = 80;
        result.qwObjectId = random.generate64();
        result.dwLocationNumber = random.bounded(100u);
        result.pszObjectType = "Human";
        result.pszAttributes = attributeText.constData();
        result.pszThumbnails = thumbnailText.constData();
        result.pTrajectory = trajectory.data();
        result.dwTrajectoryBytes = 32;

        const QVariantMap fast =
            AttributeQueryWorker::toSearchRecord(result, AttributeQueryWorker::JsonRoute::Fast);
        const QVariantMap document =
            AttributeQueryWorker::toSearchRecord(result, AttributeQueryWorker::JsonRoute::QtDocument);
        QString where;
        ASSERT_TRUE(sameTree(fast, document, &where)) << "round " << round << " at " << qPrintable(where);
        EXPECT_EQ(fast.value("feature").toList().size(), 512);
    }
}
