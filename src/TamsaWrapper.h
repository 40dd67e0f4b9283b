#pragma once
// The plug-in's only way into the object-metadata store. The wrapper keeps no state and takes
// no lock: everything it needs travels in its arguments, and the store answers for thread
// safety across handles (and between Abort and a running Next). Subclasses say where the
// store keeps its files; tests replace the whole wrapper with a fake.

#include "Tamsa.h"

#include <QByteArray>
#include <QString>

class TamsaWrapper
{
public:
    TamsaWrapper() = default;
    virtual ~TamsaWrapper();

    TamsaWrapper(const TamsaWrapper&) = delete;
    TamsaWrapper& operator=(const TamsaWrapper&) = delete;

    // Opens a connection in *database and points it at getStoragesDBPath(). The status of
    // the open itself is not decisive (the store may leave a usable handle); the returned
    // status is that of setting the storage directory.
    virtual long initDatabase(void** database);
    virtual long releaseDatabase(void** database);
    virtual long GetObjectMetaInfoFirst(void* database, const TTAMSA_OBJECTMETAINFO_QUERY* query,
                                        void** search);
    virtual long GetObjectMetaInfoNext(void* search, TTAMSA_OBJECTMETAINFO_RESULT* result);
    virtual void GetObjectMetaInfoClose(void* search);
    // May come from another thread while a Next on the same search runs.
    virtual void GetObjectMetaInfoAbort(void* search);
    // The store's storage directory, or an empty text when it is not configured.
    virtual QString getStoragesDBPath() = 0;

    // The 704-byte record initDatabase hands to the store.
    static QByteArray initRecord();
    static constexpr int kInitRecordSize = 704;
};
