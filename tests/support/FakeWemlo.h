#pragma once
// A logging library for tests: the real object layout and entry point, recording every call
// so tests can see exactly what the log facility did. Loaded by the facility by path and
// linked by the test for these inspection functions (one copy in the process).

#include <string>
#include <vector>

struct FakeWemloLine
{
    int selector = 0;
    std::string sourcePath;
    int line = 0;
    std::string text;
};

struct FakeWemloState
{
    std::vector<std::string> registeredModules; // in order of registration
    int checkCalls = 0;
    int writeCalls = 0;
    std::vector<FakeWemloLine> lines;
};

// Resets the recording and the behaviour below.
void fakeWemloReset();
FakeWemloState fakeWemloState();
// Value the check operation returns (0 = write the line).
void fakeWemloSetCheckResult(int result);
// Makes the next LogTrace_GetGlobalObject hand out an object with these operations null.
void fakeWemloSetNullOperations(bool nullRegister, bool nullCheck, bool nullWrite);
