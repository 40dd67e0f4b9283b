#include "SiteRunner.h"

#include <QMap>

SiteRunner::SiteRunner(NovirSite site)
    : m_site(std::move(site))
    , m_cameras(1, m_site.vocabulary)
{}

SiteRunner::~SiteRunner()
{
    m_server.reset();
    m_cameras.stop();
}

bool SiteRunner::start(const QString& storageDir, int objectsPerMinute, QString* error)
{
    // One simulated camera per address; the site's ports are replaced by free ones so that
    // several hosts (and tests) can run side by side.
    QMap<int, CameraSetup> byPort;
    for (const NovirCamera& camera : std::as_const(m_site.cameras)) {
        CameraSetup& setup = byPort[camera.port];
        if (setup.name.isEmpty()) {
            setup.name = camera.name;
        }
        setup.user = camera.user;
        setup.password = camera.password;
        setup.protectedMetadata = setup.protectedMetadata || camera.protectCap;
        setup.channels = qMax(setup.channels, camera.channelCount);
        setup.useSSL = setup.useSSL || camera.useSsl;
        setup.objectsPerMinute = objectsPerMinute;
    }
    if (!m_cameras.start(byPort.values(), error)) {
        return false;
    }
    for (NovirCamera& camera : m_site.cameras) {
        camera.port = m_cameras.port(byPort.value(camera.port).name);
    }
    m_server = std::make_unique<NovirConfigServer>(m_site);
    if (!m_server->openStore(storageDir, error)) {
        return false;
    }
    m_server->start();
    return true;
}

QStringList SiteRunner::recordingLocations() const
{
    QStringList locations;
    for (const NovirCamera& camera : m_site.cameras) {
        if (camera.recordCap && camera.online && !camera.location.isEmpty() &&
            !locations.contains(camera.location)) {
            locations << camera.location;
        }
    }
    return locations;
}
