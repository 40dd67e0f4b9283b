#include "TamsaWrapper.h"

#include <cstring>

TamsaWrapper::~TamsaWrapper() = default;

QByteArray TamsaWrapper::initRecord()
{
    QByteArray record(kInitRecordSize, '\0');
    char* bytes = record.data();
    const auto put16 = [bytes](int offset, uint16_t value) {
        std::memcpy(bytes + offset, &value, sizeof value);
    };
    const auto put32 = [bytes](int offset, uint32_t value) {
        std::memcpy(bytes + offset, &value, sizeof value);
    };
    put16(0, kInitRecordSize);
    put16(2, 19);
    put32(4, 5);
    put16(8, 1);
    put32(668, 1);
    return record;
}

long TamsaWrapper::initDatabase(void** database)
{
    const QByteArray record = initRecord();
    // The open's own status is not decisive: the storage path step below fails on a handle
    // the store could not make, and that status is what callers log.
    Tamsa_InitDatabase(database, record.constData(), 0);
    const QByteArray path = getStoragesDBPath().toUtf8();
    return Tamsa_SetStoragesDBPath(database ? *database : nullptr, path.constData());
}

long TamsaWrapper::releaseDatabase(void** database)
{
    return Tamsa_ReleaseDatabase(database);
}

long TamsaWrapper::GetObjectMetaInfoFirst(void* database, const TTAMSA_OBJECTMETAINFO_QUERY* query,
                                          void** search)
{
    return Tamsa_GetObjectMetaInfoFirst(database, query, search);
}

long TamsaWrapper::GetObjectMetaInfoNext(void* search, TTAMSA_OBJECTMETAINFO_RESULT* result)
{
    return Tamsa_GetObjectMetaInfoNext(search, result);
}

void TamsaWrapper::GetObjectMetaInfoClose(void* search)
{
    Tamsa_GetObjectMetaInfoClose(search);
}

void TamsaWrapper::GetObjectMetaInfoAbort(void* search)
{
    Tamsa_GetObjectMetaInfoAbort(search);
}
