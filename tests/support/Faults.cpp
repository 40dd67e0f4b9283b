#include "Faults.h"

#include "TestWait.h"

#include <QCoreApplication>
#include <QProcess>

#include <gtest/gtest.h>

#include <cerrno>
#include <csignal>
#include <cstdio>
#include <cstring>
#include <fcntl.h>
#include <sched.h>
#include <sys/mount.h>
#include <sys/resource.h>
#include <sys/wait.h>
#include <unistd.h>

namespace {

constexpr int kChildSkipped = 77;

bool writeProcFile(const char* path, const std::string& text)
{
    const int fd = ::open(path, O_WRONLY);
    if (fd < 0) {
        return false;
    }
    const bool ok = ::write(fd, text.data(), text.size()) == ssize_t(text.size());
    ::close(fd);
    return ok;
}

} // namespace

void runInChild(const std::function<std::string()>& body)
{
    std::fflush(stdout);
    const pid_t child = ::fork();
    ASSERT_GE(child, 0);
    if (child == 0) {
        const std::string skip = body();
        std::printf("%s%s\n", skip.empty() ? "" : "skipped: ", skip.c_str());
        std::fflush(stdout);
        std::fflush(stderr);
        ::_exit(!skip.empty() ? kChildSkipped : ::testing::Test::HasFailure() ? 1 : 0);
    }
    int status = 0;
    ASSERT_EQ(::waitpid(child, &status, 0), child);
    ASSERT_TRUE(WIFEXITED(status)) << "the child ended by signal " << WTERMSIG(status);
    if (WEXITSTATUS(status) == kChildSkipped) {
        GTEST_SKIP() << "the child could not make the fault (its reason is printed above)";
    }
    EXPECT_EQ(WEXITSTATUS(status), 0) << "the child's checks failed (see above)";
}

void runDisabledTestInChild(const char* filter, int limitMs)
{
    QProcess child;
    child.setProcessChannelMode(QProcess::MergedChannels);
    child.start(QCoreApplication::applicationFilePath(),
                {QStringLiteral("--gtest_also_run_disabled_tests"),
                 QStringLiteral("--gtest_filter=") + QString::fromLatin1(filter)});
    ASSERT_TRUE(child.waitForFinished(scaledMs(limitMs))) << filter << " did not finish";
    const QByteArray output = child.readAll();
    if (output.contains("[  SKIPPED ] 1 test")) {
        GTEST_SKIP() << output.constData();
    }
    EXPECT_TRUE(child.exitStatus() == QProcess::NormalExit && child.exitCode() == 0 &&
                output.contains("[  PASSED  ] 1 test"))
        << output.constData();
}

std::string enterPrivateMountNamespace()
{
    if (::unshare(CLONE_NEWNS) != 0) {
        const int rootError = errno;
        const std::string uid = std::to_string(::getuid()), gid = std::to_string(::getgid());
        if (::unshare(CLONE_NEWUSER | CLONE_NEWNS) != 0) {
            return std::string("no mount namespace: unshare(CLONE_NEWNS): ") + std::strerror(rootError) +
                   ", with a user namespace: " + std::strerror(errno);
        }
        writeProcFile("/proc/self/setgroups", "deny");
        if (!writeProcFile("/proc/self/uid_map", "0 " + uid + " 1") ||
            !writeProcFile("/proc/self/gid_map", "0 " + gid + " 1")) {
            return "cannot map the user into the new user namespace";
        }
    }
    if (::mount(nullptr, "/", nullptr, MS_REC | MS_PRIVATE, nullptr) != 0) {
        return std::string("cannot make the mounts private: ") + std::strerror(errno);
    }
    return std::string();
}

std::string bindReadOnly(const std::string& path)
{
    if (::mount(path.c_str(), path.c_str(), nullptr, MS_BIND, nullptr) != 0 ||
        ::mount(nullptr, path.c_str(), nullptr, MS_REMOUNT | MS_BIND | MS_RDONLY, nullptr) != 0) {
        return "cannot make " + path + " read-only: " + std::strerror(errno);
    }
    return std::string();
}

FileSizeLimit::FileSizeLimit(unsigned long long bytes)
{
    std::signal(SIGXFSZ, SIG_IGN);
    rlimit current{};
    EXPECT_EQ(::getrlimit(RLIMIT_FSIZE, &current), 0);
    m_previous = current.rlim_cur;
    const rlimit limited{rlim_t(bytes), current.rlim_max};
    EXPECT_EQ(::setrlimit(RLIMIT_FSIZE, &limited), 0);
}

FileSizeLimit::~FileSizeLimit()
{
    rlimit current{};
    ::getrlimit(RLIMIT_FSIZE, &current);
    const rlimit restored{rlim_t(m_previous), current.rlim_max};
    EXPECT_EQ(::setrlimit(RLIMIT_FSIZE, &restored), 0);
}
