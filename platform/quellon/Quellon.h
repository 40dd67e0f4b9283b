#pragma once
// Quellon: XML text -> QVariant tree.
//
// Shape: the result is a map holding the root element under its name. An element with child
// elements becomes a map of its children by name; an element without children becomes its text
// without the whitespace around it (servers may pretty-print), empty for an empty element. An
// element name that occurs more than once under the same parent becomes a list of the
// occurrences, in document order. Attributes, comments, processing instructions and text between
// child elements are ignored.
//
// Failures: malformed or truncated XML, a DOCTYPE (so no entity declarations, internal or
// external), an undeclared entity, nesting deeper than kMaxDepth, more than kMaxElements
// elements or input longer than kMaxInputChars give an invalid QVariant. The work and memory of
// a call are bounded by the size of its input.
//
// Threads: parse() keeps no state between calls; one instance may be used by one thread at a
// time, separate instances (and transContentAsList) from any thread.

#include <QList>
#include <QString>
#include <QVariant>

class Quellon
{
public:
    static constexpr int kMaxDepth = 64;
    static constexpr qsizetype kMaxElements = 1024 * 1024;
    static constexpr qsizetype kMaxInputChars = 64 * 1024 * 1024;

    QVariant parse(const QString& xml);

    // The value found under an element that may occur once or several times, as a list with
    // one entry per occurrence: a list stays as it is, an invalid value gives an empty list,
    // anything else a list of that one value.
    static QList<QVariant> transContentAsList(const QVariant& value);
};
