#include "TamsaCosine.h"

#include <algorithm>
#include <cmath>
#include <limits>
#if defined(__x86_64__) || defined(__i386__)
#include <immintrin.h>
#define TAMSA_X86 1
#endif

namespace tamsa {

namespace {

void dotNormPlain(const float* q, const float* x, size_t n, float* dot, float* norm2)
{
    float d = 0;
    float nn = 0;
    for (size_t i = 0; i < n; ++i) {
        d += q[i] * x[i];
        nn += x[i] * x[i];
    }
    *dot = d;
    *norm2 = nn;
}

#ifdef TAMSA_X86
// Rows lie back to back in file-backed 4 KiB pages, where the hardware prefetcher stops at every
// page edge; fetching this far ahead keeps the next rows streaming in. A prefetch past the end of
// the mapping is harmless (it never faults).
constexpr size_t kPrefetchAhead = 4096;

__attribute__((target("avx2,fma"))) float horizontalSum(__m256 v)
{
    const __m128 low = _mm256_castps256_ps128(v);
    const __m128 high = _mm256_extractf128_ps(v, 1);
    __m128 sum = _mm_add_ps(low, high);
    sum = _mm_hadd_ps(sum, sum);
    sum = _mm_hadd_ps(sum, sum);
    return _mm_cvtss_f32(sum);
}

__attribute__((target("avx2,fma"))) void dotNormAvx2(const float* q, const float* x, size_t n, float* dot,
                                                     float* norm2)
{
    // Two independent accumulator pairs hide the FMA latency.
    __m256 d0 = _mm256_setzero_ps(), d1 = _mm256_setzero_ps();
    __m256 n0 = _mm256_setzero_ps(), n1 = _mm256_setzero_ps();
    size_t i = 0;
    for (; i + 16 <= n; i += 16) {
        _mm_prefetch(reinterpret_cast<const char*>(x + i) + kPrefetchAhead, _MM_HINT_T0);
        _mm_prefetch(reinterpret_cast<const char*>(x + i) + kPrefetchAhead + 32, _MM_HINT_T0);
        const __m256 x0 = _mm256_loadu_ps(x + i);
        const __m256 x1 = _mm256_loadu_ps(x + i + 8);
        d0 = _mm256_fmadd_ps(_mm256_loadu_ps(q + i), x0, d0);
        d1 = _mm256_fmadd_ps(_mm256_loadu_ps(q + i + 8), x1, d1);
        n0 = _mm256_fmadd_ps(x0, x0, n0);
        n1 = _mm256_fmadd_ps(x1, x1, n1);
    }
    float d = horizontalSum(_mm256_add_ps(d0, d1));
    float nn = horizontalSum(_mm256_add_ps(n0, n1));
    for (; i < n; ++i) {
        d += q[i] * x[i];
        nn += x[i] * x[i];
    }
    *dot = d;
    *norm2 = nn;
}

// A halving tree: a row's two sums are on the scan's critical path, and a lane-by-lane chain of
// sixteen dependent additions would cost more than the row's loads.
__attribute__((target("avx512f"))) float laneSum(__m512 v)
{
    // The masked forms take every lane from the operation; the unmasked ones start from an
    // "undefined" vector that the warning flags.
    constexpr __mmask16 kAllLanes = 0xFFFF;
    v = _mm512_add_ps(v, _mm512_mask_shuffle_f32x4(v, kAllLanes, v, v, _MM_SHUFFLE(1, 0, 3, 2)));
    v = _mm512_add_ps(v, _mm512_mask_shuffle_f32x4(v, kAllLanes, v, v, _MM_SHUFFLE(2, 3, 0, 1)));
    v = _mm512_add_ps(v, _mm512_mask_permute_ps(v, kAllLanes, v, _MM_SHUFFLE(1, 0, 3, 2)));
    v = _mm512_add_ps(v, _mm512_mask_permute_ps(v, kAllLanes, v, _MM_SHUFFLE(2, 3, 0, 1)));
    return _mm512_cvtss_f32(v);
}

__attribute__((target("avx512f"))) void dotNormAvx512(const float* q, const float* x, size_t n, float* dot,
                                                      float* norm2)
{
    __m512 d0 = _mm512_setzero_ps(), d1 = _mm512_setzero_ps();
    __m512 n0 = _mm512_setzero_ps(), n1 = _mm512_setzero_ps();
    size_t i = 0;
    for (; i + 32 <= n; i += 32) {
        _mm_prefetch(reinterpret_cast<const char*>(x + i) + kPrefetchAhead, _MM_HINT_T0);
        _mm_prefetch(reinterpret_cast<const char*>(x + i) + kPrefetchAhead + 64, _MM_HINT_T0);
        const __m512 x0 = _mm512_loadu_ps(x + i);
        const __m512 x1 = _mm512_loadu_ps(x + i + 16);
        d0 = _mm512_fmadd_ps(_mm512_loadu_ps(q + i), x0, d0);
        d1 = _mm512_fmadd_ps(_mm512_loadu_ps(q + i + 16), x1, d1);
        n0 = _mm512_fmadd_ps(x0, x0, n0);
        n1 = _mm512_fmadd_ps(x1, x1, n1);
    }
    float d = laneSum(_mm512_add_ps(d0, d1));
    float nn = laneSum(_mm512_add_ps(n0, n1));
    for (; i < n; ++i) {
        d += q[i] * x[i];
        nn += x[i] * x[i];
    }
    *dot = d;
    *norm2 = nn;
}
#endif

int32_t compactDotPlain(const CompactQuery& query, const CompactRow& row)
{
    int32_t dot = 0;
    for (size_t i = 0; i < kCompactDim; ++i) {
        dot += int32_t(query.codes[i]) * int32_t(row.codes[i]);
    }
    return dot;
}

size_t compactFilterPlain(const CompactQuery& query, const CompactRow* rows, size_t count, uint32_t* kept)
{
    size_t n = 0;
    for (size_t i = 0; i < count; ++i) {
        kept[n] = uint32_t(i);
        n += compactMayReach(query, rows[i], compactDotPlain(query, rows[i]));
    }
    return n;
}

#ifdef TAMSA_X86
__attribute__((target("avx2"))) int32_t intLaneSum(__m256i sum)
{
    const __m128i half = _mm_add_epi32(_mm256_castsi256_si128(sum), _mm256_extracti128_si256(sum, 1));
    const __m128i quarter = _mm_add_epi32(half, _mm_shuffle_epi32(half, _MM_SHUFFLE(1, 0, 3, 2)));
    return _mm_cvtsi128_si32(_mm_add_epi32(quarter, _mm_shuffle_epi32(quarter, _MM_SHUFFLE(2, 3, 0, 1))));
}

// |d| times c with d's sign: products of two values in [-127, 127] summed in pairs stay below
// the 16-bit saturation (2 * 127 * 127 = 32258).
__attribute__((target("avx2"))) int32_t compactDotAvx2(const CompactQuery& query, const CompactRow& row)
{
    const __m256i ones = _mm256_set1_epi16(1);
    __m256i sum = _mm256_setzero_si256();
    _mm_prefetch(reinterpret_cast<const char*>(&row) + kPrefetchAhead, _MM_HINT_T0);
    for (size_t i = 0; i < kCompactDim; i += 32) {
        const __m256i d = _mm256_load_si256(reinterpret_cast<const __m256i*>(query.codes + i));
        const __m256i c = _mm256_loadu_si256(reinterpret_cast<const __m256i*>(row.codes + i));
        const __m256i pairs = _mm256_maddubs_epi16(_mm256_abs_epi8(d), _mm256_sign_epi8(c, d));
        sum = _mm256_add_epi32(sum, _mm256_madd_epi16(pairs, ones));
    }
    return intLaneSum(sum);
}

// VNNI multiplies unsigned by signed bytes: the query's codes are biased by 128, and 128 times
// the row's code sum comes off again.
__attribute__((target("avx2,avx512f,avx512bw,avx512vnni"))) int32_t compactDotVnni(const CompactQuery& query,
                                                                                   const CompactRow& row)
{
    __m512i sum0 = _mm512_setzero_si512(), sum1 = _mm512_setzero_si512();
    for (size_t i = 0; i < kCompactDim; i += 128) {
        _mm_prefetch(reinterpret_cast<const char*>(row.codes + i) + kPrefetchAhead, _MM_HINT_T0);
        _mm_prefetch(reinterpret_cast<const char*>(row.codes + i) + kPrefetchAhead + 64, _MM_HINT_T0);
        sum0 =
            _mm512_dpbusd_epi32(sum0, _mm512_load_si512(query.biased + i), _mm512_loadu_si512(row.codes + i));
        sum1 = _mm512_dpbusd_epi32(sum1, _mm512_load_si512(query.biased + i + 64),
                                   _mm512_loadu_si512(row.codes + i + 64));
    }
    // (Masked extracts: the plain ones start from an "undefined" vector that the warning flags.)
    const __m512i sum = _mm512_add_epi32(sum0, sum1);
    return intLaneSum(_mm256_add_epi32(_mm512_maskz_extracti64x4_epi64(0xFF, sum, 0),
                                       _mm512_maskz_extracti64x4_epi64(0xFF, sum, 1))) -
           128 * row.codeSum;
}

__attribute__((target("avx2"))) size_t compactFilterAvx2(const CompactQuery& query, const CompactRow* rows,
                                                         size_t count, uint32_t* kept)
{
    size_t n = 0;
    for (size_t i = 0; i < count; ++i) {
        kept[n] = uint32_t(i);
        n += compactMayReach(query, rows[i], compactDotAvx2(query, rows[i]));
    }
    return n;
}

__attribute__((target("avx2,avx512f,avx512bw,avx512vnni"))) size_t
compactFilterVnni(const CompactQuery& query, const CompactRow* rows, size_t count, uint32_t* kept)
{
    size_t n = 0;
    for (size_t i = 0; i < count; ++i) {
        kept[n] = uint32_t(i);
        n += compactMayReach(query, rows[i], compactDotVnni(query, rows[i]));
    }
    return n;
}
#endif

struct CompactChoice
{
    CompactDotFn fn;
    CompactFilterFn filter;
    const char* name;
};

const CompactChoice& compactBest()
{
    static const CompactChoice choice = [] {
#ifdef TAMSA_X86
        __builtin_cpu_init();
        if (__builtin_cpu_supports("avx512vnni") && __builtin_cpu_supports("avx512bw")) {
            return CompactChoice{compactDotVnni, compactFilterVnni, "avx512vnni"};
        }
        if (__builtin_cpu_supports("avx2")) {
            return CompactChoice{compactDotAvx2, compactFilterAvx2, "avx2"};
        }
#endif
        return CompactChoice{compactDotPlain, compactFilterPlain, "scalar"};
    }();
    return choice;
}

// Norms outside this range are left to the float32 scan: inside it no product or sum of the
// float32 kernel overflows, and underflow costs nothing measurable against the bound's slack.
constexpr double kSmallestNorm = 1.0 / (1 << 20);
constexpr double kLargestNorm = 1 << 20;
// Residuals above this are not worth bounding (and keep every term of the test near 1).
constexpr double kLargestResidual = 0.25;
// Covers the float32 scan's own rounding (2 * gamma_512 + 6u < 7e-5, gamma_n = n*u / (1 - n*u),
// u = 2^-24) and that of the estimate (about 20u): see Tamsa.h.
constexpr float kCompactSlack = 2e-4f;

// Quantises x (n = kCompactDim) to codes in [-127, 127]; returns the relative residual, rounded
// up, or infinity when x is outside what the bound covers. *scale gets s.
float quantise(const float* x, int8_t* codes, double* scale, double* norm)
{
    double norm2 = 0;
    double largest = 0;
    for (size_t i = 0; i < kCompactDim; ++i) {
        if (!std::isfinite(x[i])) {
            std::fill(codes, codes + kCompactDim, int8_t(0));
            *scale = 0;
            *norm = 0;
            return std::numeric_limits<float>::infinity();
        }
        norm2 += double(x[i]) * double(x[i]);
        largest = std::max(largest, std::fabs(double(x[i])));
    }
    *norm = std::sqrt(norm2);
    if (!(*norm >= kSmallestNorm && *norm <= kLargestNorm)) {
        std::fill(codes, codes + kCompactDim, int8_t(0));
        *scale = 0;
        return std::numeric_limits<float>::infinity();
    }
    // s is kept as a float so that s * c is exact in double below.
    const float s = float(largest / 127.0);
    double residual2 = 0;
    for (size_t i = 0; i < kCompactDim; ++i) {
        const long code = std::clamp(std::lround(double(x[i]) / double(s)), -127L, 127L);
        codes[i] = int8_t(code);
        const double error = double(x[i]) - double(s) * double(code);
        residual2 += error * error;
    }
    *scale = s;
    // The double sums are good to about 1e-13; the factor and the step up cover them.
    const double residual = std::sqrt(residual2) / *norm * (1 + 1e-9);
    if (!(residual <= kLargestResidual)) {
        return std::numeric_limits<float>::infinity();
    }
    return std::nextafter(float(residual), std::numeric_limits<float>::infinity());
}

struct Choice
{
    DotNormFn fn;
    const char* name;
};

Choice choose()
{
#ifdef TAMSA_X86
    __builtin_cpu_init();
    if (__builtin_cpu_supports("avx512f")) {
        return {dotNormAvx512, "avx512"};
    }
    if (__builtin_cpu_supports("avx2") && __builtin_cpu_supports("fma")) {
        return {dotNormAvx2, "avx2"};
    }
#endif
    return {dotNormPlain, "scalar"};
}

const Choice& best()
{
    static const Choice choice = choose();
    return choice;
}

} // namespace

DotNormFn dotNormScalar()
{
    return dotNormPlain;
}

DotNormFn dotNormBest()
{
    return best().fn;
}

const char* dotNormBestName()
{
    return best().name;
}

float cosineFromParts(float dot, float queryNorm2, float rowNorm2)
{
    if (queryNorm2 == 0 && rowNorm2 == 0) {
        return 1.0f;
    }
    if (queryNorm2 == 0 || rowNorm2 == 0) {
        return 0.0f;
    }
    const float cosine = dot / (std::sqrt(rowNorm2) * std::sqrt(queryNorm2));
    return cosine > 0 ? cosine : 0.0f;
}

void encodeCompactRow(const float* x, CompactRow* row)
{
    double scale = 0;
    double norm = 0;
    row->residual = quantise(x, row->codes, &scale, &norm);
    row->scaleOverNorm = norm > 0 ? float(scale / norm) : 0.0f;
    int32_t sum = 0;
    for (int8_t code : row->codes) {
        sum += code;
    }
    row->codeSum = sum;
    row->reserved = 0;
}

void encodeCompactQuery(const std::vector<float>& q, float threshold, CompactQuery* query)
{
    query->usable = false;
    if (q.size() != kCompactDim) {
        return; // a shorter query also shortens the row norms of the float32 score
    }
    double scale = 0;
    double norm = 0;
    const float phi = quantise(q.data(), query->codes, &scale, &norm);
    if (!std::isfinite(phi)) {
        return;
    }
    for (size_t i = 0; i < kCompactDim; ++i) {
        query->biased[i] = uint8_t(int(query->codes[i]) + 128);
    }
    query->scaleOverNorm = float(scale / norm);
    query->residualFactor = 1 + phi;
    query->limit = threshold - phi - kCompactSlack;
    query->usable = true;
}

CompactDotFn compactDotScalar()
{
    return compactDotPlain;
}

CompactDotFn compactDotBest()
{
    return compactBest().fn;
}

CompactFilterFn compactFilterBest()
{
    return compactBest().filter;
}

const char* compactDotBestName()
{
    return compactBest().name;
}

} // namespace tamsa
