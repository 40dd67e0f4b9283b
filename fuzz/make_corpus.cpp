// Writes the seed corpora of the camera-directory fuzz targets: the configuration-server
// simulator's own answers, broadcasts and events on the built-in site, and camera answers.
// usage: fuzz_make_corpus DIR   (writes DIR/directory_answers and DIR/write_data)
#include "NovirSite.h"

#include <QDir>
#include <QFile>
#include <cstdio>

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
    QDir().mkpath(answers);
    QDir().mkpath(bodies);
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
    return ok ? 0 : 1;
}
