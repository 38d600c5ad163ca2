#include "nxbase/linalg.h"

#include <gtest/gtest.h>

#include <cmath>
#include <initializer_list>
#include <random>
#include <string>
#include <vector>

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

// Every vector and matrix routine against a plain loop, over random sizes
// (zero included) and small integers, whose sums every float holds exactly;
// a guard value after each result shows a write beyond its end.
TYPED_TEST(LinAlgTyped, EveryRoutineAgreesWithAPlainLoopOverRandomSizes) {
    using T = TypeParam;
    using Vec = std::vector<T>;
    const unsigned seed = std::random_device{}();
    SCOPED_TRACE("seed " + std::to_string(seed));
    std::mt19937 random(seed);
    constexpr T kGuard = T(-12345);
    auto draw = [&](int n, bool nonzero = false) {
        Vec v(static_cast<std::size_t>(n) + 1, kGuard);
        for (int i = 0; i < n; ++i) {
            do v[i] = T(static_cast<int>(random() % 17) - 8);
            while (nonzero && v[i] == 0);
        }
        return v;
    };
    auto expect = [&](const Vec& got, const Vec& want, const char* what) {
        ASSERT_EQ(got.size(), want.size() + 1) << what;
        for (std::size_t i = 0; i < want.size(); ++i)
            ASSERT_EQ(got[i], want[i]) << what << " " << i;
        ASSERT_EQ(got.back(), kGuard) << what << " wrote beyond its end";
    };
    for (int round = 0; round < 500; ++round) {
        const int n = static_cast<int>(random() % 10), rows = static_cast<int>(random() % 6),
                  cols = static_cast<int>(random() % 6), p = static_cast<int>(random() % 6);
        const Vec a = draw(n), b = draw(n, true), m = draw(rows * cols), q = draw(cols * p);
        const T k1 = T(static_cast<int>(random() % 7) - 3),
                k2 = T(static_cast<int>(random() % 7) - 3);
        auto elementwise = [&](auto f) {
            Vec r(n);
            for (int i = 0; i < n; ++i) r[i] = f(a[i], b[i]);
            return r;
        };
        Vec d = draw(n);
        LinAlg::InitV(d.data(), k1, n);
        expect(d, elementwise([&](T, T) { return k1; }), "InitV");
        LinAlg::VAddV(d.data(), a.data(), b.data(), n);
        expect(d, elementwise([](T x, T y) { return x + y; }), "VAddV");
        LinAlg::VSubV(d.data(), b.data(), n);
        expect(d, Vec(a.begin(), a.end() - 1), "VSubV in place");
        LinAlg::VSubV(d.data(), a.data(), b.data(), n);
        expect(d, elementwise([](T x, T y) { return x - y; }), "VSubV");
        LinAlg::VAddV(d.data(), b.data(), n);
        expect(d, Vec(a.begin(), a.end() - 1), "VAddV in place");
        LinAlg::VxV(d.data(), a.data(), b.data(), n);
        expect(d, elementwise([](T x, T y) { return x * y; }), "VxV");
        LinAlg::VxV(d.data(), b.data(), n);
        expect(d, elementwise([](T x, T y) { return x * y * y; }), "VxV in place");
        LinAlg::VdivV(d.data(), d.data(), b.data(), n);
        expect(d, elementwise([](T x, T y) { return x * y; }), "VdivV");
        LinAlg::KVAddKV(d.data(), k1, a.data(), k2, b.data(), n);
        expect(d, elementwise([&](T x, T y) { return k1 * x + k2 * y; }), "KVAddKV");
        LinAlg::VAddKxV(d.data(), k2, a.data(), n);
        expect(d, elementwise([&](T x, T y) { return k1 * x + k2 * y + k2 * x; }), "VAddKxV");
        LinAlg::KxV(d.data(), k1, a.data(), n);
        expect(d, elementwise([&](T x, T) { return k1 * x; }), "KxV");
        LinAlg::KxV(d.data(), k2, n);
        expect(d, elementwise([&](T x, T) { return k2 * k1 * x; }), "KxV in place");
        LinAlg::CopyVector(d.data(), b.data(), n);
        expect(d, Vec(b.begin(), b.end() - 1), "CopyVector");
        T sum = 0, dot = 0, squares = 0;
        for (int i = 0; i < n; ++i) sum += a[i], dot += a[i] * b[i], squares += a[i] * a[i];
        ASSERT_EQ(LinAlg::SumV(a.data(), n), sum);
        ASSERT_EQ(LinAlg::DotProd(a.data(), b.data(), n), dot);
        ASSERT_EQ(LinAlg::BetragV(a.data(), n), std::sqrt(squares));

        // Matrices: row-major, a sub-block through the stride, products.
        const int stride = cols + static_cast<int>(random() % 3);
        Vec wide = draw(rows * stride), v = draw(cols), w = draw(rows), r = draw(rows);
        Vec mv(rows), mtv(cols), t(rows * cols), mq(rows * p), gram(cols * cols);
        for (int i = 0; i < rows; ++i) {
            for (int j = 0; j < cols; ++j) {
                mv[i] += wide[i * stride + j] * v[j];
                mtv[j] += m[i * cols + j] * w[i];
                t[j * rows + i] = m[i * cols + j];
                for (int c = 0; c < p; ++c) mq[i * p + c] += m[i * cols + j] * q[j * p + c];
                for (int c = 0; c < cols; ++c)
                    gram[j * cols + c] += m[i * cols + j] * m[i * cols + c];
            }
        }
        LinAlg::MxV(r.data(), wide.data(), v.data(), rows, cols, stride);
        expect(r, mv, "MxV with a stride");
        Vec out = draw(cols);
        LinAlg::MtxV(out.data(), m.data(), w.data(), rows, cols);
        expect(out, mtv, "MtxV");
        out = draw(rows * cols);
        LinAlg::TranspM(out.data(), m.data(), rows, cols);
        expect(out, t, "TranspM");
        out = draw(rows * p);
        LinAlg::MxM(out.data(), m.data(), q.data(), rows, cols, p);
        expect(out, mq, "MxM");
        out = draw(cols * cols);
        LinAlg::MaTxMa(m.data(), rows, cols, out.data());
        expect(out, gram, "MaTxMa");
        out = draw(rows * cols);
        LinAlg::KxM(out.data(), k1, m.data(), rows, cols);
        LinAlg::KxM(out.data(), k2, rows, cols);
        Vec scaled(m.begin(), m.end() - 1);
        for (T& x : scaled) x *= k1 * k2;
        expect(out, scaled, "KxM");
        LinAlg::CopyMatrix(out.data(), m.data(), rows, cols);
        expect(out, Vec(m.begin(), m.end() - 1), "CopyMatrix");
    }
}

// Elimination pivots through index arrays (rows stay in memory), takes the
// first of equal candidates, and refuses only an exactly zero pivot, leaving x.
TYPED_TEST(LinAlgTyped, GaussElPivotsByIndexAndRefusesOnlyAnExactZeroPivot) {
    using T = TypeParam;
    T a[4] = {0, 1, 1, 0}, b[2] = {2, 3}, x[3] = {0, 0, 0};  // needs a row swap
    int singular = -1, rowStart[3], rowIndex[3];
    LinAlg::GaussEl(b, a, x, 2, singular, rowStart, rowIndex);
    EXPECT_EQ(singular, 0);
    ExpectValues(x, {3, 2});
    ExpectValues(rowStart, {2, 0});
    ExpectValues(rowIndex, {1, 0});
    ExpectValues(a, {0, 1, 1, 0});

    // Column 0 has |-2| in row 1 and |2| in row 2: row 1 wins. Solution (1, 2, 3).
    T a3[9] = {1, 1, 1, -2, 1, 0, 2, 0, 1}, b3[3] = {6, 0, 5};
    LinAlg::GaussEl(b3, a3, x, 3, singular, rowStart, rowIndex);
    ASSERT_EQ(singular, 0);
    EXPECT_EQ(rowIndex[0], 1);
    for (int i = 0; i < 3; ++i) EXPECT_NEAR(x[i], T(i + 1), kSolveToleranceF);

    T flat[4] = {1, 2, 2, 4}, bf[2] = {1, 2};  // the second pivot is exactly 0
    x[0] = 42, x[1] = 43;
    LinAlg::GaussEl(bf, flat, x, 2, singular);
    EXPECT_EQ(singular, 1);
    ExpectValues(x, {42, 43});
    T tiny[4] = {T(1e-30), 0, 0, 1}, bt[2] = {T(2e-30), 5};
    LinAlg::GaussEl(bt, tiny, x, 2, singular);
    EXPECT_EQ(singular, 0);
    EXPECT_NEAR(x[0], T(2), kSolveToleranceF);
    EXPECT_EQ(x[1], T(5));

    // Division by zero gives signed infinities, not a trap.
    T one[2] = {1, -1}, zero[2] = {0, 0};
    LinAlg::VdivV(x, one, zero, 2);
    EXPECT_TRUE(std::isinf(x[0]) && x[0] > 0 && std::isinf(x[1]) && x[1] < 0);
}

// Random diagonally dominant systems up to 24 x 24 (beyond the short form's
// stack arrays): the solution reproduces the right-hand side.
TEST(LinAlg, GaussElSolvesRandomSystemsOfAnySize) {
    const unsigned seed = std::random_device{}();
    SCOPED_TRACE("seed " + std::to_string(seed));
    std::mt19937 random(seed);
    std::uniform_real_distribution<double> unit(-1.0, 1.0);
    for (int round = 0; round < 200; ++round) {
        const int n = 1 + static_cast<int>(random() % 24);
        std::vector<double> a(n * n), expect(n), b(n, 0.0), x(n, 0.0);
        for (int i = 0; i < n; ++i) {
            expect[i] = 10 * unit(random);
            for (int j = 0; j < n; ++j) a[i * n + j] = i == j ? 2.0 * n : unit(random);
        }
        for (int i = 0; i < n; ++i)
            for (int j = 0; j < n; ++j) b[i] += a[i * n + j] * expect[j];
        int singular = -1;
        LinAlg::GaussEl(b.data(), a.data(), x.data(), n, singular);
        ASSERT_EQ(singular, 0);
        for (int i = 0; i < n; ++i) ASSERT_NEAR(x[i], expect[i], kSolveTolerance) << n << " " << i;
    }
}

// Runs LeastSquareFit on m observations of N unknowns; returns its flag.
template <int N, typename T>
int Fit(T* w, T* y, T* a, T* x, int m) {
    T nm[N * N], r[N];
    int rowStart[N], rowIndex[N], ok = -1;
    LinAlg::LeastSquareFit(w, y, a, x, m, N, nm, r, rowStart, rowIndex, ok);
    return ok;
}

// y = 2 + 3 t at t = 0..4 with an outlier of weight 0 (weights applied in
// place); a square system ignores the weights; too few observations or equal
// columns (singular normals) fail and compute nothing.
TEST(LinAlg, LeastSquareFitWeighsObservationsAndRefusesUnderdeterminedOrSingularOnes) {
    double w[5] = {1, 1, 1, 1, 0}, y[5] = {2, 5, 8, 11, 1000};
    double a[10] = {1, 0, 1, 1, 1, 2, 1, 3, 1, 4}, x[3] = {0, 0, 0};
    EXPECT_EQ(Fit<2>(w, y, a, x, 5), 1);
    EXPECT_NEAR(x[0], 2.0, kSolveTolerance);
    EXPECT_NEAR(x[1], 3.0, kSolveTolerance);
    EXPECT_EQ(y[4], 0.0);
    EXPECT_EQ(a[9], 0.0);

    float wf[2] = {0, 0}, yf[2] = {3, 4}, af[4] = {1, 1, 1, -1}, xf[2];
    EXPECT_EQ(Fit<2>(wf, yf, af, xf, 2), 1);
    EXPECT_NEAR(xf[0], 3.5f, kSolveToleranceF);
    EXPECT_NEAR(xf[1], -0.5f, kSolveToleranceF);

    double w3[3] = {1, 1, 1}, y3[3] = {1, 2, 3}, a3[9] = {1, 2, 3, 4, 5, 6, 7, 8, 9};
    x[0] = -5;
    EXPECT_EQ(Fit<3>(w3, y3, a3, x, 2), 0);
    EXPECT_EQ(x[0], -5.0);
    EXPECT_EQ(a3[0], 1.0);
    double equal[6] = {1, 1, 2, 2, 4, 4};
    EXPECT_EQ(Fit<2>(w3, y3, equal, x, 3), 0);
}

}  // namespace
