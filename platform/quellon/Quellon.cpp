#include "Quellon.h"

#include <QHash>
#include <QXmlStreamReader>
#include <vector>

namespace {

// One open element while reading. Children are collected per name in lists so that repeated
// elements are appended in place; the map is built once, when the element closes. Most elements
// have a handful of distinct child names, searched in order; past kIndexedNames a hash takes over
// so that hostile inputs with many names stay linear.
struct Frame
{
    static constexpr size_t kIndexedNames = 16;

    QString name;
    QString text;
    std::vector<std::pair<QString, QVariantList>> children;
    QHash<QString, size_t> index; // name -> position in children, once there are many

    QVariantList& childList(const QString& childName)
    {
        if (children.size() <= kIndexedNames) {
            for (auto& child : children) {
                if (child.first == childName) {
                    return child.second;
                }
            }
        } else {
            const auto it = index.constFind(childName);
            if (it != index.cend()) {
                return children[it.value()].second;
            }
        }
        children.emplace_back(childName, QVariantList());
        if (children.size() > kIndexedNames) {
            if (index.isEmpty()) {
                for (size_t i = 0; i < children.size(); ++i) {
                    index.insert(children[i].first, i);
                }
            } else {
                index.insert(childName, children.size() - 1);
            }
        }
        return children.back().second;
    }
};

QVariant closeFrame(Frame& frame)
{
    if (frame.children.empty()) {
        // Servers may pretty-print their answers: "<UseSSL> false </UseSSL>" is "false".
        return QVariant(frame.text.trimmed());
    }
    QVariantMap map;
    for (auto& child : frame.children) {
        QVariantList& occurrences = child.second;
        if (occurrences.size() == 1) {
            map.insert(child.first, std::move(occurrences.first()));
        } else {
            map.insert(child.first, QVariant(std::move(occurrences)));
        }
    }
    return QVariant(std::move(map));
}

// Element names repeat all through an answer; sharing one QString per name saves an allocation
// per element. Bounded, so that a hostile input with endless names costs no more than without.
class NameCache
{
public:
    QString get(QStringView name)
    {
        for (const QString& known : m_names) {
            if (known == name) {
                return known;
            }
        }
        QString created = name.toString();
        if (m_names.size() < 64) {
            m_names.push_back(created);
        }
        return created;
    }

private:
    std::vector<QString> m_names;
};

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
    NameCache names;
    QVariantMap root;
    bool rootClosed = false;
    qsizetype elementCount = 0;

    while (!reader.atEnd()) {
        switch (reader.readNext()) {
        case QXmlStreamReader::StartElement:
            if (rootClosed || stack.size() >= size_t(kMaxDepth) || ++elementCount > kMaxElements) {
                return QVariant();
            }
            stack.push_back(Frame{names.get(reader.qualifiedName()), QString(), {}, {}});
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
                stack.back().childList(frame.name).append(std::move(value));
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
