#include "nxbase/colorconverter.h"

#include <gtest/gtest.h>
#include <lcms2.h>

#include <atomic>
#include <cmath>
#include <map>
#include <thread>
#include <tuple>

#include "color_test_util.h"
#include "nxbase/iccprofile.h"
#include "nxbase/text.h"
#include "test_util.h"

namespace {

// RGB components are on 0..100; one 8-bit step is 0.39.
// The white of the library's 10 nm D65 weights differs from the sRGB
// standard's (0.9505, 1, 1.0890) in the fourth decimal.
constexpr float kSrgbTolerance = 0.1f;
// ICC (LittleCMS float pipeline, Lab as D50 PCS, Bradford adaptation to the
// display's D65) against the formulas (Lab taken as D65-relative, i.e. a
// von Kries scaling in XYZ): neutrals agree to LittleCMS's float rounding
// (measured 1e-3); saturated colours differ by the two adaptations, up to 7.6
// (Lab 40 20 -50, red channel) of 100 in the measured set.
constexpr float kIccNeutralTolerance = 0.01f;
constexpr float kIccChromaticTolerance = 8.0f;

LABVector Lab(float l, float a, float b) {
    return LABVector(l, a, b, MeasuringCondition());
}

ReflectanceSpectrum Flat(float value) {
    return ReflectanceSpectrum(value, PhysicalConditions());
}

TEST(RGBVector, WhiteAndBlackSpectraGiveFullAndNoIntensity) {
    RGBVector white(Flat(1.0f));
    for (int i = 0; i < 3; ++i) EXPECT_NEAR(white[i], 100.0f, nxtest::kOneDisplayLevel) << i;
    RGBVector black(Flat(0.0f));
    for (int i = 0; i < 3; ++i) EXPECT_EQ(black[i], 0.0f) << i;
    // Components are whole display levels: level * 100/255.
    RGBVector grey(Flat(0.2f));
    for (int i = 0; i < 3; ++i) {
        float level = grey[i] / 0.3921568691730499f;
        EXPECT_NEAR(level, std::round(level), nxtest::kFloatTwoStagesAtHundred);
    }
    EXPECT_GT(grey[1], black[1]);
    EXPECT_LT(grey[1], white[1]);
    EXPECT_EQ(ColorConverter::RGBToColor(white),
              Color(65535, 65535, 65535));  // 100 * 655.36 = 65536 clamps
}

TEST(RGBVector, RGBToColorTruncatesAndClamps) {
    MeasuringCondition c;
    EXPECT_EQ(ColorConverter::RGBToColor(RGBVector(100.0f, 50.0f, 0.0f, c)),
              Color(65535, 32768, 0));
    EXPECT_EQ(ColorConverter::RGBToColor(RGBVector(-5.0f, 250.0f, 0.0015f, c)),
              Color(0, 65535, 0));  // 0.0015 * 655.36 = 0.98 truncates to 0
    EXPECT_EQ(ColorConverter::RGBToColor(RGBVector(NAN, INFINITY, -INFINITY, c)),
              Color(0, 65535, 0));
}

TEST(RGBVector, GammaBisectionAtTableEdgesAndForNegatives) {
    const float* table = nxbase::detail::GammaTable();
    EXPECT_EQ(table[0], 0.0f);
    EXPECT_FLOAT_EQ(table[510], 1.0f);  // (0.5 * 510 / 255)^(1/0.45)
    // The search never returns the last entry (511): lo stops one below hi.
    const std::pair<float, int> edges[] = {
        {-0.5f, -1},       {0.0f, 0},
        {table[1], 1},     {std::nextafter(table[1], 0.0f), 0},
        {table[256], 256}, {std::nextafter(table[256], 0.0f), 255},
        {table[511], 510}, {5.0f, 510}};
    for (const auto& [value, index] : edges)
        EXPECT_EQ(nxbase::detail::GammaIndex(table, value), index) << value;
    // Every value between two entries lands on the lower one.
    for (int k = 0; k < 510; ++k) {
        float between = (table[k] + table[k + 1]) / 2;
        ASSERT_EQ(nxbase::detail::GammaIndex(table, between), k) << k;
    }
}

TEST(RGBVector, LabOfTheSrgbPrimariesGivesTheStandardsFigures) {
    // CIELAB (D65) of the IEC 61966-2-1 primaries, secondaries and white.
    struct Case {
        float lab[3];
        float rgb[3];
    };
    const Case cases[] = {
        {{100.0f, 0.0f, 0.0f}, {100, 100, 100}},
        {{0.0f, 0.0f, 0.0f}, {0, 0, 0}},
        {{53.2408f, 80.0925f, 67.2032f}, {100, 0, 0}},
        {{87.7347f, -86.1827f, 83.1793f}, {0, 100, 0}},
        {{32.2970f, 79.1875f, -107.8602f}, {0, 0, 100}},
        {{97.1393f, -21.5537f, 94.4780f}, {100, 100, 0}},
        {{53.5850f, 0.0f, 0.0f}, {50.1961f, 50.1961f, 50.1961f}},  // sRGB 128/255
    };
    for (const auto& c : cases) {
        RGBVector rgb(Lab(c.lab[0], c.lab[1], c.lab[2]));
        for (int i = 0; i < 3; ++i)
            EXPECT_NEAR(rgb[i], c.rgb[i], kSrgbTolerance) << c.lab[0] << " channel " << i;
    }
    // Outside the gamut the components leave 0..100; RGBToColor clamps them.
    RGBVector outside(Lab(50.0f, 120.0f, -120.0f));
    EXPECT_LT(outside[1], 0.0f);
    // The batch path equals the object path bit for bit.
    float lab[6] = {53.2408f, 80.0925f, 67.2032f, 40.0f, 10.0f, -20.0f}, rgb[6];
    nxbase::LabToScreenRGB(lab, rgb, 2);
    for (int v = 0; v < 2; ++v) {
        RGBVector one(Lab(lab[3 * v], lab[3 * v + 1], lab[3 * v + 2]));
        for (int i = 0; i < 3; ++i) EXPECT_EQ(rgb[3 * v + i], one[i]);
    }
}

TEST(RGBVector, IccPathAgreesWithTheFormulasForLittleCmsOwnSrgbProfile) {
    nxtest::TempDir dir;
    std::string path = dir.File("srgb.icc");
    cmsHPROFILE srgb = cmsCreate_sRGBProfile();
    ASSERT_TRUE(cmsSaveProfileToFile(srgb, path.c_str()));
    cmsCloseProfile(srgb);
    std::map<std::string, std::string> settings = {{"ICCProfile", "1"}, {"ICCProfilePath", path}};
    auto previous =
        nxbase::SetICCSettingsReader([&](const std::string& key, const std::string& def) {
            auto it = settings.find(key);
            return it == settings.end() ? def : it->second;
        });

    const float labs[][3] = {{100, 0, 0},   {50, 0, 0},    {20, 0, 0},  {53.24f, 80.09f, 67.2f},
                             {70, -30, 40}, {40, 20, -50}, {60, 10, 30}};
    std::vector<RGBVector> formula;
    for (const auto& l : labs) formula.emplace_back(Lab(l[0], l[1], l[2]));

    ICCEngine::CreateICCEngine();
    ASSERT_TRUE(ICCProfile::ProfileValid());
    std::vector<RGBVector> single;
    for (std::size_t n = 0; n < formula.size(); ++n) {
        const RGBVector& icc = single.emplace_back(Lab(labs[n][0], labs[n][1], labs[n][2]));
        bool neutral = labs[n][1] == 0 && labs[n][2] == 0;
        for (int i = 0; i < 3; ++i) {
            float expected = std::clamp(formula[n][i], 0.0f, 100.0f);
            EXPECT_NEAR(icc[i], expected, neutral ? kIccNeutralTolerance : kIccChromaticTolerance)
                << "Lab #" << n << " channel " << i;
        }
    }
    // Threads share the one cached transform: every thread gets the results
    // of the single-threaded run, bit for bit.
    std::atomic<int> mismatches{0};
    std::vector<std::thread> threads;
    for (int t = 0; t < 4; ++t) {
        threads.emplace_back([&] {
            for (int round = 0; round < 500; ++round) {
                for (std::size_t n = 0; n < single.size(); ++n) {
                    RGBVector again(Lab(labs[n][0], labs[n][1], labs[n][2]));
                    for (int i = 0; i < 3; ++i) mismatches += again[i] != single[n][i];
                }
            }
        });
    }
    for (auto& thread : threads) thread.join();
    EXPECT_EQ(mismatches.load(), 0);

    // Spectra go through the profile too, and stay close to the EBU path.
    ICCProfile::EnableProfile(false);
    RGBVector viaTables(Flat(0.5f));
    ICCProfile::EnableProfile(true);
    RGBVector viaIcc(Flat(0.5f));
    for (int i = 0; i < 3; ++i) EXPECT_NEAR(viaIcc[i], viaTables[i], kIccChromaticTolerance);

    nxbase::SetICCSettingsReader(previous);
    ICCEngine::CreateICCEngine();
    EXPECT_FALSE(ICCProfile::ProfileValid());
}

TEST(ColorConverter, CmykBrushesAndBitmaps) {
    float white[4] = {0, 0, 0, 0}, cyan[4] = {100, 0, 0, 0}, halfBlack[4] = {0, 0, 0, 50};
    EXPECT_EQ(ColorConverter::CMYKToColor(white), Color(65535, 65535, 65535));
    EXPECT_EQ(ColorConverter::CMYKToColor(cyan), Color(0, 65535, 65535));
    EXPECT_EQ(ColorConverter::CMYKToColor(halfBlack), Color(32768, 32768, 32768));
    EXPECT_EQ(ColorConverter::CMYKToColor(nullptr), Color());

    EXPECT_EQ(ColorConverter::LabToBrush(Lab(100, 0, 0)).GetColor(), Color(65535, 65535, 65535));
    EXPECT_EQ(ColorConverter::SpectrumToBrush(Flat(0)).GetColor(), Color());

    Bitmap patch = ColorConverter::SpectrumToBitmap(Flat(0), Size_t<short>(10, 6));
    EXPECT_EQ(patch.GetSizePixel(), Size_t<short>(10, 6));
    EXPECT_EQ(patch.GetPixel(5, 3), Color());
    EXPECT_EQ(patch.GetPixel(0, 0), Color(0x8000, 0x8000, 0x8000));  // the frame
    EXPECT_FALSE(patch.HasTransparency());
    EXPECT_EQ(ColorConverter::ColorToBitmap(Color(1, 2, 3)).GetSizePixel(),
              ColorConverter::kDefaultBitmapSize);
}

TEST(ColorConverter, IconShapesFillOutlineAndLeaveTheRestTransparent) {
    const LABVector red = Lab(53.24f, 80.09f, 67.2f);
    const Color fill = ColorConverter::RGBToColor(RGBVector(red));
    const Size_t<short> size(15, 15);
    // Opaque pixel ranges around the rough areas: square 225, disc 177,
    // diamond 113, triangle 113, stripe 75.
    const std::tuple<decltype(ColorConverter::ICON_SQUARE), int, int> shapes[] = {
        {ColorConverter::ICON_SQUARE, 225, 225},
        {ColorConverter::ICON_CIRCLE, 160, 195},
        {ColorConverter::ICON_DIAMOND, 100, 130},
        {ColorConverter::ICON_TRIANGLE, 95, 130},
        {ColorConverter::ICON_STRIPE, 60, 90}};
    for (const auto& [shape, low, high] : shapes) {
        Bitmap icon = ColorConverter::LabToBitmap(red, size, shape);
        ASSERT_EQ(icon.GetSizePixel(), size);
        EXPECT_EQ(icon.GetPixel(7, 7), fill) << shape;  // inside every shape
        EXPECT_EQ(icon.IsTransparent(0, 0), shape != ColorConverter::ICON_SQUARE) << shape;
        int opaque = 0;
        for (int y = 0; y < 15; ++y)
            for (int x = 0; x < 15; ++x) opaque += !icon.IsTransparent(x, y);
        EXPECT_TRUE(opaque >= low && opaque <= high) << shape << ": " << opaque;
    }
    // A light colour gets a dark outline, a dark one a light outline.
    Bitmap light = ColorConverter::LabToBitmap(Lab(95, 0, 0), size, ColorConverter::ICON_CIRCLE);
    Bitmap dark = ColorConverter::LabToBitmap(Lab(10, 0, 0), size, ColorConverter::ICON_CIRCLE);
    EXPECT_LT(light.GetPixel(7, 0).GetRed(), 0x8000);
    EXPECT_GT(dark.GetPixel(7, 0).GetRed(), 0x8000);
}

TEST(ColorConverter, ColourNamesFollowHueSectorsAndLightnessClasses) {
    struct Case {
        float lab[3];
        FarbNummerType number;
        const char* name;
    };
    const Case cases[] = {
        {{5, 1, 1}, FARBE_SCHWARZ, "black"},
        {{50, 3, -3}, FARBE_GRAU, "grey"},
        {{96, 0, 2}, FARBE_WEISS, "white"},
        // ColorChecker Classic patches (CIELAB D50), the names people give them.
        {{42.1f, 53.4f, 28.2f}, FarbNummerType(6), "red"},
        {{62.7f, 35.8f, 56.5f}, FarbNummerType(9), "orange"},
        {{81.8f, 2.7f, 80.4f}, FarbNummerType(12), "yellow"},
        {{54.7f, -39.7f, 32.3f}, FarbNummerType(15), "green"},
        {{29.4f, 13.2f, -49.7f}, FarbNummerType(21), "blue"},
        {{51.1f, 49.0f, -16.9f}, FarbNummerType(27), "magenta"},
        {{37.5f, 14.4f, 14.9f}, FarbNummerType(8), "brown"},     // dark skin
        {{30.0f, 22.0f, -21.0f}, FarbNummerType(24), "violet"},  // purple
        {{15.0f, 22.0f, -21.0f}, FarbNummerType(23), "dark violet"},
        {{75.0f, 30.0f, 5.0f}, FarbNummerType(7), "pink"},
        {{45.0f, 5.0f, 40.0f}, FarbNummerType(11), "olive"},
    };
    for (const auto& c : cases) {
        LABVector lab = Lab(c.lab[0], c.lab[1], c.lab[2]);
        EXPECT_EQ(ColorConverter::FarbNummer(lab), c.number) << c.name;
        EXPECT_EQ(std::string(ColorConverter::Farbzuordnung(lab).str()), c.name);
    }
    EXPECT_EQ(ColorConverter::FarbNummer(Lab(NAN, NAN, NAN)), FARBE_SCHWARZ);
}

// The shipped text files hold the group "FarbTexte" with one name per colour
// number; loaded, they name the colours (German in Windows-1252).
TEST(ColorConverter, ShippedTextFilesNameEveryColourNumber) {
    const std::string dir = std::string(NXBASE_SOURCE_DIR) + "/data/lng/";
    const LABVector white = Lab(96, 0, 2), brown = Lab(37.5f, 14.4f, 14.9f);
    const std::tuple<const char*, const char*, const char*> languages[] = {
        {"NxBase49.lng", "Wei\xDF", "Braun"}, {"NxBase1.lng", "white", "brown"}};
    for (const auto& [file, whiteName, brownName] : languages) {
        Text::FreeResources();
        ASSERT_TRUE(Text::LoadText(String(dir + file)));
        EXPECT_EQ(Text::GetEntryCount(String("FarbTexte")),
                  static_cast<unsigned long>(FARBE_ANZAHL));
        for (int n = 0; n < FARBE_ANZAHL; ++n)
            EXPECT_FALSE(Text::GetText(String("FarbTexte"), n).Len() == 0) << file << " " << n;
        EXPECT_EQ(std::string(ColorConverter::Farbzuordnung(white).str()), whiteName);
        EXPECT_EQ(std::string(ColorConverter::Farbzuordnung(brown).str()), brownName);
    }
    Text::FreeResources();
}

}  // namespace
