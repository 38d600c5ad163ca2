// nxcolor: its CSV reader, its report, and the program on good and bad files.
#include <gtest/gtest.h>

#include <cstdio>
#include <algorithm>
#include <fstream>
#include <sstream>
#include <random>
#include <string>

#include "color_test_util.h"
#include "report.h"
#include "spectra_csv.h"
#include "test_util.h"

namespace {

using nxcolor::ParseSpectraCsv;

std::string Values(float v, int count = 36) {
    std::string text;
    for (int i = 0; i < count; ++i) text += (i ? "," : "") + std::to_string(v);
    return text;
}

std::string Header(int first = 380, int last = 730) {
    std::string text = "patch_index,patch_name";
    for (int nm = first; nm <= last; nm += 10) text += ",r" + std::to_string(nm);
    return text;
}

TEST(NxcolorCsv, EmbeddedChartIsTheChartFile) {
    nxcolor::SpectraTable file;
    std::string error;
    ASSERT_TRUE(nxcolor::ReadSpectraFile(nxtest::ChartPath(), {}, &file, &error)) << error;
    const nxcolor::SpectraTable embedded = ParseSpectraCsv(nxcolor::EmbeddedChart(), "chart");
    ASSERT_EQ(file.rows.size(), 24u);
    ASSERT_EQ(embedded.rows.size(), 24u);
    for (std::size_t i = 0; i < 24; ++i) {
        EXPECT_EQ(file.rows[i].id, embedded.rows[i].id);
        EXPECT_EQ(file.rows[i].values, embedded.rows[i].values);
    }
}

TEST(NxcolorReport, WritesTableAndCsvWithoutLocale) {
    const auto table = ParseSpectraCsv(nxcolor::EmbeddedChart(), "chart");
    const MeasuringCondition condition(IllumClass("D50"), ObserverClass(OBSERVER_2DEG),
                                       PhysicalConditions());
    const nxcolor::Report report =
        nxcolor::Evaluate(table, "chart", condition, {"xyz", "lab", "lch", "din99"}, 3);
    ASSERT_EQ(report.columns.size(), 11u);
    ASSERT_EQ(report.rows.size(), 24u);
    std::ostringstream csv;
    nxcolor::Writers().at("csv")(report, csv);
    const std::string text = csv.str();
    EXPECT_EQ(text.substr(0, text.find('\n')), "id,X,Y,Z,L*,a*,b*,C*,h,L99,a99,b99");
    EXPECT_NE(text.find("\n1 dark skin,11.805,10.328,5.166,38.424,13.688,14.422,"), std::string::npos)
        << text.substr(0, 200);
    std::ostringstream aligned;
    nxcolor::Writers().at("table")(report, aligned);
    EXPECT_EQ(aligned.str().rfind("# chart: 24 spectra, illuminant D50, observer 2", 0), 0u);
    // CGATS output parses with LittleCMS: the reader gets past the syntax and
    // finds the data format (colour fields, no spectral ones).
    std::ostringstream cgats;
    nxcolor::Writers().at("cgats")(report, cgats);
    EXPECT_NE(cgats.str().find("SAMPLE_ID XYZ_X XYZ_Y XYZ_Z LAB_L LAB_A LAB_B LAB_C LAB_H DIN99_L"),
              std::string::npos);
    const auto back = nxcolor::ParseSpectra(cgats.str(), "out.cgats");
    ASSERT_EQ(back.errors.size(), 1u);
    EXPECT_EQ(back.errors[0].rfind("out.cgats: spectral fields missing", 0), 0u) << back.errors[0];
    EXPECT_EQ(nxcolor::FormatNumber(-0.00001f, 2), "0.00");
    EXPECT_EQ(nxcolor::FormatNumber(-1.5f, 1), "-1.5");
}

using nxtest::RunNxcolor;

TEST(NxcolorProgram, ReportsBadFilesClearly) {
    nxtest::TempDir dir;
    const std::string bad = dir.File("bad.csv");
    std::ofstream(bad) << Header() << "\n1,ok," << Values(0.5f) << "\n2,short,0.5\n";
    std::string out;
    std::string err;
    EXPECT_EQ(RunNxcolor(bad, &out, &err), 1);
    EXPECT_NE(err.find(bad + ":3: 3 fields, expected 38"), std::string::npos) << err;
    EXPECT_NE(out.find("1 ok"), std::string::npos) << "the good row is still printed";

    EXPECT_EQ(RunNxcolor(dir.File("missing.csv"), &out, &err), 2);
    EXPECT_NE(err.find("missing.csv: cannot open the file"), std::string::npos) << err;
    EXPECT_EQ(RunNxcolor(dir.path().string(), &out, &err), 2);
    EXPECT_NE(err.find("is a directory"), std::string::npos) << err;

    const std::string grid = dir.File("grid.csv");
    std::ofstream(grid) << "id,r400,r390\n1,0.5,0.5\n";
    EXPECT_EQ(RunNxcolor(grid, &out, &err), 2);
    EXPECT_NE(err.find("grid.csv:1: fewer than 3 spectral columns"), std::string::npos) << err;
    EXPECT_TRUE(out.empty());

    EXPECT_EQ(RunNxcolor("--illuminant D42", &out, &err), 2);
    EXPECT_NE(err.find("unknown illuminant \"D42\""), std::string::npos) << err;
    EXPECT_EQ(RunNxcolor("--observer 7", &out, &err), 2);
    EXPECT_EQ(RunNxcolor("--precision x", &out, &err), 2);
}

TEST(NxcolorProgram, PrintsTheBuiltInChartUnderAChosenCondition) {
    std::string out;
    std::string err;
    ASSERT_EQ(RunNxcolor("--illuminant D65 --observer 10 --format csv --din99", &out, &err), 0) << err;
    EXPECT_EQ(out.substr(0, out.find('\n')), "id,X,Y,Z,L*,a*,b*,C*,h,L99,a99,b99");
    EXPECT_EQ(std::count(out.begin(), out.end(), '\n'), 25);
    // Densities of a flat 10% reflector are 1 in every channel.
    nxtest::TempDir dir;
    const std::string grey = dir.File("grey.csv");
    std::ofstream(grey) << "grey," << Values(0.1f) << "\n";
    ASSERT_EQ(RunNxcolor(grey + " --density 'Status T' -p 3 -f csv", &out, &err), 0) << err;
    EXPECT_NE(out.find(",D_RED,D_GREEN,D_BLUE\ngrey,"), std::string::npos) << out;
    EXPECT_NE(out.find(",1.000,1.000,1.000\n"), std::string::npos) << out;
    EXPECT_EQ(RunNxcolor("--density 'Status Q'", &out, &err), 2);
    ASSERT_EQ(RunNxcolor("--help", &out, &err), 0);
    EXPECT_NE(out.find("Usage: nxcolor"), std::string::npos);
    ASSERT_EQ(RunNxcolor("--format=csv -p 2", &out, &err), 0);
    EXPECT_NE(out.find("\n1 dark skin,11.81,10.33,5.17,38.42,13.69,14.42,19.88,46.50\n"),
              std::string::npos) << out.substr(0, 200);
}

}  // namespace
