#pragma once
// Synchronous answer channel of the blocking entry points. This plug-in never writes to it.

#include <QString>
#include <QVariant>

class IResponser
{
public:
    virtual void Respond(const QString& strReturnCode, const QString& strMessage,
                         const QVariant& payload) = 0;

protected:
    ~IResponser() = default;
};
