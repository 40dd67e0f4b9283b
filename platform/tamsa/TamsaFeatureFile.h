#pragma once
// The feature vectors of one location and one kind (body or face), kept out of SQLite: a file of
// contiguous float32 rows (kFeatureDim per row), a parallel file of small row records telling
// which object a row belongs to and when it was seen (so the scan can skip rows outside the time
// window without reading them), and a third parallel file holding each row's compact copy
// (CompactRow, see Tamsa.h), which the scan reads instead of the float32 row.
//
// Stores made before the compact copy existed have no third file; the writer builds the missing
// compact rows from the float32 rows when it opens, and until then the scan reads float32 rows
// where the compact ones are missing.
//
// Files only grow; a replaced object leaves its old row behind, and the object's row in SQLite
// says which row is current. A crash may leave a torn tail; the writer cuts both files back to
// the rows they both hold completely. Rows are written before the SQLite commit that refers to
// them, so every committed object finds its rows after a crash of the process.
//
// Thread use: TamsaFeatureFile (the writer) only under the store's write lock; a
// TamsaFeatureMap is immutable and shared by any number of searches.

#include "TamsaCosine.h"

#include <cstdint>
#include <memory>
#include <string>
#include <vector>

namespace tamsa {

constexpr size_t kFeatureDim = 512;
constexpr size_t kFeatureRowBytes = kFeatureDim * sizeof(float);

struct FeatureRowInfo
{
    int64_t objectRowId; // the object's SQLite rowid
    uint32_t startTime;
    uint32_t endTime;
};
static_assert(sizeof(FeatureRowInfo) == 16, "row records are 16 bytes");
static_assert(kFeatureDim == kCompactDim, "every stored row has a compact copy of the same length");

// Rows per entry of a map's time index; a window reads whole blocks.
constexpr int64_t kTimeBlockRows = 256;
struct TimeBlock
{
    uint32_t firstStart; // the earliest start time of the block's rows
    uint32_t lastEnd;    // the latest end time
};

class TamsaFeatureFile
{
public:
    TamsaFeatureFile(std::string vectorPath, std::string infoPath, std::string compactPath);
    ~TamsaFeatureFile();
    TamsaFeatureFile(const TamsaFeatureFile&) = delete;
    TamsaFeatureFile& operator=(const TamsaFeatureFile&) = delete;

    // Opens (creating) the files, cuts a torn tail and fills in missing compact rows. False on
    // an I/O error.
    bool open();
    // Row index the next append gets.
    int64_t nextRow() const { return m_rows + int64_t(m_pendingInfos.size()); }
    // Queues one row; written by flush().
    int64_t append(const float* vector, const FeatureRowInfo& info);
    // Writes the queued rows (and with `sync` forces them to the device). False on an I/O error.
    bool flush(bool sync);
    // Drops queued rows (the transaction that wanted them failed).
    void discard();

private:
    bool catchUpCompact(int64_t compactRows);

    std::string m_vectorPath;
    std::string m_infoPath;
    std::string m_compactPath;
    int m_vectorFd = -1;
    int m_infoFd = -1;
    int m_compactFd = -1;
    int64_t m_rows = 0;
    std::vector<float> m_pendingVectors;
    std::vector<FeatureRowInfo> m_pendingInfos;
    std::vector<CompactRow> m_pendingCompact;
};

// A read-only view of the rows present when it was made. Views of a growing file share one
// mapping that reserves room beyond the end of the file, so a search after an ingest does not
// map (and fault in) the whole file again; only rows below rows() are ever read. The compact
// rows and the row records are read into memory up front; float32 rows only when touched, once
// compact rows cover the file (a scale-sized store's float32 rows do not fit in memory).
// The time index summarises each kTimeBlockRows rows, whatever order they arrived in.
class TamsaFeatureMap
{
public:
    // Maps the complete rows of both files, reusing `previous`'s mapping while the rows fit in
    // it; null when the files are missing or empty.
    static std::shared_ptr<const TamsaFeatureMap>
    map(const std::string& vectorPath, const std::string& infoPath, const std::string& compactPath,
        const std::shared_ptr<const TamsaFeatureMap>& previous = {});
    // Number of complete rows the files hold now (cheap: two stat calls).
    static int64_t rowsOnDisk(const std::string& vectorPath, const std::string& infoPath);
    static int64_t compactRowsOnDisk(const std::string& compactPath);

    int64_t rows() const { return m_rows; }
    const float* vector(int64_t row) const { return m_vectors + size_t(row) * kFeatureDim; }
    const FeatureRowInfo& info(int64_t row) const { return m_infos[row]; }
    // Rows [0, compactRows()) have a compact copy.
    int64_t compactRows() const { return m_compactRows; }
    const CompactRow& compact(int64_t row) const { return m_compact[row]; }
    // Block b covers rows [b * kTimeBlockRows, min(rows(), (b + 1) * kTimeBlockRows)).
    const std::vector<TimeBlock>& timeBlocks() const { return *m_blocks; }

private:
    struct Mapping;
    TamsaFeatureMap() = default;
    std::shared_ptr<const Mapping> m_mapping;
    const float* m_vectors = nullptr;
    const FeatureRowInfo* m_infos = nullptr;
    const CompactRow* m_compact = nullptr;
    int64_t m_rows = 0;
    int64_t m_compactRows = 0;
    std::shared_ptr<const std::vector<TimeBlock>> m_blocks;
};

} // namespace tamsa
