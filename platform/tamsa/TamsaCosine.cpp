#include "TamsaCosine.h"

#include <cmath>
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

} // namespace tamsa
