#pragma once
// The camera directory as the plug-in core sees it: which camera carries a location, and the
// notifications of directory changes. getCameraNodeID is called from search threads, several
// at once; implementations make it safe for that.

#include <QObject>
#include <QString>
#include <QVariantMap>

class ICameraInformationCollector : public QObject
{
    Q_OBJECT

public:
    ICameraInformationCollector()
        : QObject(nullptr)
    {}
    ~ICameraInformationCollector() override = default;

    // Hands fetched object metadata of one location on.
    virtual void writeData(int groupID, int locationID, const QString& data) = 0;
    virtual void setDelvixSettings(const QVariantMap& delvixSettings) = 0;
    // The name of the camera whose location record carries that location id, or empty.
    virtual QString getCameraNodeID(const QString& location) = 0;

signals:
    // The whole camera directory map after every change.
    void cameraInformationChanged(const QVariantMap& camerasMap);
    void locationRemoved(const QString& cameraID);
    void cameraDisconnected(const QString& cameraID);
};
