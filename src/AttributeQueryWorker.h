#pragma once
// Runs searches against the object-metadata store: the attribute search (query) and the
// re-identification search (reId), one at a time, on the thread that calls them; stop() may
// come from any other thread. Hits are handed to the caller's callback as search records,
// one by one, followed by exactly one final call.
//
// Stops are tied to searches: every search has a generation number (how many searches this
// worker had finished when it began); stop(generation) reaches only that search and is
// dropped once it is over, so a stop that arrives late never ends the next one.

#include "TamsaWrapper.h"

#include <QString>
#include <QStringList>
#include <QVariantList>
#include <QVariantMap>

#include <atomic>
#include <functional>
#include <map>
#include <memory>
#include <mutex>
#include <string>
#include <thread>
#include <vector>

class AttributeQueryWorker
{
public:
    // (finished, search record): (false, hit) once per hit, then (true, empty map) once.
    using Callback = std::function<void(bool finished, const QVariantMap& record)>;

    // How the store's JSON texts become variants. Both give the same search record; the
    // document route is the reference the fast one is held to.
    enum class JsonRoute
    {
        Fast,
        QtDocument,
    };

    static constexpr int kMaxHits = 201;
    static constexpr float kScoreThreshold = 0.5f;
    // getObjectMetaInfoFirst's status when the request names no location.
    static constexpr long kNoLocation = -1;
    static constexpr long kEndOfRecords = TAMSA_E_NO_MORE_RECORDS;

    AttributeQueryWorker();
    virtual ~AttributeQueryWorker();

    AttributeQueryWorker(const AttributeQueryWorker&) = delete;
    AttributeQueryWorker& operator=(const AttributeQueryWorker&) = delete;

    // At most kMaxHits hits in store order, then the final call; all on the calling thread.
    virtual void query(const QVariantMap& params, const Callback& callback);
    // Ends the search that runs now, or the next one if none runs yet.
    virtual void stop();
    // One store search per location of "locIDList" (on a pool of periods threads when
    // parallel); people scored by cosine similarity and kept from kScoreThreshold on. The
    // callback is then called from several threads at once; the final call comes last.
    virtual void reId(const QVariantMap& params, const Callback& callback);
    virtual TTAMSA_TZDS getTamsaTZDS() const;
    // Cosine similarity of a[0..n) and b[0..n) in float, in index order; 0 when either is
    // shorter than n or the result is not a number, 1 when both are all zeros.
    virtual float getScore(const std::vector<float>& a, const QVariantList& b, int n) const;

    // The generation of the search that runs now, or of the next one when none runs.
    quint64 searchGeneration() const;
    // Ends the search of that generation if it has not finished; false when it has.
    bool stop(quint64 generation);

    // Configuration: set before searches run, never while one runs.
    void setTamsa(std::shared_ptr<TamsaWrapper> tamsa);
    void setPeriods(int periods); // below 1 becomes 1
    void setParallel(bool parallel);
    int periods() const { return m_periods.load(); }
    bool parallel() const { return m_bParallel.load(); }

    // Opens a store search for the request: 0 with a search in *search, kNoLocation when no
    // location remains, else the store's status. *database is always initialised; the
    // caller releases it.
    long getObjectMetaInfoFirst(const QVariantMap& params, void** database, void** search) const;
    // The query record from converted values. It points into the texts and the location
    // array passed in, which must outlive its use. Times are clamped to 32-bit seconds.
    TTAMSA_OBJECTMETAINFO_QUERY
    composeQueryCondition(qint64 startMs, qint64 endMs, const std::string& humanOther,
                          const std::string& humanPrimary, const std::string& vehicleOther,
                          const std::string& vehiclePrimary, bool loitering, const std::string& trace,
                          uint32_t duration, int direction, const std::vector<uint32_t>& locations,
                          bool descending, bool doNotSort, const std::string& feature,
                          const std::string& faceFeature, const std::string& plateNumber) const;
    // Splits a JSON object into [the other members, the members named by keys], both compact
    // JSON ("{}" at least); an empty text gives two empty texts.
    QStringList extractAndRemoveKeyFromJson(const QString& json, const QStringList& keys) const;
    static TTAMSA_TZDS makeTZDS(int standardBiasMinutes, bool daylight);

    // One store result record as a search record.
    static QVariantMap toSearchRecord(const TTAMSA_OBJECTMETAINFO_RESULT& result,
                                      JsonRoute route = JsonRoute::Fast);

    // Searches the one location of params' "locIDList"; only (false, hit) calls.
    void partialReIdSearch(const QVariantMap& params, const Callback& callback);
    void calculateScore(std::vector<float> face, std::vector<float> body, QVariantMap& record) const;
    // The calling thread's open search, which stop() aborts; a second call replaces it.
    void setTamsaHandle(void* search);
    void removeTamsaHandle();

private:
    // A request's conditions as the store query needs them, read once.
    struct StoreRequest
    {
        qint64 startMs = 0;
        qint64 endMs = 0;
        std::string humanOther;
        std::string humanPrimary;
        std::string vehicleOther;
        std::string vehiclePrimary;
        bool loitering = false;
        std::string trace;
        uint32_t duration = 0;
        int direction = 0;
        std::vector<uint32_t> locations; // with the closing 0; empty when none remains
        bool descending = false;
        bool doNotSort = false;
        std::string feature;
        std::string faceFeature;
        std::string plateNumber;
    };
    StoreRequest readRequest(const QVariantMap& params) const;
    static std::vector<uint32_t> locationNumbers(const QStringList& locationIds);
    // Initialises *database, then opens the search of request over locations.
    long openSearch(const StoreRequest& request, const std::vector<uint32_t>& locations, void** database,
                    void** search) const;
    // What a re-identification asks the store for one location: people, no other condition.
    static QVariantMap reIdStoreRequest(const QVariantMap& params);
    void searchLocation(const StoreRequest& request, const std::vector<uint32_t>& locations,
                        const std::vector<float>& body, const std::vector<float>& face,
                        const Callback& callback);

    // Clears the stop flag and moves on to the next generation, under m_mutex.
    void finishSearch();
    void abortRegisteredSearches(); // REQUIRES: m_mutex held
    bool deliver(const Callback& callback, bool finished, const QVariantMap& record) const;

    mutable std::mutex m_mutex;
    std::map<std::thread::id, void*> m_tamsaHandles; // guarded by m_mutex
    quint64 m_generation = 0;                        // guarded by m_mutex
    // Written under m_mutex, read without it by the record loops.
    std::atomic<bool> m_bStop{false};

    // Configuration, see setTamsa: read by the searching threads, written only while idle.
    std::shared_ptr<TamsaWrapper> m_tamsa;
    std::atomic<int> m_periods{1};
    std::atomic<bool> m_bParallel{true};
};
