#include "FakeTamsaWrapper.h"

#include <algorithm>
#include <chrono>
#include <cstring>
#include <thread>

struct FakeTamsaWrapper::Search
{
    std::vector<FakeObject> objects;
    std::size_t next = 0;
    int delivered = 0;
    bool aborted = false; // guarded by the wrapper's m_mutex
    FakeObject current;   // what the last result record points into
};

namespace {

int g_databaseToken = 0;

std::optional<std::string> text(const char* value)
{
    return value ? std::optional<std::string>(value) : std::nullopt;
}

} // namespace

FakeTamsaWrapper::~FakeTamsaWrapper() = default;

std::vector<CapturedQuery> FakeTamsaWrapper::queries() const
{
    std::lock_guard<std::mutex> lock(m_mutex);
    return m_queries;
}

bool FakeTamsaWrapper::waitForHeldNext(int count, int timeoutMs)
{
    std::unique_lock<std::mutex> lock(m_mutex);
    return m_changed.wait_for(lock, std::chrono::milliseconds(timeoutMs),
                              [&] { return m_heldNext >= count; });
}

long FakeTamsaWrapper::initDatabase(void** database)
{
    ++m_initCount;
    *database = &g_databaseToken;
    return initStatus;
}

long FakeTamsaWrapper::releaseDatabase(void** database)
{
    ++m_releaseCount;
    *database = nullptr;
    return 0;
}

long FakeTamsaWrapper::GetObjectMetaInfoFirst(void*, const TTAMSA_OBJECTMETAINFO_QUERY* query, void** search)
{
    ++m_firstCount;
    CapturedQuery captured;
    captured.wSize = query->wSize;
    captured.start = query->dwStartTime;
    captured.end = query->dwEndTime;
    captured.tzds = query->tzds;
    const auto* bytes = reinterpret_cast<const unsigned char*>(query);
    captured.zeroPadding = bytes[2] == 0 && bytes[3] == 0 &&
                           std::all_of(bytes + 8, bytes + 12, [](auto b) { return b == 0; }) &&
                           std::all_of(bytes + 16, bytes + 20, [](auto b) { return b == 0; }) &&
                           std::all_of(bytes + 24, bytes + 40, [](auto b) { return b == 0; }) &&
                           std::all_of(bytes + 100, bytes + 104, [](auto b) { return b == 0; });
    for (const uint32_t* id = query->pdwLocationIds; id; ++id) {
        captured.locations.push_back(*id);
        if (*id == 0) {
            break;
        }
    }
    captured.objectType = text(query->pszObjectType);
    captured.primaryAttributes = text(query->pszPrimaryAttributes);
    captured.otherAttributes = text(query->pszOtherAttributes);
    captured.trace = text(query->pszTrace);
    captured.duration = query->dwDuration;
    captured.loitering = query->bLoitering;
    captured.descending = query->bDescending;
    captured.direction = query->nDirection;
    captured.doNotSort = query->bDoNotSort;
    captured.feature = text(query->pszFeature);
    captured.faceFeature = text(query->pszFaceFeature);
    captured.plateNumber = text(query->pszPlateNumber);
    {
        std::lock_guard<std::mutex> lock(m_mutex);
        m_queries.push_back(captured);
    }
    if (firstStatus != 0) {
        *search = nullptr;
        return firstStatus;
    }
    auto* opened = new Search;
    for (const FakeObject& object : objects) {
        // The store reads the location list up to its first 0.
        const auto stop = std::find(captured.locations.begin(), captured.locations.end(), 0u);
        if (std::find(captured.locations.begin(), stop, object.location) != stop) {
            opened->objects.push_back(object);
        }
    }
    *search = opened;
    const int open = ++m_openSearches;
    int seen = m_maxOpenSearches.load();
    while (open > seen && !m_maxOpenSearches.compare_exchange_weak(seen, open)) {
    }
    return 0;
}

long FakeTamsaWrapper::GetObjectMetaInfoNext(void* handle, TTAMSA_OBJECTMETAINFO_RESULT* result)
{
    auto* search = static_cast<Search*>(handle);
    if (!search || result->wSize != sizeof(TTAMSA_OBJECTMETAINFO_RESULT)) {
        return TAMSA_E_INVALID_ARGUMENT;
    }
    if (holdUntilAbort) {
        std::unique_lock<std::mutex> lock(m_mutex);
        ++m_heldNext;
        m_changed.notify_all();
        m_changed.wait(lock, [search] { return search->aborted; });
        --m_heldNext;
        return TAMSA_E_ABORTED;
    }
    if (nextDelayMs > 0) {
        std::this_thread::sleep_for(std::chrono::milliseconds(nextDelayMs));
    }
    {
        std::lock_guard<std::mutex> lock(m_mutex);
        if (search->aborted) {
            return TAMSA_E_ABORTED;
        }
    }
    if (failNextAfter >= 0 && search->delivered >= failNextAfter) {
        return failNextStatus;
    }
    if (search->next >= search->objects.size()) {
        return TAMSA_E_NO_MORE_RECORDS;
    }
    search->current = search->objects[search->next++];
    ++search->delivered;
    const FakeObject& object = search->current;
    std::memset(result, 0, sizeof *result);
    result->wSize = sizeof(TTAMSA_OBJECTMETAINFO_RESULT);
    result->qwObjectId = object.id;
    result->dwLocationNumber = object.location;
    result->pszObjectType = object.type.c_str();
    result->pszAttributes = object.attributes.c_str();
    result->dwStartTime = object.start;
    result->dwEndTime = object.end;
    result->pTrajectory = object.nullTrajectory ? nullptr : object.trajectory.data();
    result->dwTrajectoryBytes = object.trajectoryBytes ? *object.trajectoryBytes
                                                       : uint32_t(object.trajectory.size() * sizeof(double));
    result->pszThumbnails = object.thumbnails.c_str();
    result->fScore = object.score;
    result->fFaceScore = object.faceScore;
    return 0;
}

void FakeTamsaWrapper::GetObjectMetaInfoClose(void* handle)
{
    ++m_closeCount;
    --m_openSearches;
    delete static_cast<Search*>(handle);
}

void FakeTamsaWrapper::GetObjectMetaInfoAbort(void* handle)
{
    ++m_abortCount;
    std::lock_guard<std::mutex> lock(m_mutex);
    static_cast<Search*>(handle)->aborted = true;
    m_changed.notify_all();
}
