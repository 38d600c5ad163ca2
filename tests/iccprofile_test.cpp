#include "nxbase/iccprofile.h"

#include <gtest/gtest.h>
#include <lcms2.h>

#include <map>

#include "log_test_util.h"
#include "nxbase/appconfig.h"
#include "nxbase/colorconverter.h"
#include "nxbase/logfile.h"
#include "test_util.h"

namespace {

// A LUT profile of the given class and colour space whose only table (`tag`)
// is a flat two-point CLUT from `in` to `out` channels.
cmsHPROFILE LutProfile(cmsProfileClassSignature deviceClass, cmsColorSpaceSignature space,
                       cmsTagSignature tag, int in, int out) {
    cmsHPROFILE profile = cmsCreateProfilePlaceholder(nullptr);
    cmsSetProfileVersion(profile, 2.1);  // lut16Type takes a bare CLUT
    cmsSetDeviceClass(profile, deviceClass);
    cmsSetColorSpace(profile, space);
    cmsSetPCS(profile, cmsSigLabData);
    cmsPipeline* pipeline = cmsPipelineAlloc(nullptr, in, out);
    cmsPipelineInsertStage(pipeline, cmsAT_END,
                           cmsStageAllocCLut16bit(nullptr, 2, in, out, nullptr));
    cmsWriteTag(profile, tag, pipeline);
    cmsPipelineFree(pipeline);
    return profile;
}

// Replaces the engine's configuration for one test and rebuilds the engine.
// Tests here read the log back: a log of this process's own, which no other
// test process writes or truncates.
::testing::Environment* const kLogDir =
    ::testing::AddGlobalTestEnvironment(new nxtest::LogDirEnvironment);

class IccTest : public ::testing::Test {
  protected:
    void Configure(const std::string& enable, const std::string& path) {
        settings_ = {{ICCEngine::kEnableKey, enable}, {ICCEngine::kPathKey, path}};
        previous_ =
            nxbase::SetICCSettingsReader([this](const std::string& key, const std::string& def) {
                auto it = settings_.find(key);
                return it == settings_.end() ? def : it->second;
            });
        ICCEngine::CreateICCEngine();
    }
    void TearDown() override {
        nxbase::SetICCSettingsReader(previous_);
        ICCEngine::CreateICCEngine();
    }
    // A profile LittleCMS makes itself, written to the test directory.
    std::string WriteProfile(const std::string& name, cmsHPROFILE profile) {
        std::string path = dir_.File(name);
        EXPECT_TRUE(cmsSaveProfileToFile(profile, path.c_str()));
        cmsCloseProfile(profile);
        return path;
    }

    nxtest::TempDir dir_;
    std::map<std::string, std::string> settings_;
    nxbase::SettingsReader previous_;
};

TEST_F(IccTest, SwitchedOffByDefaultAndNeverLoadsTheProfile) {
    nxbase::SetICCSettingsReader(nullptr);
    ICCEngine* engine = ICCEngine::CreateICCEngine();
    EXPECT_FALSE(ICCProfile::ProfileEnabled());
    EXPECT_FALSE(ICCProfile::ProfileValid());
    EXPECT_EQ(std::string(engine->GetVersion().str()),
              std::to_string(LCMS_VERSION / 1000) + "." + std::to_string(LCMS_VERSION % 1000 / 10));

    Configure("0", WriteProfile("srgb.icc", cmsCreate_sRGBProfile()));
    EXPECT_FALSE(ICCProfile::ProfileValid());  // present, but "0" keeps it unread
    ICCProfile::EnableProfile(true);           // switching on at run time loads it
    EXPECT_TRUE(ICCProfile::ProfileValid());
}

TEST_F(IccTest, LoadsAnRgbProfileAndConvertsLabToDisplayRgb) {
    Configure("1", WriteProfile("srgb.icc", cmsCreate_sRGBProfile()));
    ICCEngine* engine = ICCEngine::Instance();
    ASSERT_TRUE(engine->IsActive()) << engine->GetProblem();
    EXPECT_EQ(std::string(ICCProfile::GetProfileName().str()), "sRGB built-in");

    // Relative colorimetric: the PCS white is the display's white, black its black.
    constexpr double kWhiteTolerance = 1e-3;  // LittleCMS float pipeline rounding
    double white[3] = {100, 0, 0}, black[3] = {0, 0, 0}, rgb[3];
    ASSERT_TRUE(engine->LabToRGB(white, rgb));
    for (double v : rgb) EXPECT_NEAR(v, 1.0, kWhiteTolerance);
    ASSERT_TRUE(engine->LabToRGB(black, rgb));
    for (double v : rgb) EXPECT_NEAR(v, 0.0, kWhiteTolerance);
    // Far outside the gamut the result is clipped to the device range.
    double outside[3] = {50, 200, -200};
    ASSERT_TRUE(engine->LabToRGB(outside, rgb));
    for (double v : rgb) EXPECT_TRUE(v >= 0.0 && v <= 1.0) << v;

    // A spectrum's screen colour uses the vector's own condition: changing
    // the facade's current condition does not change it.
    std::vector<float> values(36);
    for (int i = 0; i < 36; ++i) values[i] = 0.2f + 0.6f * static_cast<float>(i) / 35.0f;
    const ReflectanceSpectrum orange(values, PhysicalConditions());
    const RGBVector before(orange);
    const MeasuringCondition saved = CMetry::Instance()->GetMeasuringConditions();
    CMetry::Instance()->SetMeasuringConditions(
        MeasuringCondition(IllumClass("A"), ObserverClass(OBSERVER_10DEG), PhysicalConditions()));
    const RGBVector after(orange);
    CMetry::Instance()->SetMeasuringConditions(saved);
    for (int i = 0; i < 3; ++i) EXPECT_EQ(before[i], after[i]) << i;
}

TEST_F(IccTest, UnusableProfilesFallBackWithoutRaising) {
    std::string grey = WriteProfile("grey.icc", [] {
        cmsToneCurve* gamma = cmsBuildGamma(nullptr, 2.2);
        cmsHPROFILE p = cmsCreateGrayProfile(cmsD50_xyY(), gamma);
        cmsFreeToneCurve(gamma);
        return p;
    }());
    std::string lab = WriteProfile("lab.icc", cmsCreateLab4Profile(nullptr));
    std::string cmyk = WriteProfile(
        "cmyk.icc", LutProfile(cmsSigOutputClass, cmsSigCmykData, cmsSigBToA0Tag, 3, 4));
    std::string inputOnly = WriteProfile(
        "scanner.icc", LutProfile(cmsSigInputClass, cmsSigRgbData, cmsSigAToB0Tag, 3, 3));
    std::string junk = dir_.File("junk.icc");
    nxtest::WriteFile(junk, std::string(128, 'x') + "acsp" + std::string(300, '\0'));

    const std::pair<std::string, std::string> cases[] = {
        {"", "no profile configured"},
        {dir_.File("missing.icc"), "cannot read"},
        {junk, "cannot read"},
        {grey, "is not an RGB profile"},
        {lab, "is not an RGB profile"},
        {cmyk, "is not an RGB profile"},
        {inputOnly, "cannot be used as an output profile"},
    };
    const std::string logFile = LogFile::Instance()->GetFileName();
    auto fallbackLines = [&] {
        std::size_t n = 0;
        for (const auto& line : nxtest::ReadLines(logFile))
            n += line.find("ICC profile not used") != std::string::npos;
        return n;
    };
    for (const auto& [path, problem] : cases) {
        std::size_t before = fallbackLines();
        EXPECT_NO_THROW(Configure("1", path));
        RGBVector converted(LABVector(50, 0, 0, MeasuringCondition()));  // formulas, no new line
        ICCProfile::EnableProfile(true);                                 // tried already: no retry
        EXPECT_EQ(fallbackLines(), before + 1) << path;
        EXPECT_GT(converted[0], 0.0f);
        ICCEngine* engine = ICCEngine::Instance();
        EXPECT_FALSE(ICCProfile::ProfileValid()) << path;
        EXPECT_FALSE(ICCProfile::ProfileEnabled()) << "a profile that cannot be loaded: " << path;
        EXPECT_THAT(engine->GetProblem(), HasSubstr(problem))
            << path << ": " << engine->GetProblem();
        double in[3] = {50, 0, 0}, out[3] = {-1, -1, -1};
        EXPECT_FALSE(engine->LabToRGB(in, out));
        EXPECT_EQ(out[0], -1);
    }
}

TEST_F(IccTest, ReadsBothKeysFromTheUserConfiguration) {
    std::string profile = WriteProfile("display.icc", cmsCreate_sRGBProfile());
    nxbase::SetICCSettingsReader(nullptr);
    UserConfig* config =
        UserConfig::CreateUserConfig(String("IccTest"), String(dir_.path().string()), String());
    config->WriteKey(String("Settings"), String("ICCProfile"), String("1"));
    config->WriteKey(String("Settings"), String("ICCProfilePath"), String(profile));
    ICCEngine::CreateICCEngine();
    EXPECT_TRUE(ICCProfile::ProfileEnabled());
    EXPECT_TRUE(ICCProfile::ProfileValid()) << ICCEngine::Instance()->GetProblem();
    config->WriteKey(String("Settings"), String("ICCProfile"), String("0"));
    ICCEngine::CreateICCEngine();
    EXPECT_FALSE(ICCProfile::ProfileEnabled());
    NxSingleton::Remove(config);
    delete config;
}

}  // namespace
