#include "AttributeVocabulary.h"

#include <QJsonArray>

AttributeVocabulary AttributeVocabulary::defaults()
{
    const QStringList colours{QStringLiteral("black"), QStringLiteral("white"),  QStringLiteral("grey"),
                              QStringLiteral("red"),   QStringLiteral("orange"), QStringLiteral("yellow"),
                              QStringLiteral("green"), QStringLiteral("blue"),   QStringLiteral("purple"),
                              QStringLiteral("brown")};
    AttributeVocabulary vocabulary;
    vocabulary.m_words = {
        {QStringLiteral("Age"),
         {QStringLiteral("Child"), QStringLiteral("Young"), QStringLiteral("Adult"), QStringLiteral("Middle"),
          QStringLiteral("Senior")}},
        {QStringLiteral("Gender"), {QStringLiteral("female"), QStringLiteral("male")}},
        {QStringLiteral("Accessories"),
         {QStringLiteral("none"), QStringLiteral("bag"), QStringLiteral("hat"), QStringLiteral("glasses"),
          QStringLiteral("backpack"), QStringLiteral("umbrella")}},
        {QStringLiteral("UpperColor"), colours},
        {QStringLiteral("LowerColor"), colours},
        {QStringLiteral("Type"),
         {QStringLiteral("car"), QStringLiteral("van"), QStringLiteral("truck"), QStringLiteral("bus"),
          QStringLiteral("motorcycle"), QStringLiteral("bicycle")}},
        {QStringLiteral("Color"), colours},
    };
    return vocabulary;
}

const QStringList& AttributeVocabulary::attributes()
{
    static const QStringList names{QStringLiteral("Age"),         QStringLiteral("Gender"),
                                   QStringLiteral("Accessories"), QStringLiteral("UpperColor"),
                                   QStringLiteral("LowerColor"),  QStringLiteral("Type"),
                                   QStringLiteral("Color")};
    return names;
}

bool AttributeVocabulary::merge(const QJsonObject& object, QString* error)
{
    QHash<QString, QStringList> merged = m_words;
    for (auto it = object.begin(); it != object.end(); ++it) {
        if (!attributes().contains(it.key())) {
            *error = QStringLiteral("unknown attribute \"%1\" (known: %2)")
                         .arg(it.key(), attributes().join(QStringLiteral(", ")));
            return false;
        }
        QStringList words;
        for (const QJsonValue& word : it.value().toArray()) {
            if (!word.isString() || word.toString().isEmpty()) {
                words.clear();
                break;
            }
            words << word.toString();
        }
        if (words.isEmpty()) {
            *error = QStringLiteral("\"%1\" must be a non-empty list of non-empty texts").arg(it.key());
            return false;
        }
        merged.insert(it.key(), words);
    }
    m_words = merged;
    return true;
}

QJsonObject AttributeVocabulary::toJson() const
{
    QJsonObject object;
    for (const QString& attribute : attributes()) {
        object.insert(attribute, QJsonArray::fromStringList(words(attribute)));
    }
    return object;
}

const QStringList& AttributeVocabulary::words(const QString& attribute) const
{
    static const QStringList none;
    const auto it = m_words.constFind(attribute);
    return it == m_words.cend() ? none : *it;
}

QString AttributeVocabulary::describe(const QString& attribute, const QVariant& value) const
{
    if (value.typeId() == QMetaType::QVariantList) {
        QStringList parts;
        for (const QVariant& element : value.toList()) {
            parts << describe(attribute, element);
        }
        return parts.join(QLatin1Char('/'));
    }
    bool isCode = false;
    const double number = value.toDouble(&isCode);
    if (!isCode || value.typeId() == QMetaType::QString) {
        return value.toString();
    }
    const int code = int(number);
    const QStringList& list = words(attribute);
    return code >= 0 && code < list.size() && code == number
               ? list.at(code)
               : QStringLiteral("code %1").arg(value.toString());
}
