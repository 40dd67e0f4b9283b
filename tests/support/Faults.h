#pragma once
// Faults a test makes on purpose, each kept to a process of its own so that the rest of the run
// never sees it: a full disk (a file-size limit), a read-only folder (a private mount), or simply
// a fresh process. Every helper reports through GoogleTest; a machine that cannot make the fault
// skips the test with the reason.

#include <functional>
#include <string>

// Runs `body` in a forked child and checks its outcome here. The child's failures are printed by
// its own copy of the test framework as they happen; its exit status says whether there were any.
// `body` returns a non-empty reason to skip when the machine offers no way to make the fault.
// Only for bodies that start no threads: the child has none but the caller.
void runInChild(const std::function<std::string()>& body);

// Runs the disabled test `filter` (Suite.DISABLED_Name) of this program in a new process and
// checks that it passed (or skips with the child's output). For bodies that need Qt's threads.
void runDisabledTestInChild(const char* filter, int limitMs = 120000);

// Enters a mount namespace of this process's own: as root directly, otherwise inside a new user
// namespace where the caller is root. Empty on success, else why neither worked.
std::string enterPrivateMountNamespace();

// Makes `path` a read-only view of itself (after enterPrivateMountNamespace). Empty on success.
std::string bindReadOnly(const std::string& path);

// Limits the size of any file this process writes to `bytes` while it lives; writes past it fail
// with EFBIG (SIGXFSZ is ignored). The limit is lifted again when it goes.
class FileSizeLimit
{
public:
    explicit FileSizeLimit(unsigned long long bytes);
    ~FileSizeLimit();
    FileSizeLimit(const FileSizeLimit&) = delete;
    FileSizeLimit& operator=(const FileSizeLimit&) = delete;

private:
    unsigned long long m_previous;
};
