// Placeholder entry points: the store is being built; every call fails cleanly until then.
#include "Tamsa.h"

extern "C" {
int32_t Tamsa_InitDatabase(void** database, const void*, uint32_t)
{
    if (database) {
        *database = nullptr;
    }
    return TAMSA_E_IO;
}
int32_t Tamsa_SetStoragesDBPath(void*, const char*)
{
    return TAMSA_E_INVALID_ARGUMENT;
}
int32_t Tamsa_ReleaseDatabase(void** database)
{
    if (database) {
        *database = nullptr;
    }
    return TAMSA_OK;
}
int32_t Tamsa_GetObjectMetaInfoFirst(void*, const TTAMSA_OBJECTMETAINFO_QUERY*, void** search)
{
    if (search) {
        *search = nullptr;
    }
    return TAMSA_E_INVALID_ARGUMENT;
}
int32_t Tamsa_GetObjectMetaInfoNext(void*, TTAMSA_OBJECTMETAINFO_RESULT*)
{
    return TAMSA_E_INVALID_ARGUMENT;
}
void Tamsa_GetObjectMetaInfoClose(void*)
{}
void Tamsa_GetObjectMetaInfoAbort(void*)
{}
int32_t Tamsa_PutObjectMetaInfo(void*, int32_t, int32_t, const char*)
{
    return TAMSA_E_INVALID_ARGUMENT;
}
}
