// The exported C entry points: argument checks, and no C++ exception ever crosses into the caller.
#include "Tamsa.h"
#include "TamsaDatabase.h"
#include "TamsaSearch.h"

#include <cstring>
#include <new>

using tamsa::TamsaDatabase;
using tamsa::TamsaSearch;

namespace {

constexpr uint16_t kInitRecordSize = 704;

template <typename Body>
int32_t guarded(Body body)
{
    try {
        return body();
    } catch (const std::bad_alloc&) {
        return TAMSA_E_OUT_OF_MEMORY;
    } catch (...) {
        return TAMSA_E_IO;
    }
}

} // namespace

extern "C" {

int32_t Tamsa_InitDatabase(void** database, const void* initRecord, uint32_t /*reserved*/)
{
    if (!database) {
        return TAMSA_E_INVALID_ARGUMENT;
    }
    *database = nullptr;
    uint16_t size = 0;
    if (initRecord) {
        std::memcpy(&size, initRecord, sizeof size);
    }
    if (size != kInitRecordSize) {
        return TAMSA_E_INVALID_ARGUMENT;
    }
    return guarded([&] {
        *database = new TamsaDatabase;
        return TAMSA_OK;
    });
}

int32_t Tamsa_SetStoragesDBPath(void* database, const char* storageDirUtf8)
{
    if (!database) {
        return TAMSA_E_INVALID_ARGUMENT;
    }
    return guarded([&] { return static_cast<TamsaDatabase*>(database)->setStoragePath(storageDirUtf8); });
}

int32_t Tamsa_ReleaseDatabase(void** database)
{
    if (!database) {
        return TAMSA_E_INVALID_ARGUMENT;
    }
    delete static_cast<TamsaDatabase*>(*database);
    *database = nullptr;
    return TAMSA_OK;
}

int32_t Tamsa_GetObjectMetaInfoFirst(void* database, const TTAMSA_OBJECTMETAINFO_QUERY* query, void** search)
{
    if (!search) {
        return TAMSA_E_INVALID_ARGUMENT;
    }
    *search = nullptr;
    if (!database) {
        return TAMSA_E_INVALID_ARGUMENT;
    }
    return guarded([&] {
        TamsaSearch* opened = nullptr;
        const int32_t status = static_cast<TamsaDatabase*>(database)->openSearch(query, &opened);
        *search = opened;
        return status;
    });
}

int32_t Tamsa_GetObjectMetaInfoNext(void* search, TTAMSA_OBJECTMETAINFO_RESULT* result)
{
    if (!search) {
        return TAMSA_E_INVALID_ARGUMENT;
    }
    return guarded([&] { return static_cast<TamsaSearch*>(search)->next(result); });
}

void Tamsa_GetObjectMetaInfoClose(void* search)
{
    delete static_cast<TamsaSearch*>(search);
}

void Tamsa_GetObjectMetaInfoAbort(void* search)
{
    if (search) {
        static_cast<TamsaSearch*>(search)->abort();
    }
}

int32_t Tamsa_PutObjectMetaInfo(void* database, int32_t groupId, int32_t locationNumber, const char* json)
{
    if (!database) {
        return TAMSA_E_INVALID_ARGUMENT;
    }
    return guarded([&] { return static_cast<TamsaDatabase*>(database)->put(groupId, locationNumber, json); });
}

} // extern "C"
