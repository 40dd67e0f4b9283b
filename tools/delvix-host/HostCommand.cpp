#include "HostCommand.h"

#include <QJsonArray>
#include <QJsonDocument>
#include <QJsonObject>

bool parseHostOptions(const QStringList& args, HostOptions* options, QString* error)
{
    for (int i = 0; i < args.size(); ++i) {
        const QString& arg = args.at(i);
        auto takeValue = [&](QString* out) {
            if (i + 1 >= args.size()) {
                *error = QStringLiteral("%1 needs a value").arg(arg);
                return false;
            }
            *out = args.at(++i);
            return true;
        };
        auto takeSeconds = [&](double* out) {
            QString text;
            if (!takeValue(&text)) {
                return false;
            }
            bool ok = false;
            const double seconds = text.toDouble(&ok);
            if (!ok || seconds < 0) {
                *error = QStringLiteral("%1 needs a number of seconds, not \"%2\"").arg(arg, text);
                return false;
            }
            *out = seconds;
            return true;
        };
        auto takeCount = [&](quint64 maximum, quint64* out) {
            QString text;
            if (!takeValue(&text)) {
                return false;
            }
            bool ok = false;
            const quint64 count = text.toULongLong(&ok);
            if (!ok || count > maximum) {
                *error = QStringLiteral("%1 needs a whole number up to %2, not \"%3\"")
                             .arg(arg)
                             .arg(maximum)
                             .arg(text);
                return false;
            }
            *out = count;
            return true;
        };
        quint64 count = 0;
        if (arg == QLatin1String("--objects") || arg == QLatin1String("--locations") ||
            arg == QLatin1String("--seed")) {
            if (!takeCount(arg == QLatin1String("--objects") ? 100000000ull : 0xFFFFFFFFull, &count)) {
                return false;
            }
            if (arg == QLatin1String("--objects")) {
                options->objects = count;
            } else if (arg == QLatin1String("--locations")) {
                options->locations = quint32(count);
            } else {
                options->seed = quint32(count);
            }
        } else if (arg == QLatin1String("--data")) {
            if (!takeValue(&options->dataDir)) {
                return false;
            }
        } else if (arg == QLatin1String("--module")) {
            if (!takeValue(&options->modulePath)) {
                return false;
            }
        } else if (arg == QLatin1String("--wait")) {
            if (!takeSeconds(&options->waitSeconds)) {
                return false;
            }
        } else if (arg == QLatin1String("--timeout")) {
            if (!takeSeconds(&options->timeoutSeconds)) {
                return false;
            }
        } else if (arg.startsWith(QLatin1String("--")) && arg.size() > 2) {
            *error = QStringLiteral("unknown option %1").arg(arg);
            return false;
        } else {
            options->positional << arg;
        }
    }
    return true;
}

QByteArray replyLine(bool bFinal, const QString& strCode, const QString& strMessage, const QVariant& payload)
{
    // Written by hand to keep the keys in reading order (a QJsonObject would sort them).
    auto json = [](const QJsonValue& value) {
        return QJsonDocument(QJsonArray{value}).toJson(QJsonDocument::Compact).mid(1).chopped(1);
    };
    QByteArray line = "{\"final\":" + json(bFinal) + ",\"code\":" + json(strCode) +
                      ",\"message\":" + json(strMessage) + ",\"payload\":";
    line += payload.isValid() ? json(QJsonValue::fromVariant(payload)) : QByteArray("null");
    line += '}';
    return line;
}

bool parseJsonParameter(const QString& text, QVariant* value, QString* error)
{
    // Wrapped in an array so that bare values (numbers, texts) parse as well as objects.
    QJsonParseError parseError{};
    const QJsonDocument document =
        QJsonDocument::fromJson(QByteArray("[") + text.toUtf8() + QByteArray("]"), &parseError);
    if (parseError.error != QJsonParseError::NoError || !document.isArray() || document.array().size() != 1) {
        *error = QStringLiteral("the parameter is not one JSON value: %1").arg(parseError.errorString());
        return false;
    }
    *value = document.array().at(0).toVariant();
    return true;
}
