// Ingest, durability, and the thread rules: Abort from another thread, handles used at once.
#include "StoreFixture.h"

#include <atomic>
#include <chrono>
#include <csignal>
#include <fstream>
#include <sys/wait.h>
#include <thread>
#include <unistd.h>

using namespace storetest;

namespace {

using TamsaLifecycleTest = StoreFixture;

QueryOptions at(std::vector<uint32_t> locations, const std::string& primary = "",
                const std::string& feature = "")
{
    QueryOptions options;
    options.locations = std::move(locations);
    options.primary = primary;
    options.feature = feature;
    return options;
}

TEST_F(TamsaLifecycleTest, ReingestReplacesWithoutDuplicates)
{
    const std::vector<float> oldVector = randomUnitVector(1), newVector = randomUnitVector(2);
    ASSERT_EQ(put(1, {{42, "Human", 1000, 1010, R"({"Gender":0})", {}, oldVector}}), 1);
    const ObjectSpec object{42, "Human", 1000, 1010, R"({"Gender":1})", {}, newVector};
    ASSERT_EQ(put(1, {object}), 1);
    ASSERT_EQ(put(2, {object}), 1) << "the key is (location, ID)";
    EXPECT_EQ(searchIds(at({1}, R"({"Gender":1})")), Ids{42});
    EXPECT_EQ(searchIds(at({1}, R"({"Gender":0})")), Ids{});
    EXPECT_EQ(searchIds(at({1}, "", jsonArray(oldVector))), Ids{})
        << "the replaced vector is no longer searched";
    EXPECT_EQ(searchIds(at({1, 2}, "", jsonArray(newVector))), (Ids{42, 42}));
    // The same ID twice in one answer: the later one wins.
    EXPECT_EQ(put(3, {{7, "Human", 1, 2, R"({"Age":"Young"})"}, {7, "Human", 1, 2, R"({"Age":"Old"})"}}), 1);
    EXPECT_EQ(searchIds(at({3}, R"({"Age":"Old"})")), Ids{7});
}

TEST_F(TamsaLifecycleTest, BadIngestInputIsRefusedOrSkipped)
{
    const std::string deep = std::string(100000, '[') + std::string(100000, ']');
    for (const std::string& text :
         {std::string("not json"), std::string("[]"), std::string(R"({"Objects":[]})"),
          std::string(R"({"ObjectMetaInfo":{}})"), deep}) {
        EXPECT_EQ(putText(1, text), TAMSA_E_BAD_JSON) << text.substr(0, 20);
    }
    // A text that is not UTF-8 makes the answer unreadable, as it would be to any reader of the texts
    // the store hands out: a stray continuation byte, a cut sequence, overlong forms, an encoded
    // surrogate, beyond U+10FFFF, bytes UTF-8 never uses, and a bad escape.
    for (const char* text : {"\x97", "\xC7 ", "\xE4\xBA", "\xC0\xAF", "\xE0\x80\xAF", "\xED\xA0\x80",
                             "\xF4\x90\x80\x80", "\xF8\x88\x80\x80\x80", "\xFF", "\\u12", "\\q"}) {
        EXPECT_EQ(put(1, {{3, "Human", 1, 2, std::string(R"({"Age":")") + text + "\"}"}}), TAMSA_E_BAD_JSON)
            << text;
    }
    EXPECT_EQ(putText(0, R"({"ObjectMetaInfo":[]})"), TAMSA_E_INVALID_ARGUMENT);
    EXPECT_EQ(Tamsa_PutObjectMetaInfo(m_database, 1, 1, nullptr), TAMSA_E_INVALID_ARGUMENT);

    std::string shortFeature = objectJson({50}); // a 3-number feature
    shortFeature.replace(shortFeature.find("\"image\""), 0, "\"feature\":[1,2,3],");
    const std::string bad[] = {
        R"({"ObjectType":"Human","StartTime":1,"EndTime":2})",                // no ID
        R"({"ID":"9","ObjectType":"Human","StartTime":1,"EndTime":2})",       // ID as text
        R"({"ID":-9,"ObjectType":"Human","StartTime":1,"EndTime":2})",        // negative ID
        R"({"ID":9,"ObjectType":"Human","StartTime":1e300,"EndTime":1e301})", // time out of range
        R"({"ID":9,"ObjectType":"Human","StartTime":5,"EndTime":2})",         // ends before it starts
        R"({"ID":9,"ObjectType":"Human","StartTime":1,"EndTime":2,"Attributes":[1]})",
        shortFeature,
        "null",
    };
    std::string answer = R"({"ObjectMetaInfo":[)" + objectJson({5});
    for (const std::string& element : bad) {
        answer += "," + element;
    }
    EXPECT_EQ(putText(1, answer + "]}"), 1) << "only the good element is stored";
    // Nesting beyond what any camera sends makes the whole text unreadable: nothing is stored.
    EXPECT_EQ(put(1, {{8}, {9, "Human", 1, 2, "{\"a\":" + deep + "}"}}), TAMSA_E_BAD_JSON);
    EXPECT_EQ(searchIds(QueryOptions()), Ids{5});

    void* unset = nullptr;
    unsigned char record[704] = {0xC0, 0x02};
    ASSERT_EQ(Tamsa_InitDatabase(&unset, record, 0), TAMSA_OK);
    EXPECT_EQ(Tamsa_PutObjectMetaInfo(unset, 1, 1, R"({"ObjectMetaInfo":[]})"), TAMSA_E_NO_STORAGE_PATH);
    EXPECT_EQ(Tamsa_SetStoragesDBPath(unset, "/proc/no/such/place"), TAMSA_E_IO);
    Tamsa_ReleaseDatabase(&unset);
}

TEST_F(TamsaLifecycleTest, StoredObjectsSurviveReopeningAndAKilledProcess)
{
    ASSERT_EQ(put(1, {numberedObject(11)}), 1);
    Tamsa_ReleaseDatabase(&m_database);
    // A child process stores an object and is killed at once, without any clean-up.
    const pid_t child = fork();
    ASSERT_GE(child, 0);
    if (child == 0) {
        void* database = openHandle();
        if (Tamsa_PutObjectMetaInfo(database, 1, 1, answerJson({numberedObject(12)}).c_str()) == 1) {
            ::kill(::getpid(), SIGKILL);
        }
        ::_exit(3);
    }
    int status = 0;
    ASSERT_EQ(waitpid(child, &status, 0), child);
    ASSERT_TRUE(WIFSIGNALED(status)) << "the child's ingest failed";

    // A writer killed half-way through a row leaves a torn tail in the vector files: the next
    // ingest cuts it off and appends whole rows after the last whole one.
    for (const char* file : {"/features/L1.body.f32", "/features/L1.body.rows"}) {
        std::ofstream(storagePath() + file, std::ios::app | std::ios::binary) << "torn row";
    }
    m_database = openHandle();
    ASSERT_EQ(put(1, {numberedObject(13)}), 1);
    EXPECT_EQ(searchIds(QueryOptions()), (Ids{11, 12, 13}));
    for (uint32_t id : {11, 12, 13}) {
        const std::vector<ResultCopy> hits = search(at({1}, "", jsonArray(randomUnitVector(id))));
        ASSERT_EQ(idsOf(hits), Ids{id});
        EXPECT_GT(hits[0].score, 0.999f);
    }
}

// Abort from another thread: a Next that starts after Abort returned never delivers a record, the
// search ends with the abort code, and every later Next says so too.
TEST_F(TamsaLifecycleTest, AbortFromAnotherThreadEndsTheSearch)
{
    ASSERT_EQ(put(1, numberedObjects(1, 3000, false)), 3000);
    std::vector<uint32_t> locations;
    const TTAMSA_OBJECTMETAINFO_QUERY query = makeQuery(QueryOptions(), &locations);
    void* search = nullptr;
    ASSERT_EQ(Tamsa_GetObjectMetaInfoFirst(m_database, &query, &search), TAMSA_OK);
    std::atomic<int> delivered{0};
    std::atomic<bool> abortCalled{false}, abortReturned{false};
    int32_t endStatus = 0;
    int lateRecords = 0;
    TTAMSA_OBJECTMETAINFO_RESULT record{};
    record.wSize = sizeof record;
    std::thread reader([&]() {
        for (bool afterAbort = false; (endStatus = Tamsa_GetObjectMetaInfoNext(search, &record)) == TAMSA_OK;
             afterAbort = abortReturned) {
            lateRecords += afterAbort;
            if (++delivered == 50) { // the search must not run out before Abort is called
                while (!abortCalled) {
                    std::this_thread::yield();
                }
            }
            std::this_thread::sleep_for(std::chrono::microseconds(500)); // a slow consumer
        }
    });
    while (delivered < 50) {
        std::this_thread::yield();
    }
    abortCalled = true;
    Tamsa_GetObjectMetaInfoAbort(search);
    abortReturned = true;
    reader.join();
    EXPECT_EQ(endStatus, TAMSA_E_ABORTED);
    EXPECT_EQ(lateRecords, 0) << "records delivered by a Next that started after Abort returned";
    EXPECT_EQ(Tamsa_GetObjectMetaInfoNext(search, &record), TAMSA_E_ABORTED) << "and stays ended";
    Tamsa_GetObjectMetaInfoClose(search);

    // During a feature scan, Abort lands at some point of it (or just before it).
    for (uint32_t location = 2; location <= 4; ++location) {
        ASSERT_EQ(put(location, numberedObjects(location * 10000, 2000)), 2000);
    }
    const QueryOptions options = at({2, 3, 4}, "", jsonArray(randomUnitVector(20005)));
    EXPECT_EQ(searchIds(options), Ids{20005});
    const TTAMSA_OBJECTMETAINFO_QUERY scan = makeQuery(options, &locations);
    for (int delayMicroseconds : {0, 100, 300, 1000}) {
        ASSERT_EQ(Tamsa_GetObjectMetaInfoFirst(m_database, &scan, &search), TAMSA_OK);
        std::thread aborter([&]() {
            std::this_thread::sleep_for(std::chrono::microseconds(delayMicroseconds));
            Tamsa_GetObjectMetaInfoAbort(search);
        });
        int32_t status = TAMSA_OK;
        for (int count = 0;
             count < 10 && (status = Tamsa_GetObjectMetaInfoNext(search, &record)) == TAMSA_OK;) {
            ++count;
        }
        aborter.join();
        EXPECT_TRUE(status == TAMSA_E_ABORTED || status == TAMSA_E_NO_MORE_RECORDS) << status;
        EXPECT_EQ(Tamsa_GetObjectMetaInfoNext(search, &record), TAMSA_E_ABORTED);
        Tamsa_GetObjectMetaInfoClose(search);
    }
}

TEST_F(TamsaLifecycleTest, HandlesSearchAndIngestOnSeveralThreadsAtOnce)
{
    ASSERT_EQ(put(1, numberedObjects(1, 400)), 400);
    ASSERT_EQ(put(2, numberedObjects(1001, 400)), 400);
    const QueryOptions plain = at({1, 2}, R"({"Gender":1})"),
                       feature = at({1, 2}, "", jsonArray(randomUnitVector(1100)));
    const Ids expectedPlain = searchIds(plain);
    ASSERT_EQ(expectedPlain.size(), 400u);
    ASSERT_EQ(searchIds(feature), Ids{1100});
    std::atomic<int> mismatches{0};
    std::vector<std::thread> threads;
    for (int t = 0; t < 3; ++t) {
        threads.emplace_back([&, t]() {
            void* handle = openHandle();
            for (int round = 0; round < 15; ++round) {
                int32_t status = 0;
                const Ids ids = idsOf(searchStore(handle, t % 2 ? feature : plain, &status));
                mismatches += status != TAMSA_E_NO_MORE_RECORDS || ids != (t % 2 ? Ids{1100} : expectedPlain);
            }
            Tamsa_ReleaseDatabase(&handle);
        });
    }
    // Meanwhile another handle keeps ingesting into a third location.
    threads.emplace_back([&]() {
        void* handle = openHandle();
        for (int round = 0; round < 10; ++round) {
            const std::string answer = answerJson(numberedObjects(5000 + round * 10, 10));
            mismatches += Tamsa_PutObjectMetaInfo(handle, 1, 3, answer.c_str()) != 10;
        }
        Tamsa_ReleaseDatabase(&handle);
    });
    for (std::thread& thread : threads) {
        thread.join();
    }
    EXPECT_EQ(mismatches.load(), 0);
    EXPECT_EQ(searchIds(at({3})).size(), 100u);
    // Vectors ingested after a search mapped the files are found by the next search.
    EXPECT_EQ(searchIds(at({3}, "", jsonArray(randomUnitVector(5099)))), Ids{5099});
    ASSERT_EQ(put(3, numberedObjects(7000, 5)), 5);
    EXPECT_EQ(searchIds(at({3}, "", jsonArray(randomUnitVector(7004)))), Ids{7004});
}

} // namespace
