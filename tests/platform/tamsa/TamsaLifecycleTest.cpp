// Ingest, durability, and the thread rules: Abort from another thread, handles used at once.
#include "StoreFixture.h"

#include <QJsonArray>
#include <QJsonDocument>
#include <QJsonObject>

#include <atomic>
#include <chrono>
#include <csignal>
#include <fstream>
#include <sys/wait.h>
#include <thread>
#include <unistd.h>

using namespace storetest;

namespace {

class TamsaLifecycleTest : public StoreFixture
{
protected:
    std::vector<ObjectSpec> manyObjects(uint64_t firstId, size_t count, bool withVectors)
    {
        std::vector<ObjectSpec> objects;
        for (size_t i = 0; i < count; ++i) {
            ObjectSpec object;
            object.id = firstId + i;
            object.start = uint32_t(1000 + i);
            object.end = object.start + 3;
            object.attributes = R"({"Gender":)" + std::to_string(i % 2) + "}";
            if (withVectors) {
                object.body = randomUnitVector(uint32_t(firstId + i));
            }
            objects.push_back(object);
        }
        return objects;
    }
};

TEST_F(TamsaLifecycleTest, ReingestReplacesWithoutDuplicates)
{
    const std::vector<float> oldVector = randomUnitVector(1);
    const std::vector<float> newVector = randomUnitVector(2);
    ASSERT_EQ(put(1, {{42, "Human", 1000, 1010, R"({"Gender":0})", {}, oldVector}}), 1);
    const ObjectSpec object{42, "Human", 1000, 1010, R"({"Gender":1})", {}, newVector};
    ASSERT_EQ(put(1, {object}), 1);
    ASSERT_EQ(put(2, {object}), 1) << "the key is (location, ID)";

    QueryOptions options;
    const std::vector<ResultCopy> results = search(options);
    ASSERT_EQ(results.size(), 1u);
    EXPECT_NE(results[0].attributes.find("\"Gender\":1"), std::string::npos);
    options.feature = jsonArray(oldVector);
    EXPECT_TRUE(search(options).empty()) << "the replaced vector is no longer searched";
    options.feature = jsonArray(newVector);
    EXPECT_EQ(searchIds(options), Ids{42});
    options.locations = {1, 2};
    EXPECT_EQ(search(options).size(), 2u);

    // The same ID twice in one answer: the later one wins.
    EXPECT_EQ(put(3, {{7, "Human", 1, 2, R"({"Age":"Young"})"}, {7, "Human", 1, 2, R"({"Age":"Old"})"}}), 1);
    options = QueryOptions();
    options.locations = {3};
    options.primary = R"({"Age":"Old"})";
    EXPECT_EQ(searchIds(options), Ids{7});
}

TEST_F(TamsaLifecycleTest, BadIngestInputIsRefusedOrSkipped)
{
    EXPECT_EQ(putText(1, "not json"), TAMSA_E_BAD_JSON);
    EXPECT_EQ(putText(1, "[]"), TAMSA_E_BAD_JSON);
    EXPECT_EQ(putText(1, R"({"Objects":[]})"), TAMSA_E_BAD_JSON);
    EXPECT_EQ(putText(1, R"({"ObjectMetaInfo":{}})"), TAMSA_E_BAD_JSON);
    EXPECT_EQ(putText(1, std::string(100000, '[') + std::string(100000, ']')), TAMSA_E_BAD_JSON);
    // A text that is not UTF-8 makes the answer unreadable, as it would be to any reader of the texts
    // the store hands out: a stray continuation byte, a cut sequence, overlong forms, an encoded
    // surrogate, beyond U+10FFFF, bytes UTF-8 never uses, and a bad escape.
    for (const char* text : {"\x97", "\xC7 ", "\xE4\xBA", "\xC0\xAF", "\xE0\x80\xAF", "\xED\xA0\x80",
                             "\xF4\x90\x80\x80", "\xF8\x88\x80\x80\x80", "\xFF", "\\u12", "\\q"}) {
        EXPECT_EQ(putText(1, std::string(R"({"ObjectMetaInfo":[{"ID":3,"ObjectType":"Human","StartTime":1,)"
                                         R"("EndTime":2,"Attributes":{"Age":")") +
                                 text + "\"}}]}"),
                  TAMSA_E_BAD_JSON)
            << text;
    }
    EXPECT_EQ(putText(1, R"({"ObjectMetaInfo":[]})"), 0);
    EXPECT_EQ(putText(0, R"({"ObjectMetaInfo":[]})"), TAMSA_E_INVALID_ARGUMENT);
    EXPECT_EQ(Tamsa_PutObjectMetaInfo(m_database, 1, 1, nullptr), TAMSA_E_INVALID_ARGUMENT);
    EXPECT_EQ(Tamsa_PutObjectMetaInfo(nullptr, 1, 1, "{}"), TAMSA_E_INVALID_ARGUMENT);

    ObjectSpec good;
    good.id = 50;
    std::string shortFeature = objectJson(good); // a 3-number feature
    good.id = 5;
    shortFeature.replace(shortFeature.find("\"image\""), 0, "\"feature\":[1,2,3],");
    const std::string deep = std::string(1000, '[') + std::string(1000, ']');
    const std::vector<std::string> bad = {
        R"({"ObjectType":"Human","StartTime":1,"EndTime":2})",            // no ID
        R"({"ID":"9","ObjectType":"Human","StartTime":1,"EndTime":2})",   // ID as text
        R"({"ID":-9,"ObjectType":"Human","StartTime":1,"EndTime":2})",    // negative ID
        R"({"ID":1e400,"ObjectType":"Human","StartTime":1,"EndTime":2})", // huge ID
        R"({"ID":18446744073709551616,"ObjectType":"Human","StartTime":1,"EndTime":2})",
        R"({"ID":9,"ObjectType":7,"StartTime":1,"EndTime":2})",               // type not a text
        R"({"ID":9,"ObjectType":"Human","StartTime":"NaN","EndTime":2})",     // time not a number
        R"({"ID":9,"ObjectType":"Human","StartTime":1e300,"EndTime":1e301})", // time out of range
        R"({"ID":9,"ObjectType":"Human","StartTime":5,"EndTime":2})",         // ends before it starts
        R"({"ID":9,"ObjectType":"Human","StartTime":1,"EndTime":2,"Attributes":[1]})",
        R"({"ID":9,"ObjectType":"Human","StartTime":1,"EndTime":2,"Trajectory":[{"x":1}]})",
        R"({"ID":9,"ObjectType":"Human","StartTime":1,"EndTime":2,"Thumbnail":{"image":1}})",
        shortFeature,
        "17",
        "null",
    };
    std::string answer = R"({"ObjectMetaInfo":[)" + objectJson(good);
    for (const std::string& element : bad) {
        answer += "," + element;
    }
    answer += "]}";
    EXPECT_EQ(putText(1, answer), 1) << "only the good element is stored";
    // Nesting beyond what any camera sends makes the whole text unreadable: nothing is stored.
    good.id = 8;
    const std::string nested =
        R"({"ObjectMetaInfo":[)" + objectJson(good) +
        R"(,{"ID":9,"ObjectType":"Human","StartTime":1,"EndTime":2,"Attributes":{"a":)" + deep + "}}]}";
    EXPECT_EQ(putText(1, nested), TAMSA_E_BAD_JSON);
    QueryOptions options;
    EXPECT_EQ(searchIds(options), Ids{5});

    void* unset = nullptr;
    unsigned char record[704] = {0xC0, 0x02};
    ASSERT_EQ(Tamsa_InitDatabase(&unset, record, 0), TAMSA_OK);
    EXPECT_EQ(Tamsa_PutObjectMetaInfo(unset, 1, 1, R"({"ObjectMetaInfo":[]})"), TAMSA_E_NO_STORAGE_PATH);
    EXPECT_EQ(Tamsa_SetStoragesDBPath(unset, ""), TAMSA_E_NO_STORAGE_PATH);
    EXPECT_EQ(Tamsa_SetStoragesDBPath(unset, "/proc/no/such/place"), TAMSA_E_IO);
    EXPECT_EQ(Tamsa_ReleaseDatabase(&unset), TAMSA_OK);
    EXPECT_EQ(unset, nullptr);
    record[0] = 0;
    EXPECT_EQ(Tamsa_InitDatabase(&unset, record, 0), TAMSA_E_INVALID_ARGUMENT);
    EXPECT_EQ(unset, nullptr);
}

TEST_F(TamsaLifecycleTest, StoredObjectsSurviveReopeningAndAKilledProcess)
{
    const auto withVector = [](uint32_t id) {
        return ObjectSpec{id, "Human", 1000, 1010, "{}", {}, randomUnitVector(id)};
    };
    ASSERT_EQ(put(1, {withVector(11)}), 1);
    Tamsa_ReleaseDatabase(&m_database);

    // A child process stores an object and is killed at once, without any clean-up.
    const pid_t child = fork();
    ASSERT_GE(child, 0);
    if (child == 0) {
        void* database = openHandle();
        if (Tamsa_PutObjectMetaInfo(database, 1, 1, answerJson({withVector(12)}).c_str()) == 1) {
            ::kill(::getpid(), SIGKILL);
        }
        ::_exit(3);
    }
    int status = 0;
    ASSERT_EQ(waitpid(child, &status, 0), child);
    ASSERT_TRUE(WIFSIGNALED(status)) << "the child's ingest failed";

    m_database = openHandle();
    ASSERT_NE(m_database, nullptr);
    QueryOptions options;
    EXPECT_EQ(searchIds(options), (Ids{11, 12}));
    options.feature = jsonArray(randomUnitVector(12));
    EXPECT_EQ(searchIds(options), Ids{12}) << "the child's vector is on disk too";

    // A writer killed half-way through a row leaves a torn tail in the vector files: the next
    // ingest cuts it off and appends whole rows after the last whole one.
    Tamsa_ReleaseDatabase(&m_database);
    for (const char* file : {"/features/L1.body.f32", "/features/L1.body.rows"}) {
        std::ofstream(storagePath() + file, std::ios::app | std::ios::binary) << "torn row";
    }
    m_database = openHandle();
    ASSERT_EQ(put(1, {withVector(13)}), 1);
    for (uint32_t id : {11, 12, 13}) {
        options.feature = jsonArray(randomUnitVector(id));
        const std::vector<ResultCopy> hits = search(options);
        ASSERT_EQ(idsOf(hits), Ids{id});
        EXPECT_GT(hits[0].score, 0.999f);
    }
}

// Abort from another thread: a Next that starts after Abort returned never delivers a record, the
// search ends with the abort code, and every later Next says so too.
TEST_F(TamsaLifecycleTest, AbortFromAnotherThreadEndsTheSearch)
{
    ASSERT_EQ(put(1, manyObjects(1, 3000, false)), 3000);
    QueryOptions options;
    std::vector<uint32_t> locations;
    const TTAMSA_OBJECTMETAINFO_QUERY query = makeQuery(options, &locations);
    void* search = nullptr;
    ASSERT_EQ(Tamsa_GetObjectMetaInfoFirst(m_database, &query, &search), TAMSA_OK);

    std::atomic<int> delivered{0};
    std::atomic<bool> abortCalled{false};
    std::atomic<bool> abortReturned{false};
    int32_t endStatus = 0;
    int lateRecords = 0;
    std::thread reader([&]() {
        TTAMSA_OBJECTMETAINFO_RESULT record{};
        record.wSize = sizeof record;
        for (;;) {
            const bool afterAbort = abortReturned;
            if ((endStatus = Tamsa_GetObjectMetaInfoNext(search, &record)) != TAMSA_OK) {
                break;
            }
            lateRecords += afterAbort;
            if (++delivered == 50) {
                while (!abortCalled) { // the search must not run out before Abort is called
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
    TTAMSA_OBJECTMETAINFO_RESULT record{};
    record.wSize = sizeof record;
    EXPECT_EQ(Tamsa_GetObjectMetaInfoNext(search, &record), TAMSA_E_ABORTED) << "and stays ended";
    Tamsa_GetObjectMetaInfoClose(search);

    // During a feature scan, Abort lands at some point of it (or just before it).
    for (uint32_t location = 2; location <= 4; ++location) {
        ASSERT_EQ(put(location, manyObjects(location * 10000, 2000, true)), 2000);
    }
    options.locations = {2, 3, 4};
    options.feature = jsonArray(randomUnitVector(20005));
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
    ASSERT_EQ(put(1, manyObjects(1, 400, true)), 400);
    ASSERT_EQ(put(2, manyObjects(1001, 400, true)), 400);
    QueryOptions plain;
    plain.locations = {1, 2};
    plain.primary = R"({"Gender":1})";
    QueryOptions feature;
    feature.locations = {1, 2};
    feature.feature = jsonArray(randomUnitVector(1100));
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
                if (status != TAMSA_E_NO_MORE_RECORDS || ids != (t % 2 ? Ids{1100} : expectedPlain)) {
                    ++mismatches;
                }
            }
            Tamsa_ReleaseDatabase(&handle);
        });
    }
    // Meanwhile another handle keeps ingesting into a third location.
    threads.emplace_back([&]() {
        void* handle = openHandle();
        for (int round = 0; round < 10; ++round) {
            const std::string answer = answerJson(manyObjects(5000 + round * 10, 10, true));
            if (Tamsa_PutObjectMetaInfo(handle, 1, 3, answer.c_str()) != 10) {
                ++mismatches;
            }
        }
        Tamsa_ReleaseDatabase(&handle);
    });
    for (std::thread& thread : threads) {
        thread.join();
    }
    EXPECT_EQ(mismatches.load(), 0);
    QueryOptions third;
    third.locations = {3};
    EXPECT_EQ(searchIds(third).size(), 100u);

    // Vectors ingested after a search mapped the files are found by the next search.
    third.feature = jsonArray(randomUnitVector(5099));
    EXPECT_EQ(searchIds(third), Ids{5099});
    ASSERT_EQ(put(3, manyObjects(7000, 5, true)), 5);
    third.feature = jsonArray(randomUnitVector(7004));
    EXPECT_EQ(searchIds(third), Ids{7004});
}

} // namespace
