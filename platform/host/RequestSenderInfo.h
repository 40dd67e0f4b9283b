#pragma once
// Who sent a request. The host fills it; the plug-in reads only senderHandle and passes
// the record on unchanged (to the bookmark plug-in, to the case batch).

#include <QMetaType>
#include <QString>

struct RequestSenderInfo
{
    QString strSenderName;    // host's own: the client's display name
    QString strSenderAddress; // host's own: where the client connects from
    // Opaque, pointer-sized value naming the requesting client; two requests of the
    // same client carry the same handle, so one client's stop reaches its own search.
    void* senderHandle = nullptr;
};

Q_DECLARE_METATYPE(RequestSenderInfo)
