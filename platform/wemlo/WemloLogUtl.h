#pragma once
// The logging library's one entry point and the log object it hands out.
//
// The library owns the object; callers never free it. Callers read the words below and skip
// an operation whose word is null. All operations may be called from several threads at once.
//
// Writing a line is two calls: check(context, (moduleId << 8) | level, 0, sourcePath, line)
// returns 0 when the line is wanted, then write(context, format, args) formats and writes it.
// The check stores the source position for the write that follows on the same thread.
//
// Environment: WEMLO_LOG_FILE names the file to append to (standard error when unset or not
// writable); WEMLO_LOG_LEVEL is the highest level written (default 3: errors and settings).

#include <cstdarg>
#include <cstddef>

extern "C" {

typedef int (*WemloRegisterModuleFn)(void* context, int kind, const char* moduleName, int* moduleIdOut);
typedef int (*WemloCheckFn)(void* context, int selector, int reserved, const char* sourcePath, int line);
typedef void (*WemloWriteFn)(void* context, const char* format, va_list args);

struct WemloLogObject
{
    void* reserved0[3];
    void* context; // word 3
    void* reserved4[5];
    WemloRegisterModuleFn registerModule; // word 9
    void* reserved10[4];
    WemloCheckFn check; // word 14
    WemloWriteFn write; // word 15
};

static_assert(offsetof(WemloLogObject, context) == 3 * 8, "word 3");
static_assert(offsetof(WemloLogObject, registerModule) == 9 * 8, "word 9");
static_assert(offsetof(WemloLogObject, check) == 14 * 8, "word 14");
static_assert(offsetof(WemloLogObject, write) == 15 * 8, "word 15");

typedef int (*LogTrace_GetGlobalObjectFn)(int reserved, WemloLogObject** logObjectOut);

#if defined(_WIN32)
#define WEMLO_EXPORT __declspec(dllexport)
#else
#define WEMLO_EXPORT __attribute__((visibility("default")))
#endif

WEMLO_EXPORT int LogTrace_GetGlobalObject(int reserved, WemloLogObject** logObjectOut);
}
