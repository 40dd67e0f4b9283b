// Writes the seed corpora: for the camera-directory targets the configuration-server
// simulator's own answers, broadcasts and events on the built-in site, and camera answers; for
// the store targets the seeder's camera answers, the malformed ones the store's tests refuse, and
// result records a real store hands out; for the request target every command of the dispatch
// table with the parameters the tests use.
// usage: fuzz_make_corpus DIR   (writes DIR/<target> for every target)
#include "NovirSite.h"
#include "Tamsa.h"
#include "TamsaSeeder.h"

#include <QDir>
#include <QFile>
#include <QTemporaryDir>
#include <cstdio>
#include <cstring>
#include <string>
#include <vector>

namespace {

bool write(const QString& dir, const QString& name, char first, const QByteArray& body)
{
    QFile file(QDir(dir).filePath(name));
    if (!file.open(QIODevice::WriteOnly)) {
        std::fprintf(stderr, "cannot write %s\n", qUtf8Printable(file.fileName()));
        return false;
    }
    file.write(QByteArray(1, first) + body);
    return true;
}

bool writeText(const QString& dir, const QString& name, const QByteArray& text)
{
    QFile file(QDir(dir).filePath(name));
    if (!file.open(QIODevice::WriteOnly)) {
        std::fprintf(stderr, "cannot write %s\n", qUtf8Printable(file.fileName()));
        return false;
    }
    file.write(text);
    return true;
}

// The seed of the request target's store (fuzz_request.cpp seeds the same).
tamsa::TamsaSeedOptions requestStoreOptions()
{
    tamsa::TamsaSeedOptions options;
    options.objects = 90;
    options.locations = 3;
    options.seed = 5;
    options.spanSeconds = 3600;
    options.batchSize = 30;
    return options;
}

// An input of fuzz_record_conversion: header, then the texts and the trajectory bytes.
QByteArray recordInput(uint8_t nulls, uint32_t trajectoryBytes, uint32_t location, uint32_t start,
                       uint32_t end, uint64_t id, const QByteArray& type, const QByteArray& attributes,
                       const QByteArray& thumbnails, const QByteArray& trajectory)
{
    QByteArray out(1, char(nulls));
    const auto append = [&out](uint64_t value, int bytes) {
        for (int i = 0; i < bytes; ++i) {
            out.append(char((value >> (8 * i)) & 0xff));
        }
    };
    append(trajectoryBytes, 4);
    append(location, 4);
    append(start, 4);
    append(end, 4);
    append(id, 8);
    return out + type + '\0' + attributes + '\0' + thumbnails + '\0' + trajectory;
}

QByteArray doubles(const std::vector<double>& values)
{
    return QByteArray(reinterpret_cast<const char*>(values.data()),
                      qsizetype(values.size() * sizeof(double)));
}

// Objects of the seeder's answers through a real store, and the texts the store's tests refuse.
bool writeStoreCorpora(const QString& ingest, const QString& records)
{
    bool ok = true;
    const tamsa::TamsaSeeder seeder(requestStoreOptions());
    // One person with a face, one without, a vehicle, and a small mixed answer.
    for (uint64_t first : {0u, 1u, 2u, 3u, 4u, 5u}) {
        const std::string answer = seeder.answer(1, first, 1);
        ok &= write(ingest, QStringLiteral("seeder_object_%1").arg(first), 3,
                    QByteArray::fromStdString(answer));
    }
    ok &= write(ingest, QStringLiteral("seeder_answer_3"), char(-7),
                QByteArray::fromStdString(seeder.answer(2, 0, 3)));
    const char* const refused[] = {
        "not json",
        "[]",
        R"({"Objects":[]})",
        R"({"ObjectMetaInfo":{}})",
        R"({"ObjectMetaInfo":[]})",
        R"({"ObjectMetaInfo":[{"ObjectType":"Human","StartTime":1,"EndTime":2}]})",
        R"({"ObjectMetaInfo":[{"ID":"9","ObjectType":"Human","StartTime":1,"EndTime":2}]})",
        R"({"ObjectMetaInfo":[{"ID":-9,"ObjectType":"Human","StartTime":1,"EndTime":2}]})",
        R"({"ObjectMetaInfo":[{"ID":1e400,"ObjectType":"Human","StartTime":1,"EndTime":2}]})",
        R"({"ObjectMetaInfo":[{"ID":18446744073709551616,"ObjectType":"Human","StartTime":1,"EndTime":2}]})",
        R"({"ObjectMetaInfo":[{"ID":9,"ObjectType":7,"StartTime":1,"EndTime":2}]})",
        R"({"ObjectMetaInfo":[{"ID":9,"ObjectType":"Human","StartTime":"NaN","EndTime":2}]})",
        R"({"ObjectMetaInfo":[{"ID":9,"ObjectType":"Human","StartTime":1e300,"EndTime":1e301}]})",
        R"({"ObjectMetaInfo":[{"ID":9,"ObjectType":"Human","StartTime":5,"EndTime":2}]})",
        R"({"ObjectMetaInfo":[{"ID":9,"ObjectType":"Human","StartTime":1,"EndTime":2,"Attributes":[1]}]})",
        R"({"ObjectMetaInfo":[{"ID":9,"ObjectType":"Human","StartTime":1,"EndTime":2,"Trajectory":[{"x":1}]}]})",
        R"({"ObjectMetaInfo":[{"ID":9,"ObjectType":"Human","StartTime":1,"EndTime":2,"Thumbnail":{"image":1}}]})",
        R"({"ObjectMetaInfo":[{"ID":5,"ObjectType":"Human","StartTime":1,"EndTime":2,"Thumbnail":[{"feature":[1,2,3],"image":"aGk="}]}]})",
        R"({"ObjectMetaInfo":[17,null,{"ID":7,"ObjectType":"Human","StartTime":1,"EndTime":2,"Attributes":{"Age":"Young"}},{"ID":7,"ObjectType":"Human","StartTime":1,"EndTime":3,"Attributes":{"Age":"Old"}}]})",
    };
    int index = 0;
    for (const char* text : refused) {
        ok &= write(ingest, QStringLiteral("refused_%1").arg(index++), 1, QByteArray(text));
    }
    const std::string deep = std::string(1000, '[') + std::string(1000, ']');
    ok &= write(ingest, QStringLiteral("refused_deep"), 1,
                QByteArray::fromStdString(R"({"ObjectMetaInfo":[{"ID":9,"ObjectType":"Human","StartTime":1,)"
                                          R"("EndTime":2,"Attributes":{"a":)" +
                                          deep + "}}]})"));

    // Result records as the store hands them out for a few of the seeder's objects.
    QTemporaryDir storage;
    void* database = nullptr;
    unsigned char record[704] = {0xC0, 0x02};
    if (!storage.isValid() || Tamsa_InitDatabase(&database, record, 0) != TAMSA_OK ||
        Tamsa_SetStoragesDBPath(database, storage.path().toUtf8().constData()) != TAMSA_OK ||
        Tamsa_PutObjectMetaInfo(database, 3, 1, seeder.answer(1, 0, 6).c_str()) <= 0) {
        std::fprintf(stderr, "cannot fill a store\n");
        return false;
    }
    const uint32_t locations[] = {1, 0};
    TTAMSA_OBJECTMETAINFO_QUERY query{};
    query.wSize = sizeof query;
    query.dwEndTime = 0xFFFFFFFFu;
    query.pdwLocationIds = locations;
    void* search = nullptr;
    ok &= Tamsa_GetObjectMetaInfoFirst(database, &query, &search) == TAMSA_OK;
    TTAMSA_OBJECTMETAINFO_RESULT result{};
    result.wSize = sizeof result;
    for (int n = 0; search && Tamsa_GetObjectMetaInfoNext(search, &result) == TAMSA_OK; ++n) {
        const QByteArray trajectory(reinterpret_cast<const char*>(result.pTrajectory),
                                    result.dwTrajectoryBytes);
        ok &= writeText(records, QStringLiteral("store_record_%1").arg(n),
                        recordInput(0, result.dwTrajectoryBytes, result.dwLocationNumber, result.dwStartTime,
                                    result.dwEndTime, result.qwObjectId, result.pszObjectType,
                                    result.pszAttributes, result.pszThumbnails, trajectory));
    }
    Tamsa_GetObjectMetaInfoClose(search);
    Tamsa_ReleaseDatabase(&database);

    // The edge cases the worker's tests pin down.
    const QByteArray points = doubles({0.1, 0.2, 0.3, 0.4});
    ok &=
        writeText(records, QStringLiteral("edge_no_texts"), recordInput(15, 40, 0, 0, 0, 0, "", "", "", ""));
    ok &= writeText(records, QStringLiteral("edge_bare_thumbnail_array"),
                    recordInput(0, 20, 2, 10, 20, 5, "Human", R"({"Gender":1,"UpperColor":[2,3]})",
                                R"([{"image":"b","feature":[1]}])", points));
    ok &= writeText(records, QStringLiteral("edge_empty_crops"),
                    recordInput(0, 0, 3, 10, 20, 6, "Vehicle", "{}",
                                R"({"Thumbnail":[],"FaceThumbnail":[],"LicensePlateThumbnail":{}})", ""));
    ok &= writeText(
        records, QStringLiteral("edge_filtered_face_plate"),
        recordInput(
            0, 32, 1, 10, 20, 7, "Human", R"({"Age":"adult","Gender":2,"Accessories":[]})",
            R"({"Thumbnail":[{"image":"bodyB64","feature":[0.25,1]}],)"
            R"("FaceThumbnail":[{"image":"f","feature":[1e-3,-2.5E+2],"face_detection_info":{"filtered":1}}],)"
            R"("LicensePlateThumbnail":[{"image":"plateB64","PlateNumber":"AB123","detection_info":{"filtered":0}}]})",
            points));
    ok &= writeText(
        records, QStringLiteral("edge_escapes_numbers"),
        recordInput(
            0, 16, 4000000000u, 0xFFFFFFFFu, 0, ~0ull, "\xe4\xba\xba",
            R"({"Type":null,"Color":[18446744073709551615,-9223372036854775808,1.5e308],"Age":"\u00e9\ud83d\ude00"})",
            R"({"Thumbnail":[{"image":"\"\\\/\b\f\n\r\t","feature":[0,-0,1e-400]}]})",
            doubles({-0.0, 1e308})));
    return ok;
}

// "command\nJSON": every command of the dispatch table with the tests' parameters, and a few
// requests no handler takes.
bool writeRequestCorpus(const QString& dir)
{
    const tamsa::TamsaSeeder seeder(requestStoreOptions());
    const auto vector = [](const std::vector<float>& values) {
        QByteArray text = "[";
        for (size_t i = 0; i < values.size(); ++i) {
            text += (i ? "," : "") + QByteArray::number(double(values[i]), 'g', 9);
        }
        return text + "]";
    };
    const QByteArray window = R"("startTimestamp":1704067200000,"endTimestamp":1704074400000)";
    const QByteArray item =
        R"({"nodeID":"cam1","locID":"Loc3","startTimestamp":1700000000000,"endTimestamp":1700000060000,)"
        R"("caseItemType":0,"objImage":"aW1n","needBookmark":false})";
    const QByteArray bookmarked =
        R"({"nodeID":"cam1","locID":"Loc1","startTimestamp":1700000000000,"endTimestamp":1700000060000,)"
        R"("caseItemType":0,"objImage":"aW1n","needBookmark":true})";
    const QByteArray relayed =
        R"({"nodeID":"east/cam2","locID":"Loc2","startTimestamp":1700000001000,"endTimestamp":1700000061000,)"
        R"("caseItemType":1,"previewImage":"cA==","needBookmark":true})";
    const QByteArray unknownRelay =
        R"({"nodeID":"west/cam9","locID":"Loc9","startTimestamp":1,"endTimestamp":2,"needBookmark":true})";
    const QList<std::pair<const char*, QByteArray>> requests = {
        {"startSearch", R"({"locIDList":["Loc2"],)" + window + "}"},
        {"startSearch", R"({"locIDList":["Loc1","Loc3"],)" + window +
                            R"(,"humanInfo":"{\"Gender\":1,\"UpperColor\":[2]}","descending":true})"},
        {"startSearch",
         R"({"locIDList":["Loc3"],)" + window +
             R"(,"vehicleInfo":"{\"Type\":\"car\",\"Color\":[1],\"PlateNumber\":\"AB1\"}","plateNumber":"*1?"})"},
        {"startSearch", R"({"locIDList":["Loc1"],)" + window +
                            R"(,"ruleInfo":{"type":"lineCrossing","trace":"[[0,0],[1,1]]","direction":1}})"},
        {"startSearch",
         R"({"locIDList":["Loc2"],)" + window +
             R"(,"ruleInfo":{"type":"loitering","trace":"[[0,0],[1,1],[1,0]]","duration":5},"doNotSort":true})"},
        {"startSearch",
         R"({"locIDList":["Loc1",""],"humanInfo":"{not json","startTimestamp":-1,"endTimestamp":1e30})"},
        {"stopSearch", ""},
        {"startReIdSearch", R"({"locIDList":["Loc1","Loc2","Loc3"],)" + window + R"(,"feature":)" +
                                vector(seeder.identityBody(1)) + R"(,"faceFeature":)" +
                                vector(seeder.identityFace(1)) + "}"},
        {"startReIdSearch", R"({"locIDList":["Loc2"],)" + window + R"(,"feature":[3,4]})"},
        {"stopReIdSearch", "{}"},
        {"retrieveDelvixData", R"({"nodeID":"cam1",)" + window + "}"},
        {"retrieveDelvixData", R"({"nodeID":"nobody","startTimestamp":0,"endTimestamp":0})"},
        {"addCaseWithItem", R"({"caseName":"Robbery","reporter":"Ann","caseItem":)" + item + "}"},
        {"addCaseWithItem", R"({"caseName":"c","caseItem":)" + bookmarked + "}"},
        {"addCaseItem",
         R"({"caseId":1,"nodeID":"cam1","locID":"Loc1","startTimestamp":1,"endTimestamp":2,"needBookmark":false})"},
        {"addCaseItem",
         R"({"caseId":2,"nodeID":"east/cam2","startTimestamp":1,"endTimestamp":2,"needBookmark":true})"},
        {"addCaseWithRecordings", R"({"caseName":"Robbery","reporter":"Ann","caseItem":[)" + item + "," +
                                      bookmarked + "," + relayed + "]}"},
        {"addCaseWithRecordings", R"({"caseName":"kept","caseItem":[]})"},
        {"addCaseItemFromRecordings", R"({"caseId":1,"caseItem":[)" + relayed + "," + unknownRelay + "]}"},
        {"addCaseItemFromRecordings", R"({"caseId":9999,"caseItem":[)" + item + "]}"},
        {"updateCase",
         R"({"caseId":1,"caseName":"renamed","description":"d","caseItem":[{"id":1,"comment":"kept"},{"id":3}]})"},
        {"updateCase", R"({"caseId":1})"},
        {"updateCase", R"({"caseId":9999})"},
        {"deleteCase", "1"},
        {"deleteCase", "9999"},
        {"deleteCase", R"("not a number")"},
        {"getCaseList", ""},
        {"retrieveCaseModel", ""},
        {"retrieveCaseItemModel", "1"},
        {"retrieveCaseItemModel", "2"},
        {"StartSearch", "{}"},
        {"", "{}"},
        {"noSuchCommand", "[1,2,3]"},
    };
    bool ok = true;
    int index = 0;
    for (const auto& [command, params] : requests) {
        ok &= writeText(dir, QStringLiteral("%1_%2").arg(QLatin1String(command)).arg(index++),
                        QByteArray(command) + '\n' + params);
    }
    return ok;
}

} // namespace

int main(int argc, char** argv)
{
    if (argc != 2) {
        std::fprintf(stderr, "usage: fuzz_make_corpus DIR\n");
        return 2;
    }
    const QString answers =
        QDir(QString::fromLocal8Bit(argv[1])).filePath(QStringLiteral("directory_answers"));
    const QString bodies = QDir(QString::fromLocal8Bit(argv[1])).filePath(QStringLiteral("write_data"));
    const QDir root(QString::fromLocal8Bit(argv[1]));
    const QString requests = root.filePath(QStringLiteral("request"));
    const QString ingest = root.filePath(QStringLiteral("store_ingest"));
    const QString records = root.filePath(QStringLiteral("record_conversion"));
    for (const QString& dir : {answers, bodies, requests, ingest, records}) {
        QDir().mkpath(dir);
    }
    const NovirSite site = NovirSite::defaultSite();
    bool ok = true;
    const QByteArray all = NovirSite::nodeInfoXml(site.cameras).toUtf8();
    ok &= write(answers, QStringLiteral("converter_nodeinfo"), 0, all);
    ok &= write(answers, QStringLiteral("nodeinfo_all"), 1, all);
    ok &= write(answers, QStringLiteral("nodeinfo_part"), 1,
                NovirSite::nodeInfoXml(site.cameras.mid(3, 3)).toUtf8());
    ok &= write(answers, QStringLiteral("nodeinfo_empty"), 1, NovirSite::nodeInfoXml({}).toUtf8());
    ok &= write(answers, QStringLiteral("locations_all"), 2, NovirSite::locationsXml(site.cameras).toUtf8());
    ok &= write(answers, QStringLiteral("nodeinfo_single"), 3,
                NovirSite::nodeInfoXml(site.cameras.mid(2, 1)).toUtf8());
    ok &= write(answers, QStringLiteral("broadcast_camins"), 4,
                "<CamIns><Entry><Name>Dock</Name></Entry></CamIns>");
    ok &= write(answers, QStringLiteral("broadcast_camrmv"), 5, "<CamRm><Name>Dock</Name></CamRm>");
    ok &= write(answers, QStringLiteral("broadcast_caminfochange"), 6,
                "<CamInfoChange><Cam>Lobby</Cam></CamInfoChange>");
    ok &= write(answers, QStringLiteral("broadcast_channeladd"), 7,
                "<ChannelAdd><CamName>Dock</CamName><Loc>Loc21</Loc><GrpID>4</GrpID></ChannelAdd>");
    ok &= write(answers, QStringLiteral("broadcast_channelrmv"), 8,
                "<ChannelRmv><CamName>Dock</CamName></ChannelRmv>");
    ok &= write(answers, QStringLiteral("event_camstatus"), 9,
                NovirSite::cameraStatusXml(site.cameras).toUtf8());

    const QByteArray objects =
        R"({"ObjectMetaInfo":[{"ID":5,"ObjectType":"Human","StartTime":1700000000,"EndTime":1700000004,)"
        R"("Attributes":{"Age":"30","Gender":1,"UpperColor":[1,4]},"Trajectory":[{"x":0.1,"y":0.2}],)"
        R"("Thumbnail":[{"image":"aGk="}],"FaceThumbnail":[{"image":"ZmFjZQ==","face_detection_info":{"filtered":0}}]},)"
        R"({"ID":3,"ObjectType":"Vehicle","StartTime":1700000001,"EndTime":1700000009,)"
        R"("Attributes":{"Type":"Car","Color":[2],"PlateNumber":"京A·12<3>&%1"},"Trajectory":[],)"
        R"("Thumbnail":[],"LicensePlateThumbnail":[{"image":"cA==","PlateNumber":"X","detection_info":{"filtered":1}}]},)"
        R"({"ID":18446744073709551615},{"NoId":true},7]})";
    for (char flags = 0; flags < 4; ++flags) {
        ok &= write(bodies, QStringLiteral("camera_answer_flags%1").arg(int(flags)), char(128 + flags),
                    objects);
    }
    ok &= write(bodies, QStringLiteral("empty_list"), 3, R"({"ObjectMetaInfo":[]})");
    ok &= write(bodies, QStringLiteral("not_json"), 3, "<ObjectMetaInfo/>");
    ok &= writeStoreCorpora(ingest, records);
    ok &= writeRequestCorpus(requests);
    return ok ? 0 : 1;
}
