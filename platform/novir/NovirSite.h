#pragma once
// The site the configuration-server simulator serves: its id and cameras, loaded from a site
// file (format in SITE_FORMAT.md beside this file), and the XML texts the server sends about
// them. A plain value type; no threads, no I/O beyond fromFile.

#include "AttributeVocabulary.h"

#include <QByteArray>
#include <QList>
#include <QString>

// One camera entry as the configuration server knows it. A multi-channel camera is one entry
// per channel, each with its own name and location, sharing the address.
struct NovirCamera
{
    QString name;
    QString ip = QStringLiteral("127.0.0.1");
    int port = 80;
    bool useSsl = false;
    int httpsPort = 0; // 0: no HTTPSPort element
    QString user;
    QString password;        // plain; sent as hexadecimal text of its Latin-1 bytes
    bool recordCap = true;   // records object metadata
    bool protectCap = false; // metadata needs a pair token
    int channelCount = 1;
    int channel = 1;  // 1-based
    QString location; // empty: records nowhere (not in location answers)
    int groupId = 1;
    bool live = true; // location is recording
    bool online = true;
};

class NovirSite
{
public:
    QString serverId = QStringLiteral("cfg-server-1");
    int partSize = 50;      // cameras or locations per answer part
    bool prettyXml = false; // answers and events indented, a line for every tag and every text
    QList<NovirCamera> cameras;
    // What the site's attribute codes mean: the built-in words, with a site file's lists over them.
    AttributeVocabulary vocabulary = AttributeVocabulary::defaults();

    // Parses a site file's text. Returns false with a reason in *error (and leaves *site alone).
    static bool fromJson(const QByteArray& json, NovirSite* site, QString* error);
    static bool fromFile(const QString& path, NovirSite* site, QString* error);
    // The small site built in: six cameras on loopback ports 18081-18086, one protected, one
    // with two channels, one offline, one without location, one that records no metadata.
    static QByteArray defaultSiteJson();
    static NovirSite defaultSite();

    // XML texts, every camera-provided text escaped.
    static QString nodeInfoXml(const QList<NovirCamera>& cameras);
    // One location answer part; locations of cameras whose location is empty are left out.
    static QString locationsXml(const QList<NovirCamera>& cameras);
    static QString cameraStatusXml(const QList<NovirCamera>& cameras);
    // Why a camera stays out of the plug-in's directory ("offline", ...), comma-separated; empty
    // when nothing in its entry keeps it out.
    static QString exclusionReasons(const NovirCamera& camera);
    // The same XML indented, every tag and every text on a line of its own, as servers that
    // pretty-print their answers write it (leaf texts then carry whitespace around them).
    static QString indentedXml(const QString& xml);
    static QString escape(const QString& text);
};
