#pragma once
// A fast reader for the JSON texts the store hands out with every hit. It yields exactly the
// variant tree that QJsonDocument gives (toVariantMap/toVariantList): objects as QVariantMap,
// arrays as QVariantList, texts as QString, null as a nullptr variant, numbers as qlonglong
// when integral and within 64 bits, else as double. It accepts only plain, strict JSON with an
// object or array at the top; for anything else it reports failure and the caller asks
// QJsonDocument, so the two never disagree on a text this reader accepts.
//
// Why: a hit's thumbnail text is some 20 KB (a base64 image and a 512-number feature), and
// QJsonDocument's route through its own tree costs about twice the per-hit budget.

#include <QVariant>
#include <cstddef>

class JsonVariantParser
{
public:
    // Parses text[0, length). On failure *ok is false and the result is invalid.
    static QVariant parse(const char* text, std::size_t length, bool* ok);
};
