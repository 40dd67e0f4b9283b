// Fuzz target: the store's ingest (Tamsa_PutObjectMetaInfo) and the read-back of what it stored.
// Byte 0 is the group ID (signed), the rest the camera answer text. Each input is stored under a
// location of its own, so that the search that follows (First/Next/Close over that location and
// all time) sees exactly this input's objects: as many as the ingest counted, each with unique
// ID, an end not before its start, whole trajectory points, and attribute and thumbnail texts
// that read as JSON objects. Anything else, or a status that is neither a count nor a refusal,
// is a crash.
#include "Tamsa.h"

#include <QCoreApplication>
#include <QDir>
#include <QFileInfo>
#include <QJsonDocument>
#include <QTemporaryDir>
#include <cstdint>
#include <cstdio>
#include <cstdlib>
#include <set>
#include <string>

namespace {

void check(bool condition, const char* what)
{
    if (!condition) {
        std::fprintf(stderr, "fuzz_store_ingest: %s\n", what);
        std::abort();
    }
}

bool isJsonObject(const char* text)
{
    return text && QJsonDocument::fromJson(QByteArray(text)).isObject();
}

// Stores and vaults write through to their files on every change; a memory file system, where
// there is one, keeps an input at milliseconds rather than at the disk's sync time.
QString scratchFolder()
{
    const QFileInfo memory(QStringLiteral("/dev/shm"));
    return memory.isDir() && memory.isWritable() ? memory.filePath() : QDir::tempPath();
}

// A storage folder per generation of inputs, one location per input within it; the folder of a
// generation long gone is deleted so that the files stay small however long the run.
class Storage
{
public:
    static constexpr uint32_t kLocationsPerStore = 256;
    static constexpr int kGenerationsKept = 6;

    Storage()
        : m_root(QDir(scratchFolder()).filePath(QStringLiteral("fuzz_store_ingest-XXXXXX")))
    {
        check(m_root.isValid(), "no temporary folder");
    }
    ~Storage() { close(); }

    QString folder() const { return m_root.path(); }

    // The database handle and the location for the next input.
    void* next(uint32_t* location)
    {
        if (!m_database || m_location == kLocationsPerStore) {
            open();
        }
        *location = ++m_location;
        return m_database;
    }

private:
    void open()
    {
        close();
        ++m_generation;
        QDir(m_root.filePath(QString::number(m_generation - kGenerationsKept))).removeRecursively();
        unsigned char record[704] = {0xC0, 0x02}; // wSize 704
        check(Tamsa_InitDatabase(&m_database, record, 0) == TAMSA_OK, "no database handle");
        const QByteArray path = m_root.filePath(QString::number(m_generation)).toUtf8();
        check(Tamsa_SetStoragesDBPath(m_database, path.constData()) == TAMSA_OK, "no storage folder");
        m_location = 0;
    }
    void close()
    {
        if (m_database) {
            Tamsa_ReleaseDatabase(&m_database);
        }
    }

    QTemporaryDir m_root;
    void* m_database = nullptr;
    uint32_t m_location = 0;
    int m_generation = 0;
};

} // namespace

extern "C" int LLVMFuzzerTestOneInput(const uint8_t* data, size_t size)
{
    if (size < 1) {
        return 0;
    }
    static int argc = 1;
    static char name[] = "fuzz";
    static char* argv[] = {name, nullptr};
    static QCoreApplication* app = QCoreApplication::instance() ? nullptr : new QCoreApplication(argc, argv);
    (void)app;
    static Storage* storage = new Storage;
    // The objects stay to the end (threads may still use them); only their files go then.
    static const int removal = std::atexit([]() { QDir(storage->folder()).removeRecursively(); });
    (void)removal;

    uint32_t location = 0;
    void* database = storage->next(&location);
    const int32_t groupId = int8_t(data[0]);
    // A C text: whatever follows a NUL is not part of it.
    const std::string text(reinterpret_cast<const char*>(data + 1), size - 1);
    const int32_t stored = Tamsa_PutObjectMetaInfo(database, groupId, int32_t(location), text.c_str());
    check(stored >= 0 || stored == TAMSA_E_BAD_JSON,
          "an ingest status that is neither a count nor a refusal");

    const uint32_t locations[] = {location, 0};
    TTAMSA_OBJECTMETAINFO_QUERY query{};
    query.wSize = sizeof query;
    query.dwStartTime = 0;
    query.dwEndTime = 0xFFFFFFFFu;
    query.pdwLocationIds = locations;
    void* search = nullptr;
    check(Tamsa_GetObjectMetaInfoFirst(database, &query, &search) == TAMSA_OK, "the read-back search failed");
    std::set<uint64_t> ids;
    int32_t status = TAMSA_OK;
    for (;;) {
        TTAMSA_OBJECTMETAINFO_RESULT result{};
        result.wSize = sizeof result;
        status = Tamsa_GetObjectMetaInfoNext(search, &result);
        if (status != TAMSA_OK) {
            break;
        }
        check(result.dwLocationNumber == location, "an object of another location");
        check(ids.insert(result.qwObjectId).second, "an ID handed out twice");
        check(result.pszObjectType != nullptr, "no object type");
        check(result.dwStartTime <= result.dwEndTime, "an end before the start");
        check(result.dwTrajectoryBytes % 16 == 0, "a trajectory of partial points");
        check(result.dwTrajectoryBytes == 0 || result.pTrajectory != nullptr,
              "trajectory bytes without points");
        for (uint32_t i = 0; i < result.dwTrajectoryBytes / sizeof(double); ++i) {
            volatile double coordinate = result.pTrajectory[i]; // every byte counted is readable
            (void)coordinate;
        }
        check(isJsonObject(result.pszAttributes), "attributes that are not a JSON object");
        check(isJsonObject(result.pszThumbnails), "thumbnails that are not a JSON object");
    }
    Tamsa_GetObjectMetaInfoClose(search);
    check(status == TAMSA_E_NO_MORE_RECORDS, "the read-back ended in a failure");
    check(ids.size() == size_t(stored > 0 ? stored : 0), "not as many objects read back as stored");
    return 0;
}
