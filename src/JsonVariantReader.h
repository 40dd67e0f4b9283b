#pragma once
// Reads the JSON texts the store hands out with every hit into exactly the variant tree that
// QJsonDocument gives (toVariantMap/toVariantList): objects as QVariantMap, arrays as
// QVariantList, texts as QString, null as a nullptr variant, numbers as qlonglong when they have
// an exact 64-bit integer value, else as double. Only an object or array at the top is read.
// Where the two readers could differ (texts simdjson refuses, numbers that are zero or
// subnormal only after rounding) it returns an invalid variant and the caller asks QJsonDocument.
//
// Why: a hit's thumbnail text is some 20 KB (a base64 image and a 512-number feature), and
// QJsonDocument's route through its own tree costs several times the per-hit budget.

#include <QVariant>
#include <cstddef>

class JsonVariantReader
{
public:
    // Any thread; each thread keeps a parser of its own.
    static QVariant read(const char* text, std::size_t length);
};
