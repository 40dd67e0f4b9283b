#pragma once
// The one place where the plug-in meets the operating system. Each operation has a Windows
// branch (the calls production uses) and a POSIX branch (what this code runs on elsewhere);
// nothing else in the plug-in tests the platform.

#include <QString>
#include <QVariant>

class PlatformHelper
{
public:
    // Loads a library by its Windows file name ("WemloLogUtl.dll"). On POSIX the name maps
    // to "libWemloLogUtl.so", looked up the usual way and then beside the plug-in module,
    // so a library shipped next to the module is found without any search path. An absolute
    // or relative path is used as it stands. Returns null when the library is not there.
    static void* loadLibrary(const char* windowsFileName);
    static void* resolveSymbol(void* library, const char* name);
    static void freeLibrary(void* library);

    // Reads value strName under a machine-wide registry key ("HKEY_LOCAL_MACHINE\\Software\\..."),
    // native format on Windows. Elsewhere the same key path is read from the system-scope
    // settings file of the organisation and application named by the key's last two parts
    // (for "...\\Quorvex, Inc.\\NOVIR": "Quorvex, Inc."/"NOVIR" under XDG_CONFIG_DIRS), with
    // the value under the group named by the rest of the path, or at the top level.
    // An absent value gives an invalid variant.
    static QVariant readMachineSetting(const QString& strKeyPath, const QString& strName);

    // Native directory separator of this platform ('\\' on Windows).
    static QChar nativeSeparator();

    // The local time zone as the store expects it: the standard bias in minutes (UTC minus
    // local standard time, so UTC+8 gives -480) and whether daylight saving is in force now.
    // Read anew on every call, so a zone change reaches the next query. Thread-safe.
    struct LocalZone
    {
        int standardBiasMinutes = 0;
        bool daylightNow = false;
    };
    static LocalZone localZone();

    // Number of physical processor cores (hyper-threads of one core count once). When the
    // platform does not say, the number of threads the machine runs at once; 0 only when even
    // that is unknown.
    static int physicalCoreCount();
};
