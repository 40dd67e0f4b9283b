#include "Quellon.h"

#include <QHash>
#include <QXmlStreamReader>
#include <vector>

namespace {

// One open element while reading. Children are collected per name in lists so that repeated
// elements are appended in place; the map is built once, when the element closes.
struct Frame
{
    QString name;
    QString text;
    QHash<QString, QVariantList> children;
};

QVariant closeFrame(Frame& frame)
{
    if (frame.children.isEmpty()) {
        return QVariant(std::move(frame.text));
    }
    QVariantMap map;
    for (auto it = frame.children.begin(); it != frame.children.end(); ++it) {
        QVariantList& occurrences = it.value();
        if (occurrences.size() == 1) {
            map.insert(it.key(), std::move(occurrences.first()));
        } else {
            map.insert(it.key(), QVariant(std::move(occurrences)));
        }
    }
    return QVariant(std::move(map));
}

} // namespace

QVariant Quellon::parse(const QString& xml)
{
    if (xml.size() > kMaxInputChars) {
        return QVariant();
    }
    QXmlStreamReader reader(xml);
    // Also a guard should a DOCTYPE ever get through: expansions stay small.
    reader.setEntityExpansionLimit(1024);

    std::vector<Frame> stack;
    QVariantMap root;
    bool rootClosed = false;
    qsizetype elementCount = 0;

    while (!reader.atEnd()) {
        switch (reader.readNext()) {
        case QXmlStreamReader::StartElement:
            if (rootClosed || stack.size() >= size_t(kMaxDepth) || ++elementCount > kMaxElements) {
                return QVariant();
            }
            stack.push_back(Frame{reader.qualifiedName().toString(), QString(), {}});
            break;
        case QXmlStreamReader::EndElement: {
            if (stack.empty()) {
                return QVariant();
            }
            Frame frame = std::move(stack.back());
            stack.pop_back();
            QVariant value = closeFrame(frame);
            if (stack.empty()) {
                root.insert(frame.name, std::move(value));
                rootClosed = true;
            } else {
                stack.back().children[frame.name].append(std::move(value));
            }
            break;
        }
        case QXmlStreamReader::Characters:
            // Text between child elements (indentation, mixed content) is dropped when the
            // element closes with children; only a leaf keeps its text.
            if (!stack.empty()) {
                stack.back().text += reader.text();
            }
            break;
        case QXmlStreamReader::DTD:
        case QXmlStreamReader::EntityReference:
            // Answers never declare entities; refusing them rules out expansion tricks.
            return QVariant();
        default:
            break;
        }
    }
    if (reader.hasError() || !rootClosed) {
        return QVariant();
    }
    return QVariant(std::move(root));
}

QList<QVariant> Quellon::transContentAsList(const QVariant& value)
{
    if (!value.isValid()) {
        return QList<QVariant>();
    }
    if (value.typeId() == QMetaType::QVariantList) {
        return value.toList();
    }
    return QList<QVariant>{value};
}
