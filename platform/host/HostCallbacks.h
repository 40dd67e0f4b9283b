#pragma once
// Callback types of the host framework and their meta-type registration.

#include "RequestSenderInfo.h"

#include <QMetaType>
#include <QString>
#include <QVariant>
#include <functional>

// Reply callback handed with every request: (final flag, return code, message, payload).
// Callable from any thread, and from several threads at once.
using HDLR_DO_REQUEST_CB = std::function<void(bool bFinal, const QString& strReturnCode,
                                              const QString& strMessage, const QVariant& payload)>;

// Answer of a relayed request: (flag, result, return code, message, flag). Called once.
using HDLR_RELAY_RESPONSE_CB = std::function<void(bool bSuccess, QVariant result, QString strReturnCode,
                                                  QString strMessage, bool bLast)>;

Q_DECLARE_METATYPE(HDLR_DO_REQUEST_CB)

// Registers the host's meta-types under exactly the names that invokeMethod and queued
// connections look up. Safe to call any number of times from any thread.
inline void registerHostMetaTypes()
{
    qRegisterMetaType<HDLR_DO_REQUEST_CB>("HDLR_DO_REQUEST_CB");
    qRegisterMetaType<RequestSenderInfo>("RequestSenderInfo");
    qRegisterMetaType<QVariant>("QVariant");
}
