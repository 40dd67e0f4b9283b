#include "PlatformHelper.h"

#include <QDir>
#include <QFile>
#include <QFileInfo>
#include <QSet>
#include <QSettings>
#include <QStringList>
#include <QThread>

#include <algorithm>
#include <ctime>
#include <mutex>
#include <vector>

#if defined(Q_OS_WIN)
#include <windows.h>
#else
#include <dlfcn.h>
#endif

namespace {

// Serialises the calls here that touch process-wide state of the C library (the time zone,
// which tzset rewrites and QSettings reads too): the library's own lock is invisible to race
// detectors, and several search threads come here at once.
std::mutex& processStateMutex()
{
    static std::mutex mutex;
    return mutex;
}

} // namespace

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
    // Every store connection reads the value, from several search threads at once, and
    // QSettings consults the C library's time zone (see localZone).
    std::lock_guard<std::mutex> lock(processStateMutex());
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

PlatformHelper::LocalZone PlatformHelper::localZone()
{
    LocalZone zone;
#if defined(Q_OS_WIN)
    // What production reports: the registry's standard bias, and the C runtime's daylight
    // flag for the present moment.
    TIME_ZONE_INFORMATION information{};
    if (GetTimeZoneInformation(&information) != TIME_ZONE_ID_INVALID) {
        zone.standardBiasMinutes = static_cast<int>(information.Bias + information.StandardBias);
    }
    const __time64_t now = _time64(nullptr);
    std::tm local = {};
    if (_localtime64_s(&local, &now) == 0) {
        zone.daylightNow = local.tm_isdst > 0;
    }
#else
    // POSIX has no "standard bias" call: standard time is the smaller UTC offset of January and
    // July of this year and daylight time the larger, whichever hemisphere, and whatever tm_isdst
    // says (a zone may mark its winter as daylight time with a negative saving, as Europe/Dublin
    // does; Windows gives that zone a standard bias of 0). localtime_r, unlike localtime, keeps its
    // result to the caller; tzset makes a changed TZ count, as a changed Windows zone does. tzset
    // rewrites the C library's zone state, and the re-identification threads all ask at once: one
    // caller at a time, under a lock every tool can see.
    std::lock_guard<std::mutex> lock(processStateMutex());
    tzset();
    const time_t now = std::time(nullptr);
    std::tm local = {};
    if (!localtime_r(&now, &local)) {
        return zone;
    }
    long offsets[2] = {local.tm_gmtoff, local.tm_gmtoff};
    for (int half : {0, 1}) {
        std::tm probe = {};
        probe.tm_year = local.tm_year;
        probe.tm_mon = half * 6;
        probe.tm_mday = 1;
        probe.tm_hour = 12;
        probe.tm_isdst = -1;
        const time_t probeTime = mktime(&probe);
        std::tm probeLocal = {};
        if (probeTime != static_cast<time_t>(-1) && localtime_r(&probeTime, &probeLocal)) {
            offsets[half] = probeLocal.tm_gmtoff;
        }
    }
    const long standardOffsetSeconds = std::min(offsets[0], offsets[1]);
    zone.daylightNow = offsets[0] != offsets[1] && local.tm_gmtoff == std::max(offsets[0], offsets[1]);
    zone.standardBiasMinutes = static_cast<int>(-standardOffsetSeconds / 60);
#endif
    return zone;
}

int PlatformHelper::physicalCoreCount()
{
#if defined(Q_OS_WIN)
    // One RelationProcessorCore entry per physical core, as production counts them.
    DWORD bytes = 0;
    GetLogicalProcessorInformation(nullptr, &bytes);
    if (bytes == 0) {
        return 0;
    }
    std::vector<SYSTEM_LOGICAL_PROCESSOR_INFORMATION> entries(bytes /
                                                              sizeof(SYSTEM_LOGICAL_PROCESSOR_INFORMATION));
    if (!GetLogicalProcessorInformation(entries.data(), &bytes)) {
        return 0;
    }
    int cores = 0;
    for (const SYSTEM_LOGICAL_PROCESSOR_INFORMATION& entry : entries) {
        if (entry.Relationship == RelationProcessorCore) {
            ++cores;
        }
    }
    return cores;
#else
    // Linux names each logical CPU's package and core; distinct pairs are physical cores.
    QSet<QString> cores;
    const QDir cpuDir(QStringLiteral("/sys/devices/system/cpu"));
    const QStringList cpus = cpuDir.entryList({QStringLiteral("cpu[0-9]*")}, QDir::Dirs);
    for (const QString& cpu : cpus) {
        QFile package(cpuDir.filePath(cpu + QStringLiteral("/topology/physical_package_id")));
        QFile core(cpuDir.filePath(cpu + QStringLiteral("/topology/core_id")));
        if (package.open(QIODevice::ReadOnly) && core.open(QIODevice::ReadOnly)) {
            cores.insert(QString::fromLatin1(package.readAll().trimmed() + '/' + core.readAll().trimmed()));
        }
    }
    if (cores.isEmpty()) {
        // No sysfs (containers sometimes hide it): the same pairs from /proc/cpuinfo.
        QFile cpuinfo(QStringLiteral("/proc/cpuinfo"));
        if (cpuinfo.open(QIODevice::ReadOnly | QIODevice::Text)) {
            QByteArray package;
            const QList<QByteArray> lines = cpuinfo.readAll().split('\n');
            for (const QByteArray& line : lines) {
                const int colon = line.indexOf(':');
                if (colon < 0) {
                    continue;
                }
                const QByteArray key = line.left(colon).trimmed();
                const QByteArray value = line.mid(colon + 1).trimmed();
                if (key == "physical id") {
                    package = value;
                } else if (key == "core id") {
                    cores.insert(QString::fromLatin1(package + '/' + value));
                }
            }
        }
    }
    if (!cores.isEmpty()) {
        return static_cast<int>(cores.size());
    }
    return qMax(0, QThread::idealThreadCount());
#endif
}
