// A storage directory that is read-only or full: ingest fails with a status and stores nothing
// half-way, searches keep answering from what is there, and once the directory is writable (or has
// room) again the same handle ingests as before, with nothing acknowledged earlier lost. Each fault
// lives in a forked child, so that its mounts and file-size limit end with it.
#include "Faults.h"
#include "StoreFixture.h"

#include <QDir>

#include <algorithm>
#include <filesystem>
#include <set>
#include <sys/mount.h>

using namespace storetest;

namespace {

class TamsaStorageFaultTest : public StoreFixture
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

    // Stores objects firstId.. (count of them) and, when it worked, adds them to *acknowledged.
    static int32_t putOn(void* database, uint64_t firstId, size_t count,
                         std::set<uint64_t>* acknowledged = nullptr)
    {
        std::vector<ObjectSpec> list;
        for (uint64_t id = firstId; id < firstId + count; ++id) {
            list.push_back(object(id));
        }
        const int32_t result = Tamsa_PutObjectMetaInfo(database, 7, 1, answerJson(list).c_str());
        for (uint64_t id = firstId; acknowledged && result > 0 && id < firstId + count; ++id) {
            acknowledged->insert(id);
        }
        return result;
    }

    // Every stored object must come back whole: the plain search returns exactly `expected`
    // with each one's own attributes, and each one's body vector finds it first.
    static void expectStored(void* database, const std::set<uint64_t>& expected)
    {
        ASSERT_NE(database, nullptr);
        QueryOptions options;
        std::set<uint64_t> found;
        for (const ResultCopy& result : searchStore(database, options)) {
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
            const std::vector<ResultCopy> hits = searchStore(database, options);
            ASSERT_FALSE(hits.empty()) << "object " << id << " is not found by its vector";
            EXPECT_EQ(hits[0].id, id);
            EXPECT_GT(hits[0].score, 0.999f);
        }
    }

    // Opens `directory` afresh, checks what it holds and lets the handle go.
    static void expectStoredInFreshHandle(const std::string& directory, const std::set<uint64_t>& expected)
    {
        void* fresh = openStore(directory);
        expectStored(fresh, expected);
        Tamsa_ReleaseDatabase(&fresh);
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
    const std::string store = mountPoint + "/Server";
    const std::string bare = mountPoint + "/Bare";
    std::set<uint64_t> stored;
    // Filled by a process of its own, so that the one below meets the stores first while they are
    // read-only (this process's stores stay warm for a while after their handles go).
    runInChild([&]() {
        for (const std::string& directory : {store, bare}) {
            void* database = openStore(directory);
            EXPECT_EQ(putOn(database, 1, 30), 30);
            Tamsa_ReleaseDatabase(&database);
        }
        return std::string();
    });
    for (uint64_t id = 1; id <= 30; ++id) {
        stored.insert(id);
    }
    // A store whose writers left no log files behind (all is in the database file then).
    for (const char* leftover : {"/tamsa.db-wal", "/tamsa.db-shm"}) {
        std::filesystem::remove(bare + leftover);
    }
    runInChild([&]() {
        std::string why = enterPrivateMountNamespace();
        if (why.empty()) {
            why = bindReadOnly(mountPoint);
        }
        if (!why.empty()) {
            return why;
        }
        void* database = openStore(store);
        EXPECT_NE(database, nullptr) << "a read-only store must still open for searching";
        expectStored(database, stored);
        void* bareDatabase = openStore(bare);
        EXPECT_NE(bareDatabase, nullptr) << "a read-only store without log files must open too";
        expectStored(bareDatabase, stored);
        EXPECT_LT(putOn(bareDatabase, 100, 5), 0);
        for (uint64_t attempt = 0; attempt < 3; ++attempt) {
            EXPECT_LT(putOn(database, 100 + attempt * 10, 5), 0) << "ingest must fail, not count";
        }
        expectStored(database, stored);

        EXPECT_EQ(::mount(nullptr, mountPoint.c_str(), nullptr, MS_REMOUNT | MS_BIND, nullptr), 0)
            << "writable again";
        EXPECT_EQ(putOn(database, 200, 12), 12) << "ingest resumes on the same handle";
        EXPECT_EQ(putOn(bareDatabase, 200, 12, &stored), 12) << "and on the bare store's handle";
        expectStored(database, stored);
        expectStored(bareDatabase, stored);
        Tamsa_ReleaseDatabase(&database);
        Tamsa_ReleaseDatabase(&bareDatabase);
        expectStoredInFreshHandle(store, stored);
        return std::string();
    });
}

TEST_F(TamsaStorageFaultTest, FullDirectoryRefusesIngestWithoutLosingAcknowledgedObjects)
{
    const std::string store = (m_dir.path() + QStringLiteral("/full")).toStdString();
    runInChild([&]() {
        void* database = openStore(store);
        std::set<uint64_t> acknowledged;
        EXPECT_EQ(putOn(database, 1, 20, &acknowledged), 20);
        // Limits from "nothing may be written" (-1) and "nothing may grow" to a few pages more:
        // each batch stops at a different write (vectors, row records, the log, the commit), or fits.
        int failures = 0;
        uint64_t nextId = 1000;
        for (int64_t extra : {-1, 0, 0, 1024, 4096, 9000, 20000, 40000, 70000, 0, 2048, 16000, 100000, -1}) {
            int32_t result = 0;
            {
                const FileSizeLimit limit(extra < 0 ? 0 : largestFile(store) + extra);
                result = putOn(database, nextId, 12, &acknowledged);
                if (result < 0) { // searches answer while the directory is full, on a new handle too
                    expectStored(database, acknowledged);
                    expectStoredInFreshHandle(store, acknowledged);
                }
            }
            if (result < 0) {
                ++failures;
                EXPECT_TRUE(result == TAMSA_E_IO || result == TAMSA_E_BUSY) << result;
            } else {
                EXPECT_EQ(result, 12);
            }
            nextId += 100;
            expectStored(database, acknowledged);
        }
        EXPECT_GE(failures, 2) << "the limit never made a write fail";

        // Room again: the same handle ingests, and a new one reads everything.
        EXPECT_EQ(putOn(database, 5000, 8, &acknowledged), 8);
        expectStored(database, acknowledged);
        Tamsa_ReleaseDatabase(&database);
        expectStoredInFreshHandle(store, acknowledged);
        return std::string();
    });
    // And a process that never saw the fault reads the same.
    void* after = openStore(store);
    ASSERT_NE(after, nullptr);
    EXPECT_GE(searchStore(after, QueryOptions()).size(), 28u);
    Tamsa_ReleaseDatabase(&after);
}

} // namespace
