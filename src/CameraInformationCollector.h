#pragma once
// The camera directory: cameras, recording locations and online states as the configuration
// server announces them through the tunnel control, merged into one record per camera that is
// online and has a location. Every change is announced with the whole directory.
//
// Threads: the slots run on the collector's thread (the one that created it), whatever thread
// the tunnel control emits from. writeData and setDelvixSettings may be called from any
// thread. getCameraNodeID is called on request threads: it reads an immutable location index
// that the slots swap under m_indexMutex, so a lookup never waits on more than a pointer copy.

#include "ICameraInformationCollector.h"
#include "NOVIRImplementation/NOVIRSrvTunnelControl.h"

#include <QHash>
#include <QMutex>
#include <QSharedPointer>
#include <QVariantMap>
#include <atomic>

class IFrameworkTools;

class CameraInformationCollector : public ICameraInformationCollector
{
    Q_OBJECT
    // The directory as last announced, for the host's diagnostics; thread-safe.
    Q_PROPERTY(QVariantMap cameraDirectory READ cameraDirectory)
public:
    explicit CameraInformationCollector(IFrameworkTools* tools);
    ~CameraInformationCollector() override;

    QSharedPointer<NOVIRSrvTunnelControl> getNOVIRSrvTunnelControl() const;
    void writeData(int groupID, int locationID, const QString& data) override;
    void setDelvixSettings(const QVariantMap& settings) override;
    QString getCameraNodeID(const QString& location) override;

    QVariantMap cameraDirectory() const;

private slots:
    void updateCameras(const QVariantMap& cameras);
    void removeCamera(const QString& name);
    void updateCamera(const QString& name, const QVariantMap& record);
    void updateCameraStatus(const QString& name, bool online);
    void queryLocations(const QVariantMap& locations);
    void addLocation(const QString& name, const QVariantMap& record);
    void removeLocation(const QString& name);

private:
    void handleCameraInformationChange(NOVIRSrvTunnelControl* control);
    void handleLocationInformationChange(NOVIRSrvTunnelControl* control);
    void updateSingleCameraInformation(const QString& name);
    void updateAllCamerasInformation();
    void emitCameraInformationChanged();
    // Rebuilds the location -> camera index after every change of the location map.
    void rebuildLocationIndex();

    // The four maps are used on the collector's thread only.
    QVariantMap m_cameraInformationMap;
    QVariantMap m_locationMap;
    QVariantMap m_cameraDirectoryMap;
    QVariantMap m_cameraStatusMap;
    QSharedPointer<NOVIRSrvTunnelControl> m_tunnelControl;
    // Written by setDelvixSettings, read by writeData, possibly on different threads: atomic.
    std::atomic<bool> m_bFaceThumbnail{true};
    std::atomic<bool> m_bPlateThumbnail{true};

    mutable QMutex m_indexMutex;
    // Location id -> first camera name (ascending) whose location record carries it.
    QHash<QString, QString> m_locationIndex; // guarded by m_indexMutex; copied out, never changed in place
    QVariantMap m_announcedDirectory;        // guarded by m_indexMutex
};
