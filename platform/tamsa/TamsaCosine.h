#pragma once
// Cosine similarity for the feature scan. The scan reads every stored vector of the searched
// locations once, so its speed is memory bandwidth; the kernels below use explicit SIMD
// (AVX-512 or AVX2/FMA, picked at run time from the CPU) because compilers do not vectorise a
// float sum on their own (it would change the rounding order). The scalar kernel is the
// reference: the SIMD ones agree with it to about 1e-6 relative.

#include <cstddef>

namespace tamsa {

// Computes the dot product of q and x and the squared norm of x, over n floats.
using DotNormFn = void (*)(const float* q, const float* x, size_t n, float* dot, float* norm2);

DotNormFn dotNormScalar();
// The fastest kernel this CPU runs.
DotNormFn dotNormBest();
// Name of the kernel dotNormBest() returns ("avx512", "avx2", "scalar"), for reports.
const char* dotNormBestName();

// The store's cosine: both norms zero is 1, one of them zero is 0, negative values are 0.
float cosineFromParts(float dot, float queryNorm2, float rowNorm2);

} // namespace tamsa
