#include "TamsaFeatureFile.h"

#include <algorithm>
#include <cerrno>
#include <fcntl.h>
#include <sys/mman.h>
#include <sys/stat.h>
#include <unistd.h>

namespace tamsa {

namespace {

bool writeAll(int fd, const void* data, size_t bytes, off_t offset)
{
    const char* p = static_cast<const char*>(data);
    while (bytes > 0) {
        const ssize_t written = ::pwrite(fd, p, bytes, offset);
        if (written < 0) {
            if (errno == EINTR) {
                continue;
            }
            return false;
        }
        p += written;
        bytes -= size_t(written);
        offset += written;
    }
    return true;
}

bool readAll(int fd, void* data, size_t bytes, off_t offset)
{
    char* p = static_cast<char*>(data);
    while (bytes > 0) {
        const ssize_t got = ::pread(fd, p, bytes, offset);
        if (got <= 0) {
            if (got < 0 && errno == EINTR) {
                continue;
            }
            return false;
        }
        p += got;
        bytes -= size_t(got);
        offset += got;
    }
    return true;
}

int64_t fileSize(const std::string& path)
{
    struct stat info
    {};
    return ::stat(path.c_str(), &info) == 0 ? int64_t(info.st_size) : -1;
}

} // namespace

TamsaFeatureFile::TamsaFeatureFile(std::string vectorPath, std::string infoPath, std::string compactPath)
    : m_vectorPath(std::move(vectorPath))
    , m_infoPath(std::move(infoPath))
    , m_compactPath(std::move(compactPath))
{}

TamsaFeatureFile::~TamsaFeatureFile()
{
    if (m_vectorFd >= 0) {
        ::close(m_vectorFd);
    }
    if (m_infoFd >= 0) {
        ::close(m_infoFd);
    }
    if (m_compactFd >= 0) {
        ::close(m_compactFd);
    }
}

bool TamsaFeatureFile::open()
{
    if (m_vectorFd < 0) {
        m_vectorFd = ::open(m_vectorPath.c_str(), O_RDWR | O_CREAT | O_CLOEXEC, 0644);
    }
    if (m_infoFd < 0) {
        m_infoFd = ::open(m_infoPath.c_str(), O_RDWR | O_CREAT | O_CLOEXEC, 0644);
    }
    if (m_compactFd < 0) {
        m_compactFd = ::open(m_compactPath.c_str(), O_RDWR | O_CREAT | O_CLOEXEC, 0644);
    }
    if (m_vectorFd < 0 || m_infoFd < 0 || m_compactFd < 0) {
        return false;
    }
    // Sizes are read on every open (each ingest): cheap, and right after a crash of a writer.
    struct stat vectorInfo
    {};
    struct stat infoInfo
    {};
    if (::fstat(m_vectorFd, &vectorInfo) != 0 || ::fstat(m_infoFd, &infoInfo) != 0) {
        return false;
    }
    const int64_t rows = std::min(int64_t(vectorInfo.st_size) / int64_t(kFeatureRowBytes),
                                  int64_t(infoInfo.st_size) / int64_t(sizeof(FeatureRowInfo)));
    if (vectorInfo.st_size != rows * int64_t(kFeatureRowBytes)) {
        if (::ftruncate(m_vectorFd, rows * int64_t(kFeatureRowBytes)) != 0) {
            return false;
        }
    }
    if (infoInfo.st_size != rows * int64_t(sizeof(FeatureRowInfo))) {
        if (::ftruncate(m_infoFd, rows * int64_t(sizeof(FeatureRowInfo))) != 0) {
            return false;
        }
    }
    m_rows = rows;
    struct stat compactInfo
    {};
    if (::fstat(m_compactFd, &compactInfo) != 0) {
        return false;
    }
    const int64_t compactRows = std::min(rows, int64_t(compactInfo.st_size) / int64_t(sizeof(CompactRow)));
    if (compactInfo.st_size != compactRows * int64_t(sizeof(CompactRow)) &&
        ::ftruncate(m_compactFd, compactRows * int64_t(sizeof(CompactRow))) != 0) {
        return false;
    }
    return compactRows == rows || catchUpCompact(compactRows);
}

bool TamsaFeatureFile::catchUpCompact(int64_t compactRows)
{
    constexpr int64_t kChunk = 1024;
    std::vector<float> vectors(size_t(kChunk) * kFeatureDim);
    std::vector<CompactRow> compact(static_cast<size_t>(kChunk));
    for (int64_t first = compactRows; first < m_rows; first += kChunk) {
        const int64_t count = std::min(kChunk, m_rows - first);
        if (!readAll(m_vectorFd, vectors.data(), size_t(count) * kFeatureRowBytes,
                     off_t(first * int64_t(kFeatureRowBytes)))) {
            return false;
        }
        for (int64_t i = 0; i < count; ++i) {
            encodeCompactRow(vectors.data() + size_t(i) * kFeatureDim, &compact[size_t(i)]);
        }
        if (!writeAll(m_compactFd, compact.data(), size_t(count) * sizeof(CompactRow),
                      off_t(first * int64_t(sizeof(CompactRow))))) {
            return false;
        }
    }
    return true;
}

int64_t TamsaFeatureFile::append(const float* vector, const FeatureRowInfo& info)
{
    const int64_t row = nextRow();
    m_pendingVectors.insert(m_pendingVectors.end(), vector, vector + kFeatureDim);
    m_pendingInfos.push_back(info);
    encodeCompactRow(vector, &m_pendingCompact.emplace_back());
    return row;
}

bool TamsaFeatureFile::flush(bool sync)
{
    if (m_pendingInfos.empty()) {
        return true;
    }
    const bool ok =
        writeAll(m_vectorFd, m_pendingVectors.data(), m_pendingVectors.size() * sizeof(float),
                 off_t(m_rows * int64_t(kFeatureRowBytes))) &&
        writeAll(m_infoFd, m_pendingInfos.data(), m_pendingInfos.size() * sizeof(FeatureRowInfo),
                 off_t(m_rows * int64_t(sizeof(FeatureRowInfo)))) &&
        writeAll(m_compactFd, m_pendingCompact.data(), m_pendingCompact.size() * sizeof(CompactRow),
                 off_t(m_rows * int64_t(sizeof(CompactRow)))) &&
        (!sync ||
         (::fdatasync(m_vectorFd) == 0 && ::fdatasync(m_infoFd) == 0 && ::fdatasync(m_compactFd) == 0));
    if (ok) {
        m_rows += int64_t(m_pendingInfos.size());
    }
    discard();
    return ok;
}

void TamsaFeatureFile::discard()
{
    m_pendingVectors.clear();
    m_pendingInfos.clear();
    m_pendingCompact.clear();
}

int64_t TamsaFeatureMap::rowsOnDisk(const std::string& vectorPath, const std::string& infoPath)
{
    const int64_t vectorBytes = fileSize(vectorPath);
    const int64_t infoBytes = fileSize(infoPath);
    if (vectorBytes <= 0 || infoBytes <= 0) {
        return 0;
    }
    return std::min(vectorBytes / int64_t(kFeatureRowBytes), infoBytes / int64_t(sizeof(FeatureRowInfo)));
}

int64_t TamsaFeatureMap::compactRowsOnDisk(const std::string& compactPath)
{
    return std::max<int64_t>(0, fileSize(compactPath) / int64_t(sizeof(CompactRow)));
}

struct TamsaFeatureMap::Mapping
{
    void* vectorBase = nullptr;
    size_t vectorBytes = 0;
    void* infoBase = nullptr;
    size_t infoBytes = 0;
    void* compactBase = nullptr;
    size_t compactBytes = 0;
    int64_t capacityRows = 0;

    ~Mapping()
    {
        if (vectorBase) {
            ::munmap(vectorBase, vectorBytes);
        }
        if (infoBase) {
            ::munmap(infoBase, infoBytes);
        }
        if (compactBase) {
            ::munmap(compactBase, compactBytes);
        }
    }
};

namespace {

// Maps `bytes` of the file at `path` (reserving room past its end); null on failure.
void* mapFile(const std::string& path, size_t bytes, bool populate)
{
    const int fd = ::open(path.c_str(), O_RDONLY | O_CLOEXEC);
    if (fd < 0) {
        return nullptr;
    }
    void* base = ::mmap(nullptr, bytes, PROT_READ, MAP_SHARED | (populate ? MAP_POPULATE : 0), fd, 0);
    ::close(fd);
    return base != MAP_FAILED ? base : nullptr;
}

} // namespace

std::shared_ptr<const TamsaFeatureMap>
TamsaFeatureMap::map(const std::string& vectorPath, const std::string& infoPath,
                     const std::string& compactPath, const std::shared_ptr<const TamsaFeatureMap>& previous)
{
    const int64_t rows = rowsOnDisk(vectorPath, infoPath);
    if (rows <= 0) {
        return nullptr;
    }
    const int64_t compactRows = std::min(rows, compactRowsOnDisk(compactPath));
    std::shared_ptr<TamsaFeatureMap> result(new TamsaFeatureMap);
    result->m_rows = rows;
    result->m_compactRows = compactRows;
    const std::shared_ptr<const Mapping> old = previous ? previous->m_mapping : nullptr;
    if (old && rows <= old->capacityRows && (compactRows == 0 || old->compactBase)) {
        result->m_mapping = old;
    } else {
        auto mapping = std::make_shared<Mapping>();
        // Room for the files to grow by half again (at least 16384 rows) before a new mapping.
        mapping->capacityRows = std::max(rows + rows / 2, rows + 16384);
        mapping->vectorBytes = size_t(mapping->capacityRows) * kFeatureRowBytes;
        mapping->infoBytes = size_t(mapping->capacityRows) * sizeof(FeatureRowInfo);
        // What the scan reads is populated up front, so that it runs at memory speed; float32
        // rows too while some lack a compact copy (the scan reads those).
        const bool compactCovers = compactRows == rows;
        mapping->vectorBase = mapFile(vectorPath, mapping->vectorBytes, !compactCovers);
        mapping->infoBase = mapFile(infoPath, mapping->infoBytes, true);
        if (compactRows > 0) {
            mapping->compactBytes = size_t(mapping->capacityRows) * sizeof(CompactRow);
            mapping->compactBase = mapFile(compactPath, mapping->compactBytes, true);
        }
        if (!mapping->vectorBase || !mapping->infoBase || (compactRows > 0 && !mapping->compactBase)) {
            return nullptr;
        }
        // Once compact rows cover the file, float32 rows are read one by one (the few rows that
        // compact scores cannot rule out, and the hits handed out): read-ahead would only waste
        // memory and, on a cold cache, time.
        ::madvise(mapping->vectorBase, mapping->vectorBytes, compactCovers ? MADV_RANDOM : MADV_SEQUENTIAL);
        result->m_mapping = mapping;
    }
    result->m_vectors = static_cast<const float*>(result->m_mapping->vectorBase);
    result->m_infos = static_cast<const FeatureRowInfo*>(result->m_mapping->infoBase);
    result->m_compact = static_cast<const CompactRow*>(result->m_mapping->compactBase);

    // The time index: complete blocks of the previous view stay as they are.
    auto blocks = std::make_shared<std::vector<TimeBlock>>();
    int64_t firstRow = 0;
    if (previous && previous->m_blocks) {
        const size_t complete = size_t(std::min(previous->m_rows, rows) / kTimeBlockRows);
        blocks->assign(previous->m_blocks->begin(), previous->m_blocks->begin() + ptrdiff_t(complete));
        firstRow = int64_t(complete) * kTimeBlockRows;
    }
    for (int64_t row = firstRow; row < rows; ++row) {
        const FeatureRowInfo& info = result->m_infos[row];
        if (row % kTimeBlockRows == 0) {
            blocks->push_back({info.startTime, info.endTime});
        } else {
            TimeBlock& block = blocks->back();
            block.firstStart = std::min(block.firstStart, info.startTime);
            block.lastEnd = std::max(block.lastEnd, info.endTime);
        }
    }
    result->m_blocks = std::move(blocks);
    return result;
}

} // namespace tamsa
