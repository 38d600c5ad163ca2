// Illuminant and observer classes, filters, measuring conditions, densities
// and the colorimetry facade, with the ColorChecker as a numeric check.
#include <gtest/gtest.h>

#include <cfloat>
#include <cmath>
#include <cstring>
#include <filesystem>
#include <random>
#include <sstream>
#include <string>
#include <vector>

#include "color_test_util.h"
#include "colorimetry_test_util.h"
#include "nxbase/cielab.h"
#include "nxbase/cmetry.h"
#include "nxbase/colordiff.h"
#include "nxbase/colorvector.h"
#include "nxbase/finegrid.h"
#include "nxbase/resample.h"
#include "nxbase/spectrafile.h"

namespace {

::testing::Environment* const kLogDir =
    ::testing::AddGlobalTestEnvironment(new nxtest::LogDirEnvironment);

// Densities are summed in double from float weights and reflectances.
constexpr float kDensityTolerance = 1e-5f;

ReflectanceSpectrum Flat(float value) {
    return ReflectanceSpectrum(value, PhysicalConditions());
}

// Resets the facade to its state at creation when a test ends.
class CMetryFacade : public ::testing::Test {
  protected:
    void TearDown() override {
        CMetry& cmetry = *CMetry::Instance();
        cmetry.SetMeasuringConditions(MeasuringCondition());
        cmetry.EnterWhite(Flat(0.0f));
    }
};

}  // namespace

TEST(IllumClass, TypesSelectTheirTableNameAndOthersTheDefault) {
    const std::pair<int, const char*> table[] = {
        {0, "A"},    {1, "C"},    {2, "D65"},   {3, "D50"},   {24, "FL1"},
        {28, "FL5"}, {32, "FL9"}, {33, "FL10"}, {34, "FL11"}, {35, "FL12"},
        {40, "D55"}, {41, "D75"}, {50, "E"},
    };
    for (const auto& entry : table) {
        const IllumClass illuminant(static_cast<IllumType>(entry.first), 0);
        EXPECT_EQ(illuminant.GetName(), entry.second);
        EXPECT_EQ(illuminant.GetIllumType(), entry.first);
    }
    for (int type : {4, 23, 36, 39, 42, 49, 51, -1}) {
        EXPECT_EQ(IllumClass(static_cast<IllumType>(type), 0).GetName(), "D50") << type;
    }
    EXPECT_EQ(IllumClass().GetName(), "D50");
    EXPECT_EQ(IllumClass(std::string("unknown")).GetName(), "D50");

    // A caller-owned illuminant is copied, so the class outlives it.
    std::unique_ptr<IllumClass> kept;
    {
        const auto d65 = klume::cmetry::IlluminantRepository::Get("D65");
        const auto own =
            klume::cmetry::MakeIlluminant("Mine", "test", d65->GetWavelengths(), d65->GetPowers());
        kept.reset(new IllumClass(*own));
        EXPECT_EQ(IllumClass(*d65).GetIlluminant(), d65);
    }
    EXPECT_EQ(kept->GetName(), "Mine");
    EXPECT_EQ(kept->GetIllumType(), ILLUM_UNKNOWN);
}

TEST(ObserverClass, NamesTypesAndTheDegreeString) {
    EXPECT_EQ(ObserverClass(OBSERVER_2DEG).GetName(), "2");
    EXPECT_EQ(ObserverClass(OBSERVER_10DEG).GetObserver()->GetFieldSize(), 10);
    EXPECT_EQ(ObserverClass(String("10")).GetObserverType(), OBSERVER_10DEG);
    EXPECT_EQ(ObserverClass(String("2\xB0")).GetObserverType(), OBSERVER_2DEG);
    EXPECT_EQ(ObserverClass(String("10deg")).GetObserverType(), OBSERVER_10DEG);
    const ObserverClass unknown(String("7"));
    EXPECT_EQ(unknown.GetObserverType(), OBSERVER_UNKNOWN);
    EXPECT_EQ(unknown.GetObserver()->GetName(), "2");
    EXPECT_EQ(static_cast<ObserverType>(ObserverClass(static_cast<ObserverType>(5))),
              OBSERVER_UNKNOWN);

    const String saved = ObserverClass::GetDegreeString();
    EXPECT_EQ(static_cast<String>(ObserverClass(OBSERVER_10DEG)), String("10\xB0"));
    ObserverClass::SetDegreeString(String(" deg"));
    EXPECT_EQ(static_cast<String>(ObserverClass(OBSERVER_2DEG)), String("2 deg"));
    ObserverClass::SetDegreeString(saved);
}

TEST(Filter, SumsDotProductsAndDefinition) {
    Filter empty;
    EXPECT_FALSE(empty.isDefined());
    EXPECT_EQ(empty.FilterSumme(), 0.0f);

    float weights[Filter::kSize];
    for (int i = 0; i < Filter::kSize; ++i) weights[i] = static_cast<float>(i);
    Filter ramp(weights);
    EXPECT_TRUE(ramp.isDefined());
    EXPECT_EQ(ramp.FilterSumme(), 630.0f);  // 0 + 1 + ... + 35
    EXPECT_EQ(ramp * std::vector<float>(36, 2.0f), 1260.0f);
    EXPECT_THROW(ramp * std::vector<float>(35, 2.0f), std::logic_error);

    static_cast<float*>(ramp)[0] = 100.0f;  // writing through the pointer
    EXPECT_EQ(ramp.FilterSumme(), 730.0f);  // invalidates the cached sum

    EXPECT_EQ(ramp.FilterXFilter(ramp).GetWeights()[3], 9.0f);
    ramp.Init(0.5f);
    EXPECT_EQ(ramp.FilterSumme(), 18.0f);
    ramp.Define(0);
    EXPECT_FALSE(ramp.isDefined());
}

TEST(CMetryFilter, HoldsTheProvidersWeightsAsFloatTables) {
    const CMetryFilter defaults;
    EXPECT_EQ(defaults.GetIllum().GetName(), "D65");
    EXPECT_EQ(defaults.GetObserver().GetName(), "2");
    const auto provider = klume::cmetry::CMetryFilter::Find("D65", "2");
    for (unsigned short c = 0; c < 3; ++c) {
        for (int i = 0; i < Filter::kSize; ++i) {
            EXPECT_EQ(defaults[c].GetWeights()[i], static_cast<float>(provider->GetWeights(c)[i]));
            EXPECT_EQ(defaults.GetWeightTable()[c * Filter::kSize + i],
                      defaults[c].GetWeights()[i]);
        }
    }
    EXPECT_NEAR(defaults.GetWeightSum(1), 100.0f, nxtest::kFloatAtHundred);

    const CMetryFilter a10(Lichtart(IllumClass(ILLUM_A, 0)), Observer(OBSERVER_10DEG));
    EXPECT_EQ(a10.GetProviderFilter(), klume::cmetry::CMetryFilter::Find("A", "10"));
}

TEST(ActualFilterClass, NamesGeometriesAndDisplayNames) {
    EXPECT_EQ(ActualFilterClass().GetType(), 0x1FFFFFFF);
    const std::pair<const char*, ActualFilterClass::Geometry> names[] = {
        {"No", ActualFilterClass::GEOMETRY_45_0},    {"Pol", ActualFilterClass::GEOMETRY_45_0},
        {"D65", ActualFilterClass::GEOMETRY_45_0},   {"UV", ActualFilterClass::GEOMETRY_45_0},
        {"UVCut", ActualFilterClass::GEOMETRY_45_0}, {"Custom", ActualFilterClass::GEOMETRY_45_0},
        {"Repro", ActualFilterClass::GEOMETRY_45_0}, {"D8t", ActualFilterClass::GEOMETRY_D8T},
        {"D8e", ActualFilterClass::GEOMETRY_D8E},    {"D8i", ActualFilterClass::GEOMETRY_D8I},
    };
    for (const auto& entry : names) {
        const ActualFilterClass filter{String(entry.first)};
        EXPECT_EQ(static_cast<String>(filter), String(entry.first));
        EXPECT_EQ(filter.GetGeometry(), entry.second) << entry.first;
    }
    EXPECT_EQ(ActualFilterClass(String("Cust")).GetType(), FILTER_CUSTOM);
    EXPECT_EQ(ActualFilterClass(String("uvcut")).GetType(), FILTER_UVCUT);
    EXPECT_EQ(ActualFilterClass(String("Sepia")).GetType(), FILTER_DEFAULT);

    ActualFilterClass::SetDisplayFilterName(FILTER_POL, String("Polfilter"));
    EXPECT_EQ(ActualFilterClass(FILTER_POL).GetDisplayName(), String("Polfilter"));
    EXPECT_EQ(static_cast<String>(ActualFilterClass(FILTER_POL)), String("Pol"));

    const PhysicalConditions physical(FILTER_D8I, WBaseClass(String("paper")),
                                      PhysicalConditions::SURFACE_WET);
    EXPECT_EQ(static_cast<String>(physical), String("D8i,Paper,2"));
}

TEST(DStdClass, TypesSelectStandardsAndMissingOnesFallBackToStatusE) {
    nxtest::TempDir dir;
    nxtest::ScopedEnv data("NXBASE_DATA_DIR", dir.path().string());
    EXPECT_EQ(DStdClass(DSTD_STATUS_A).GetName(), "Status A");
    EXPECT_EQ(DStdClass(DSTD_STATUS_M).GetName(), "Status M");
    for (int type : {5, 7}) EXPECT_EQ(DStdClass(static_cast<DStdType>(type)).GetName(), "Status E");
    // Without an installed table there is no DIN NB curve to use.
    EXPECT_EQ(DStdClass(DSTD_DIN_NB).GetName(), "Status E");

    std::filesystem::create_directories(dir.path() / "density");
    nxtest::WriteFile(dir.File("density/din_nb_log10.csv"),
                      "wavelength,red,green,blue\n600,5,4,3\n610,4,5,3\n620,3,4,5\n");
    EXPECT_EQ(DStdClass(DSTD_DIN_NB).GetName(), "DIN NB");
}

TEST(DichteFilter, DensitiesOfWhiteAndGreyReflectors) {
    for (DStdType type : {DSTD_STATUS_A, DSTD_STATUS_T, DSTD_STATUS_M, DSTD_STATUS_E}) {
        const DichteFilter filter{DStdClass(type)};
        ASSERT_EQ(filter.GetChannelCount(), 3);
        for (unsigned short c = 0; c < 3; ++c) {
            for (int d = 0; d <= 2; ++d) {
                float density = -1.0f;
                ASSERT_TRUE(filter.GetDensity(Flat(std::pow(10.0f, -d)), c, density));
                EXPECT_NEAR(density, d, kDensityTolerance);
            }
        }
        float untouched = 7.0f;
        EXPECT_FALSE(filter.GetDensity(Flat(0.0f), 0, untouched));
        EXPECT_FALSE(filter.GetDensity(Flat(0.5f), 3, untouched));
        EXPECT_EQ(untouched, 7.0f);
    }
    // A cyan ink absorbs red: high red-filter density, low blue-filter one.
    std::vector<float> cyan(36, 0.8f);
    for (int i = (580 - 380) / 10; i < 36; ++i) cyan[i] = 0.05f;
    const DichteFilter statusT{DStdClass(DSTD_STATUS_T)};
    float red = 0.0f;
    float blue = 0.0f;
    ASSERT_TRUE(statusT.GetDensity(Spectrum(cyan), 0, red));
    ASSERT_TRUE(statusT.GetDensity(Spectrum(cyan), 2, blue));
    EXPECT_GT(red, 1.2f);
    EXPECT_LT(blue, 0.15f);
}

TEST(MeasuringCondition, StringShowsIlluminantAndObserverOrQuestionMarks) {
    const String saved = ObserverClass::GetDegreeString();
    ObserverClass::SetDegreeString(String("deg"));
    const MeasuringCondition d65(IllumClass(ILLUM_D65, 0), ObserverClass(OBSERVER_10DEG),
                                 PhysicalConditions());
    EXPECT_EQ(d65.GetMeasuringConditionString(), "D65,10deg");
    EXPECT_EQ(static_cast<String>(d65), String("D65,10deg,Status E,Default,Absolute,0"));

    const auto d50 = klume::cmetry::IlluminantRepository::Get("D50");
    const auto custom =
        klume::cmetry::MakeIlluminant("Lamp", "test", d50->GetWavelengths(), d50->GetPowers());
    const MeasuringCondition unknown(IllumClass(custom), ObserverClass(String("7")),
                                     PhysicalConditions());
    EXPECT_EQ(unknown.GetMeasuringConditionString(), "?,?");
    ObserverClass::SetDegreeString(saved);

    const MeasuringCondition statusA{DStdClass(DSTD_STATUS_A), PhysicalConditions()};
    EXPECT_NE(statusA, d65);
    EXPECT_EQ(statusA.GetIllum().GetName(), "D50");
}

TEST_F(CMetryFacade, SetCMetryRebuildsTheSumFilterButNotTheRgbFilter) {
    CMetry& cmetry = *CMetry::Instance();
    EXPECT_EQ(cmetry.GetDensityStandard()->GetName(), "Status E");
    const boost::shared_ptr<CMetryFilter> before = cmetry.GetLXYZFilter();
    cmetry.SetCMetry(IllumClass(ILLUM_FL11, 0), ObserverClass(OBSERVER_10DEG));
    EXPECT_EQ(cmetry.GetLXYZFilter()->GetIllum().GetName(), "FL11");
    EXPECT_EQ(before->GetIllum().GetName(), "D50");  // a held filter stays alive

    const CMetryFilter e10(Lichtart(IllumClass(ILLUM_E, 0)), Observer(OBSERVER_10DEG));
    for (int i = 0; i < Filter::kSize; ++i) {
        EXPECT_EQ(cmetry.GetSumFilter().GetWeights()[i],
                  e10.GetWeights(0)[i] + e10.GetWeights(1)[i] + e10.GetWeights(2)[i]);
    }
    EXPECT_EQ(CMetry::GetRGBFilter().GetIllum().GetName(), "D65");

    const MeasuringCondition condition(IllumClass(ILLUM_A, 0), ObserverClass(OBSERVER_2DEG),
                                       DStdClass(DSTD_STATUS_T), PhysicalConditions(FILTER_UVCUT));
    cmetry.SetMeasuringConditions(condition);
    EXPECT_EQ(cmetry.GetDichteFilter().GetDStd().GetName(), "Status T");
}

TEST_F(CMetryFacade, EnterWhiteDefinesOrResetsThePaper) {
    CMetry& cmetry = *CMetry::Instance();
    EXPECT_FALSE(cmetry.IsPaperSpectrumDefined());
    cmetry.EnterWhite(Flat(0.9f));
    EXPECT_TRUE(cmetry.IsPaperSpectrumDefined());
    EXPECT_EQ(cmetry.GetPaperSpectrum()[0], 0.9f);
    float density = 0.0f;
    ASSERT_TRUE(cmetry.GetDensity(Flat(0.09f), 1, density, true));
    EXPECT_NEAR(density, 1.0f, kDensityTolerance);

    std::vector<float> canceling(36, 0.0f);
    canceling[0] = 1.0f;
    canceling[1] = -1.0f;
    cmetry.EnterWhite(ReflectanceSpectrum(canceling, PhysicalConditions()));
    EXPECT_FALSE(cmetry.IsPaperSpectrumDefined());  // sums to exactly 0.0
    ASSERT_TRUE(cmetry.GetDensity(Flat(0.09f), 1, density, true));
    EXPECT_NEAR(density, -std::log10(0.09f), kDensityTolerance);
}

TEST_F(CMetryFacade, MaxDensityPrefersTheSampleNearest560Nanometres) {
    CMetry& cmetry = *CMetry::Instance();
    float density = 0.0f;
    EXPECT_EQ(cmetry.GetMaxDensity(Flat(0.1f), density, false), 560);
    EXPECT_EQ(density, -std::log10(0.1f));

    ReflectanceSpectrum spectrum = Flat(0.5f);
    spectrum[(480 - 380) / 10] = 0.2f;  // 8 samples below 560 nm
    spectrum[(640 - 380) / 10] = 0.2f;  // 8 samples above: the later wins
    EXPECT_EQ(cmetry.GetMaxDensity(spectrum, density, false), 640);
    spectrum[(540 - 380) / 10] = 0.2f;  // nearer than both
    EXPECT_EQ(cmetry.GetMaxDensity(spectrum, density, false), 540);
    spectrum[(390 - 380) / 10] = 0.001f;  // outside 410..700 nm
    spectrum[(710 - 380) / 10] = 0.001f;
    EXPECT_EQ(cmetry.GetMaxDensity(spectrum, density, false), 540);

    EXPECT_EQ(cmetry.GetMaxDensity(Flat(0.0f), density, false), 380);
    EXPECT_EQ(density, -4.0f);

    // Relative to a paper that is half as bright at 600 nm only.
    ReflectanceSpectrum paper = Flat(1.0f);
    paper[(600 - 380) / 10] = 0.25f;
    cmetry.EnterWhite(paper);
    const ReflectanceSpectrum sample = Flat(0.25f);
    EXPECT_EQ(cmetry.GetMaxDensity(sample, density, false), 560);
    EXPECT_NE(cmetry.GetMaxDensity(sample, density, true), 600);
    EXPECT_EQ(density, -std::log10(0.25f));
}

TEST(CMetry, ToEqualStrengthMatchesKubelkaMunkSums) {
    ReflectanceSpectrum white = Flat(1.0f);
    CMetry::ToEqualStrength(white, Flat(0.5f));
    EXPECT_EQ(white, Flat(1.0f));  // K/S 0 stays 0 whatever the ratio

    // A sample twice as strong as the reference comes back to the reference.
    const auto ks = [](float r) { return (1.0f - r) * (1.0f - r) / (2.0f * r); };
    const float reference = 0.4f;
    const float k = 2.0f * ks(reference);
    const float strong = k + 1.0f - std::sqrt(k * (k + 2.0f));
    ReflectanceSpectrum sample = Flat(strong);
    const ReflectanceSpectrum ref = Flat(reference);
    CMetry::ToEqualStrength(sample, ref);
    for (int i = 0; i < Spectrum::kSize; ++i) EXPECT_NEAR(sample[i], reference, 1e-5f);
    EXPECT_EQ(ref, Flat(reference));  // the reference is not changed
}

namespace {

// An application's own light source that gives no light at all.
class DarkLamp : public klume::cmetry::IIlluminant {
  public:
    const std::string& GetName() const override { return amName; }
    const std::string& GetDescription() const override { return amName; }
    const std::vector<double>& GetWavelengths() const override { return amWavelengths; }
    const std::vector<double>& GetPowers() const override { return amPowers; }

  private:
    std::string amName = "Dark";
    std::vector<double> amWavelengths{300.0, 900.0};
    std::vector<double> amPowers{0.0, 0.0};
};

}  // namespace

TEST(CMetryFilter, AnIlluminantWithoutLightFallsBackToTheDefaultWithALogLine) {
    nxtest::LogCapture log;
    const boost::shared_ptr<klume::cmetry::IIlluminant> dark(new DarkLamp);
    EXPECT_FALSE(
        klume::cmetry::CMetryFilter::Find(dark, klume::cmetry::ObserverRepository::Get("2")));
    const CMetryFilter filter{Lichtart(IllumClass(dark)), Observer(OBSERVER_2DEG)};
    EXPECT_EQ(filter.GetIllum().GetName(), "D50");
    EXPECT_NEAR(filter.GetWeightSum(1), 100.0f, nxtest::kFloatAtHundred);
    EXPECT_THAT(log.Text(), HasSubstr("Illuminant \"Dark\" has no weights")) << log.Text();
}

namespace {

// A table "wavelength,v1,v2,..." of the CIE data, read here without the
// library, for an independent summation.
std::vector<std::vector<double>> ReadTable(const std::string& path) {
    std::vector<std::vector<double>> rows;
    const std::vector<std::string> lines = nxtest::ReadLines(path);
    for (std::size_t i = 1; i < lines.size(); ++i) {
        std::vector<double> row;
        std::stringstream fields(lines[i]);
        for (std::string field; std::getline(fields, field, ',');) row.push_back(std::stod(field));
        if (!row.empty()) rows.push_back(row);
    }
    return rows;
}

// Column `column` of a table at `nm`: linear between rows, ends held.
double At(const std::vector<std::vector<double>>& table, double nm, std::size_t column) {
    if (nm <= table.front()[0]) return table.front()[column];
    if (nm >= table.back()[0]) return table.back()[column];
    std::size_t i = 1;
    while (table[i][0] < nm) ++i;
    const double t = (nm - table[i - 1][0]) / (table[i][0] - table[i - 1][0]);
    return table[i - 1][column] + t * (table[i][column] - table[i - 1][column]);
}

// CIE 15 summation at the grid's interval over 360..830 nm, R held at its
// ends, in long double: X = 100 sum(S x R) / sum(S y).
std::array<double, 3> IndependentXyz(const std::string& illuminant, const std::vector<double>& grid,
                                     const std::vector<float>& r) {
    const std::string cie = std::string(NXBASE_SOURCE_DIR) + "/platform/cmetry/data/cie/";
    static const auto cmf = ReadTable(cie + "cmf_cie1931_2deg.csv");
    const auto light = ReadTable(cie + "illuminants/" + illuminant + ".csv");
    const double step = grid[1] - grid[0];
    long double sums[3] = {}, norm = 0;
    for (double nm = grid[0] - step * std::floor((grid[0] - 360.0) / step + 1e-9);
         nm <= 830.0 + 1e-9; nm += step) {
        const std::size_t k = nm < grid.front() ? 0
                              : nm > grid.back()
                                  ? grid.size() - 1
                                  : static_cast<std::size_t>(std::lround((nm - grid[0]) / step));
        const long double s = At(light, nm, 1);
        for (int c = 0; c < 3; ++c) sums[c] += s * At(cmf, nm, 1 + c) * r[k];
        norm += s * At(cmf, nm, 2);
    }
    return {static_cast<double>(100 * sums[0] / norm), static_cast<double>(100 * sums[1] / norm),
            static_cast<double>(100 * sums[2] / norm)};
}

std::vector<double> Grid(double from, double to, double step) {
    std::vector<double> grid;
    for (double nm = from; nm <= to + 1e-9; nm += step) grid.push_back(nm);
    return grid;
}

// Runs `check` once with the kernels of each instruction set the machine
// has, the widest again in use afterwards.
template <class Check>
void ForEachFineGridIsa(Check check) {
    using toolkit::VectorIsa;
    for (VectorIsa isa : {VectorIsa::kBaseline, VectorIsa::kAvx2, VectorIsa::kAvx512}) {
        if (!nxbase::detail::UseFineGridIsa(isa)) break;
        SCOPED_TRACE("instruction set " + std::to_string(static_cast<int>(isa)));
        check();
        if (::testing::Test::HasFatalFailure()) break;
    }
    nxbase::detail::UseFineGridIsa(toolkit::MachineVectorIsa());
}

}  // namespace

// Random regular and uneven fine grids and spectra: one spectrum against a
// plain sum of the object's own weights in long double; the batch forms the
// one-spectrum values narrowed, bit for bit, on any number of threads.
TEST(FineGridTristimulus, BatchesAndThreadsGiveTheOneSpectrumValues) {
    const unsigned seed = std::random_device{}();
    SCOPED_TRACE("seed " + std::to_string(seed));
    std::mt19937 random(seed);
    std::uniform_real_distribution<double> unit(0.0, 1.0);
    const MeasuringCondition condition;
    ForEachFineGridIsa([&] {
        for (int round = 0; round < 12; ++round) {
            std::vector<double> grid;
            if (round % 3 == 2) {
                for (double nm = 350 + 20 * unit(random); nm < 840; nm += 0.5 + 12 * unit(random))
                    grid.push_back(nm);
            } else {
                // Now and then fewer values than a step of the sums' lanes.
                const double from = 340 + 60 * unit(random), step = 0.5 + 9 * unit(random);
                const double span =
                    round % 3 == 1 ? step * (2 + random() % 16) : 300 + 200 * unit(random);
                grid = Grid(from, from + span, step);
            }
            if (!nxbase::FineGridTristimulus::Applies(grid)) continue;
            const nxbase::FineGridTristimulus fine(condition, grid);
            // Every fourth round has enough spectra for the threads to share them
            // (a thread takes about 600 000 values).
            const std::size_t n = grid.size();
            const std::size_t count =
                round % 4 ? 1 + random() % 200 : 2 * 589824 / n + random() % 999;
            std::vector<float> spectra(count * n);
            for (float& v : spectra) v = static_cast<float>(1.2 * unit(random));
            std::vector<float> xyz(3 * count), lab(3 * count), threaded(3 * count);
            fine.ToXYZ(spectra.data(), count, xyz.data());
            fine.ToLab(spectra.data(), count, lab.data());
            // Every spectrum of the first blocks (batches go two at a time), sparser after.
            for (std::size_t i = 0; i < count; i += 1 + i / 128) {
                const float* r = &spectra[i * n];
                const std::array<double, 3> one = fine.ToXYZ(r), oneLab = fine.ToLab(r);
                for (int c = 0; c < 3; ++c) {
                    long double model = 0;
                    for (std::size_t k = 0; k < n; ++k) model += fine.Weight(c, k) * r[k];
                    ASSERT_NEAR(one[c], static_cast<double>(model), 1e-12 * (1 + std::fabs(one[c])))
                        << "grid of " << n << ", spectrum " << i << ", channel " << c;
                    ASSERT_EQ(xyz[3 * i + c], static_cast<float>(one[c]));
                    ASSERT_EQ(lab[3 * i + c], static_cast<float>(oneLab[c]));
                }
            }
            for (unsigned threads : {2u, 3u, 0u}) {
                fine.ToLabParallel(spectra.data(), count, threaded.data(), threads);
                ASSERT_EQ(threaded, lab) << threads << " threads, " << count << " spectra";
                fine.ToXYZParallel(spectra.data(), count, threaded.data(), threads);
                ASSERT_EQ(threaded, xyz) << threads << " threads, " << count << " spectra";
            }
        }
    });
}

// AVX2 and AVX-512 sum each lane and halve the lanes alike: the same bits,
// one spectrum or many, XYZ and Lab.
TEST(FineGridTristimulus, Avx2AndAvx512GiveTheSameBits) {
    using toolkit::VectorIsa;
    if (toolkit::MachineVectorIsa() != VectorIsa::kAvx512) GTEST_SKIP() << "no AVX-512 here";
    const unsigned seed = std::random_device{}();
    SCOPED_TRACE("seed " + std::to_string(seed));
    std::mt19937 random(seed);
    std::uniform_real_distribution<double> unit(0.0, 1.0);
    for (int round = 0; round < 20; ++round) {
        const double from = 340 + 60 * unit(random), step = 0.5 + 9 * unit(random);
        const nxbase::FineGridTristimulus fine(MeasuringCondition(), Grid(from, from + 400, step));
        const std::size_t n = fine.Wavelengths().size(), count = 1 + random() % 40;
        std::vector<float> spectra(count * n);
        for (float& v : spectra) v = static_cast<float>(1.2 * unit(random));
        std::vector<float> batch[2];
        std::vector<std::array<double, 3>> one[2];
        for (int wide = 0; wide < 2; ++wide) {
            nxbase::detail::UseFineGridIsa(wide ? VectorIsa::kAvx512 : VectorIsa::kAvx2);
            batch[wide].resize(3 * count);
            fine.ToLab(spectra.data(), count, batch[wide].data());
            for (std::size_t i = 0; i < count; ++i) {
                one[wide].push_back(fine.ToXYZ(&spectra[i * n]));
                one[wide].push_back(fine.ToLab(&spectra[i * n]));
            }
        }
        ASSERT_EQ(batch[0], batch[1]) << "grid of " << n;
        ASSERT_EQ(std::memcmp(one[0].data(), one[1].data(), one[0].size() * sizeof one[0][0]), 0)
            << "grid of " << n;
    }
}

// CIELAB's cube root: within an ulp of the exact root over twenty decades;
// and the many-colour form, eight lanes at a time, equal bit for bit to
// CielabOf of each colour, colours of either branch and unusable ones alike.
TEST(FineGridTristimulus, TheCubeRootIsWithinAnUlpAndManyColoursGiveEachOnesLab) {
    const unsigned seed = std::random_device{}();
    SCOPED_TRACE("seed " + std::to_string(seed));
    std::mt19937 random(seed);
    std::uniform_real_distribution<double> decades(-300.0, 300.0), unit(0.0, 1.3);
    for (int i = 0; i < 200000; ++i) {
        const double t = std::pow(10.0, decades(random)), root = nxbase::cielab::CubeRoot(t);
        const long double error = root - std::cbrt(static_cast<long double>(t));
        ASSERT_LE(std::fabs(static_cast<double>(error)), std::nextafter(root, INFINITY) - root)
            << t;
    }
    // Arguments outside the steps' range are still roots, or NaN for NaN.
    for (double t : {0.0, -0.0, -27.0, 4e-320, DBL_MIN, DBL_MAX, HUGE_VAL, -HUGE_VAL})
        EXPECT_EQ(nxbase::cielab::CubeRoot(t), std::cbrt(t)) << t;
    EXPECT_TRUE(std::isnan(nxbase::cielab::CubeRoot(NAN)));
    EXPECT_EQ(nxbase::cielab::F(INFINITY), INFINITY);
    ForEachFineGridIsa([&] {
        const std::array<double, 3> white{96.42 * unit(random) + 1, 100.0,
                                          82.52 * unit(random) + 1};
        const double odd[] = {0.0, -3.0, 1e-3, NAN, INFINITY, 1e12};
        std::vector<double> xyz(3 * 203);
        for (std::size_t j = 0; j < xyz.size(); ++j)
            xyz[j] = j % 29 == 0 ? odd[j / 29 % 6] : white[j % 3] * unit(random);
        std::vector<double> lab = xyz;
        nxbase::CielabInPlace(lab.data(), 203, white);
        // The model: CIE's formula with the standard library's cube root; NaN
        // exactly when a ratio to the white is not finite.
        auto f = [](double t) { return t > 0.008856 ? std::cbrt(t) : 7.787 * t + 16.0 / 116.0; };
        for (std::size_t i = 0; i < 203; ++i) {
            const auto one = nxbase::CielabOf({xyz[3 * i], xyz[3 * i + 1], xyz[3 * i + 2]}, white);
            ASSERT_EQ(std::memcmp(one.data(), &lab[3 * i], sizeof one), 0) << "colour " << i;
            double r[3];
            for (int c = 0; c < 3; ++c) r[c] = xyz[3 * i + c] / white[c];
            if (!std::isfinite(r[0]) || !std::isfinite(r[1]) || !std::isfinite(r[2])) {
                for (int c = 0; c < 3; ++c) ASSERT_TRUE(std::isnan(one[c])) << "colour " << i;
                continue;
            }
            const double model[3] = {116.0 * f(r[1]) - 16.0, 500.0 * (f(r[0]) - f(r[1])),
                                     200.0 * (f(r[1]) - f(r[2]))};
            for (int c = 0; c < 3; ++c)
                ASSERT_NEAR(one[c], model[c], 1e-9 * (1.0 + std::fabs(model[c]))) << "colour " << i;
        }
    });
    // Finite values whose ratio to a white below 1 overflows have no colour,
    // nor has any colour under a white with a subnormal component.
    for (double v : nxbase::CielabOf({1e308, 1.0, 1.0}, {0.5, 1.0, 1.0}))
        EXPECT_TRUE(std::isnan(v));
    for (double v : nxbase::CielabOf({1.0, 1.0, 1.0}, {1.0, 4e-320, 1.0}))
        EXPECT_TRUE(std::isnan(v));
}

TEST(FineGridTristimulus, SumsAtTheirOwnIntervalAndAgreeWithTheTenNanometrePathForSmoothSpectra) {
    EXPECT_TRUE(nxbase::FineGridTristimulus::Applies(Grid(380, 730, 5)));
    EXPECT_TRUE(nxbase::FineGridTristimulus::Applies(Grid(400, 700, 10.0 / 3.0)));
    EXPECT_FALSE(nxbase::FineGridTristimulus::Applies(Grid(380, 730, 10)));
    // Uneven grids with a step below 10 nm are summed at every nanometre;
    // coarser ones, and grids that do not increase, are not for this class.
    EXPECT_TRUE(nxbase::FineGridTristimulus::Applies({380, 385, 395, 400}));
    EXPECT_FALSE(nxbase::FineGridTristimulus::Applies({380, 400, 410, 430}));
    EXPECT_FALSE(nxbase::FineGridTristimulus::Applies({380, 385, 385, 400}));
    const nxbase::FineGridTristimulus uneven(MeasuringCondition(), {360, 363, 420, 555, 556, 830});
    EXPECT_NEAR(uneven.White()[1], 100.0, 1e-9);
    const float grey[6] = {0.4f, 0.4f, 0.4f, 0.4f, 0.4f, 0.4f};
    EXPECT_NEAR(uneven.ToXYZ(grey)[1], 40.0, 1e-5);

    // A lamp line: a narrow peak between the 10 nm points, on 1 nm and 5 nm
    // grids, against an independent summation of the CIE tables.
    for (const char* illuminant : {"D65", "FL2"}) {
        const MeasuringCondition condition(IllumClass(illuminant), ObserverClass(String("2")),
                                           DStdClass(), PhysicalConditions());
        for (double step : {1.0, 5.0}) {
            const std::vector<double> grid = Grid(380, 730, step);
            std::vector<float> line(grid.size(), 0.1f);
            for (std::size_t k = 0; k < grid.size(); ++k) {
                if (std::fabs(grid[k] - 545.0) <= 2.0) line[k] = 0.9f;
            }
            const nxbase::FineGridTristimulus fine(condition, grid);
            const std::array<double, 3> xyz = fine.ToXYZ(line.data());
            const std::array<double, 3> expected = IndependentXyz(illuminant, grid, line);
            for (int c = 0; c < 3; ++c)
                EXPECT_NEAR(xyz[c], expected[c], nxtest::kDoubleSumReordered)
                    << illuminant << " " << step << " " << c;
            EXPECT_NEAR(fine.White()[1], 100.0, nxtest::kDoubleSumReordered);
        }
    }

    // The ColorChecker, brought onto 5 nm and 1 nm by Sprague interpolation:
    // smooth spectra, for which both paths must agree within 0.05 dE00.
    const MeasuringCondition d50;
    const nxbase::SpectraTable chart = [] {
        nxbase::SpectraTable t;
        std::string error;
        nxbase::ReadSpectralFile(nxtest::ChartPath(), {nxbase::SpectralScale::kFraction}, &t,
                                 &error);
        return t;
    }();
    ASSERT_EQ(chart.rows.size(), 24u);
    double worst = 0.0;
    for (double step : {1.0, 5.0}) {
        const std::vector<double> grid = Grid(380, 730, step);
        const nxbase::SpectralResampler finer(nxbase::StandardWavelengths(), grid);
        const nxbase::FineGridTristimulus fine(d50, grid);
        for (const nxbase::SpectrumRow& row : chart.rows) {
            std::vector<float> values(grid.size());
            finer.Resample(row.values.data(), values.data());
            const std::array<double, 3> lab = fine.ToLab(values.data());
            const LABVector tenNm(ReflectanceSpectrum(row.values.data(), PhysicalConditions()),
                                  d50);
            worst = std::max(
                worst, nxbase::DeltaE2000({lab[0], lab[1], lab[2]}, nxbase::ToLabValue(tenNm)));
        }
    }
    EXPECT_LT(worst, 0.05);
}
