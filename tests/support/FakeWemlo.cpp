#include "FakeWemlo.h"

#include "WemloLogUtl.h"

#include <cstdio>
#include <mutex>

namespace {

struct Behaviour
{
    int checkResult = 0;
    int nextModuleId = 7; // not 1, so tests see that the facility uses what it was given
    bool nullRegister = false, nullCheck = false, nullWrite = false;
};

std::mutex g_mutex; // guards everything below
FakeWemloState g_state;
Behaviour g_behaviour;
thread_local FakeWemloLine t_pending;
int g_context = 0;
WemloLogObject g_object{};

int registerOp(void*, int, const char* name, int* idOut)
{
    std::lock_guard<std::mutex> lock(g_mutex);
    g_state.registeredModules.emplace_back(name ? name : "");
    *idOut = g_behaviour.nextModuleId++;
    return 0;
}

int checkOp(void*, int selector, int, const char* path, int line)
{
    std::lock_guard<std::mutex> lock(g_mutex);
    ++g_state.checkCalls;
    t_pending = FakeWemloLine{selector, path ? path : "", line, {}};
    return g_behaviour.checkResult;
}

void writeOp(void*, const char* format, va_list args)
{
    char buffer[4096];
    std::vsnprintf(buffer, sizeof buffer, format, args);
    std::lock_guard<std::mutex> lock(g_mutex);
    ++g_state.writeCalls;
    g_state.lines.push_back(t_pending);
    g_state.lines.back().text = buffer;
}

} // namespace

void fakeWemloReset()
{
    std::lock_guard<std::mutex> lock(g_mutex);
    g_state = FakeWemloState{};
    g_behaviour = Behaviour{};
}

FakeWemloState fakeWemloState()
{
    std::lock_guard<std::mutex> lock(g_mutex);
    return g_state;
}

void fakeWemloSetCheckResult(int result)
{
    std::lock_guard<std::mutex> lock(g_mutex);
    g_behaviour.checkResult = result;
}

void fakeWemloSetNullOperations(bool nullRegister, bool nullCheck, bool nullWrite)
{
    std::lock_guard<std::mutex> lock(g_mutex);
    g_behaviour =
        Behaviour{g_behaviour.checkResult, g_behaviour.nextModuleId, nullRegister, nullCheck, nullWrite};
}

extern "C" WEMLO_EXPORT int LogTrace_GetGlobalObject(int, WemloLogObject** logObjectOut)
{
    std::lock_guard<std::mutex> lock(g_mutex);
    g_object = WemloLogObject{};
    g_object.context = &g_context;
    g_object.registerModule = g_behaviour.nullRegister ? nullptr : registerOp;
    g_object.check = g_behaviour.nullCheck ? nullptr : checkOp;
    g_object.write = g_behaviour.nullWrite ? nullptr : writeOp;
    *logObjectOut = &g_object;
    return 0;
}
