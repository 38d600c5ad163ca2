// Colour differences against published data and LittleCMS, and chromatic
// adaptation against the published Bradford and von Kries matrices.
#include "nxbase/colordiff.h"

#include <gtest/gtest.h>
#include <lcms2.h>

#include <array>
#include <cmath>
#include <fstream>
#include <random>
#include <sstream>
#include <string>

#include "color_test_util.h"
#include "nxbase/adaptation.h"
#include "nxbase/colorconverter.h"
#include "nxbase/colorvector.h"
#include "nxbase/finegrid.h"

namespace {

using nxbase::LabValue;

TEST(ColorDifference, Ciede2000ReproducesTheSharmaPairs) {
    std::ifstream in(std::string(NXBASE_TEST_DATA_DIR) + "/ciede2000_sharma2005.csv");
    ASSERT_TRUE(in);
    std::string line;
    std::getline(in, line);  // header
    int pairs = 0;
    double worst = 0.0;
    while (std::getline(in, line)) {
        std::istringstream fields(line);
        double v[8];
        char comma;
        for (int i = 0; i < 8; ++i) fields >> v[i] >> (i < 7 ? comma : comma);
        const LabValue a{v[1], v[2], v[3]};
        const LabValue b{v[4], v[5], v[6]};
        const double forward = nxbase::DeltaE2000(a, b);
        worst = std::max(worst, std::fabs(forward - v[7]));
        EXPECT_NEAR(forward, v[7], nxtest::kPublished4Decimals) << "pair " << v[0];
        EXPECT_NEAR(nxbase::DeltaE2000(b, a), forward, nxtest::kDoubleReordered)
            << "symmetric, pair " << v[0];
        ++pairs;
    }
    EXPECT_EQ(pairs, 34);
    EXPECT_LT(worst, 5.01e-5) << "published values are rounded to 4 decimals";

    // The parts: weighted, they sum to the total without the rotation term.
    const auto parts = nxbase::DeltaE2000Detailed({50, 2.6772, -79.7751}, {50, 0, -82.7485});
    EXPECT_EQ(parts.dL, 0.0);
    EXPECT_GT(parts.dC, 0.0) << "sample minus reference";
    EXPECT_NEAR(nxbase::DeltaE2000({60, 10, 10}, {61, 10, 10}, {2.0, 1.0, 1.0}),
                0.5 * nxbase::DeltaE2000({60, 10, 10}, {61, 10, 10}), nxtest::kDoubleReordered);
}

TEST(ColorDifference, AgreesWithLittleCms) {
    std::mt19937 random(11);
    std::uniform_real_distribution<double> lightness(0.0, 100.0), axis(-120.0, 120.0),
        near(-4.0, 4.0);
    double worst[4] = {};
    for (int i = 0; i < 20000; ++i) {
        const LabValue a{lightness(random), axis(random), axis(random)};
        // Half near pairs (where the formulas are meant to be used), half far.
        const LabValue b =
            i % 2 ? LabValue{a.L + near(random), a.a + near(random), a.b + near(random)}
                  : LabValue{lightness(random), axis(random), axis(random)};
        const cmsCIELab la{a.L, a.a, a.b}, lb{b.L, b.a, b.b};
        const double ours[4] = {
            nxbase::DeltaEab(a, b),
            nxbase::DeltaE94(a, b, nxbase::Cie94Parameters{1.0, 0.048, 0.014, true}),
            nxbase::DeltaECMC(a, b, 2.0, 1.0), nxbase::DeltaE2000(a, b)};
        const double theirs[4] = {cmsDeltaE(&la, &lb), cmsCIE94DeltaE(&la, &lb),
                                  cmsCMCdeltaE(&la, &lb, 2.0, 1.0),
                                  cmsCIE2000DeltaE(&la, &lb, 1.0, 1.0, 1.0)};
        for (int f = 0; f < 4; ++f) {
            const double error = std::fabs(ours[f] - theirs[f]) / std::max(1.0, theirs[f]);
            worst[f] = std::max(worst[f], error);
        }
    }
    EXPECT_LT(worst[0], 1e-12);
    EXPECT_LT(worst[1], 1e-9);
    EXPECT_LT(worst[2], 1e-9);
    EXPECT_LT(worst[3], 1e-9);
}

TEST(ColorDifference, NamesAndVectorsAndBatch) {
    nxbase::DeltaEMethod method{};
    EXPECT_TRUE(nxbase::ParseDeltaEMethod("cmc", &method));
    EXPECT_EQ(method, nxbase::DeltaEMethod::kCmc21);
    EXPECT_TRUE(nxbase::ParseDeltaEMethod("2000", &method));
    EXPECT_FALSE(nxbase::ParseDeltaEMethod("2001", &method));
    EXPECT_FALSE(nxbase::ParseDeltaEMethod(nullptr, &method));
    const MeasuringCondition condition;
    const LABVector a(50.0f, 10.0f, 20.0f, condition), b(52.0f, 9.0f, 23.0f, condition);
    EXPECT_NEAR(nxbase::DeltaEab(a, b), std::sqrt(4.0 + 1.0 + 9.0), nxtest::kFloatNearTen);
    EXPECT_DOUBLE_EQ(nxbase::DeltaE2000(a, b),
                     nxbase::DeltaE2000(nxbase::ToLabValue(a), nxbase::ToLabValue(b)));
    EXPECT_DOUBLE_EQ(nxbase::DeltaE94(a, b, nxbase::Cie94Application::kTextiles),
                     nxbase::DeltaE94(nxbase::ToLabValue(a), nxbase::ToLabValue(b),
                                      nxbase::Cie94Application::kTextiles));
    // CIE 116's two applications: kL 1 or 2 for a lightness difference, and
    // SC = 1 + K1 C*ab of the reference, K1 0.045 or 0.048, for a chroma one.
    using nxbase::Cie94Application;
    EXPECT_DOUBLE_EQ(nxbase::DeltaE94({50, 0, 0}, {52, 0, 0}), 2.0);
    EXPECT_DOUBLE_EQ(nxbase::DeltaE94({50, 0, 0}, {52, 0, 0}, Cie94Application::kTextiles), 1.0);
    EXPECT_NEAR(nxbase::DeltaE94({50, 50, 0}, {50, 52, 0}), 2.0 / 3.25, 1e-12);
    EXPECT_NEAR(nxbase::DeltaE94({50, 50, 0}, {50, 52, 0}, Cie94Application::kTextiles), 2.0 / 3.4,
                1e-12);

    const float reference[6] = {50, 2.6772f, -79.7751f, 60, 0, 0};
    const float sample[6] = {50, 0, -82.7485f, 60, 0, 0};
    float out[2];
    nxbase::DeltaE2000Batch(reference, sample, 2, out);
    EXPECT_NEAR(out[0], 2.0425, nxtest::kPublished4Decimals);
    EXPECT_EQ(out[1], 0.0f);
}

TEST(ChromaticAdaptation, MatchesPublishedMatricesAndMapsWhiteToWhite) {
    const nxbase::Tristimulus d65{0.95047, 1.0, 1.08883};
    const nxbase::Tristimulus d50{0.96422, 1.0, 0.82521};
    // Bradford D65 to D50 as B. Lindbloom tabulates it.
    const double bradford[3][3] = {{1.0478112, 0.0228866, -0.0501270},
                                   {0.0295424, 0.9904844, -0.0170491},
                                   {-0.0092345, 0.0150436, 0.7521316}};
    const nxbase::Matrix3 b =
        nxbase::AdaptationMatrix(d65, d50, nxbase::AdaptationMethod::kBradford);
    for (int i = 0; i < 3; ++i) {
        for (int j = 0; j < 3; ++j) {
            EXPECT_NEAR(b[i][j], bradford[i][j], nxtest::kPublished7Decimals) << i << j;
        }
    }
    // The sRGB white adapted to the ICC D50 white.
    const nxbase::Tristimulus white = nxbase::Apply(
        nxbase::AdaptationMatrix(d65, {0.9642, 1.0, 0.8249}, nxbase::AdaptationMethod::kBradford),
        d65);
    EXPECT_NEAR(white[0], 0.9642, nxtest::kPublished4Decimals);
    EXPECT_NEAR(white[1], 1.0, nxtest::kPublished4Decimals);
    EXPECT_NEAR(white[2], 0.8249, nxtest::kPublished4Decimals);

    for (const char* name : {"xyz", "vonkries", "bradford", "CAT02"}) {
        nxbase::AdaptationMethod method{};
        ASSERT_TRUE(nxbase::ParseAdaptationMethod(name, &method)) << name;
        const nxbase::Matrix3 forward = nxbase::AdaptationMatrix(d65, d50, method);
        const nxbase::Tristimulus w = nxbase::Apply(forward, d65);
        for (int c = 0; c < 3; ++c) EXPECT_NEAR(w[c], d50[c], nxtest::kDoubleReordered) << name;
        // There and back is the identity.
        const nxbase::Tristimulus colour{0.2, 0.3, 0.4};
        const nxbase::Tristimulus back = nxbase::Apply(nxbase::AdaptationMatrix(d50, d65, method),
                                                       nxbase::Apply(forward, colour));
        for (int c = 0; c < 3; ++c)
            EXPECT_NEAR(back[c], colour[c], nxtest::kDoubleReordered) << name;
    }
    EXPECT_THROW(nxbase::AdaptationMatrix({0, 0, 0}, d50), std::invalid_argument);

    // On vectors: a D65 colour adapted to D50 carries D50 and the white
    // point of D65 lands on that of D50.
    const MeasuringCondition underD65(IllumClass("D65"), ObserverClass(OBSERVER_2DEG),
                                      PhysicalConditions());
    const MeasuringCondition underD50(IllumClass("D50"), ObserverClass(OBSERVER_2DEG),
                                      PhysicalConditions());
    const nxbase::Tristimulus n65 = nxbase::WhitePointOf(underD65);
    const nxbase::Tristimulus n50 = nxbase::WhitePointOf(underD50);
    EXPECT_NEAR(n65[0], 95.04, nxtest::kWhiteOfGrid);
    const XYZVector adapted =
        nxbase::Adapt(XYZVector(static_cast<float>(n65[0]), static_cast<float>(n65[1]),
                                static_cast<float>(n65[2]), underD65),
                      underD50);
    EXPECT_TRUE(adapted.GetMeasuringCondition() == underD50);
    for (int c = 0; c < 3; ++c) EXPECT_NEAR(adapted[c], n50[c], nxtest::kFloatTwoStagesAtHundred);
}

// Properties every public colour function keeps, over random input: a NaN
// or an infinity in gives NaN out (never a perfect match); ΔE(x, x) = 0;
// CIE76 and CIEDE2000 are symmetric; CIELAB round-trips through XYZ; the
// adaptation keeps the colour's scale whatever scale the whites are on; a
// grey computed in single precision is grey.
TEST(ColorFunctions, KeepTheirPropertiesOverRandomInput) {
    const unsigned seed = std::random_device{}();
    SCOPED_TRACE("seed " + std::to_string(seed));
    std::mt19937 random(seed);
    std::uniform_real_distribution<double> lightness(0.0, 100.0), axis(-128.0, 128.0),
        unit(0.02, 1.2), scale(0.5, 200.0);
    const double bad[] = {std::nan(""), INFINITY, -INFINITY};
    const nxbase::DeltaEMethod methods[] = {
        nxbase::DeltaEMethod::kCie76,         nxbase::DeltaEMethod::kCie94,
        nxbase::DeltaEMethod::kCie94Textiles, nxbase::DeltaEMethod::kCmc21,
        nxbase::DeltaEMethod::kCmc11,         nxbase::DeltaEMethod::kCiede2000};
    for (int i = 0; i < 5000; ++i) {
        const LabValue x{lightness(random), axis(random), axis(random)};
        const LabValue y{lightness(random), axis(random), axis(random)};
        LabValue broken = x;
        (&broken.L)[i % 3] = bad[i % 3];
        for (const auto method : methods) {
            ASSERT_EQ(nxbase::DeltaE(x, x, method), 0.0) << static_cast<int>(method);
            ASSERT_TRUE(std::isnan(nxbase::DeltaE(broken, y, method))) << static_cast<int>(method);
            ASSERT_TRUE(std::isnan(nxbase::DeltaE(y, broken, method))) << static_cast<int>(method);
        }
        ASSERT_EQ(nxbase::DeltaEab(x, y), nxbase::DeltaEab(y, x));
        ASSERT_NEAR(nxbase::DeltaE2000(x, y), nxbase::DeltaE2000(y, x), 1e-9);

        const std::array<double, 3> white{96.422 * unit(random), 100.0, 82.521 * unit(random)};
        const std::array<double, 3> xyz{white[0] * unit(random), white[1] * unit(random),
                                        white[2] * unit(random)};
        const std::array<double, 3> back = nxbase::XyzOfCielab(nxbase::CielabOf(xyz, white), white);
        for (int c = 0; c < 3; ++c) ASSERT_NEAR(back[c], xyz[c], 1e-9 * white[c]) << c;
        std::array<double, 3> notWhite = white;
        notWhite[i % 3] = i % 2 ? 0.0 : -white[i % 3];
        ASSERT_TRUE(std::isnan(nxbase::CielabOf(xyz, notWhite)[0]));

        // A white on 0..1 and one on 0..100 adapt as the same two whites do.
        const nxbase::Tristimulus d65{95.047, 100.0, 108.883};
        const double k = scale(random);
        const nxbase::Tristimulus small{white[0] / k, white[1] / k, white[2] / k};
        const auto method = nxbase::AdaptationMethod::kBradford;
        const nxbase::Tristimulus same =
            nxbase::Apply(nxbase::AdaptationMatrix(white, d65, method), xyz);
        const nxbase::Tristimulus mixed =
            nxbase::Apply(nxbase::AdaptationMatrix(small, d65, method), xyz);
        for (int c = 0; c < 3; ++c)
            ASSERT_NEAR(mixed[c], same[c], 1e-9 * std::fabs(same[c]) + 1e-12);
    }
    EXPECT_THROW(
        nxbase::AdaptationMatrix({0, 0, 0}, {95, 100, 108}, nxbase::AdaptationMethod::kBradford),
        std::invalid_argument);
    // Grey: a and b of a computed grey lie within the float path's rounding.
    EXPECT_EQ(nxbase::HueOfComputedLab(0.0, 1.19e-5), 360.0);
    EXPECT_EQ(nxbase::HueOfComputedLab(-8.9e-5, 3e-5), 360.0);
    EXPECT_NEAR(nxbase::HueOfComputedLab(0.0, 0.01), 90.0, 1e-12);
    EXPECT_EQ(nxbase::HueOfComputedLab(1.0, 0.0), 360.0);
    EXPECT_TRUE(std::isnan(nxbase::HueOfComputedLab(std::nan(""), 1.0)));
    const float infinite[6] = {50.0f, INFINITY, 0.0f, 50.0f, 0.0f, 0.0f};
    float rgb[6];
    nxbase::LabToScreenRGB(infinite, rgb, 2);
    EXPECT_TRUE(std::isnan(rgb[0]) && std::isnan(rgb[1]) && std::isnan(rgb[2]));
    EXPECT_TRUE(std::isfinite(rgb[3]));
}

}  // namespace
