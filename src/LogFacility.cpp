#include "LogFacility.h"

#include "PlatformHelper.h"
#include "WemloLogUtl.h"

#include <atomic>
#include <cstdarg>

namespace {

// One registration of a log module with the library.
struct LogRegistration
{
    const char* moduleName;
    void* library = nullptr;
    std::atomic<WemloLogObject*> logObject{nullptr};
    int moduleId = 0;
};

// The three registrations, in order. Only "DelvixSrv" is written to; the other two names
// are registered so the library can list them next to the server's other modules.
LogRegistration g_registrations[] = {{"CameraProxy"}, {"TamsaRetriever"}, {"DelvixSrv"}};
LogRegistration& g_writer = g_registrations[2];

void registerModule(LogRegistration& registration, const char* libraryName)
{
    registration.library = PlatformHelper::loadLibrary(libraryName);
    if (!registration.library) {
        return;
    }
    auto getObject = reinterpret_cast<LogTrace_GetGlobalObjectFn>(
        PlatformHelper::resolveSymbol(registration.library, "LogTrace_GetGlobalObject"));
    if (!getObject) {
        return;
    }
    WemloLogObject* object = nullptr;
    getObject(0, &object);
    if (object && object->registerModule) {
        object->registerModule(object->context, 19, registration.moduleName, &registration.moduleId);
    }
    registration.logObject.store(object);
}

// Static registration at library load and release at unload, in reverse order.
struct StaticRegistration
{
    StaticRegistration() { LogFacility::reload(LogFacility::defaultLibraryName()); }
    ~StaticRegistration() { LogFacility::release(); }
};

} // namespace

// Runs before the plug-in's other static objects (GCC/Clang init_priority); on other
// compilers the plug-in has no static object that logs during its own construction.
#if defined(__GNUC__)
__attribute__((init_priority(200)))
#endif
StaticRegistration g_staticRegistration;

bool LogFacility::allow(int level, const char* sourcePath, int line)
{
    WemloLogObject* object = g_writer.logObject.load();
    if (!object || !object->context || !object->check) {
        return false;
    }
    return object->check(object->context, (g_writer.moduleId << 8) | level, 0, sourcePath, line) == 0;
}

void LogFacility::write(const char* format, ...)
{
    // Read again: the object may have gone between the check and the write.
    WemloLogObject* object = g_writer.logObject.load();
    if (!object || !object->context || !object->write) {
        return;
    }
    va_list args;
    va_start(args, format);
    object->write(object->context, format, args);
    va_end(args);
}

void LogFacility::reload(const char* libraryName)
{
    release();
    for (LogRegistration& registration : g_registrations) {
        registerModule(registration, libraryName);
    }
}

void LogFacility::release()
{
    for (int i = int(std::size(g_registrations)) - 1; i >= 0; --i) {
        LogRegistration& registration = g_registrations[i];
        registration.logObject.store(nullptr);
        registration.moduleId = 0;
        if (registration.library) {
            PlatformHelper::freeLibrary(registration.library);
            registration.library = nullptr;
        }
    }
}

const char* LogFacility::defaultLibraryName()
{
    return "WemloLogUtl.dll";
}
