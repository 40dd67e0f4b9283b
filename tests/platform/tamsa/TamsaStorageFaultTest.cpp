// A storage directory that is read-only or full: ingest fails with a status and stores nothing
// half-way, searches keep answering from what is there, and once the directory is writable (or has
// room) again the same handle ingests as before, with nothing acknowledged earlier lost. Each fault
// lives in a forked child, so that its mounts and file-size limit end with it.
#include "Faults.h"
#include "StoreFixture.h"

#include <algorithm>
#include <filesystem>
#include <numeric>
#include <sys/mount.h>

using namespace storetest;

namespace {

using TamsaStorageFaultTest = StoreFixture;

// Stores objects firstId.. (count of them) and, when it worked, adds them to *acknowledged.
int32_t putOn(void* database, uint64_t firstId, size_t count, Ids* acknowledged = nullptr)
{
    const int32_t result =
        Tamsa_PutObjectMetaInfo(database, 7, 1, answerJson(numberedObjects(firstId, count)).c_str());
    for (uint64_t id = firstId; acknowledged && result > 0 && id < firstId + count; ++id) {
        acknowledged->push_back(id);
    }
    return result;
}

// Every stored object comes back whole: the plain search returns exactly `expected` (in id order,
// as their start times go) with their own attributes and thumbnails, and a sample of them is found
// first by its own body vector. A null `database` opens `directory` afresh for the check.
void expectStored(void* database, const Ids& expected, const std::string& directory = "")
{
    void* fresh = database ? nullptr : openStore(directory);
    ASSERT_NE(database ? database : fresh, nullptr);
    QueryOptions options;
    std::string got, want;
    for (const ResultCopy& r : searchStore(database ? database : fresh, options)) {
        got += std::to_string(r.id) + r.attributes +
               (r.thumbnails.find("null") == std::string::npos ? "" : "null");
    }
    for (uint64_t id : expected) {
        want += std::to_string(id) + numberedObject(id).attributes;
        if (id % 7 == 0 || id == expected.back()) { // a sample keeps the scans few
            options.feature = jsonArray(randomUnitVector(uint32_t(id)));
            const std::vector<ResultCopy> hits = searchStore(database ? database : fresh, options);
            EXPECT_TRUE(!hits.empty() && hits[0].id == id && hits[0].score > 0.999f) << "object " << id;
        }
    }
    EXPECT_EQ(got, want);
    Tamsa_ReleaseDatabase(&fresh);
}

TEST_F(TamsaStorageFaultTest, ReadOnlyDirectoryServesSearchesAndIngestResumesWhenWritable)
{
    const std::string mountPoint = (m_dir.path() + QStringLiteral("/readonly")).toStdString();
    const std::string stores[] = {mountPoint + "/Server", mountPoint + "/Bare"};
    // Filled by a process of its own, so that the one below meets the stores first while they are
    // read-only (this process's stores stay warm for a while after their handles go).
    runInChild([&]() {
        for (const std::string& directory : stores) {
            void* database = openStore(directory);
            EXPECT_EQ(putOn(database, 1, 30), 30);
            Tamsa_ReleaseDatabase(&database);
        }
        return std::string();
    });
    // The second store's writers left no log files behind (all is in the database file then).
    for (const char* leftover : {"/tamsa.db-wal", "/tamsa.db-shm"}) {
        std::filesystem::remove(stores[1] + leftover);
    }
    runInChild([&]() {
        std::string why = enterPrivateMountNamespace();
        if (why.empty()) {
            why = bindReadOnly(mountPoint);
        }
        if (!why.empty()) {
            return why;
        }
        Ids stored(30);
        std::iota(stored.begin(), stored.end(), 1);
        void* handles[2] = {openStore(stores[0]), openStore(stores[1])};
        for (void* database : handles) {
            EXPECT_NE(database, nullptr) << "a read-only store must still open for searching";
            expectStored(database, stored);
            for (uint64_t attempt = 0; attempt < 2; ++attempt) {
                EXPECT_LT(putOn(database, 100 + attempt * 10, 5), 0) << "ingest must fail, not count";
            }
            expectStored(database, stored);
        }
        EXPECT_EQ(::mount(nullptr, mountPoint.c_str(), nullptr, MS_REMOUNT | MS_BIND, nullptr), 0);
        EXPECT_EQ(putOn(handles[0], 200, 12), 12) << "ingest resumes on the same handle";
        EXPECT_EQ(putOn(handles[1], 200, 12, &stored), 12);
        for (int i = 0; i < 2; ++i) {
            expectStored(handles[i], stored);
            Tamsa_ReleaseDatabase(&handles[i]);
            expectStored(nullptr, stored, stores[i]);
        }
        return std::string();
    });
}

TEST_F(TamsaStorageFaultTest, FullDirectoryRefusesIngestWithoutLosingAcknowledgedObjects)
{
    const std::string store = (m_dir.path() + QStringLiteral("/full")).toStdString();
    runInChild([&]() {
        void* database = openStore(store);
        Ids acknowledged;
        EXPECT_EQ(putOn(database, 1, 20, &acknowledged), 20);
        // Limits from "nothing may be written" (-1) and "nothing may grow" to a few pages more:
        // each batch stops at a different write (vectors, row records, the log, the commit), or fits.
        int failures = 0;
        uint64_t nextId = 1000;
        for (int64_t extra : {-1, 0, 0, 1024, 4096, 9000, 20000, 40000, 70000, 0, 2048, 16000, 100000, -1}) {
            int64_t largest = 0; // a limit at the largest file of the store lets no file grow
            for (const auto& entry : std::filesystem::recursive_directory_iterator(store)) {
                largest =
                    std::max<int64_t>(largest, entry.is_regular_file() ? int64_t(entry.file_size()) : 0);
            }
            int32_t result = 0;
            {
                const FileSizeLimit limit(extra < 0 ? 0 : largest + extra);
                result = putOn(database, nextId, 12, &acknowledged);
                if (result < 0) { // searches answer while the directory is full, on a new handle too
                    expectStored(database, acknowledged);
                    expectStored(nullptr, acknowledged, store);
                }
            }
            failures += result < 0;
            EXPECT_TRUE(result == 12 || result == TAMSA_E_IO || result == TAMSA_E_BUSY) << result;
            nextId += 100;
            expectStored(database, acknowledged);
        }
        EXPECT_GE(failures, 2) << "the limit never made a write fail";
        // Room again: the same handle ingests, and a new one reads everything.
        EXPECT_EQ(putOn(database, 5000, 8, &acknowledged), 8);
        expectStored(database, acknowledged);
        Tamsa_ReleaseDatabase(&database);
        expectStored(nullptr, acknowledged, store);
        return std::string();
    });
    // And a process that never saw the fault reads the same.
    void* after = openStore(store);
    EXPECT_GE(searchStore(after, QueryOptions()).size(), 28u);
    Tamsa_ReleaseDatabase(&after);
}

} // namespace
