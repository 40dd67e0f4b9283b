#pragma once
// What one simulated camera is: its account, what it protects and how it behaves.

#include <QString>

struct CameraSetup
{
    QString name;     // camera ID, the "Name" of its directory record
    quint16 port = 0; // 0: an ephemeral port; a fixed one for the cameras of a site file
    QString user = QStringLiteral("admin");
    QString password = QStringLiteral("admin");
    bool protectedMetadata = false; // metadata only with a valid access token, 403 otherwise
    int channels = 1;               // more than 1: a multi-channel camera, channels /VCA/c0 ...
    bool useSSL = false;            // HTTPS with a self-signed certificate
    bool digestAuth = false;        // digest instead of basic authentication
    int objectsPerMinute = 6;
    int groupID = 1;        // where its location records say it records
    int locationNumber = 0; // 0: assigned by the simulator
};

// One request a camera answered, for tests and the demo to look at.
struct ServedRequest
{
    QString camera;
    int channel = -1; // -1: the path carried no channel
    QString path;     // path and query as received
    int status = 0;
    int objectCount = 0;
    bool withAccessToken = false;
};
