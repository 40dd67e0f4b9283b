#pragma once
// The words for the attribute codes of the simulated site: what its cameras mean by "Gender": 1 or
// "UpperColor": [3]. The plug-in hands codes on without reading them; the cameras that make them and
// the clients that show them (the demo, the explorer page) share this one table. Site files may
// replace any attribute's list ("vocabulary", platform/novir/SITE_FORMAT.md).
//
// Codes are positions in an attribute's list, except for "Age", whose stored values are the words
// themselves. A plain value type.

#include <QHash>
#include <QJsonObject>
#include <QStringList>
#include <QVariant>

class AttributeVocabulary
{
public:
    // The built-in lists: every attribute the cameras fill.
    static AttributeVocabulary defaults();
    // The attribute names in a fixed order: Age, Gender, Accessories, UpperColor, LowerColor, Type, Color.
    static const QStringList& attributes();

    // Replaces the lists the object names. False with a reason (and nothing changed) on an unknown
    // attribute or a list that is not a non-empty list of non-empty texts.
    bool merge(const QJsonObject& object, QString* error);
    QJsonObject toJson() const;

    const QStringList& words(const QString& attribute) const;
    int size(const QString& attribute) const { return int(words(attribute).size()); }
    // A stored value in words: a code, a list of codes (joined by "/"), or a text (an age) as it is.
    // A code outside the list reads "code N", so a camera that knows more words still shows.
    QString describe(const QString& attribute, const QVariant& value) const;

private:
    QHash<QString, QStringList> m_words;
};
