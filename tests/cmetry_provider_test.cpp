// The colorimetry data provider: weight tables against colour-science's
// ASTM E308 tables, repositories, installed tables and bad input.
#include <gtest/gtest.h>

#include <algorithm>
#include <atomic>
#include <cmath>
#include <filesystem>
#include <string>
#include <thread>
#include <vector>

#include "colorimetry_test_util.h"
#include "klume/cmetry/cmetry.h"

namespace cm = klume::cmetry;

namespace {

::testing::Environment* const kLogDir =
    ::testing::AddGlobalTestEnvironment(new nxtest::LogDirEnvironment);

// The weights are computed in double from the same 1 nm data as the
// reference; only the order of summation differs.
constexpr double kWeightRelativeTolerance = 1e-9;
// Weights below this are compared absolutely (relative error is meaningless
// next to zero).
constexpr double kWeightAbsoluteFloor = 1e-12;

void ExpectWeightsMatch(const std::string& illuminant, const std::string& observer,
                        const std::string& file) {
    SCOPED_TRACE(file);
    const auto rows = nxtest::ReadCsvRows(nxtest::ColorimetryData(file));
    ASSERT_EQ(rows.size(), static_cast<std::size_t>(cm::kSampleCount));
    const auto filter = cm::CMetryFilter::Find(illuminant, observer);
    ASSERT_TRUE(filter);
    for (int i = 0; i < cm::kSampleCount; ++i) {
        EXPECT_EQ(nxtest::ToDouble(rows[i][0]), cm::kFirstWavelength + 10 * i);
        for (int c = 0; c < 3; ++c) {
            const double expected = nxtest::ToDouble(rows[i][1 + c]);
            const double actual = filter->GetWeights(c)[i];
            const double scale = std::max(std::fabs(expected), kWeightAbsoluteFloor);
            EXPECT_LE(std::fabs(actual - expected) / scale, kWeightRelativeTolerance)
                << "row " << i << " channel " << c << ": " << actual << " vs " << expected;
            EXPECT_EQ(filter->GetFloatWeights(c)[i], static_cast<float>(actual));
        }
    }
}

std::string D65Table() {
    std::string csv = "wavelength,value\n";
    const auto d65 = cm::IlluminantRepository::Get("D65");
    for (std::size_t i = 0; i < d65->GetWavelengths().size(); ++i) {
        char line[96];
        std::snprintf(line, sizeof line, "%.17g,%.17g\n", d65->GetWavelengths()[i],
                      d65->GetPowers()[i]);
        csv += line;
    }
    return csv;
}

class CMetryProviderInDataDir : public ::testing::Test {
  protected:
    void SetUp() override {
        std::filesystem::create_directories(dir.path() / "illuminants");
        std::filesystem::create_directories(dir.path() / "density");
    }
    std::string Illuminant(const std::string& name) const {
        return (dir.path() / "illuminants" / (name + ".csv")).string();
    }
    std::string Density(const std::string& stem) const {
        return (dir.path() / "density" / (stem + "_log10.csv")).string();
    }

    nxtest::TempDir dir;
    nxtest::ScopedEnv dataDir{"NXBASE_DATA_DIR", dir.path().string()};
    nxtest::LogCapture log;
};

}  // namespace

TEST(CMetryProvider, WeightsReproduceTheAstmE308ReferenceTables) {
    ExpectWeightsMatch("D65", "2", "weights_D65_2deg.csv");
    ExpectWeightsMatch("D50", "2", "weights_D50_2deg.csv");
    ExpectWeightsMatch("A", "10", "weights_A_10deg.csv");
}

TEST(CMetryProvider, EveryBuiltInPairHasWeightsWhoseYColumnSumsToOneHundred) {
    constexpr double kSumTolerance = 1e-9;
    for (const std::string& illuminant : cm::IlluminantRepository::GetNames()) {
        for (const std::string& observer : cm::ObserverRepository::GetNames()) {
            SCOPED_TRACE(illuminant + "/" + observer);
            const auto filter = cm::CMetryFilter::Find(illuminant, observer);
            ASSERT_TRUE(filter);
            double sum = 0.0;
            for (double w : filter->GetWeights(1)) sum += w;
            EXPECT_NEAR(sum, 100.0, kSumTolerance);
            // Filters are computed once and shared.
            EXPECT_EQ(filter, cm::CMetryFilter::Find(illuminant, observer));
        }
    }
    EXPECT_EQ(cm::IlluminantRepository::GetNames().size(), 19u);
}

TEST(CMetryProvider, RepositoriesKnowTheirNamesAndFallBackToTheDefaults) {
    EXPECT_EQ(cm::IlluminantRepository::GetDefault()->GetName(), "D50");
    EXPECT_EQ(cm::IlluminantRepository::Get("FL11")->GetName(), "FL11");
    EXPECT_EQ(cm::IlluminantRepository::Get("no such light")->GetName(), "D50");
    EXPECT_FALSE(cm::IlluminantRepository::Exists("../../etc/passwd"));
    EXPECT_EQ(cm::ObserverRepository::Get("10")->GetFieldSize(), 10);
    EXPECT_EQ(cm::ObserverRepository::Get("2")->GetFieldSize(), 2);
    EXPECT_FALSE(cm::ObserverRepository::Get("4"));
    EXPECT_FALSE(cm::CMetryFilter::Find("D65", "4"));

    // The linear interpolation holds the table's end values: FL tables start
    // at 380 nm, D tables end at 780 nm.
    const auto fl1 = cm::IlluminantRepository::Get("FL1");
    EXPECT_EQ(fl1->GetPower(360.0), fl1->GetPower(380.0));
    const auto d65 = cm::IlluminantRepository::Get("D65");
    EXPECT_EQ(d65->GetPower(830.0), d65->GetPowers().back());
    EXPECT_DOUBLE_EQ(d65->GetPower(562.0), 0.6 * d65->GetPower(560.0) + 0.4 * d65->GetPower(565.0));
}

TEST(CMetryProvider, StatusDensitiesAreBuiltInAndTheNarrowBandOnesAreNot) {
    nxtest::TempDir dir;
    nxtest::ScopedEnv noData("NXBASE_DATA_DIR", dir.File("nothing-here"));
    nxtest::LogCapture log;
    for (const char* name : {"Status A", "Status T", "Status M", "Status E"}) {
        SCOPED_TRACE(name);
        ASSERT_TRUE(cm::DensityStandardRepository::Exists(name));
        const auto standard = cm::DensityStandardRepository::Get(name);
        ASSERT_EQ(standard->GetChannelCount(), 3);
        for (int c = 0; c < 3; ++c) {
            // Peak-normalised linear products: the peak (log 5.000) is 1.0.
            const auto& products = standard->GetProducts(c);
            EXPECT_DOUBLE_EQ(*std::max_element(products.begin(), products.end()), 1.0);
        }
    }
    for (const char* name : {"Status I", "DIN", "DIN NB", "SPI"}) {
        SCOPED_TRACE(name);
        EXPECT_FALSE(cm::DensityStandardRepository::Exists(name));
        EXPECT_EQ(cm::DensityStandardRepository::Get(name)->GetName(), "Status E");
    }
    EXPECT_EQ(cm::DensityStandardRepository::GetDefault()->GetName(), "Status E");
    EXPECT_THAT(log.Text(), HasSubstr("Density standard \"DIN NB\" not available")) << log.Text();
}

TEST_F(CMetryProviderInDataDir, InstalledIlluminantGoesThroughTheSameWeightPath) {
    nxtest::WriteFile(Illuminant("MyD65"), D65Table());
    std::string error;
    const auto mine = cm::IlluminantRepository::Find("MyD65", &error);
    ASSERT_TRUE(mine) << error;
    EXPECT_EQ(cm::IlluminantRepository::Get("MyD65"), mine);  // parsed once

    const auto custom = cm::CMetryFilter::Find("MyD65", "2");
    const auto builtIn = cm::CMetryFilter::Find("D65", "2");
    ASSERT_TRUE(custom);
    for (int c = 0; c < 3; ++c) {
        for (int i = 0; i < cm::kSampleCount; ++i) {
            EXPECT_EQ(custom->GetWeights(c)[i], builtIn->GetWeights(c)[i]);
        }
    }
}

TEST_F(CMetryProviderInDataDir, BadIlluminantFilesAreRejectedWithFileAndLine) {
    struct Case {
        const char* name;
        std::string text;
        const char* expected;
    };
    const Case cases[] = {
        {"Text", "wavelength,value\n380,1\n390,abc\n", "line 3: not a number: abc"},
        {"Signs", "wavelength,value\n+380,1\n390,+-1\n", "line 3: not a number: +-1"},
        {"Short", "wavelength,value\n380,1\n390\n", "line 3: wrong number of fields"},
        {"Order", "wavelength,value\n390,1\n380,2\n", "line 3: wavelengths not strictly"},
        {"Header", "nm,value\n380,1\n390,2\n", "line 1: header must start with wavelength"},
        {"OneRow", "wavelength,value\n380,1\n", "fewer than two rows"},
        {"Empty", "", "no header"},
        {"Binary", std::string("\0\xff\x01,\n", 5), "line 1"},
        {"Infinite", "wavelength,value\n380,1\n390,1e999\n", "line 3: not a number"},
        {"Columns", "wavelength,value,more\n380,1,2\n390,1,2\n", "expected the columns"},
        {"Negative", "wavelength,value\n380,1\n390,-1\n", "negative power at 390"},
        {"Dark", "wavelength,value\n300,5\n310,0\n900,0\n", "no power between 360 and 780"},
    };
    for (const Case& c : cases) {
        SCOPED_TRACE(c.name);
        nxtest::WriteFile(Illuminant(c.name), c.text);
        std::string error;
        EXPECT_FALSE(cm::IlluminantRepository::Find(c.name, &error));
        EXPECT_THAT(error, HasSubstr(c.expected)) << error;
        EXPECT_THAT(error, HasSubstr(Illuminant(c.name))) << error;
        EXPECT_EQ(cm::IlluminantRepository::Get(c.name)->GetName(), "D50");
        EXPECT_FALSE(cm::CMetryFilter::Find(c.name, "2"));
    }
    EXPECT_THAT(log.Text(),
                HasSubstr("Illuminant \"Text\" not available (" + Illuminant("Text") + ": line 3"))
        << log.Text();
    // A byte-order mark and CRLF line ends are accepted.
    nxtest::WriteFile(Illuminant("Bom"), "\xEF\xBB\xBFwavelength,value\r\n380,1\r\n780,1\r\n");
    std::string error;
    EXPECT_TRUE(cm::IlluminantRepository::Find("Bom", &error)) << error;
}

TEST_F(CMetryProviderInDataDir, InstalledDensityTableMakesAStandardExist) {
    // A made-up narrow-band table: it exercises loading, it is no real curve.
    nxtest::WriteFile(Density("din_nb"),
                      "wavelength,red,green,blue\n"
                      "380,-10,3.0,-10\n"  // the grid's first and last rows count too
                      "440,-10,-10,5.0\n450,-10,-10,4.0\n"
                      "540,-10,5.0,-10\n550,-10,4.7,-10\n"
                      "620,5.0,-10,-10\n630,4.0,-10,-10\n"
                      "730,2.0,-10,-10\n");
    ASSERT_TRUE(cm::DensityStandardRepository::Exists("DIN NB"));
    const auto standard = cm::DensityStandardRepository::Get("DIN NB");
    EXPECT_EQ(standard->GetChannelName(2), "blue");
    EXPECT_DOUBLE_EQ(standard->GetProducts(2)[(440 - 380) / 10], 1.0);
    EXPECT_DOUBLE_EQ(standard->GetProducts(2)[(450 - 380) / 10], 0.1);
    EXPECT_DOUBLE_EQ(standard->GetProducts(1)[(550 - 380) / 10], std::pow(10.0, -0.3));
    EXPECT_DOUBLE_EQ(standard->GetProducts(1)[0], 0.01);
    EXPECT_DOUBLE_EQ(standard->GetProducts(0)[(730 - 380) / 10], 0.001);
    EXPECT_FALSE(cm::DensityStandardRepository::Exists("DIN"));

    nxtest::WriteFile(Density("spi"), "wavelength,red\n445,5\n455,5\n");
    std::string error;
    EXPECT_FALSE(cm::DensityStandardRepository::Find("SPI", &error));
    EXPECT_THAT(error, HasSubstr("off the 10 nm grid")) << error;
    nxtest::WriteFile(Density("status_i"), "wavelength,red\n400,-10\n410,-10\n");
    EXPECT_FALSE(cm::DensityStandardRepository::Find("Status I", &error));
    EXPECT_THAT(error, HasSubstr("no response")) << error;
}

TEST(CMetryProvider, ConcurrentFirstUseOfAFilterComputesItOnce) {
    constexpr int kThreads = 8;
    // A pair no other test asks for, so that this is its first use.
    std::vector<boost::shared_ptr<const cm::CMetryFilter>> results(kThreads);
    std::atomic<int> ready{0};
    std::vector<std::thread> threads;
    for (int t = 0; t < kThreads; ++t) {
        threads.emplace_back([&, t] {
            ++ready;
            while (ready.load() < kThreads) std::this_thread::yield();
            results[t] = cm::CMetryFilter::Find("FL7", "10");
        });
    }
    for (std::thread& thread : threads) thread.join();
    ASSERT_TRUE(results[0]);
    for (const auto& result : results) EXPECT_EQ(result, results[0]);
}
