// The SIMD cosine kernel against the plain loop: a fault there would only shift scores slightly,
// which no search result shows.
#include "TamsaCosine.h"

#include <gtest/gtest.h>

#include <cmath>
#include <random>

namespace {

TEST(TamsaCosine, SimdKernelMatchesThePlainLoop)
{
    std::mt19937 random(9);
    std::normal_distribution<float> normal(0.0f, 0.05f);
    for (size_t n : {512u, 511u, 17u, 3u, 0u}) {
        std::vector<float> q(n), x(n);
        for (int trial = 0; trial < 200; ++trial) {
            for (size_t i = 0; i < n; ++i) {
                q[i] = normal(random);
                x[i] = normal(random) + (trial % 2 ? q[i] : 0.0f);
            }
            float plainDot = 0, plainNorm = 0, simdDot = 0, simdNorm = 0, queryNorm = 0, unused = 0;
            tamsa::dotNormScalar()(q.data(), x.data(), n, &plainDot, &plainNorm);
            tamsa::dotNormBest()(q.data(), x.data(), n, &simdDot, &simdNorm);
            tamsa::dotNormScalar()(q.data(), q.data(), n, &unused, &queryNorm);
            const float plain = tamsa::cosineFromParts(plainDot, queryNorm, plainNorm);
            const float simd = tamsa::cosineFromParts(simdDot, queryNorm, simdNorm);
            ASSERT_NEAR(plain, simd, 1e-5) << tamsa::dotNormBestName() << " n=" << n;
        }
    }
    EXPECT_EQ(tamsa::cosineFromParts(0, 0, 0), 1.0f);
    EXPECT_EQ(tamsa::cosineFromParts(0, 1, 0), 0.0f);
    EXPECT_EQ(tamsa::cosineFromParts(-1, 1, 1), 0.0f);
    EXPECT_NEAR(tamsa::cosineFromParts(24, 25, 25), 0.96f, 1e-6) << "[3,4] against [4,3]";
}

} // namespace
