#pragma once
// Cosine similarity for the feature scan. The scan reads every stored vector of the searched
// locations once, so its speed is memory bandwidth; the kernels below use explicit SIMD
// (AVX-512 or AVX2/FMA, picked at run time from the CPU) because compilers do not vectorise a
// float sum on their own (it would change the rounding order). The scalar kernel is the
// reference: the SIMD ones agree with it to about 1e-6 relative.

#include <cstddef>
#include <cstdint>
#include <vector>

namespace tamsa {

constexpr size_t kCompactDim = 512; // the stored rows' length (kFeatureDim)

// Computes the dot product of q and x and the squared norm of x, over n floats.
using DotNormFn = void (*)(const float* q, const float* x, size_t n, float* dot, float* norm2);

DotNormFn dotNormScalar();
// The fastest kernel this CPU runs.
DotNormFn dotNormBest();
// Name of the kernel dotNormBest() returns ("avx512", "avx2", "scalar"), for reports.
const char* dotNormBestName();

// The store's cosine: both norms zero is 1, one of them zero is 0, negative values are 0.
float cosineFromParts(float dot, float queryNorm2, float rowNorm2);

// ---- the compact copy (layout, bound and argument in Tamsa.h) --------------------------------

// One stored row's int8 copy: codes c with x ~ s*c (s = max|x_i| / 127), and what turns their dot
// product with a query's codes into a score estimate with a known error.
struct CompactRow
{
    int8_t codes[kCompactDim]; // in [-127, 127]
    float scaleOverNorm;       // s / |x|
    float residual;            // >= |x - s*c| / |x|; +infinity: the row is always scored in float32
    int32_t codeSum;           // sum of the codes (the AVX-512 kernel works on biased query codes)
    uint32_t reserved;
};
static_assert(sizeof(CompactRow) == kCompactDim + 16, "compact rows are 528 bytes");

struct CompactQuery
{
    bool usable = false; // false: the query is scored in float32 everywhere
    alignas(64) int8_t codes[kCompactDim];
    alignas(64) uint8_t biased[kCompactDim]; // codes + 128
    float scaleOverNorm = 0;                 // t / |q|
    float residualFactor = 0;                // 1 + phi, phi >= |q - t*d| / |q|
    float limit = 0;                         // threshold - phi - slack
};

void encodeCompactRow(const float* x, CompactRow* row);
// `threshold`: the float32 score a row must reach to count.
void encodeCompactQuery(const std::vector<float>& q, float threshold, CompactQuery* query);

// The exact integer dot product of the query's and the row's codes.
using CompactDotFn = int32_t (*)(const CompactQuery& query, const CompactRow& row);
CompactDotFn compactDotScalar();
CompactDotFn compactDotBest();
const char* compactDotBestName();

// False only when the row's float32 score is certainly below the query's threshold.
inline bool compactMayReach(const CompactQuery& query, const CompactRow& row, int32_t dot)
{
    return float(dot) * row.scaleOverNorm * query.scaleOverNorm + row.residual * query.residualFactor >=
           query.limit;
}

// The scan's inner loop: writes to `kept` the indexes of the rows among `count` that
// compactMayReach keeps, and returns how many (one call per chunk, the dot product inlined).
using CompactFilterFn = size_t (*)(const CompactQuery& query, const CompactRow* rows, size_t count,
                                   uint32_t* kept);
CompactFilterFn compactFilterBest();

} // namespace tamsa
