#pragma once
// Tamsa: the object-metadata store. C entry points and the records that cross them
// (byte-exact layouts shared with the plug-in; 64-bit, natural alignment).
//
// Statuses: every entry point returns a 32-bit signed status, 0 = success. TAMSA_E_NO_MORE_RECORDS
// (0x80431905) is not a failure: Next returns it once the enumeration is exhausted (and again on
// every later Next). Every other non-zero value is a failure, one TAMSA_E_* code per cause.
// Tamsa_PutObjectMetaInfo returns a count (>= 0) instead, or a TAMSA_E_* code (all negative).
//
// Ownership: the caller owns the query record and every text it points to; First copies what it
// needs, so they may be destroyed as soon as First returns. The store owns everything a result
// record points to (pszObjectType, pszAttributes, pTrajectory, pszThumbnails); those stay valid
// until the next Next or Close on the same search, and the caller copies them out at once.
// A database handle is created by Tamsa_InitDatabase and freed by Tamsa_ReleaseDatabase (which
// nulls it); a search handle is created by First and freed by Close, never by anyone else.
// Close every search before releasing its database handle.
//
// Threads: one database handle (and the searches opened on it) is used by one thread at a time;
// several handles may be used on different threads at once, on the same storage directory
// or on different ones, searching and ingesting concurrently. Tamsa_GetObjectMetaInfoAbort is the
// one call that may come from another thread: at any time between First and Close, including
// while a Next on that search is running. That Next, or the next one, then returns
// TAMSA_E_ABORTED promptly (within milliseconds, also during a feature scan), and so does
// every later Next; the caller still calls Close.
//
// Storage: files under the directory given to Tamsa_SetStoragesDBPath (created on first use).
// Tamsa_PutObjectMetaInfo returns only after the objects it counts are written to the store's
// files: they survive a crash of the process (set TAMSA_SYNC=full to also sync them to the device, surviving a power
// loss, at a much lower ingest rate). Several processes may share a directory. A read-only
// directory holding a store still opens and serves searches; ingest there (or into a full one)
// fails with TAMSA_E_IO, stores nothing, and works again on the same handle once it can write.
//
// Matching, where a choice had to be made: a two-point trace is a finite tripwire (the path must
// touch the segment between the points while changing side); a zone is entered when a
// trajectory point lies inside it or a trajectory segment crosses its border; loitering needs a
// run of consecutive points inside spanning dwDuration seconds. Feature texts may be shorter
// than the stored 512-float vectors (the first n elements count); longer ones score 0. A query
// text that does not parse (attributes not an object, trace not a list of >= 2 points, feature
// not a list of numbers) fails First with TAMSA_E_BAD_QUERY rather than matching everything.
// A scalar attribute condition matches a stored list that holds the value (objects store colours
// as lists). A plate condition, in pszPlateNumber or as the "PlateNumber" attribute, needs an
// object with a plate: a pattern of stars alone matches every plate, not the absence of one.
//
// Feature files: per location and kind (body, face), features/L<n>.<kind>.f32 holds float32 rows
// of 512 values, .rows one 16-byte record per row (object rowid, start, end), and .q8 the row's
// compact copy, 528 bytes: 512 int8 codes c_i = round(x_i / s) with s = max|x_i| / 127 (a float),
// then s/|x| (float), the residual rho (float, rounded up; rho >= |x - s*c| / |x|, or +infinity
// when the row is left to float32: a value not finite, |x| outside [2^-20, 2^20], or rho > 0.25),
// the sum of the codes (int32) and 4 zero bytes. The copy is 26% of the float32 files. A store
// without .q8 files opens as before; its writer fills them in from the float32 rows at the next
// ingest, and until then the scan reads float32 rows. Rows are appended in arrival order; each
// view of a location keeps, per 256 rows, the earliest start and the latest end among them, and a
// scan reads only the blocks that can overlap the window (a late or long stay widens its block's
// range, so it is still found).
//
// Why a compact scan returns exactly what a float32 scan returns: the query q (512 values) is
// coded the same way, q = t*d + f, phi >= |f| / |q|. With C = q.x / (|q||x|) exactly and the
// estimate E = t*s*(d.c) / (|q||x|) (d.c is an exact integer):
//   q.x - t*s*(d.c) = t*d.e + f.x, so |C - E| <= rho*(1 + phi) + phi   (Cauchy-Schwarz).
// The float32 score S the scan computes differs from C by less than 7e-5: each of its three sums
// of 512 products, in any order, errs by at most gamma_512 * sum|terms| <= gamma_512 * |q||x|
// (gamma_n = n*u / (1 - n*u), u = 2^-24), and the square roots, product and quotient add a few u;
// in the norm range above nothing overflows and underflow is negligible. E is evaluated in
// float32 to about 2e-6. A row is ruled out only when E + rho*(1 + phi) < 0.5 - phi - 2e-4; then
// C < 0.5 - 1.98e-4, so S < 0.5 and the float32 scan would not have kept it either. Every other
// row is scored by the float32 kernel exactly as before, so hits, scores and their order are the
// float32 scan's, bit for bit. Queries shorter than 512 values (which shorten the row norms too),
// or outside the norm range, are scanned in float32 throughout. int8 was chosen over fp16: a
// quarter of the bytes of fp16, and an integer dot product that is exact (bench_tamsa prints both
// rates).

#include <cstddef>
#include <cstdint>

#if defined(_WIN32)
#define TAMSA_EXPORT __declspec(dllexport)
#else
#define TAMSA_EXPORT __attribute__((visibility("default")))
#endif

extern "C" {

// ---- statuses ------------------------------------------------------------------------------
#define TAMSA_OK 0
#define TAMSA_E_INVALID_ARGUMENT ((int32_t)0x80431901) // null handle or pointer, wrong wSize
#define TAMSA_E_NO_STORAGE_PATH ((int32_t)0x80431902)  // no (usable) Tamsa_SetStoragesDBPath yet
#define TAMSA_E_IO ((int32_t)0x80431903)               // a file or SQLite operation failed
#define TAMSA_E_ABORTED ((int32_t)0x80431904)          // the search was ended by Abort
#define TAMSA_E_NO_MORE_RECORDS ((int32_t)0x80431905)  // end of records (not a failure)
#define TAMSA_E_BAD_JSON ((int32_t)0x80431906)         // ingest text is not the camera answer format
#define TAMSA_E_BAD_QUERY ((int32_t)0x80431907)     // a query text is malformed (attributes, trace, feature)
#define TAMSA_E_OUT_OF_MEMORY ((int32_t)0x80431908) // an allocation failed
#define TAMSA_E_BUSY ((int32_t)0x80431909)          // the storage stayed locked by another writer

// ---- records -------------------------------------------------------------------------------
// Every record starts with a 16-bit size the caller fills in; reserved bytes are zero.

typedef struct TTAMSA_TZDS
{
    uint16_t wZone;       // 0: time zone in quarter hours, biased by 48
    uint16_t wDaylight;   // 2: 1 when daylight saving is in force
    uint8_t reserved[12]; // 4
} TTAMSA_TZDS;

typedef struct TTAMSA_OBJECTMETAINFO_QUERY
{
    uint16_t wSize;                   // 0: 128
    uint16_t reserved2;               // 2
    uint32_t dwStartTime;             // 4: window start, seconds since the Unix epoch
    uint32_t reserved8;               // 8
    uint32_t dwEndTime;               // 12: window end, seconds since the Unix epoch
    uint32_t reserved16;              // 16
    TTAMSA_TZDS tzds;                 // 20: the server's zone (informational)
    uint32_t reserved36;              // 36
    const uint32_t* pdwLocationIds;   // 40: location numbers ended by 0; null or empty matches nothing
    const char* pszObjectType;        // 48: "Human", "Vehicle" or null (any)
    const char* pszPrimaryAttributes; // 56: compact JSON object, or null
    const char* pszTrace;             // 64: JSON array of [x, y] points, or null
    uint32_t dwDuration;              // 72: loitering duration, seconds
    uint32_t bLoitering;              // 76: 1 or 0
    uint32_t bDescending;             // 80: 1 or 0
    int32_t nDirection;               // 84: 0 either way, 1 negative->positive, 2 positive->negative
    const char* pszOtherAttributes;   // 88: compact JSON object, or null
    uint32_t bDoNotSort;              // 96: 1 or 0
    uint32_t reserved100;             // 100
    const char* pszFeature;           // 104: compact JSON array of numbers (body vector), or null
    const char* pszFaceFeature;       // 112: compact JSON array of numbers (face vector), or null
    const char* pszPlateNumber;       // 120: plate text with * and ? wildcards, or null
} TTAMSA_OBJECTMETAINFO_QUERY;

typedef struct TTAMSA_OBJECTMETAINFO_RESULT
{
    uint16_t wSize;             // 0: 80, set by the caller
    uint16_t reserved2;         // 2
    uint32_t reserved4;         // 4
    uint64_t qwObjectId;        // 8: the camera's "ID"
    uint32_t dwLocationNumber;  // 16: location number ("Loc" + this number is the location id)
    uint32_t reserved20;        // 20
    const char* pszObjectType;  // 24: "Human", "Vehicle", ...
    const char* pszAttributes;  // 32: JSON object of the object's attributes, as ingested
    uint32_t dwStartTime;       // 40: first seen, seconds since the Unix epoch
    uint32_t dwEndTime;         // 44: last seen, seconds since the Unix epoch
    const double* pTrajectory;  // 48: points, each x then y (64-bit floats)
    uint32_t dwTrajectoryBytes; // 56: byte size of pTrajectory (16 per point)
    uint32_t reserved60;        // 60
    const char* pszThumbnails;  // 64: JSON object {"Thumbnail", "FaceThumbnail"?, "LicensePlateThumbnail"?}
    float fScore;               // 72: body cosine similarity, 0 when the query has no body vector
    float fFaceScore;           // 76: face cosine similarity, 0 when the query has no face vector
} TTAMSA_OBJECTMETAINFO_RESULT;

// ---- entry points --------------------------------------------------------------------------

// Creates a database handle in *database (null on failure). initRecord: the 704-byte
// initialisation record (u16 size 704 at offset 0); reserved: 0.
TAMSA_EXPORT int32_t Tamsa_InitDatabase(void** database, const void* initRecord, uint32_t reserved);
// Sets the storage directory (UTF-8); creates it and the store files when missing.
TAMSA_EXPORT int32_t Tamsa_SetStoragesDBPath(void* database, const char* storageDirUtf8);
// Frees the handle in *database and sets *database to null. A null *database is a no-op (0).
TAMSA_EXPORT int32_t Tamsa_ReleaseDatabase(void** database);
// Opens a search; on success *search is the new handle, on failure it is null.
TAMSA_EXPORT int32_t Tamsa_GetObjectMetaInfoFirst(void* database, const TTAMSA_OBJECTMETAINFO_QUERY* query,
                                                  void** search);
// Fills *result with the next object (result->wSize must be 80); 0, TAMSA_E_NO_MORE_RECORDS or an error.
TAMSA_EXPORT int32_t Tamsa_GetObjectMetaInfoNext(void* search, TTAMSA_OBJECTMETAINFO_RESULT* result);
// Ends a search and frees its handle. Null is a no-op.
TAMSA_EXPORT void Tamsa_GetObjectMetaInfoClose(void* search);
// Asks a search to end (thread-safe, see above). Null is a no-op.
TAMSA_EXPORT void Tamsa_GetObjectMetaInfoAbort(void* search);
// Our own ingest entry point: stores the objects of one camera answer
// ({"ObjectMetaInfo": [object, ...]}, the format the cameras answer in) under locationNumber (> 0).
// Returns the number of objects stored; elements that are not valid objects are skipped.
// Returns a negative TAMSA_E_* code, and stores nothing, when the text is not that format.
// An object with the (location, "ID") of a stored one replaces it.
TAMSA_EXPORT int32_t Tamsa_PutObjectMetaInfo(void* database, int32_t groupId, int32_t locationNumber,
                                             const char* json);

} // extern "C"

// ---- layout checks ------------------------------------------------------------------------
static_assert(sizeof(TTAMSA_TZDS) == 16, "TTAMSA_TZDS is 16 bytes");
static_assert(offsetof(TTAMSA_TZDS, wZone) == 0, "wZone");
static_assert(offsetof(TTAMSA_TZDS, wDaylight) == 2, "wDaylight");

static_assert(sizeof(TTAMSA_OBJECTMETAINFO_QUERY) == 128, "query record is 128 bytes");
static_assert(offsetof(TTAMSA_OBJECTMETAINFO_QUERY, wSize) == 0, "wSize");
static_assert(offsetof(TTAMSA_OBJECTMETAINFO_QUERY, dwStartTime) == 4, "dwStartTime");
static_assert(offsetof(TTAMSA_OBJECTMETAINFO_QUERY, dwEndTime) == 12, "dwEndTime");
static_assert(offsetof(TTAMSA_OBJECTMETAINFO_QUERY, tzds) == 20, "tzds");
static_assert(offsetof(TTAMSA_OBJECTMETAINFO_QUERY, pdwLocationIds) == 40, "pdwLocationIds");
static_assert(offsetof(TTAMSA_OBJECTMETAINFO_QUERY, pszObjectType) == 48, "pszObjectType");
static_assert(offsetof(TTAMSA_OBJECTMETAINFO_QUERY, pszPrimaryAttributes) == 56, "pszPrimaryAttributes");
static_assert(offsetof(TTAMSA_OBJECTMETAINFO_QUERY, pszTrace) == 64, "pszTrace");
static_assert(offsetof(TTAMSA_OBJECTMETAINFO_QUERY, dwDuration) == 72, "dwDuration");
static_assert(offsetof(TTAMSA_OBJECTMETAINFO_QUERY, bLoitering) == 76, "bLoitering");
static_assert(offsetof(TTAMSA_OBJECTMETAINFO_QUERY, bDescending) == 80, "bDescending");
static_assert(offsetof(TTAMSA_OBJECTMETAINFO_QUERY, nDirection) == 84, "nDirection");
static_assert(offsetof(TTAMSA_OBJECTMETAINFO_QUERY, pszOtherAttributes) == 88, "pszOtherAttributes");
static_assert(offsetof(TTAMSA_OBJECTMETAINFO_QUERY, bDoNotSort) == 96, "bDoNotSort");
static_assert(offsetof(TTAMSA_OBJECTMETAINFO_QUERY, pszFeature) == 104, "pszFeature");
static_assert(offsetof(TTAMSA_OBJECTMETAINFO_QUERY, pszFaceFeature) == 112, "pszFaceFeature");
static_assert(offsetof(TTAMSA_OBJECTMETAINFO_QUERY, pszPlateNumber) == 120, "pszPlateNumber");

static_assert(sizeof(TTAMSA_OBJECTMETAINFO_RESULT) == 80, "result record is 80 bytes");
static_assert(offsetof(TTAMSA_OBJECTMETAINFO_RESULT, wSize) == 0, "wSize");
static_assert(offsetof(TTAMSA_OBJECTMETAINFO_RESULT, qwObjectId) == 8, "qwObjectId");
static_assert(offsetof(TTAMSA_OBJECTMETAINFO_RESULT, dwLocationNumber) == 16, "dwLocationNumber");
static_assert(offsetof(TTAMSA_OBJECTMETAINFO_RESULT, pszObjectType) == 24, "pszObjectType");
static_assert(offsetof(TTAMSA_OBJECTMETAINFO_RESULT, pszAttributes) == 32, "pszAttributes");
static_assert(offsetof(TTAMSA_OBJECTMETAINFO_RESULT, dwStartTime) == 40, "dwStartTime");
static_assert(offsetof(TTAMSA_OBJECTMETAINFO_RESULT, dwEndTime) == 44, "dwEndTime");
static_assert(offsetof(TTAMSA_OBJECTMETAINFO_RESULT, pTrajectory) == 48, "pTrajectory");
static_assert(offsetof(TTAMSA_OBJECTMETAINFO_RESULT, dwTrajectoryBytes) == 56, "dwTrajectoryBytes");
static_assert(offsetof(TTAMSA_OBJECTMETAINFO_RESULT, pszThumbnails) == 64, "pszThumbnails");
static_assert(offsetof(TTAMSA_OBJECTMETAINFO_RESULT, fScore) == 72, "fScore");
static_assert(offsetof(TTAMSA_OBJECTMETAINFO_RESULT, fFaceScore) == 76, "fFaceScore");
