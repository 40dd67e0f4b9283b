#include "TamsaImplement.h"

#include "DelvixKeys.h"
#include "PlatformHelper.h"

#include <QStringList>

TamsaImplement::~TamsaImplement() = default;

QString TamsaImplement::getStoragesDBPath()
{
    // The installer of a 32-bit build writes below WOW6432node; a 64-bit one does not.
    static const QString keyTemplates[] = {
        QStringLiteral("HKEY_LOCAL_MACHINE\\Software\\WOW6432node\\%1, Inc.\\%2"),
        QStringLiteral("HKEY_LOCAL_MACHINE\\Software\\%1, Inc.\\%2"),
    };
    for (const QString& keyTemplate : keyTemplates) {
        const QString key = keyTemplate.arg(QStringLiteral("Quorvex"), QStringLiteral("NOVIR"));
        const QVariant value = PlatformHelper::readMachineSetting(key, KEY_INSTALL_PATH);
        if (value.isValid()) {
            return value.toString() + PlatformHelper::nativeSeparator() + QStringLiteral("Server");
        }
    }
    return QString();
}
