#pragma once
// A whole site on this machine: one simulated camera per camera address of the site (channels
// of a multi-channel camera share one), each on a free loopback port, and the configuration
// server announcing the site with those ports and storing what the plug-in forwards.
//
// Lifetime: keep the runner until the plug-in that uses its server is unloaded. Threads: the
// cameras and the server run threads of their own; use the runner from the main thread.

#include "CameraSimulator.h"
#include "NovirConfigServer.h"
#include "NovirSite.h"

#include <memory>

class SiteRunner
{
public:
    explicit SiteRunner(NovirSite site);
    ~SiteRunner();

    // Starts the cameras and the server; the store lives in storageDir. False with a reason.
    bool start(const QString& storageDir, int objectsPerMinute, QString* error);

    const NovirSite& site() const { return m_site; }
    NovirConfigServer& server() { return *m_server; }
    CameraSimulator& cameras() { return m_cameras; }
    // Distinct recording locations ("Loc<n>") of the cameras the plug-in will synchronise.
    QStringList recordingLocations() const;

private:
    NovirSite m_site;
    CameraSimulator m_cameras;
    std::unique_ptr<NovirConfigServer> m_server;
};
