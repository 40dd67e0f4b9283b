// delvix-host demo: the whole system on the built-in site. Simulated cameras and the
// configuration server run on loopback, the plug-in learns the cameras, synchronises their
// metadata into the store, and then a person's view of it: searches, a re-identification and
// a case with bookmarks, each with a line of explanation and a table, and a summary.
#include "HostCommand.h"
#include "PluginHost.h"
#include "SiteRunner.h"

#include <QCoreApplication>
#include <QDateTime>
#include <QDir>
#include <QElapsedTimer>
#include <QEventLoop>
#include <QFile>
#include <QJsonArray>
#include <QJsonDocument>
#include <QJsonObject>
#include <QThread>
#include <QTimer>
#include <cstdio>
#include <memory>
#include <mutex>

namespace {

int g_demoClient = 0;

struct Reply
{
    bool bFinal = false;
    QString strCode;
    QVariant payload;
};

struct StepTime
{
    QString name;
    qint64 ms = 0;
    int results = 0;
};

// Sends one request and collects its replies until the final one (or the time-out). Replies come
// from the plug-in's threads, perhaps after the time-out, so they go into a list both sides share
// under a lock: nothing of this call's frame is touched once it has returned, and the lock orders
// each payload before it is read here (Qt's event queue orders it too, but invisibly to
// ThreadSanitizer).
QList<Reply> request(PluginHost& host, const QString& command, const QVariant& params, int timeoutMs = 15000)
{
    struct Collected
    {
        std::mutex mutex;
        QList<Reply> replies; // guarded by mutex
        bool bFinal = false;  // guarded by mutex
    };
    auto collected = std::make_shared<Collected>();
    HDLR_DO_REQUEST_CB reply = [collected](bool bFinal, const QString& strCode, const QString&,
                                           const QVariant& payload) {
        std::lock_guard<std::mutex> lock(collected->mutex);
        collected->replies.append({bFinal, strCode, payload});
        collected->bFinal = collected->bFinal || bFinal;
    };
    RequestSenderInfo sender;
    sender.strSenderName = QStringLiteral("delvix-host demo");
    sender.senderHandle = &g_demoClient;
    host.request(command, params, sender, reply);
    QElapsedTimer timer;
    timer.start();
    QEventLoop loop;
    QTimer tick;
    QObject::connect(&tick, &QTimer::timeout, &loop, [&]() {
        std::lock_guard<std::mutex> lock(collected->mutex);
        if (collected->bFinal || timer.elapsed() >= timeoutMs) {
            loop.quit();
        }
    });
    tick.start(5);
    loop.exec();
    std::lock_guard<std::mutex> lock(collected->mutex);
    return collected->replies;
}

QList<QVariantMap> hitsOf(const QList<Reply>& replies)
{
    QList<QVariantMap> hits;
    for (const Reply& reply : replies) {
        if (!reply.bFinal && reply.payload.isValid()) {
            hits << reply.payload.toMap();
        }
    }
    return hits;
}

QString timeText(qint64 ms)
{
    return QDateTime::fromMSecsSinceEpoch(ms).toString(QStringLiteral("hh:mm:ss"));
}

// Attributes in the site's words, not its codes.
QString describe(const QVariantMap& hit, const AttributeVocabulary& words)
{
    if (hit.value(QStringLiteral("objType")).toString() == QLatin1String("Human")) {
        return QStringLiteral("%1, %2, %3 top, %4 bottom")
            .arg(words.describe(QStringLiteral("Age"), hit.value(QStringLiteral("objectAge"))),
                 words.describe(QStringLiteral("Gender"), hit.value(QStringLiteral("objectGender"))),
                 words.describe(QStringLiteral("UpperColor"), hit.value(QStringLiteral("objectUpperColor"))),
                 words.describe(QStringLiteral("LowerColor"), hit.value(QStringLiteral("objectLowerColor"))));
    }
    return QStringLiteral("%1 %2, plate %3")
        .arg(words.describe(QStringLiteral("Color"), hit.value(QStringLiteral("objectVehicleColor"))),
             words.describe(QStringLiteral("Type"), hit.value(QStringLiteral("objectVehicleType"))),
             hit.value(QStringLiteral("plateNumber")).toString());
}

void printHits(const QList<QVariantMap>& hits, const AttributeVocabulary& words, bool withScores,
               int limit = 8)
{
    if (hits.isEmpty()) {
        std::printf("   (no hits)\n");
        return;
    }
    std::printf("   %-12s %-8s %-6s %-14s %-8s %-8s %s\n", "object", "type", "loc", "camera", "from", "to",
                withScores ? "score / face  attributes" : "attributes");
    for (int i = 0; i < hits.size() && i < limit; ++i) {
        const QVariantMap& hit = hits[i];
        const QString scores = withScores
                                   ? QStringLiteral("%1 / %2  ")
                                         .arg(hit.value(QStringLiteral("score")).toDouble(), 0, 'f', 3)
                                         .arg(hit.value(QStringLiteral("faceScore")).toDouble(), 0, 'f', 3)
                                   : QString();
        std::printf("   %-12s %-8s %-6s %-14s %-8s %-8s %s%s\n",
                    qUtf8Printable(hit.value(QStringLiteral("objectID")).toString()),
                    qUtf8Printable(hit.value(QStringLiteral("objType")).toString()),
                    qUtf8Printable(hit.value(QStringLiteral("locID")).toString()),
                    qUtf8Printable(hit.value(QStringLiteral("nodeID")).toString()),
                    qUtf8Printable(timeText(hit.value(QStringLiteral("startTimestamp")).toLongLong())),
                    qUtf8Printable(timeText(hit.value(QStringLiteral("endTimestamp")).toLongLong())),
                    qUtf8Printable(scores), qUtf8Printable(describe(hit, words)));
    }
    if (hits.size() > limit) {
        std::printf("   ... and %lld more\n", static_cast<long long>(hits.size() - limit));
    }
}

// Runs the event loop until pred holds or the time is up.
template <typename Pred>
bool waitUntil(Pred pred, int timeoutMs)
{
    QElapsedTimer timer;
    timer.start();
    while (!pred() && timer.elapsed() < timeoutMs) {
        QCoreApplication::processEvents(QEventLoop::AllEvents, 50);
        QThread::msleep(10);
    }
    return pred();
}

bool writeText(const QString& path, const QByteArray& text)
{
    QFile file(path);
    return file.open(QIODevice::WriteOnly | QIODevice::Truncate) && file.write(text) == text.size();
}

QVariantMap caseItemFrom(const QVariantMap& hit, bool bNeedBookmark)
{
    return QVariantMap{{QStringLiteral("nodeID"), hit.value(QStringLiteral("nodeID"))},
                       {QStringLiteral("locID"), hit.value(QStringLiteral("locID"))},
                       {QStringLiteral("startTimestamp"), hit.value(QStringLiteral("startTimestamp"))},
                       {QStringLiteral("endTimestamp"), hit.value(QStringLiteral("endTimestamp"))},
                       {QStringLiteral("caseItemType"), 0},
                       {QStringLiteral("objImage"), hit.value(QStringLiteral("objImage"))},
                       {QStringLiteral("faceImage"), hit.value(QStringLiteral("faceImage"))},
                       {QStringLiteral("trajectory"), hit.value(QStringLiteral("trajectory"))},
                       {QStringLiteral("comment"),
                        QStringLiteral("seen at %1").arg(hit.value(QStringLiteral("locID")).toString())},
                       {QStringLiteral("needBookmark"), bNeedBookmark}};
}

} // namespace

int runDemo(const HostOptions& options)
{
    QElapsedTimer total;
    total.start();
    QList<StepTime> steps;
    auto step = [&steps](const QString& name, QElapsedTimer& timer, int results) {
        steps.append({name, timer.elapsed(), results});
    };

    const QString dataDir = QFileInfo(options.dataDir).absoluteFilePath();
    if (!QDir().mkpath(dataDir)) {
        std::fprintf(stderr, "delvix-host demo: cannot create the data folder %s\n", qUtf8Printable(dataDir));
        return 1;
    }
    // The synchroniser reads its two settings files from the working folder: passes every two
    // seconds, right up to the present, so the demo has fresh metadata at once.
    const QString previousDir = QDir::currentPath();
    QDir::setCurrent(dataDir);
    if (!writeText(QStringLiteral("routineSyncTimeBuffer.txt"), "2\n") ||
        !writeText(QStringLiteral("getObjectDataTimeBuffer.txt"), "0\n")) {
        std::fprintf(stderr, "delvix-host demo: cannot write the settings files in %s\n",
                     qUtf8Printable(dataDir));
        return 1;
    }

    std::printf("Delvix demo: the plug-in in a development host, on a simulated site.\nData folder: %s\n",
                qUtf8Printable(dataDir));

    QElapsedTimer timer;
    timer.start();
    SiteRunner site(NovirSite::defaultSite());
    QString error;
    if (!site.start(QDir(dataDir).filePath(QStringLiteral("Server")), 6, &error)) {
        std::fprintf(stderr, "delvix-host demo: the site did not start: %s\n", qUtf8Printable(error));
        return 1;
    }
    const AttributeVocabulary& words = site.site().vocabulary;
    PluginHost host(dataDir);
    host.setNovirTunnelClient(&site.server());
    const QString module =
        options.modulePath.isEmpty() ? PluginHost::defaultModulePath() : options.modulePath;
    if (!host.load(module, &error)) {
        std::fprintf(stderr, "delvix-host: %s\n", qUtf8Printable(error));
        return 1;
    }

    // 1. The camera directory the plug-in learns from the configuration server.
    std::printf("\n== 1. Cameras: the plug-in asks the configuration server which cameras exist and where "
                "they record.\n");
    QVariantMap directory;
    const int expectedCameras = site.recordingLocations().size();
    waitUntil(
        [&]() {
            QMetaObject::invokeMethod(host.plugin(), "cameraDirectory", Qt::DirectConnection,
                                      Q_RETURN_ARG(QVariantMap, directory));
            return directory.size() >= expectedCameras;
        },
        15000);
    std::printf("   %-16s %-8s %-10s %s\n", "camera", "location", "protected", "address");
    QStringList locations;
    for (auto it = directory.cbegin(); it != directory.cend(); ++it) {
        const QVariantMap record = it.value().toMap();
        locations << record.value(QStringLiteral("Location")).toString();
        std::printf("   %-16s %-8s %-10s %s:%d\n", qUtf8Printable(it.key()),
                    qUtf8Printable(record.value(QStringLiteral("Location")).toString()),
                    record.value(QStringLiteral("DelvixProtect")).toBool() ? "yes" : "no",
                    qUtf8Printable(record.value(QStringLiteral("IP")).toString()),
                    record.value(QStringLiteral("Port")).toInt());
    }
    std::printf("   %lld of the site's %lld camera entries are in the directory (offline cameras, cameras "
                "without a location\n   and cameras that record no metadata are left out).\n",
                static_cast<long long>(directory.size()), static_cast<long long>(site.site().cameras.size()));
    step(QStringLiteral("camera directory"), timer, int(directory.size()));
    locations.removeDuplicates();

    // 2. Metadata: routine passes plus one explicit request for the last hour of every camera.
    std::printf(
        "\n== 2. Metadata: the synchroniser fetches every camera over HTTP (the protected one with an "
        "access token)\n   and asks each for its last hour; the configuration server stores what is "
        "forwarded.\n");
    timer.restart();
    const qint64 now = QDateTime::currentSecsSinceEpoch();
    for (auto it = directory.cbegin(); it != directory.cend(); ++it) {
        request(host, QStringLiteral("retrieveDelvixData"),
                QVariantMap{{QStringLiteral("nodeID"), it.key()},
                            {QStringLiteral("startTimestamp"), now - 3600},
                            {QStringLiteral("endTimestamp"), now}},
                50);
    }
    int lastCount = -1;
    QElapsedTimer stable;
    stable.start();
    waitUntil(
        [&]() {
            const int count = site.server().ingestedObjects();
            if (count != lastCount) {
                lastCount = count;
                stable.restart();
            }
            return count > 0 && stable.elapsed() > 3000;
        },
        60000);
    int served = 0;
    int protectedServed = 0;
    for (const ServedRequest& request : site.cameras().servedRequests()) {
        served += request.status == 200 ? 1 : 0;
        protectedServed += request.status == 200 && request.withAccessToken ? 1 : 0;
    }
    std::printf("   %d camera answers (%d with an access token), %d objects stored.\n", served,
                protectedServed, site.server().ingestedObjects());
    step(QStringLiteral("metadata synchronisation"), timer, site.server().ingestedObjects());

    const qint64 fromMs = (now - 3600) * 1000;
    const qint64 toMs = QDateTime::currentMSecsSinceEpoch();
    const QVariantMap window{{QStringLiteral("startTimestamp"), fromMs},
                             {QStringLiteral("endTimestamp"), toMs},
                             {QStringLiteral("locIDList"), locations}};

    // 3. Attribute search.
    std::printf("\n== 3. Attribute search: %s people (gender 1) over every location in the last hour, newest "
                "first.\n",
                qUtf8Printable(words.describe(QStringLiteral("Gender"), 1)));
    timer.restart();
    QVariantMap params = window;
    params.insert(QStringLiteral("humanInfo"), QStringLiteral("{\"Gender\":1}"));
    params.insert(QStringLiteral("descending"), true);
    const QList<QVariantMap> people = hitsOf(request(host, QStringLiteral("startSearch"), params));
    printHits(people, words, false);
    step(QStringLiteral("attribute search"), timer, int(people.size()));

    // 4. Plate search, from a vehicle the store holds.
    std::printf("\n== 4. Plate search: a partial plate with a wildcard.\n");
    timer.restart();
    params = window;
    params.insert(QStringLiteral("vehicleInfo"), QStringLiteral("{}"));
    const QList<QVariantMap> vehicles = hitsOf(request(host, QStringLiteral("startSearch"), params));
    QString plate = vehicles.isEmpty() ? QStringLiteral("A*")
                                       : vehicles.first().value(QStringLiteral("plateNumber")).toString();
    const QString pattern = plate.left(3) + QLatin1Char('*');
    params = window;
    params.insert(QStringLiteral("plateNumber"), pattern);
    const QList<QVariantMap> plates = hitsOf(request(host, QStringLiteral("startSearch"), params));
    std::printf("   plate \"%s\"\n", qUtf8Printable(pattern));
    printHits(plates, words, false);
    step(QStringLiteral("plate search"), timer, int(plates.size()));

    // 5. Rule search: objects that crossed the vertical middle line of the image.
    std::printf("\n== 5. Line crossing: objects whose path crossed the middle of the picture, left to right "
                "or back.\n");
    timer.restart();
    params = window;
    params.insert(QStringLiteral("ruleInfo"),
                  QVariantMap{{QStringLiteral("type"), QStringLiteral("lineCrossing")},
                              {QStringLiteral("trace"), QStringLiteral("[[0.5,0],[0.5,1]]")},
                              {QStringLiteral("direction"), 0}});
    const QList<QVariantMap> crossings = hitsOf(request(host, QStringLiteral("startSearch"), params));
    printHits(crossings, words, false);
    step(QStringLiteral("line-crossing search"), timer, int(crossings.size()));

    // 6. Re-identification of the first person found.
    std::printf(
        "\n== 6. Re-identification: where else was the first person of step 3 seen? (cosine >= 0.5)\n");
    timer.restart();
    QList<QVariantMap> sightings;
    if (!people.isEmpty()) {
        params = window;
        params.insert(QStringLiteral("feature"), people.first().value(QStringLiteral("feature")));
        sightings = hitsOf(request(host, QStringLiteral("startReIdSearch"), params));
        std::printf("   person %s at %s\n",
                    qUtf8Printable(people.first().value(QStringLiteral("objectID")).toString()),
                    qUtf8Printable(people.first().value(QStringLiteral("locID")).toString()));
        std::sort(sightings.begin(), sightings.end(), [](const QVariantMap& a, const QVariantMap& b) {
            return a.value(QStringLiteral("score")).toDouble() > b.value(QStringLiteral("score")).toDouble();
        });
        printHits(sightings, words, true);
        QStringList where;
        for (const QVariantMap& hit : std::as_const(sightings)) {
            where << hit.value(QStringLiteral("locID")).toString();
        }
        where.removeDuplicates();
        std::printf("   seen at %lld location(s): %s\n", static_cast<long long>(where.size()),
                    qUtf8Printable(where.join(QStringLiteral(", "))));
    } else {
        std::printf("   (no person to follow)\n");
    }
    step(QStringLiteral("re-identification"), timer, int(sightings.size()));

    // 7. A case: made from two sightings with bookmarks, a recording added, renamed, read, deleted.
    std::printf("\n== 7. Case workflow: a case from two hits with bookmarks on the recording server, a "
                "recording added,\n   the case renamed, read back, and deleted with its bookmarks.\n");
    timer.restart();
    QList<QVariantMap> evidence = sightings.isEmpty() ? people : sightings;
    int caseId = 0;
    bool caseOk = false;
    if (evidence.size() >= 1) {
        QVariantList items{caseItemFrom(evidence.first(), true)};
        if (evidence.size() >= 2) {
            items << caseItemFrom(evidence.at(1), true);
        }
        QList<Reply> replies = request(host, QStringLiteral("addCaseWithRecordings"),
                                       QVariantMap{{QStringLiteral("caseName"), QStringLiteral("Demo case")},
                                                   {QStringLiteral("reporter"), QStringLiteral("demo")},
                                                   {QStringLiteral("caseItem"), items}});
        const Reply created = replies.isEmpty() ? Reply{} : replies.last();
        caseId = created.payload.toMap().value(QStringLiteral("caseId")).toInt();
        std::printf("   addCaseWithRecordings -> code %s, case %d, number %s, %lld progress replies\n",
                    qUtf8Printable(created.strCode), caseId,
                    qUtf8Printable(created.payload.toMap().value(QStringLiteral("caseNumber")).toString()),
                    static_cast<long long>(replies.size() - 1));
        std::printf("   bookmarks on the recording server: %lld\n",
                    static_cast<long long>(host.bookmarkPlugin().bookmarks().size()));

        QVariantMap recording = caseItemFrom(evidence.first(), false);
        recording.insert(QStringLiteral("caseItemType"), 1);
        recording.insert(QStringLiteral("comment"), QStringLiteral("the whole minute"));
        replies = request(host, QStringLiteral("addCaseItemFromRecordings"),
                          QVariantMap{{QStringLiteral("caseId"), caseId},
                                      {QStringLiteral("caseItem"), QVariantList{recording}}});
        std::printf("   addCaseItemFromRecordings -> code %s\n",
                    qUtf8Printable(replies.isEmpty() ? QStringLiteral("(none)") : replies.last().strCode));

        QVariantMap model =
            request(host, QStringLiteral("retrieveCaseItemModel"), caseId).value(0).payload.toMap();
        QVariantList kept = model.value(QStringLiteral("caseItemList")).toList();
        replies = request(
            host, QStringLiteral("updateCase"),
            QVariantMap{{QStringLiteral("caseId"), caseId},
                        {QStringLiteral("caseName"), QStringLiteral("Demo case (reviewed)")},
                        {QStringLiteral("description"), QStringLiteral("two sightings and a recording")},
                        {QStringLiteral("caseItem"), kept}});
        std::printf(
            "   updateCase -> code %s, name \"%s\"\n", qUtf8Printable(replies.value(0).strCode),
            qUtf8Printable(replies.value(0).payload.toMap().value(QStringLiteral("caseName")).toString()));

        const QVariantList caseModel =
            request(host, QStringLiteral("retrieveCaseModel"), QVariant()).value(0).payload.toList();
        model = request(host, QStringLiteral("retrieveCaseItemModel"), caseId).value(0).payload.toMap();
        const QVariantMap info = model.value(QStringLiteral("caseInfoMap")).toMap();
        std::printf(
            "   case %d \"%s\": %lld items, from %s to %s, %lld cover image(s); %lld case(s) in the vault\n",
            caseId, qUtf8Printable(info.value(QStringLiteral("caseName")).toString()),
            static_cast<long long>(model.value(QStringLiteral("caseItemList")).toList().size()),
            qUtf8Printable(info.value(QStringLiteral("startTimestamp")).toString()),
            qUtf8Printable(info.value(QStringLiteral("endTimestamp")).toString()),
            static_cast<long long>(info.value(QStringLiteral("coverImage")).toList().size()),
            static_cast<long long>(caseModel.size()));

        replies = request(host, QStringLiteral("deleteCase"), caseId);
        waitUntil([&]() { return host.bookmarkPlugin().bookmarks().isEmpty(); }, 5000);
        std::printf("   deleteCase -> code %s; bookmarks left: %lld\n",
                    qUtf8Printable(replies.value(0).strCode),
                    static_cast<long long>(host.bookmarkPlugin().bookmarks().size()));
        caseOk = created.strCode == QLatin1String("0") && replies.value(0).strCode == QLatin1String("0");
    } else {
        std::printf("   (nothing found to put in a case)\n");
    }
    step(QStringLiteral("case workflow"), timer, caseOk ? 1 : 0);

    host.unload();
    QDir::setCurrent(previousDir);

    std::printf("\n== Summary\n");
    std::printf("   %-26s %9s %8s\n", "step", "time", "results");
    for (const StepTime& s : std::as_const(steps)) {
        std::printf("   %-26s %7lld ms %8d\n", qUtf8Printable(s.name), static_cast<long long>(s.ms),
                    s.results);
    }
    const bool ok = !directory.isEmpty() && site.server().ingestedObjects() > 0 && !people.isEmpty() &&
                    !sightings.isEmpty() && caseOk;
    std::printf("   demo %s in %.1f s; data left in %s\n", ok ? "complete" : "INCOMPLETE",
                double(total.elapsed()) / 1000.0, qUtf8Printable(dataDir));
    std::printf("\n== To look at it in a browser: the explorer page (cameras, searches with thumbnails, "
                "re-identification, cases)\n   %s serve --data %s\n   then open http://127.0.0.1:8765/\n",
                qUtf8Printable(QCoreApplication::applicationFilePath()), qUtf8Printable(dataDir));
    return ok ? 0 : 1;
}
