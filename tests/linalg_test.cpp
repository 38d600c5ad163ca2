#include "nxbase/linalg.h"

#include <gtest/gtest.h>

#include <cmath>
#include <initializer_list>

namespace {

// Exact binary fractions throughout unless noted, so results compare exactly.
constexpr double kSolveTolerance = 1e-12;  // double elimination of small well-conditioned systems
constexpr float kSolveToleranceF = 1e-5f;  // the same in single precision

// Compares got[0..] with the listed values exactly.
template <typename T>
void ExpectValues(const T* got, std::initializer_list<double> want) {
    for (std::size_t i = 0; i < want.size(); ++i) EXPECT_EQ(got[i], T(want.begin()[i])) << i;
}

template <typename T>
class LinAlgTyped : public ::testing::Test {};
using ElementTypes = ::testing::Types<float, double>;
TYPED_TEST_SUITE(LinAlgTyped, ElementTypes);

TYPED_TEST(LinAlgTyped, VectorRoutinesActElementByElement) {
    using T = TypeParam;
    T a[4] = {1, 2, 3, 4};
    T b[4] = {0.5, -1, 2, 8};
    T d[4];
    LinAlg::InitV(d, T(7), 4);
    for (T v : d) EXPECT_EQ(v, T(7));
    LinAlg::VAddV(d, a, b, 4);
    ExpectValues(d, {1.5, 1, 5, 12});
    LinAlg::VSubV(d, a, 4);
    EXPECT_EQ(d[1], T(-1));
    LinAlg::VxV(d, a, b, 4);
    EXPECT_EQ(d[2], T(6));
    LinAlg::VxV(d, a, 4);
    EXPECT_EQ(d[2], T(18));
    LinAlg::VdivV(d, a, b, 4);
    ExpectValues(d, {2, -2, 1.5, 0.5});
    LinAlg::KVAddKV(d, T(2), a, T(-1), b, 4);
    ExpectValues(d, {1.5, 5, 4, 0});
    LinAlg::VAddKxV(d, T(0.5), a, 4);
    EXPECT_EQ(d[3], T(2));
    LinAlg::KxV(d, T(3), a, 4);
    EXPECT_EQ(d[1], T(6));
    LinAlg::KxV(d, T(0.5), 4);
    EXPECT_EQ(d[1], T(3));
    LinAlg::CopyVector(d, b, 4);
    EXPECT_EQ(d[3], T(8));
    LinAlg::VSubV(d, a, b, 4);
    EXPECT_EQ(d[3], T(-4));
    LinAlg::VAddV(d, a, 4);
    EXPECT_EQ(d[3], T(0));

    EXPECT_EQ(LinAlg::SumV(a, 4), T(10));
    EXPECT_EQ(LinAlg::DotProd(a, b, 4), T(0.5 - 2 + 6 + 32));
    T v[2] = {3, 4};
    EXPECT_EQ(LinAlg::BetragV(v, 2), T(5));
    EXPECT_EQ(LinAlg::SumV(a, 0), T(0));
}

TYPED_TEST(LinAlgTyped, DivisionByZeroYieldsInfinityNotATrap) {
    using T = TypeParam;
    T a[2] = {1, -1};
    T b[2] = {0, 0};
    T d[2];
    LinAlg::VdivV(d, a, b, 2);
    EXPECT_TRUE(std::isinf(d[0]) && d[0] > 0);
    EXPECT_TRUE(std::isinf(d[1]) && d[1] < 0);
}

TYPED_TEST(LinAlgTyped, MatrixRoutinesUseRowMajorLayoutAndStride) {
    using T = TypeParam;
    // 2 x 3 matrix inside a 2 x 4 block (stride 4).
    const T wide[8] = {1, 2, 3, 99, 4, 5, 6, 99};
    const T v3[3] = {1, 0, -1};
    T r[3];
    LinAlg::MxV(r, wide, v3, 2, 3, 4);
    ExpectValues(r, {-2, -2});

    const T m[6] = {1, 2, 3, 4, 5, 6};  // 2 x 3
    LinAlg::MxV(r, m, v3, 2, 3);
    EXPECT_EQ(r[1], T(-2));
    const T v2[2] = {1, 10};
    LinAlg::MtxV(r, m, v2, 2, 3);
    ExpectValues(r, {41, 52, 63});

    T t[6];
    LinAlg::TranspM(t, m, 2, 3);  // 3 x 2
    ExpectValues(t, {1, 4, 2, 5, 3, 6});

    T c[4];
    LinAlg::MxM(c, m, t, 2, 3, 2);  // (2x3)(3x2) = M M^T
    ExpectValues(c, {14, 32, 32, 77});

    T scaled[6];
    LinAlg::KxM(scaled, T(2), m, 2, 3);
    EXPECT_EQ(scaled[5], T(12));
    LinAlg::KxM(scaled, T(0.5), 2, 3);
    LinAlg::CopyMatrix(t, scaled, 3, 2);
    for (int i = 0; i < 6; ++i) EXPECT_EQ(t[i], m[i]);
}

TYPED_TEST(LinAlgTyped, MaTxMaIsSymmetricGramMatrix) {
    using T = TypeParam;
    const T a[6] = {1, 2, 3, 4, 5, 6};  // 3 x 2
    T n[4] = {-1, -1, -1, -1};
    LinAlg::MaTxMa(a, 3, 2, n);
    ExpectValues(n, {35, 44, 44, 56});
}

TYPED_TEST(LinAlgTyped, GaussElPivotsThroughIndexArraysWithoutMovingRows) {
    using T = TypeParam;
    // [[0, 1], [1, 0]] x = (2, 3) needs a row swap.
    T a[4] = {0, 1, 1, 0};
    T b[2] = {2, 3};
    T x[2] = {0, 0};
    int singular = -1;
    int rowStart[2];
    int rowIndex[2];
    LinAlg::GaussEl(b, a, x, 2, singular, rowStart, rowIndex);
    EXPECT_EQ(singular, 0);
    ExpectValues(x, {3, 2});
    ExpectValues(rowStart, {2, 0});
    ExpectValues(rowIndex, {1, 0});
    // Rows stay where they were in memory.
    EXPECT_EQ(a[0], T(0));
    EXPECT_EQ(a[2], T(1));
}

TYPED_TEST(LinAlgTyped, GaussElKeepsFirstOfEqualPivotCandidates) {
    using T = TypeParam;
    // Column 0 has |-2| in row 1 and |2| in row 2: the first (row 1) wins.
    T a[9] = {1, 1, 1, -2, 1, 0, 2, 0, 1};
    T b[3] = {6, 0, 5};  // solution (1, 2, 3)
    T x[3];
    int singular = -1;
    int rowStart[3];
    int rowIndex[3];
    LinAlg::GaussEl(b, a, x, 3, singular, rowStart, rowIndex);
    ASSERT_EQ(singular, 0);
    EXPECT_EQ(rowIndex[0], 1);
    EXPECT_NEAR(x[0], T(1), kSolveToleranceF);
    EXPECT_NEAR(x[1], T(2), kSolveToleranceF);
    EXPECT_NEAR(x[2], T(3), kSolveToleranceF);
}

TYPED_TEST(LinAlgTyped, GaussElReportsOnlyAnExactZeroPivotAsSingular) {
    using T = TypeParam;
    // [[1, 2], [2, 4]]: the second column's remaining pivot is exactly 0.
    T a[4] = {1, 2, 2, 4};
    T b[2] = {1, 2};
    T x[2] = {42, 43};
    int singular = 0;
    LinAlg::GaussEl(b, a, x, 2, singular);
    EXPECT_EQ(singular, 1);
    ExpectValues(x, {42, 43});  // untouched

    // A tiny but nonzero pivot is accepted.
    T tiny[4] = {T(1e-30), 0, 0, 1};
    T bt[2] = {T(2e-30), 5};
    LinAlg::GaussEl(bt, tiny, x, 2, singular);
    EXPECT_EQ(singular, 0);
    EXPECT_NEAR(x[0], T(2), kSolveToleranceF);
    EXPECT_EQ(x[1], T(5));
}

TEST(LinAlg, GaussElSolvesLargerSystemsThroughItsOwnIndexArrays) {
    // 20 x 20 (beyond the short form's stack arrays): diagonally dominant.
    constexpr int n = 20;
    double a[n * n];
    double b[n];
    double expect[n];
    for (int i = 0; i < n; ++i) {
        expect[i] = i - 7.5;
        for (int j = 0; j < n; ++j) a[i * n + j] = (i == j) ? 50.0 : std::sin(i * 3.0 + j);
    }
    for (int i = 0; i < n; ++i) {
        b[i] = 0;
        for (int j = 0; j < n; ++j) b[i] += a[i * n + j] * expect[j];
    }
    double x[n];
    int singular = -1;
    LinAlg::GaussEl(b, a, x, n, singular);
    ASSERT_EQ(singular, 0);
    for (int i = 0; i < n; ++i) EXPECT_NEAR(x[i], expect[i], kSolveTolerance) << i;
}

// Runs LeastSquareFit on m observations of N unknowns; returns its flag.
template <int N, typename T>
int Fit(T* w, T* y, T* a, T* x, int m) {
    T nm[N * N], r[N];
    int rowStart[N], rowIndex[N], ok = -1;
    LinAlg::LeastSquareFit(w, y, a, x, m, N, nm, r, rowStart, rowIndex, ok);
    return ok;
}

TEST(LinAlg, LeastSquareFitRecoversALineFromWeightedObservations) {
    // y = 2 + 3 t at t = 0..4, with one outlier that has weight 0.
    double w[5] = {1, 1, 1, 1, 0};
    double y[5] = {2, 5, 8, 11, 1000};
    double a[10] = {1, 0, 1, 1, 1, 2, 1, 3, 1, 4};
    double x[2] = {0, 0};
    EXPECT_EQ(Fit<2>(w, y, a, x, 5), 1);
    EXPECT_NEAR(x[0], 2.0, kSolveTolerance);
    EXPECT_NEAR(x[1], 3.0, kSolveTolerance);
    // The weights were applied in place to A and y.
    EXPECT_EQ(y[4], 0.0);
    EXPECT_EQ(a[9], 0.0);
}

TEST(LinAlg, LeastSquareFitWithSquareSystemIgnoresWeights) {
    float w[2] = {0, 0};  // would zero everything if used
    float y[2] = {3, 4};
    float a[4] = {1, 1, 1, -1};
    float x[2];
    EXPECT_EQ(Fit<2>(w, y, a, x, 2), 1);
    EXPECT_NEAR(x[0], 3.5f, kSolveToleranceF);
    EXPECT_NEAR(x[1], -0.5f, kSolveToleranceF);
}

TEST(LinAlg, LeastSquareFitFailsOnTooFewObservationsOrSingularNormals) {
    double w[3] = {1, 1, 1};
    double y[3] = {1, 2, 3};
    double a[9] = {1, 2, 3, 4, 5, 6, 7, 8, 9};
    double x[3] = {-5, -5, -5};
    EXPECT_EQ(Fit<3>(w, y, a, x, 2), 0);
    EXPECT_EQ(x[0], -5.0);
    EXPECT_EQ(a[0], 1.0);  // nothing computed

    // Two identical columns: A^T A is singular exactly.
    double w2[3] = {1, 1, 1};
    double y2[3] = {1, 2, 3};
    double a2[6] = {1, 1, 2, 2, 4, 4};
    EXPECT_EQ(Fit<2>(w2, y2, a2, x, 3), 0);
}

}  // namespace
