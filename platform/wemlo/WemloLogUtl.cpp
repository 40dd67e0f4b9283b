#include "WemloLogUtl.h"

#include <chrono>
#include <cstdio>
#include <cstdlib>
#include <cstring>
#include <ctime>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

namespace {

const char* levelName(int level)
{
    switch (level) {
    case 1:
        return "FATAL";
    case 2:
        return "ERROR";
    case 3:
        return "NOTE";
    case 4:
        return "INFO";
    case 5:
        return "TRACE";
    default:
        return "LEVEL";
    }
}

class Logger
{
public:
    Logger()
    {
        if (const char* level = std::getenv("WEMLO_LOG_LEVEL")) {
            m_threshold = std::atoi(level);
        }
        if (const char* path = std::getenv("WEMLO_LOG_FILE"); path && *path) {
            m_file = std::fopen(path, "a");
        }
        if (!m_file) {
            m_file = stderr;
        }
    }

    int registerModule(const char* name, int* idOut)
    {
        std::lock_guard<std::mutex> lock(m_mutex);
        m_modules.emplace_back(name ? name : "");
        if (idOut) {
            *idOut = static_cast<int>(m_modules.size());
        }
        return 0;
    }

    int check(int selector, const char* path, int line)
    {
        const int level = selector & 0xff;
        if (level > m_threshold) {
            return 1;
        }
        t_pending = {selector, path, line};
        return 0;
    }

    void write(const char* format, va_list args)
    {
        char stackBuffer[1024];
        std::vector<char> heapBuffer;
        char* text = stackBuffer;
        va_list copy;
        va_copy(copy, args);
        const int needed = std::vsnprintf(stackBuffer, sizeof stackBuffer, format, copy);
        va_end(copy);
        if (needed < 0) {
            return;
        }
        if (static_cast<size_t>(needed) >= sizeof stackBuffer) {
            heapBuffer.resize(static_cast<size_t>(needed) + 1);
            std::vsnprintf(heapBuffer.data(), heapBuffer.size(), format, args);
            text = heapBuffer.data();
        }

        const Pending pending = t_pending;
        t_pending = {};
        const auto now = std::chrono::system_clock::now();
        const std::time_t seconds = std::chrono::system_clock::to_time_t(now);
        const int millis = static_cast<int>(
            std::chrono::duration_cast<std::chrono::milliseconds>(now.time_since_epoch()).count() % 1000);
        std::tm local{};
        localtime_r(&seconds, &local);
        char stamp[32];
        std::strftime(stamp, sizeof stamp, "%Y-%m-%d %H:%M:%S", &local);
        const char* file = pending.path ? std::strrchr(pending.path, '/') : nullptr;
        file = file ? file + 1 : (pending.path ? pending.path : "?");

        std::lock_guard<std::mutex> lock(m_mutex);
        const int module = pending.selector >> 8;
        const char* moduleName = module > 0 && static_cast<size_t>(module) <= m_modules.size()
                                     ? m_modules[module - 1].c_str()
                                     : "-";
        std::fprintf(m_file, "%s.%03d %s %s %s:%d %s\n", stamp, millis, levelName(pending.selector & 0xff),
                     moduleName, file, pending.line, text);
        std::fflush(m_file);
    }

private:
    struct Pending
    {
        int selector = 0;
        const char* path = nullptr;
        int line = 0;
    };
    static thread_local Pending t_pending;

    std::mutex m_mutex; // guards m_modules and the writes to m_file
    std::vector<std::string> m_modules;
    std::FILE* m_file = nullptr;
    int m_threshold = 3;
};

thread_local Logger::Pending Logger::t_pending;

int registerModuleOp(void* context, int, const char* name, int* idOut)
{
    return static_cast<Logger*>(context)->registerModule(name, idOut);
}

int checkOp(void* context, int selector, int, const char* path, int line)
{
    return static_cast<Logger*>(context)->check(selector, path, line);
}

void writeOp(void* context, const char* format, va_list args)
{
    static_cast<Logger*>(context)->write(format, args);
}

} // namespace

extern "C" int LogTrace_GetGlobalObject(int, WemloLogObject** logObjectOut)
{
    // Built once, on first use, and kept for the life of the process: callers hold the
    // pointer without owning it.
    static Logger logger;
    static WemloLogObject object = [] {
        WemloLogObject o{};
        o.context = &logger;
        o.registerModule = registerModuleOp;
        o.check = checkOp;
        o.write = writeOp;
        return o;
    }();
    if (logObjectOut) {
        *logObjectOut = &object;
    }
    return 0;
}
