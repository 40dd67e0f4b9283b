#include "ScopeTracer.h"

ScopeTracer::ScopeTracer(const char* functionName, const char* sourcePath, int line)
    : m_functionName(functionName)
    , m_sourcePath(sourcePath)
{
    if (LogFacility::allow(LogFacility::LevelTrace, m_sourcePath, line)) {
        LogFacility::write("%s, Enter", m_functionName);
    }
}

ScopeTracer::~ScopeTracer()
{
    // The leave line carries line 0: the tracer does not know where the scope was left.
    if (LogFacility::allow(LogFacility::LevelTrace, m_sourcePath, 0)) {
        LogFacility::write("%s, Leave", m_functionName);
    }
}
