#pragma once
// The plug-in's log facility over the optional logging library.
//
// The library is loaded by name during static initialisation, before any other plug-in code
// runs, and released at unload. Without it every line is silently dropped. Lines go out in two
// steps: allow() asks the library's check operation, and only then are the arguments evaluated
// and write() formats them (DELVIX_LOG does both). The facility takes no lock: the library's
// operations are thread-safe. Texts are passed as local 8-bit strings (qPrintable).

#include <QtGlobal>

class LogFacility
{
public:
    enum Level
    {
        LevelError = 2,   // failures
        LevelSetting = 3, // a changed setting
        LevelTrace = 5,   // entry and exit traces
    };

    // True when a line of this level, written at sourcePath:line, is to be written.
    static bool allow(int level, const char* sourcePath, int line);
    static void write(const char* format, ...) Q_ATTRIBUTE_FORMAT_PRINTF(1, 2);

    // Drops the current registrations (releasing their libraries) and registers the three
    // modules again from the library named (a Windows file name or a path). Loading happens
    // by itself at start-up; tests use this to put a library of their own behind the facility.
    static void reload(const char* libraryName);
    static void release();
    // The library file the plug-in loads at start-up.
    static const char* defaultLibraryName();
};

// Writes one line: DELVIX_LOG(LogFacility::LevelError, "%s, GetPluginObject failure", "X::f").
// The arguments are evaluated only when the library wants the line.
#define DELVIX_LOG(level, ...)                                                                               \
    do {                                                                                                     \
        if (LogFacility::allow((level), __FILE__, __LINE__)) {                                               \
            LogFacility::write(__VA_ARGS__);                                                                 \
        }                                                                                                    \
    } while (0)
