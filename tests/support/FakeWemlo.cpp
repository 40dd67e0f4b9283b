#include "FakeWemlo.h"

#include "WemloLogUtl.h"

#include <cstdio>
#include <mutex>

namespace {

std::mutex g_mutex; // guards everything below
FakeWemloState g_state;
int g_checkResult = 0;
int g_nextModuleId = 7; // not 1, so tests see that the facility uses what it was given
bool g_nullRegister = false;
bool g_nullCheck = false;
bool g_nullWrite = false;
thread_local FakeWemloLine t_pending;
int g_context = 0;
WemloLogObject g_object{};

int registerOp(void*, int kind, const char* name, int* idOut)
{
    std::lock_guard<std::mutex> lock(g_mutex);
    g_state.registeredModules.emplace_back(name ? name : "");
    g_state.registerKinds.push_back(kind);
    *idOut = g_nextModuleId++;
    return 0;
}

int checkOp(void*, int selector, int, const char* path, int line)
{
    std::lock_guard<std::mutex> lock(g_mutex);
    ++g_state.checkCalls;
    t_pending = FakeWemloLine{selector, path ? path : "", line, {}};
    return g_checkResult;
}

void writeOp(void*, const char* format, va_list args)
{
    char buffer[4096];
    std::vsnprintf(buffer, sizeof buffer, format, args);
    std::lock_guard<std::mutex> lock(g_mutex);
    ++g_state.writeCalls;
    FakeWemloLine line = t_pending;
    line.text = buffer;
    g_state.lines.push_back(line);
}

} // namespace

void fakeWemloReset()
{
    std::lock_guard<std::mutex> lock(g_mutex);
    g_state = FakeWemloState{};
    g_checkResult = 0;
    g_nextModuleId = 7;
    g_nullRegister = g_nullCheck = g_nullWrite = false;
}

FakeWemloState fakeWemloState()
{
    std::lock_guard<std::mutex> lock(g_mutex);
    return g_state;
}

void fakeWemloSetCheckResult(int result)
{
    std::lock_guard<std::mutex> lock(g_mutex);
    g_checkResult = result;
}

void fakeWemloSetNullOperations(bool nullRegister, bool nullCheck, bool nullWrite)
{
    std::lock_guard<std::mutex> lock(g_mutex);
    g_nullRegister = nullRegister;
    g_nullCheck = nullCheck;
    g_nullWrite = nullWrite;
}

extern "C" WEMLO_EXPORT int LogTrace_GetGlobalObject(int, WemloLogObject** logObjectOut)
{
    std::lock_guard<std::mutex> lock(g_mutex);
    g_object = WemloLogObject{};
    g_object.context = &g_context;
    g_object.registerModule = g_nullRegister ? nullptr : registerOp;
    g_object.check = g_nullCheck ? nullptr : checkOp;
    g_object.write = g_nullWrite ? nullptr : writeOp;
    *logObjectOut = &g_object;
    return 0;
}
