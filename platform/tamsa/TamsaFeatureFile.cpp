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

int64_t fileSize(const std::string& path)
{
    struct stat info
    {};
    return ::stat(path.c_str(), &info) == 0 ? int64_t(info.st_size) : -1;
}

} // namespace

TamsaFeatureFile::TamsaFeatureFile(std::string vectorPath, std::string infoPath)
    : m_vectorPath(std::move(vectorPath))
    , m_infoPath(std::move(infoPath))
{}

TamsaFeatureFile::~TamsaFeatureFile()
{
    if (m_vectorFd >= 0) {
        ::close(m_vectorFd);
    }
    if (m_infoFd >= 0) {
        ::close(m_infoFd);
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
    if (m_vectorFd < 0 || m_infoFd < 0) {
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
    return true;
}

int64_t TamsaFeatureFile::append(const float* vector, const FeatureRowInfo& info)
{
    const int64_t row = nextRow();
    m_pendingVectors.insert(m_pendingVectors.end(), vector, vector + kFeatureDim);
    m_pendingInfos.push_back(info);
    return row;
}

bool TamsaFeatureFile::flush(bool sync)
{
    if (m_pendingInfos.empty()) {
        return true;
    }
    const bool ok = writeAll(m_vectorFd, m_pendingVectors.data(), m_pendingVectors.size() * sizeof(float),
                             off_t(m_rows * int64_t(kFeatureRowBytes))) &&
                    writeAll(m_infoFd, m_pendingInfos.data(), m_pendingInfos.size() * sizeof(FeatureRowInfo),
                             off_t(m_rows * int64_t(sizeof(FeatureRowInfo)))) &&
                    (!sync || (::fdatasync(m_vectorFd) == 0 && ::fdatasync(m_infoFd) == 0));
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

struct TamsaFeatureMap::Mapping
{
    void* vectorBase = nullptr;
    size_t vectorBytes = 0;
    void* infoBase = nullptr;
    size_t infoBytes = 0;
    int64_t capacityRows = 0;

    ~Mapping()
    {
        if (vectorBase) {
            ::munmap(vectorBase, vectorBytes);
        }
        if (infoBase) {
            ::munmap(infoBase, infoBytes);
        }
    }
};

std::shared_ptr<const TamsaFeatureMap>
TamsaFeatureMap::map(const std::string& vectorPath, const std::string& infoPath,
                     const std::shared_ptr<const TamsaFeatureMap>& previous)
{
    const int64_t rows = rowsOnDisk(vectorPath, infoPath);
    if (rows <= 0) {
        return nullptr;
    }
    std::shared_ptr<TamsaFeatureMap> result(new TamsaFeatureMap);
    result->m_rows = rows;
    if (previous && previous->m_mapping && rows <= previous->m_mapping->capacityRows) {
        result->m_mapping = previous->m_mapping;
    } else {
        auto mapping = std::make_shared<Mapping>();
        // Room for the file to grow by half again (at least 16384 rows) before a new mapping.
        mapping->capacityRows = std::max(rows + rows / 2, rows + 16384);
        mapping->vectorBytes = size_t(mapping->capacityRows) * kFeatureRowBytes;
        mapping->infoBytes = size_t(mapping->capacityRows) * sizeof(FeatureRowInfo);
        const int vectorFd = ::open(vectorPath.c_str(), O_RDONLY | O_CLOEXEC);
        const int infoFd = ::open(infoPath.c_str(), O_RDONLY | O_CLOEXEC);
        if (vectorFd >= 0 && infoFd >= 0) {
            // Populated up front (the part the files hold): the scan then runs at memory speed.
            void* vectors =
                ::mmap(nullptr, mapping->vectorBytes, PROT_READ, MAP_SHARED | MAP_POPULATE, vectorFd, 0);
            void* infos =
                ::mmap(nullptr, mapping->infoBytes, PROT_READ, MAP_SHARED | MAP_POPULATE, infoFd, 0);
            mapping->vectorBase = vectors != MAP_FAILED ? vectors : nullptr;
            mapping->infoBase = infos != MAP_FAILED ? infos : nullptr;
        }
        if (vectorFd >= 0) {
            ::close(vectorFd);
        }
        if (infoFd >= 0) {
            ::close(infoFd);
        }
        if (!mapping->vectorBase || !mapping->infoBase) {
            return nullptr;
        }
        ::madvise(mapping->vectorBase, mapping->vectorBytes, MADV_SEQUENTIAL);
        result->m_mapping = mapping;
    }
    result->m_vectors = static_cast<const float*>(result->m_mapping->vectorBase);
    result->m_infos = static_cast<const FeatureRowInfo*>(result->m_mapping->infoBase);
    return result;
}

} // namespace tamsa
