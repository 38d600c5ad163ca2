#include "nxbase/colorvector.h"

#include <gtest/gtest.h>

#include <atomic>
#include <cmath>
#include <cstdlib>
#include <new>
#include <thread>
#include <vector>

#include "color_test_util.h"

// Counts global allocations so that the object path can be shown to allocate
// nothing per value.
// The allocation and release go through out-of-line helpers so that the
// compiler does not pair an inlined operator new with free() and warn.
namespace {
std::atomic<long> gAllocations{0};

__attribute__((noinline)) void* Allocate(std::size_t size) {
    return std::malloc(size ? size : 1);
}
__attribute__((noinline)) void Release(void* p) {
    std::free(p);
}
}  // namespace

void* operator new(std::size_t size) {
    gAllocations.fetch_add(1, std::memory_order_relaxed);
    if (void* p = Allocate(size)) return p;
    throw std::bad_alloc();
}
void operator delete(void* p) noexcept {
    Release(p);
}
void operator delete(void* p, std::size_t) noexcept {
    Release(p);
}

namespace {

// XYZ (white Y = 100) against the double-precision references: float weights
// and 36 float products summed in float (measured worst 2.7e-5).
constexpr double kXyzTolerance = 1e-4;
// CIELAB against the references: the above through the float power with the
// exponent 0.33333334 instead of 1/3 (measured worst 5.8e-5).
constexpr double kLabTolerance = 2e-4;
// Round trips through float formulas.
constexpr double kRoundTripTolerance = 2e-3;
// DIN99 in double from float input, stored as float.
constexpr double kDinTolerance = 2e-4;
// The interval searches stop at a step of 0.001 or an mg error of 0.001;
// the flattest transform (chroma, slope about 0.18) turns that into 0.006.
constexpr double kSearchTolerance = 0.01;

MeasuringCondition D50Condition() {
    return MeasuringCondition(IllumClass("D50"), ObserverClass(OBSERVER_2DEG),
                              PhysicalConditions());
}

ReflectanceSpectrum SpectrumOf(const nxtest::CsvRow& row) {
    std::vector<float> values(row.values.begin(), row.values.end());
    return ReflectanceSpectrum(values, PhysicalConditions());
}

// Restores the process-wide Lab type after a test changed it.
struct LabTypeGuard {
    ~LabTypeGuard() { LABVector::SetColorSpaceType(LAB_CIE1976); }
};

TEST(ColorVector, ColorCheckerMatchesD50References) {
    const auto chart = nxtest::ReadPatchCsv(nxtest::ChartPath());
    const auto refs = nxtest::ReadPatchCsv(nxtest::ChartReferencePath());
    ASSERT_EQ(chart.size(), 24u);
    ASSERT_EQ(refs.size(), 24u);
    const CMetryFilter filter(Lichtart(IllumClass("D50")), Observer(ObserverClass(OBSERVER_2DEG)));
    for (std::size_t p = 0; p < chart.size(); ++p) {
        ASSERT_EQ(chart[p].values.size(), 36u);
        ASSERT_EQ(chart[p].id, refs[p].id);
        const ReflectanceSpectrum spectrum = SpectrumOf(chart[p]);
        const XYZVector xyz(filter, spectrum);
        const LABVector lab(spectrum, D50Condition());
        const LABVector labCurrent(spectrum);  // the facade starts with D50, type 0
        for (int i = 0; i < 3; ++i) {
            EXPECT_NEAR(xyz[i], refs[p].values[i], kXyzTolerance) << chart[p].name << " XYZ " << i;
            EXPECT_NEAR(lab[i], refs[p].values[3 + i], kLabTolerance)
                << chart[p].name << " Lab " << i;
            EXPECT_EQ(labCurrent[i], lab[i]) << "same filter, same float operations";
        }
        EXPECT_EQ(labCurrent.GetMeasuringCondition().GetIllum().GetName(), "D50");
    }
}

TEST(ColorVector, WhiteSpectrumHasYOfHundredAndTheFilterWhitePoint) {
    const ReflectanceSpectrum white(1.0f, PhysicalConditions(ActualFilterClass(FILTER_POL)));
    const XYZVector xyz(white);
    EXPECT_NEAR(xyz[1], 100.0f, nxtest::kFloatAtHundred);
    EXPECT_NEAR(xyz[0], 96.42379518406467, kXyzTolerance);
    EXPECT_NEAR(xyz[2], 82.51290003017643, kXyzTolerance);
    EXPECT_EQ(xyz.GetMeasuringCondition().GetPhysicalConditions().GetActualFilter(),
              ActualFilterClass(FILTER_POL));
    const LABVector lab(white);
    for (int i = 0; i < 3; ++i)
        EXPECT_NEAR(lab[i], i == 0 ? 100.0f : 0.0f, nxtest::kFloatAtHundred);
    const xyYVector xyY(white);
    EXPECT_NEAR(xyY[0], 0.3457, nxtest::kChromaticityOfGrid);  // D50 chromaticity
    EXPECT_NEAR(xyY[1], 0.3585, nxtest::kChromaticityOfGrid);
    EXPECT_EQ(xyY[2], xyz[1]);
}

TEST(ColorVector, ObjectPathAllocatesNothingPerValue) {
    const ReflectanceSpectrum spectrum(0.5f, PhysicalConditions());
    LABVector warm(spectrum);  // first use builds the facade and the per-thread caches
    const long before = gAllocations.load();
    float sink = 0.0f;
    for (int i = 0; i < 1000; ++i) {
        const LABVector lab(spectrum);
        sink += lab[0];
    }
    EXPECT_EQ(gAllocations.load() - before, 0);
    EXPECT_GT(sink, 0.0f);
}

TEST(ColorVector, ThreadsComputeTheSameValuesUnderTheirOwnConditions) {
    const auto chart = nxtest::ReadPatchCsv(nxtest::ChartPath());
    const MeasuringCondition conditions[] = {
        D50Condition(),
        MeasuringCondition(IllumClass("D65"), ObserverClass(OBSERVER_10DEG), PhysicalConditions()),
        MeasuringCondition(IllumClass("A"), ObserverClass(OBSERVER_2DEG), PhysicalConditions())};
    // Lab and the XYZ back from it for every patch, in one list.
    auto values = [&](int c) {
        std::vector<float> all;
        for (const auto& row : chart) {
            const LABVector lab(SpectrumOf(row), conditions[c]);
            const XYZVector xyz(lab);
            all.insert(all.end(), {lab[0], lab[1], lab[2], xyz[0], xyz[1], xyz[2]});
        }
        return all;
    };
    const std::vector<std::vector<float>> expected = {values(0), values(1), values(2)};
    std::vector<std::thread> threads;
    std::atomic<int> mismatches{0};
    for (int t = 0; t < 6; ++t) {
        threads.emplace_back([&, t] {
            for (int round = 0; round < 50; ++round) {
                const int c = (t + round) % 3;  // switch conditions to churn the per-thread caches
                if (values(c) != expected[c]) ++mismatches;
            }
        });
    }
    for (auto& thread : threads) thread.join();
    EXPECT_EQ(mismatches.load(), 0);
}

TEST(ColorVector, ArithmeticIsComponentWiseAndKeepsTheCondition) {
    const MeasuringCondition condition = D50Condition();
    ColorVector v(3.0f, 4.0f, 12.0f, condition);
    EXPECT_EQ(v.Length(), 13.0f);
    v += ColorVector(1.0f, 1.0f, 1.0f, MeasuringCondition());
    v *= 2.0f;
    v -= ColorVector(0.0f, 2.0f, 6.0f, MeasuringCondition());
    v /= ColorVector(2.0f, 4.0f, 5.0f, MeasuringCondition());
    EXPECT_EQ(String(v).str(), "4.00 2.00 4.00");
    EXPECT_EQ(v.GetMeasuringCondition(), condition);
    EXPECT_EQ(String(ColorVector(12.345f, -5.0f, 0.004f, condition)).str(), "12.35 -5.00 0.00");
    EXPECT_TRUE(ColorVector(1, 2, 3, condition) != ColorVector(1, 2, 4, condition));
    EXPECT_FALSE(ColorVector(1, 2, 3, condition) != ColorVector(1, 2, 3, condition));
}

// The float within 64 units in the last place of axCenter that satisfies
// fTest, or NaN.
template <typename Test>
float FloatNear(float axCenter, Test fTest) {
    float v = axCenter;
    for (int k = 0; k < 64; ++k) v = std::nextafter(v, 0.0f);
    for (int k = 0; k < 128; ++k, v = std::nextafter(v, 1e9f)) {
        if (fTest(v)) return v;
    }
    return std::nanf("");
}

TEST(LABVector, LinearBranchesIncludeTheirBoundaries) {
    // Find a Y whose t is exactly 0.008856 with the formulas' float steps.
    const CMetryFilter& filter = *CMetry::Instance()->GetLXYZFilter();
    const float sumY = filter.GetWeightSum(1);
    const float y =
        FloatNear(0.8856f, [&](float v) { return v * sumY / sumY / 100.0f == 0.008856f; });
    ASSERT_FALSE(std::isnan(y));
    const LABVector lab(filter, XYZVector(0.0f, y, 0.0f, D50Condition()));
    const float linearL = 116.0f * (7.787f * 0.008856f + 0.13793103f) - 16.0f;
    const float cubeL = 116.0f * std::pow(0.008856f, 0.33333334f) - 16.0f;
    ASSERT_NE(linearL, cubeL);
    EXPECT_FLOAT_EQ(lab[0], linearL);

    // And back: f exactly 0.206893034423 takes the linear branch too. L steps
    // are too coarse to hit it, so use f_X = a/500 + f_Y at L = 0.
    const float fy = 16.0f / 116.0f;
    const float a = FloatNear((0.206893034423f - fy) * 500.0f,
                              [&](float v) { return v / 500.0f + fy == 0.206893034423f; });
    ASSERT_FALSE(std::isnan(a));
    const XYZVector back(LABVector(0.0f, a, 0.0f, D50Condition()));
    const double xn = 100.0 * filter.GetWeightSum(0) / sumY;
    const double linear = (0.206893034423 - 16.0 / 116.0) * xn / 7.787;
    const double cube = std::pow(0.206893034423, 3.0) * xn;
    EXPECT_NEAR(back[0], linear, nxtest::kFloatNearOne);
    EXPECT_GT(std::fabs(back[0] - cube), 3e-6) << "the cube branch differs by 4e-6";
}

TEST(LABVector, RoundTripsThroughXYZAndLCh) {
    const auto chart = nxtest::ReadPatchCsv(nxtest::ChartPath());
    for (const auto& row : chart) {
        const LABVector lab(SpectrumOf(row), D50Condition());
        const XYZVector xyz(lab);
        const LABVector again(xyz);
        const LChVector lch(lab);
        const LABVector fromLch(lch);
        for (int i = 0; i < 3; ++i) {
            EXPECT_NEAR(again[i], lab[i], kRoundTripTolerance) << row.name;
            EXPECT_NEAR(fromLch[i], lab[i], kRoundTripTolerance) << row.name;
        }
    }
    // A dark colour, below both linear thresholds.
    const LABVector dark(2.0f, 1.0f, -1.0f, D50Condition());
    const LABVector darkAgain{XYZVector(dark)};
    for (int i = 0; i < 3; ++i) EXPECT_NEAR(darkAgain[i], dark[i], kRoundTripTolerance);
}

TEST(LChVector, HuesLieInZeroExclusiveToThreeSixtyInclusive) {
    const MeasuringCondition mc;
    auto hue = [&](float a, float b) { return LChVector(LABVector(50.0f, a, b, mc))[2]; };
    // Grey, below the neutral threshold, exactly 0 degrees (both zero signs).
    const std::pair<float, float> zeroHues[] = {
        {0.0f, 0.0f}, {0.000009f, -0.000009f}, {1.0f, 0.0f}, {1.0f, -0.0f}};
    for (auto [a, b] : zeroHues) EXPECT_EQ(hue(a, b), 360.0f) << a << " " << b;
    EXPECT_FLOAT_EQ(hue(0.0f, 1.0f), 90.0f);
    EXPECT_FLOAT_EQ(hue(-1.0f, 0.0f), 180.0f);
    EXPECT_FLOAT_EQ(hue(-1.0f, -0.0f), 180.0f);  // atan2 gives -180, folded
    EXPECT_FLOAT_EQ(hue(0.0f, -1.0f), 270.0f);
    EXPECT_NEAR(hue(1.0f, -0.01f), 359.427, nxtest::kPublished3Decimals);
    EXPECT_NEAR(hue(1.0f, 0.01f), 0.573, nxtest::kPublished3Decimals);
}

TEST(LABVector, ValuesEnteredWhileDin99IsCurrentAreCielab) {
    LabTypeGuard guard;
    LABVector::SetColorSpaceType(LAB_DIN99);
    const LABVector entered(50, 10, 20, D50Condition());
    EXPECT_EQ(entered.GetLabVectorColorSpace(), LAB_CIE1976);
    const XYZVector xyz(entered);
    EXPECT_NEAR(xyz[0], 19.70, nxtest::kPublished2Decimals);
    EXPECT_NEAR(xyz[1], 18.42, nxtest::kPublished2Decimals);
    EXPECT_NEAR(xyz[2], 8.51, nxtest::kPublished2Decimals);
}

TEST(LABVector, Din99MatchesDoublePrecisionValuesAndInvertsBack) {
    LabTypeGuard guard;
    // DIN 6176 evaluated in double from the same inputs (pi = 3.1415926).
    struct Case {
        float l, a, b;
        double l99, a99, b99;
    };
    const Case cases[] = {
        {50, 20, -30, 61.42957005065455, 7.218965945582522, -15.843488586394821},
        {75, -40, 10, 82.46828607005237, -20.70878095204724, 8.381584951505413},
        {30, 0, 0, 40.93574804037146, 0.0, 0.0},
        {60, -5, -25, 70.35440618279843, -8.37454876966765, -11.352944505619925},
        {95, 1, 2, 96.72003068149233, 1.4512856640255423, 1.1061363374218658},
    };
    // DIN99 is applied on construction from tristimulus values: go through XYZ.
    for (const Case& c : cases) {
        LABVector::SetColorSpaceType(LAB_CIE1976);
        const XYZVector xyz(LABVector(c.l, c.a, c.b, D50Condition()));
        const LABVector cie(xyz);
        LABVector::SetColorSpaceType(LAB_DIN99);
        const LABVector din(xyz);
        const LABVector back = din.GetCIELab();
        EXPECT_EQ(back.GetLabVectorColorSpace(), LAB_CIE1976);
        const double ref[] = {c.l99, c.a99, c.b99};
        for (int i = 0; i < 3; ++i) {
            EXPECT_NEAR(din[i], ref[i], kDinTolerance + 1e-3) << i;  // plus the XYZ round trip
            EXPECT_NEAR(back[i], cie[i], kDinTolerance) << i;
        }
    }
    // From a spectrum: type 1 gives DIN99 whose inverse is the CIELAB of type 0.
    const ReflectanceSpectrum spectrum = SpectrumOf(nxtest::ReadPatchCsv(nxtest::ChartPath())[2]);
    LABVector::SetColorSpaceType(LAB_CIE1976);
    const LABVector cie(spectrum);
    EXPECT_EQ(cie.GetCIELab(), cie) << "type 0 returns the vector unchanged";
    LABVector::SetColorSpaceType(LAB_DIN99);
    const LABVector din(spectrum);
    EXPECT_NE(din[0], cie[0]);
    const LABVector back = din.GetCIELab();
    for (int i = 0; i < 3; ++i) EXPECT_NEAR(back[i], cie[i], kDinTolerance);
    EXPECT_THAT(String(din.ToString()).str(), HasSubstr("L99="));
    LABVector::SetColorSpaceType(static_cast<LabColorSpaceType>(7));
    EXPECT_EQ(din.GetCIELab().Length(), 0.0f) << "unknown type gives zero";
}

TEST(LCHmgVector, ForwardTransformHasItsFixedPoints) {
    EXPECT_FLOAT_EQ(LCHmgVector::LightnessToMg(10.0f), 10.0f / 0.511f);
    EXPECT_NEAR(LCHmgVector::LightnessToMg(50.0f),
                (std::log(0.040975 * 50) + 0.01765 * 50) / 0.040975 + 34.7231,
                nxtest::kFloatTwoStagesAtHundred);
    EXPECT_NEAR(LCHmgVector::ChromaToMg(0.0f), 12.253 * std::log(0.638) + 5.50671,
                nxtest::kFloatAtHundred);
    // The hue series is built so that 0 and 360 degrees map onto themselves.
    EXPECT_NEAR(LCHmgVector::HueToMg(0.0f), 0.0f, nxtest::kFloatTwoStagesAtHundred);
    EXPECT_NEAR(LCHmgVector::HueToMg(360.0f), 360.0f, nxtest::kFloatTwoStagesAtHundred);
    float previous = LCHmgVector::HueToMg(0.0f);
    for (int h = 1; h <= 360; ++h) {
        const float next = LCHmgVector::HueToMg(static_cast<float>(h));
        EXPECT_GT(next, previous) << "monotonic, so the search needs no folding, at " << h;
        previous = next;
    }
    const LABmgVector labmg(LCHmgVector(LChVector(60.0f, 30.0f, 90.0f, MeasuringCondition())));
    const float hmg = LCHmgVector::HueToMg(90.0f);
    EXPECT_NEAR(labmg[1], LCHmgVector::ChromaToMg(30.0f) * std::cos(hmg * M_PI / 180.0),
                nxtest::kFloatAtHundred);
    EXPECT_NEAR(labmg[2], LCHmgVector::ChromaToMg(30.0f) * std::sin(hmg * M_PI / 180.0),
                nxtest::kFloatAtHundred);
}

TEST(LChVector, ProbiereSearchesInvertTheMgTransform) {
    const MeasuringCondition mc = D50Condition();
    for (float l : {0.0f, 5.0f, 15.9f, 16.0f, 50.0f, 99.5f}) {
        for (float c : {0.0f, 0.5f, 20.0f, 80.0f, 150.0f}) {
            for (float h : {0.3f, 45.0f, 133.3f, 200.0f, 359.5f, 360.0f}) {
                const LChVector back{LCHmgVector(LChVector(l, c, h, mc))};
                const float in[] = {l, c, h};
                for (int i = 0; i < 3; ++i)
                    EXPECT_NEAR(back[i], in[i], kSearchTolerance) << l << " " << c << " " << h;
                EXPECT_EQ(back.GetMeasuringCondition(), mc);
            }
        }
    }
}

TEST(dLCHVector, DecomposesKnownPairsWithTheHueSign) {
    const MeasuringCondition mc;
    const LABVector a(50.0f, 10.0f, 0.0f, mc);  // hue 0 (360)
    const LABVector b(40.0f, 0.0f, 10.0f, mc);  // hue 90
    const dLCHVector d(a, b);
    EXPECT_FLOAT_EQ(d[0], 10.0f);
    EXPECT_NEAR(d[1], 0.0f, nxtest::kFloatNearTen);
    EXPECT_NEAR(d[2], -std::sqrt(200.0f), nxtest::kFloatAtHundred)
        << "a's hue lies clockwise of b's";
    const dLCHVector swapped(b, a);
    EXPECT_FLOAT_EQ(swapped[0], -10.0f);
    EXPECT_NEAR(swapped[2], std::sqrt(200.0f), nxtest::kFloatAtHundred);
    // Chroma difference only: same hue, dH vanishes.
    const dLCHVector chroma(LABVector(50.0f, 30.0f, 40.0f, mc), LABVector(50.0f, 15.0f, 20.0f, mc));
    EXPECT_FLOAT_EQ(chroma[1], 25.0f);
    EXPECT_NEAR(chroma[2], 0.0f, nxtest::kFloatCancellation);
    // dL^2 + dC^2 + dH^2 is dE^2 (CIE76).
    const LABVector p(62.0f, -12.5f, 33.0f, mc);
    const LABVector q(58.5f, -3.0f, 41.0f, mc);
    const dLCHVector pq(p, q);
    const float dE = std::sqrt(3.5f * 3.5f + 9.5f * 9.5f + 8.0f * 8.0f);
    EXPECT_NEAR(pq.Length(), dE, nxtest::kFloatAtHundred);
    EXPECT_EQ(dLCHVector(p, p).Length(), 0.0f);
}

TEST(dLCHmgVector, DecomposesTheMgFormsAndFlipsWithTheArguments) {
    const MeasuringCondition mc;
    const LABVector p(62.0f, -12.5f, 33.0f, mc);
    const LABVector q(58.5f, -3.0f, 41.0f, mc);
    const dLCHmgVector pq(p, q);
    const dLCHmgVector qp(q, p);
    for (int i = 0; i < 3; ++i) EXPECT_FLOAT_EQ(pq[i], -qp[i]) << i;
    const LABmgVector pm{LCHmgVector(LChVector(p))};
    const LABmgVector qm{LCHmgVector(LChVector(q))};
    ColorVector diff(pm);
    diff -= qm;
    EXPECT_NEAR(pq.Length(), diff.Length(), nxtest::kFloatTwoStagesAtHundred);
    EXPECT_FLOAT_EQ(pq[0], pm[0] - qm[0]);
    EXPECT_EQ(dLCHmgVector(p, p).Length(), 0.0f);
}

}  // namespace
