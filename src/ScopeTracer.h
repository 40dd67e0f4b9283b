#pragma once
// Writes "<name>, Enter" when constructed and "<name>, Leave" when the scope is left, by any
// way out, both at the trace level. The name must outlive the tracer (a string literal).

#include "LogFacility.h"

class ScopeTracer
{
public:
    ScopeTracer(const char* functionName, const char* sourcePath, int line);
    ~ScopeTracer();

    ScopeTracer(const ScopeTracer&) = delete;
    ScopeTracer& operator=(const ScopeTracer&) = delete;

private:
    const char* m_functionName;
    const char* m_sourcePath;
};

#define DELVIX_SCOPE_TRACE(functionName) ScopeTracer delvixScopeTracer_(functionName, __FILE__, __LINE__)
