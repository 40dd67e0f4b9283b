#include "PlatformHelper.h"

#include <QDir>
#include <QFileInfo>
#include <QSettings>
#include <QStringList>

#if defined(Q_OS_WIN)
#include <windows.h>
#else
#include <dlfcn.h>
#endif

void* PlatformHelper::loadLibrary(const char* windowsFileName)
{
    if (!windowsFileName || !*windowsFileName) {
        return nullptr;
    }
#if defined(Q_OS_WIN)
    return reinterpret_cast<void*>(LoadLibraryA(windowsFileName));
#else
    // A path is taken as it stands; a bare Windows name becomes the POSIX library name.
    QString name = QString::fromLocal8Bit(windowsFileName);
    if (!name.contains(QLatin1Char('/'))) {
        if (name.endsWith(QLatin1String(".dll"), Qt::CaseInsensitive)) {
            name.chop(4);
        }
        if (!name.startsWith(QLatin1String("lib"))) {
            name.prepend(QLatin1String("lib"));
        }
        if (!name.endsWith(QLatin1String(".so"))) {
            name.append(QLatin1String(".so"));
        }
    }
    if (void* handle = dlopen(name.toLocal8Bit().constData(), RTLD_NOW | RTLD_LOCAL)) {
        return handle;
    }
    if (name.contains(QLatin1Char('/'))) {
        return nullptr;
    }
    // Production keeps its libraries beside the plug-in module; look there, and in the
    // sibling lib folder of a build tree, before giving up.
    Dl_info info{};
    if (dladdr(reinterpret_cast<void*>(&PlatformHelper::loadLibrary), &info) == 0 || !info.dli_fname) {
        return nullptr;
    }
    const QDir moduleDir = QFileInfo(QString::fromLocal8Bit(info.dli_fname)).absoluteDir();
    const QStringList candidates{moduleDir.filePath(name),
                                 moduleDir.filePath(QLatin1String("../lib/") + name)};
    for (const QString& candidate : candidates) {
        if (QFileInfo::exists(candidate)) {
            if (void* handle = dlopen(candidate.toLocal8Bit().constData(), RTLD_NOW | RTLD_LOCAL)) {
                return handle;
            }
        }
    }
    return nullptr;
#endif
}

void* PlatformHelper::resolveSymbol(void* library, const char* name)
{
    if (!library || !name) {
        return nullptr;
    }
#if defined(Q_OS_WIN)
    return reinterpret_cast<void*>(GetProcAddress(static_cast<HMODULE>(library), name));
#else
    return dlsym(library, name);
#endif
}

void PlatformHelper::freeLibrary(void* library)
{
    if (!library) {
        return;
    }
#if defined(Q_OS_WIN)
    FreeLibrary(static_cast<HMODULE>(library));
#else
    dlclose(library);
#endif
}

QVariant PlatformHelper::readMachineSetting(const QString& strKeyPath, const QString& strName)
{
#if defined(Q_OS_WIN)
    QSettings settings(strKeyPath, QSettings::NativeFormat);
    return settings.value(strName);
#else
    // "HKEY_LOCAL_MACHINE\Software\WOW6432node\Quorvex, Inc.\NOVIR": the last two parts name
    // the organisation and application whose system-scope file holds the values; the parts
    // between the hive and them ("Software\WOW6432node") name the group of the first key, so
    // that both registry keys can live in one file as they do in one registry.
    QStringList parts = strKeyPath.split(QLatin1Char('\\'), Qt::SkipEmptyParts);
    if (parts.size() < 3) {
        return QVariant();
    }
    const QString application = parts.takeLast();
    const QString organisation = parts.takeLast();
    parts.removeFirst(); // the hive
    QSettings settings(QSettings::NativeFormat, QSettings::SystemScope, organisation, application);
    const QString group = parts.join(QLatin1Char('/'));
    const QString key = group.isEmpty() ? strName : group + QLatin1Char('/') + strName;
    return settings.value(key);
#endif
}

QChar PlatformHelper::nativeSeparator()
{
    return QDir::separator();
}
