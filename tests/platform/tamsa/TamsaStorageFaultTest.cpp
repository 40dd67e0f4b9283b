// A storage directory that is read-only or full: ingest fails with a status and stores nothing
// half-way, searches keep answering from what is there, and once the directory is writable (or has
// room) again the same handle ingests as before, with nothing acknowledged earlier lost.
//
// The faults live in a forked child, so that its mounts and file-size limit end with it: a tmpfs in
// a private mount namespace remounted read-only (chmod binds nobody when the tests run as root),
// and RLIMIT_FSIZE with SIGXFSZ ignored, under which writes past the limit fail with EFBIG.
#include "TamsaTestStore.h"

#include <QDir>

#include <algorithm>
#include <cerrno>
#include <csignal>
#include <cstdio>
#include <cstring>
#include <fcntl.h>
#include <filesystem>
#include <sched.h>
#include <set>
#include <sys/mount.h>
#include <sys/resource.h>
#include <sys/wait.h>
#include <unistd.h>

using namespace tamsatest;

namespace {

using Ids = std::vector<uint64_t>;

constexpr int kChildSkipped = 77;

bool writeProcFile(const char* path, const std::string& text)
{
    const int fd = ::open(path, O_WRONLY | O_CLOEXEC);
    if (fd < 0) {
        return false;
    }
    const bool ok = ::write(fd, text.data(), text.size()) == ssize_t(text.size());
    ::close(fd);
    return ok;
}

// A mount namespace of this process's own: as root directly, otherwise inside a new user
// namespace where the caller is root. Empty on success, else why neither worked.
std::string enterPrivateMountNamespace()
{
    if (::unshare(CLONE_NEWNS) != 0) {
        const int rootError = errno;
        const uid_t uid = ::getuid();
        const gid_t gid = ::getgid();
        if (::unshare(CLONE_NEWUSER | CLONE_NEWNS) != 0) {
            return std::string("no mount namespace: unshare(CLONE_NEWNS): ") + std::strerror(rootError) +
                   ", with a user namespace: " + std::strerror(errno);
        }
        writeProcFile("/proc/self/setgroups", "deny");
        if (!writeProcFile("/proc/self/uid_map", "0 " + std::to_string(uid) + " 1") ||
            !writeProcFile("/proc/self/gid_map", "0 " + std::to_string(gid) + " 1")) {
            return "cannot map the user into the new user namespace";
        }
    }
    if (::mount(nullptr, "/", nullptr, MS_REC | MS_PRIVATE, nullptr) != 0) {
        return std::string("cannot make the mounts private: ") + std::strerror(errno);
    }
    return std::string();
}

bool remount(const std::string& path, bool readOnly)
{
    return ::mount(nullptr, path.c_str(), nullptr, MS_REMOUNT | (readOnly ? MS_RDONLY : 0), nullptr) == 0;
}

// Runs `body` in a forked child and checks its outcome here. The child's failures are printed by
// its own copy of the test framework as they happen; its exit status says whether there were any.
// `body` returns a non-empty reason to skip when the machine offers no way to make the fault.
template <typename Body>
void runInChild(Body body)
{
    int reasonPipe[2];
    ASSERT_EQ(::pipe(reasonPipe), 0);
    std::fflush(stdout);
    const pid_t child = ::fork();
    ASSERT_GE(child, 0);
    if (child == 0) {
        ::close(reasonPipe[0]);
        const std::string skip = body();
        if (!skip.empty()) {
            (void)!::write(reasonPipe[1], skip.data(), skip.size());
        }
        std::fflush(stdout);
        std::fflush(stderr);
        ::_exit(!skip.empty() ? kChildSkipped : ::testing::Test::HasFailure() ? 1 : 0);
    }
    ::close(reasonPipe[1]);
    std::string reason;
    char buffer[256];
    for (ssize_t n; (n = ::read(reasonPipe[0], buffer, sizeof buffer)) > 0;) {
        reason.append(buffer, size_t(n));
    }
    ::close(reasonPipe[0]);
    int status = 0;
    ASSERT_EQ(::waitpid(child, &status, 0), child);
    ASSERT_TRUE(WIFEXITED(status)) << "the child ended by signal " << WTERMSIG(status);
    if (WEXITSTATUS(status) == kChildSkipped) {
        GTEST_SKIP() << reason;
    }
    EXPECT_EQ(WEXITSTATUS(status), 0) << "the child's checks failed (see above)";
}

class TamsaStorageFaultTest : public TamsaStoreFixture
{
protected:
    static ObjectSpec object(uint64_t id)
    {
        ObjectSpec made;
        made.id = id;
        made.start = uint32_t(1000 + id);
        made.end = made.start + 5;
        made.attributes =
            R"({"Gender":)" + std::to_string(id % 2) + R"(,"Tag":"object )" + std::to_string(id) + "\"}";
        made.body = randomUnitVector(uint32_t(id));
        if (id % 3 == 0) {
            made.face = randomUnitVector(uint32_t(id + 100000));
        }
        return made;
    }

    static std::vector<ObjectSpec> objects(uint64_t firstId, size_t count)
    {
        std::vector<ObjectSpec> list;
        for (size_t i = 0; i < count; ++i) {
            list.push_back(object(firstId + i));
        }
        return list;
    }

    static void* openOn(const std::string& directory)
    {
        unsigned char record[704] = {704 & 0xFF, 704 >> 8};
        void* database = nullptr;
        if (Tamsa_InitDatabase(&database, record, 0) != TAMSA_OK) {
            return nullptr;
        }
        if (Tamsa_SetStoragesDBPath(database, directory.c_str()) != TAMSA_OK) {
            Tamsa_ReleaseDatabase(&database);
        }
        return database;
    }

    static int32_t putOn(void* database, const std::vector<ObjectSpec>& list)
    {
        return Tamsa_PutObjectMetaInfo(database, 7, 1, answerJson(list).c_str());
    }

    // Every stored object must come back whole: the plain search returns exactly `expected`
    // with each one's own attributes, and each one's body vector finds it first.
    void expectStored(void* database, const std::set<uint64_t>& expected)
    {
        QueryOptions options;
        int32_t status = 0;
        const std::vector<ResultCopy> results = search(options, &status, database);
        EXPECT_EQ(status, TAMSA_E_NO_MORE_RECORDS) << "the search must end with its final status";
        std::set<uint64_t> found;
        for (const ResultCopy& result : results) {
            found.insert(result.id);
            EXPECT_EQ(result.attributes, object(result.id).attributes) << "object " << result.id;
            EXPECT_EQ(result.thumbnails.find("null"), std::string::npos) << "object " << result.id;
        }
        EXPECT_EQ(found, expected);
        for (uint64_t id : expected) {
            if (id % 7 != 0 && id != *expected.rbegin()) {
                continue; // a sample keeps the scans few
            }
            options.feature = jsonArray(object(id).body);
            const std::vector<ResultCopy> hits = search(options, &status, database);
            EXPECT_EQ(status, TAMSA_E_NO_MORE_RECORDS);
            ASSERT_FALSE(hits.empty()) << "object " << id << " is not found by its vector";
            EXPECT_EQ(hits[0].id, id);
            EXPECT_GT(hits[0].score, 0.999f);
        }
    }

    // The size of the largest file of the store: a limit there lets no file grow.
    static int64_t largestFile(const std::string& directory)
    {
        int64_t largest = 0;
        for (const auto& entry : std::filesystem::recursive_directory_iterator(directory)) {
            if (entry.is_regular_file()) {
                largest = std::max<int64_t>(largest, int64_t(entry.file_size()));
            }
        }
        return largest;
    }
};

TEST_F(TamsaStorageFaultTest, ReadOnlyDirectoryServesSearchesAndIngestResumesWhenWritable)
{
    const std::string mountPoint = (m_dir.path() + QStringLiteral("/readonly")).toStdString();
    ASSERT_TRUE(QDir().mkpath(QString::fromStdString(mountPoint)));
    runInChild([&]() -> std::string {
        const std::string why = enterPrivateMountNamespace();
        if (!why.empty()) {
            return why;
        }
        if (::mount("tmpfs", mountPoint.c_str(), "tmpfs", 0, "size=64m") != 0) {
            return std::string("cannot mount a tmpfs: ") + std::strerror(errno);
        }
        const std::string store = mountPoint + "/Server";
        const std::string bare = mountPoint + "/Bare";
        // Filled by a grandchild, so that this process meets the directories first while they
        // are read-only (and holds no file there open for writing, which would keep them writable).
        const pid_t filler = ::fork();
        if (filler == 0) {
            bool ok = true;
            for (const std::string& directory : {store, bare}) {
                void* database = openOn(directory);
                ok = ok && database && putOn(database, objects(1, 30)) == 30;
                Tamsa_ReleaseDatabase(&database);
            }
            std::fflush(stdout);
            ::_exit(ok ? 0 : 1);
        }
        int status = 0;
        EXPECT_EQ(::waitpid(filler, &status, 0), filler);
        EXPECT_TRUE(WIFEXITED(status) && WEXITSTATUS(status) == 0) << "filling the stores failed";
        // A store whose writers left no log files behind (all is in the database file then).
        for (const char* leftover : {"/tamsa.db-wal", "/tamsa.db-shm"}) {
            std::filesystem::remove(bare + leftover);
        }
        EXPECT_TRUE(remount(mountPoint, true)) << std::strerror(errno);
        std::set<uint64_t> stored;
        for (uint64_t id = 1; id <= 30; ++id) {
            stored.insert(id);
        }

        void* database = openOn(store);
        EXPECT_NE(database, nullptr) << "a read-only store must still open for searching";
        if (!database) {
            return std::string();
        }
        expectStored(database, stored);
        void* bareDatabase = openOn(bare);
        EXPECT_NE(bareDatabase, nullptr) << "a read-only store without log files must open too";
        if (bareDatabase) {
            expectStored(bareDatabase, stored);
            EXPECT_LT(putOn(bareDatabase, objects(100, 5)), 0);
        }
        for (int attempt = 0; attempt < 3; ++attempt) {
            const int32_t result = putOn(database, objects(100 + uint64_t(attempt) * 10, 5));
            EXPECT_LT(result, 0) << "ingest into a read-only directory must fail, not count";
        }
        expectStored(database, stored);

        EXPECT_TRUE(remount(mountPoint, false)) << std::strerror(errno);
        EXPECT_EQ(putOn(database, objects(200, 12)), 12) << "ingest resumes on the same handle";
        if (bareDatabase) {
            EXPECT_EQ(putOn(bareDatabase, objects(200, 12)), 12) << "and on the bare store's handle";
        }
        for (uint64_t id = 200; id < 212; ++id) {
            stored.insert(id);
        }
        expectStored(database, stored);
        Tamsa_ReleaseDatabase(&database);
        if (bareDatabase) {
            expectStored(bareDatabase, stored);
            Tamsa_ReleaseDatabase(&bareDatabase);
        }

        void* fresh = openOn(store);
        EXPECT_NE(fresh, nullptr);
        if (fresh) {
            expectStored(fresh, stored);
            Tamsa_ReleaseDatabase(&fresh);
        }
        return std::string();
    });
}

TEST_F(TamsaStorageFaultTest, FullDirectoryRefusesIngestWithoutLosingAcknowledgedObjects)
{
    const std::string store = (m_dir.path() + QStringLiteral("/full")).toStdString();
    runInChild([&]() -> std::string {
        std::signal(SIGXFSZ, SIG_IGN); // over the limit, writes fail with EFBIG instead
        rlimit unlimited{};
        EXPECT_EQ(::getrlimit(RLIMIT_FSIZE, &unlimited), 0);
        void* database = openOn(store);
        EXPECT_NE(database, nullptr);
        if (!database) {
            return std::string();
        }
        std::set<uint64_t> acknowledged;
        EXPECT_EQ(putOn(database, objects(1, 20)), 20);
        for (uint64_t id = 1; id <= 20; ++id) {
            acknowledged.insert(id);
        }

        // Limits from "nothing may be written" and "nothing may grow" to a few pages more: each
        // batch stops at a different write (vectors, row records, the log, the commit), or fits.
        int failures = 0;
        uint64_t nextId = 1000;
        // -1: no write at all.
        for (int64_t extra : {-1, 0, 0, 1024, 4096, 9000, 20000, 40000, 70000, 0, 2048, 16000, 100000, -1}) {
            const rlimit limit{extra < 0 ? 0 : rlim_t(largestFile(store) + extra), unlimited.rlim_max};
            EXPECT_EQ(::setrlimit(RLIMIT_FSIZE, &limit), 0);
            const std::vector<ObjectSpec> batch = objects(nextId, 12);
            const int32_t result = putOn(database, batch);
            if (result < 0) {
                // Searches answer while the directory is full, on this handle and on a new one.
                expectStored(database, acknowledged);
                void* another = openOn(store);
                EXPECT_NE(another, nullptr) << "no handle while the directory is full";
                if (another) {
                    expectStored(another, acknowledged);
                    Tamsa_ReleaseDatabase(&another);
                }
            }
            EXPECT_EQ(::setrlimit(RLIMIT_FSIZE, &unlimited), 0);
            if (result < 0) {
                ++failures;
                EXPECT_TRUE(result == TAMSA_E_IO || result == TAMSA_E_BUSY) << result;
            } else {
                EXPECT_EQ(result, 12);
                for (const ObjectSpec& stored : batch) {
                    acknowledged.insert(stored.id);
                }
            }
            nextId += 100;
            expectStored(database, acknowledged);
        }
        EXPECT_GE(failures, 2) << "the limit never made a write fail";

        // Room again: the same handle ingests, and a new one reads everything.
        EXPECT_EQ(putOn(database, objects(5000, 8)), 8);
        for (uint64_t id = 5000; id < 5008; ++id) {
            acknowledged.insert(id);
        }
        expectStored(database, acknowledged);
        Tamsa_ReleaseDatabase(&database);
        void* fresh = openOn(store);
        EXPECT_NE(fresh, nullptr);
        if (fresh) {
            expectStored(fresh, acknowledged);
            Tamsa_ReleaseDatabase(&fresh);
        }
        return std::string();
    });
    // And a process that never saw the fault reads the same.
    void* after = openOn(store);
    ASSERT_NE(after, nullptr);
    QueryOptions options;
    int32_t status = 0;
    EXPECT_GE(search(options, &status, after).size(), 28u);
    EXPECT_EQ(status, TAMSA_E_NO_MORE_RECORDS);
    Tamsa_ReleaseDatabase(&after);
}

} // namespace
