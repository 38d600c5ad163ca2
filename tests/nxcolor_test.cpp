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

TEST(NxcolorCsv, ReadsTheChartAndItsEmbeddedCopyAlike) {
    nxcolor::SpectraTable file;
    std::string error;
    ASSERT_TRUE(nxcolor::ReadSpectraFile(nxtest::ChartPath(), 1.0f, &file, &error)) << error;
    const nxcolor::SpectraTable embedded = ParseSpectraCsv(nxcolor::EmbeddedChart(), "chart");
    EXPECT_TRUE(file.errors.empty());
    ASSERT_EQ(file.rows.size(), 24u);
    ASSERT_EQ(embedded.rows.size(), 24u);
    for (std::size_t i = 0; i < 24; ++i) {
        EXPECT_EQ(file.rows[i].id, embedded.rows[i].id);
        EXPECT_EQ(file.rows[i].values, embedded.rows[i].values);
    }
    EXPECT_EQ(file.rows[0].id, "1 dark skin");
    EXPECT_EQ(file.rows[0].values[0], 0.055f);
    EXPECT_EQ(file.rows[0].values[35], 0.209f);
    EXPECT_EQ(file.rows[0].line, 2);
}

TEST(NxcolorCsv, ReportsBadRowsWithTheirLineAndKeepsTheOthers) {
    const std::string text = Header() + "\n" +
                             "1,good," + Values(0.5f) + "\n" +
                             "2,short," + Values(0.5f, 30) + "\n" +
                             "3,text,0.1,abc," + Values(0.5f, 34) + "\n" +
                             "4,nan," + Values(0.5f, 35) + ",nan\n" +
                             "5,\"quoted, name\"," + Values(0.25f) + "\r\n" +
                             "6,huge,1e300," + Values(0.5f, 35) + "\n";
    const nxcolor::SpectraTable table = ParseSpectraCsv(text, "bad.csv");
    ASSERT_EQ(table.rows.size(), 2u);
    EXPECT_EQ(table.rows[0].id, "1 good");
    EXPECT_EQ(table.rows[1].id, "5 quoted, name");
    EXPECT_EQ(table.rows[1].values[35], 0.25f) << "CR of CR LF removed";
    ASSERT_EQ(table.errors.size(), 4u);
    EXPECT_EQ(table.errors[0], "bad.csv:3: 32 fields, expected 38");
    EXPECT_EQ(table.errors[1], "bad.csv:4: field 4 (390 nm): \"abc\" is not a number");
    EXPECT_EQ(table.errors[2], "bad.csv:5: field 38 (730 nm): \"nan\" is not a number");
    EXPECT_EQ(table.errors[3], "bad.csv:7: field 3 (380 nm): \"1e300\" is out of range");
    EXPECT_FALSE(table.unusable);
}

TEST(NxcolorCsv, RejectsAnyOtherWavelengthGrid) {
    for (const auto& header : {Header(380, 780), Header(400, 700), Header(390, 740),
                               std::string("id,SPEC_380,SPEC_385")}) {
        const nxcolor::SpectraTable table =
            ParseSpectraCsv("# comment\n" + header + "\n1,x," + Values(0.5f) + "\n", "grid.csv");
        EXPECT_TRUE(table.unusable) << header;
        EXPECT_TRUE(table.rows.empty());
        ASSERT_EQ(table.errors.size(), 1u);
        EXPECT_EQ(table.errors[0].rfind("grid.csv:2: spectral columns", 0), 0u) << table.errors[0];
    }
    // Other spellings of the right grid are fine.
    std::string cgats = "SAMPLE_ID";
    for (int nm = 380; nm <= 730; nm += 10) cgats += ",SPECTRAL_NM" + std::to_string(nm);
    const auto table = ParseSpectraCsv("\xEF\xBB\xBF" + cgats + "\nA1," + Values(0.5f) + "\n", "s");
    EXPECT_FALSE(table.unusable);
    ASSERT_EQ(table.rows.size(), 1u);
    EXPECT_EQ(table.rows[0].id, "A1");
}

TEST(NxcolorCsv, WithoutHeaderTakesTheLast36FieldsAsValues) {
    const auto table = ParseSpectraCsv(Values(0.5f) + "\n" + "7," + Values(0.1f) + "\n" +
                                           "0.1,0.2,0.3," + Values(0.2f, 33) + ",oops\n",
                                       "plain");
    ASSERT_EQ(table.rows.size(), 2u);
    EXPECT_EQ(table.rows[0].id, "1") << "numbered when there is no id";
    EXPECT_EQ(table.rows[1].id, "7");
    ASSERT_EQ(table.errors.size(), 1u) << "a bad last value is a bad row, not a header";
    const auto percent = ParseSpectraCsv(Values(50.0f), "p", 100.0f);
    ASSERT_EQ(percent.rows.size(), 1u);
    EXPECT_FLOAT_EQ(percent.rows[0].values[7], 0.5f);
}

TEST(NxcolorCsv, SurvivesArbitraryBytes) {
    std::mt19937 random(3);
    std::uniform_int_distribution<int> byte(0, 255);
    const std::string seed = Header() + "\n1,a," + Values(0.5f) + "\n";
    for (int round = 0; round < 300; ++round) {
        std::string text = seed;
        for (int k = 0; k < 20; ++k) text[random() % text.size()] = static_cast<char>(byte(random));
        if (round % 3 == 0) text = std::string(random() % 5000, static_cast<char>(byte(random)));
        const auto table = ParseSpectraCsv(text, "junk");
        EXPECT_LE(table.rows.size(), 1u + text.size() / 36);
    }
    const auto longLine = ParseSpectraCsv(std::string(nxcolor::kMaxLineLength + 1, '1'), "long");
    ASSERT_EQ(longLine.errors.size(), 1u);
}

// A CGATS.17 file as measurement software writes it, with `sets` data lines.
std::string Cgats(const std::vector<std::string>& sets, int first = 380, int last = 730) {
    std::string text = "CGATS.17\nORIGINATOR \"test\"\nNUMBER_OF_FIELDS " +
                       std::to_string(2 + (last - first) / 10 + 1) +
                       "\nBEGIN_DATA_FORMAT\nSAMPLE_ID SAMPLE_NAME";
    for (int nm = first; nm <= last; nm += 10) text += " SPECTRAL_NM" + std::to_string(nm);
    text += "\nEND_DATA_FORMAT\nNUMBER_OF_SETS " + std::to_string(sets.size()) + "\nBEGIN_DATA\n";
    for (const std::string& set : sets) text += set + "\n";
    return text + "END_DATA\n";
}

std::string SpaceValues(float v, int count = 36) {
    std::string text = Values(v, count);
    std::replace(text.begin(), text.end(), ',', ' ');
    return text;
}

TEST(NxcolorCgats, ReadsSpectralFieldsThroughLittleCms) {
    const std::string text = Cgats({"A1 \"paper white\" " + SpaceValues(0.9f),
                                    "A2 \"bad\" 0.5 abc " + SpaceValues(0.5f, 34),
                                    "A3 \"grey\" " + SpaceValues(0.2f)});
    ASSERT_TRUE(nxcolor::LooksLikeCgats(text));
    const nxcolor::SpectraTable table = nxcolor::ParseSpectra(text, "m.cgats");
    ASSERT_EQ(table.rows.size(), 2u);
    EXPECT_EQ(table.rows[0].id, "A1 paper white");
    EXPECT_EQ(table.rows[0].values[35], 0.9f);
    EXPECT_EQ(table.rows[1].id, "A3 grey");
    EXPECT_EQ(table.rows[1].line, 11);
    ASSERT_EQ(table.errors.size(), 1u);
    EXPECT_EQ(table.errors[0], "m.cgats:10: SPECTRAL_NM390: \"abc\" is not a number");

    const auto grid = nxcolor::ParseSpectra(Cgats({"A1 x " + SpaceValues(0.5f, 41)}, 380, 780), "g");
    EXPECT_TRUE(grid.unusable);
    ASSERT_EQ(grid.errors.size(), 1u);
    EXPECT_EQ(grid.errors[0].rfind("g: spectral fields 380..780 nm (41 fields)", 0), 0u) << grid.errors[0];

    const auto broken = nxcolor::ParseSpectra("CGATS.17\nBEGIN_DATA_FORMAT\nKEYWORD\n", "b");
    EXPECT_TRUE(broken.unusable);
    ASSERT_EQ(broken.errors.size(), 1u);
    EXPECT_EQ(broken.errors[0].rfind("b:", 0), 0u) << broken.errors[0];
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
    std::ofstream(grid) << Header(380, 780) << "\n1,x," << Values(0.5f, 41) << "\n";
    EXPECT_EQ(RunNxcolor(grid, &out, &err), 2);
    EXPECT_NE(err.find("380..780 nm (41 columns)"), std::string::npos) << err;
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
