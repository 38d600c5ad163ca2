// nxcolor: its CSV reader, its report, and the program on good and bad files.
#include <gtest/gtest.h>
#include <lcms2.h>

#include <algorithm>
#include <cstdlib>
#include <filesystem>
#include <fstream>
#include <sstream>
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
    ASSERT_TRUE(nxcolor::ReadSpectralFile(nxtest::ChartPath(), {}, &file, &error)) << error;
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
    EXPECT_EQ(text.substr(0, text.find('\n')), "id,name,X,Y,Z,L*,a*,b*,C*,h,L99,a99,b99");
    EXPECT_THAT(text, HasSubstr("\n1,dark skin,11.805,10.328,5.166,38.424,13.688,14.422,"))
        << text.substr(0, 200);
    std::ostringstream aligned;
    nxcolor::Writers().at("table")(report, aligned);
    EXPECT_EQ(aligned.str().rfind("# chart: 24 spectra, illuminant D50, observer 2", 0), 0u);
    // CGATS output parses with LittleCMS: the reader gets past the syntax and
    // finds the data format (colour fields, no spectral ones).
    std::ostringstream cgats;
    nxcolor::Writers().at("cgats")(report, cgats);
    EXPECT_THAT(
        cgats.str(),
        HasSubstr("SAMPLE_ID SAMPLE_NAME XYZ_X XYZ_Y XYZ_Z LAB_L LAB_A LAB_B LAB_C LAB_H DIN99_L"));
    const auto back = nxcolor::ParseSpectra(cgats.str(), "out.cgats");
    ASSERT_EQ(back.errors.size(), 1u);
    EXPECT_EQ(back.errors[0].rfind("out.cgats: spectral fields missing", 0), 0u) << back.errors[0];
    EXPECT_EQ(nxcolor::FormatNumber(-0.00001f, 2), "0.00");
    // Names with double quotes come back as they were written.
    nxcolor::Report quoted = report;
    quoted.keepSpectra = true;
    quoted.rows[0].sampleName = "12\" \"tile\"";
    std::ostringstream withSpectra;
    nxcolor::Writers().at("cgats")(quoted, withSpectra);
    const auto names = nxcolor::ParseSpectra(withSpectra.str(), "q.cgats");
    ASSERT_EQ(names.rows.size(), 24u)
        << (names.errors.empty() ? withSpectra.str().substr(0, 2000) : names.errors[0]);
    EXPECT_EQ(names.rows[0].sampleName, "12\" \"tile\"");
    // A spectrum that reached the report without the reader's checks and
    // gives infinite XYZ is left out with its line.
    nxcolor::SpectraTable wild = table;
    wild.rows[1].values.fill(3e38f);
    wild.rows[1].line = 7;
    const nxcolor::Report checked = nxcolor::Evaluate(wild, "w.csv", condition, {"xyz", "xyy"}, 3);
    EXPECT_EQ(checked.rows.size(), 23u);
    ASSERT_EQ(checked.errors.size(), 1u);
    EXPECT_EQ(checked.errors[0], "w.csv:7: X is inf; the spectrum is left out");
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
    EXPECT_THAT(err, HasSubstr(bad + ":3: 3 fields, expected 38")) << err;
    EXPECT_THAT(out, HasSubstr("1 ok")) << "the good row is still printed";

    EXPECT_EQ(RunNxcolor(dir.File("missing.csv"), &out, &err), 2);
    EXPECT_THAT(err, HasSubstr("missing.csv: cannot open the file")) << err;
    EXPECT_EQ(RunNxcolor(dir.path().string(), &out, &err), 2);
    EXPECT_THAT(err, HasSubstr("is a directory")) << err;

    const std::string grid = dir.File("grid.csv");
    std::ofstream(grid) << "id,r400,r390\n1,0.5,0.5\n";
    EXPECT_EQ(RunNxcolor(grid, &out, &err), 2);
    EXPECT_THAT(err, HasSubstr("grid.csv:1: fewer than 3 spectral columns")) << err;
    EXPECT_TRUE(out.empty());

    EXPECT_EQ(RunNxcolor("--illuminant D42", &out, &err), 2);
    EXPECT_THAT(err, HasSubstr("unknown illuminant \"D42\"")) << err;
    EXPECT_EQ(RunNxcolor("--observer 7", &out, &err), 2);
    EXPECT_EQ(RunNxcolor("--precision x", &out, &err), 2);
}

TEST(NxcolorProgram, PrintsTheBuiltInChartUnderAChosenCondition) {
    std::string out;
    std::string err;
    ASSERT_EQ(RunNxcolor("--illuminant D65 --observer 10 --format csv --din99", &out, &err), 0)
        << err;
    EXPECT_EQ(out.substr(0, out.find('\n')), "id,name,X,Y,Z,L*,a*,b*,C*,h,L99,a99,b99");
    EXPECT_EQ(std::count(out.begin(), out.end(), '\n'), 25);
    // Densities of a flat 10% reflector are 1 in every channel.
    nxtest::TempDir dir;
    const std::string grey = dir.File("grey.csv");
    std::ofstream(grey) << "grey," << Values(0.1f) << "\n";
    ASSERT_EQ(RunNxcolor(grey + " --density 'Status T' -p 3 -f csv", &out, &err), 0) << err;
    EXPECT_THAT(out, HasSubstr(",D_RED,D_GREEN,D_BLUE\ngrey,")) << out;
    EXPECT_THAT(out, HasSubstr(",1.000,1.000,1.000\n")) << out;
    EXPECT_EQ(RunNxcolor("--density 'Status Q'", &out, &err), 2);
    ASSERT_EQ(RunNxcolor("--help", &out, &err), 0);
    EXPECT_THAT(out, HasSubstr("Usage: nxcolor"));
    ASSERT_EQ(RunNxcolor("--format=csv -p 2", &out, &err), 0);
    EXPECT_THAT(out, HasSubstr("\n1,dark skin,11.81,10.33,5.17,38.42,13.69,14.42,19.88,46.50\n"))
        << out.substr(0, 200);
}

TEST(NxcolorProgram, RejectsRowsThatGiveNoFiniteColourAndBoundsItsInput) {
    nxtest::TempDir dir;
    const std::string rows = dir.File("rows.csv");
    std::ofstream(rows) << Header() << "\n1,huge," << Values(1e30f) << "\n2,black," << Values(0.0f)
                        << "\n3,tiny," << Values(0.5f, 35) << ",1e-45"
                        << "\n4,ok," << Values(0.5f) << "\n";
    std::string out;
    std::string err;
    EXPECT_EQ(RunNxcolor(rows + " --fraction --xyy -f csv", &out, &err), 1);
    EXPECT_THAT(err, HasSubstr(rows + ":2: value")) << err;
    EXPECT_THAT(err, HasSubstr(rows + ":3: every value is zero")) << err;
    EXPECT_THAT(out, Not(HasSubstr("inf"))) << out;
    EXPECT_THAT(out, Not(HasSubstr("nan"))) << out;
    EXPECT_THAT(out, HasSubstr("\n4,ok,")) << out;

    // An installed illuminant of absurd power is normalised like any other:
    // finite colours, no inf or nan.
    const std::string data = dir.File("data");
    std::filesystem::create_directories(data + "/illuminants");
    {
        std::ofstream table(data + "/illuminants/HOT.csv");
        table << "wavelength,value\n";
        for (int nm = 300; nm <= 830; nm += 5) table << nm << ",3e38\n";
    }
    EXPECT_EQ(RunNxcolor("NXBASE_DATA_DIR=" + data + " -f csv", &out, &err), 2)
        << "an option is not a file";
    const std::string program = std::string("NXBASE_DATA_DIR=") + data + " " + NXCOLOR_PATH;
    const std::string command =
        program + " -i HOT -f csv >" + dir.File("o") + " 2>" + dir.File("e");
    const int status = std::system(command.c_str());
    EXPECT_EQ(WEXITSTATUS(status), 0) << nxtest::ReadFile(dir.File("e"));
    EXPECT_THAT(nxtest::ReadFile(dir.File("o")), Not(HasSubstr("inf")));
    EXPECT_THAT(nxtest::ReadFile(dir.File("o")), Not(HasSubstr("nan")));
    EXPECT_EQ(std::system((program + " --list-illuminants | grep -qx 'HOT (installed)'").c_str()),
              0);
    // The same table named by its path.
    std::string byPath;
    EXPECT_EQ(RunNxcolor("-i " + data + "/illuminants/HOT.csv -f csv", &byPath, &err), 0) << err;
    EXPECT_EQ(byPath, nxtest::ReadFile(dir.File("o")));

    // Binary and endless input end in a clear error, not in exhausted memory.
    EXPECT_EQ(RunNxcolor("/dev/zero", &out, &err), 2);
    EXPECT_THAT(err, HasSubstr("binary data")) << err;
    EXPECT_EQ(RunNxcolor("--icc-profile " + dir.File("missing.icc") + " --rgb", &out, &err), 2);
    EXPECT_EQ(RunNxcolor("--icc-profile " + dir.File("missing.icc"), &out, &err), 2);
    EXPECT_EQ(RunNxcolor("-i D42", &out, &err), 2);
    EXPECT_EQ(err.find("D42"), err.rfind("D42")) << "the reason once: " << err;
}

TEST(NxcolorProgram, ReadsOtherGridsScalesAndNames) {
    std::string out;
    std::string err;
    const std::string five =
        std::string(NXBASE_TEST_DATA_DIR) + "/spectra/colorchecker_5nm_percent.csv";
    ASSERT_EQ(RunNxcolor(five + " -f csv -p 2 -i d50 -v", &out, &err), 0) << err;
    // A 5 nm file: colour summed at 5 nm (the 10 nm path gives 11.81,10.33,
    // 5.17,38.42,13.69,... for the same patch).
    EXPECT_THAT(out, HasSubstr("\n1,dark skin,11.80,10.33,5.17,38.43,13.66,14.43,19.87,46.57\n"))
        << out;
    EXPECT_THAT(
        err, HasSubstr("71 wavelengths 380..730 nm, as read, percent; colour summed at the file's "
                       "own interval"))
        << err;
    std::string f2, fl2;
    ASSERT_EQ(RunNxcolor("-i f2 -f csv", &f2, &err), 0) << err;
    ASSERT_EQ(RunNxcolor("-i FL2 -f csv", &fl2, &err), 0) << err;
    EXPECT_EQ(f2, fl2);
    ASSERT_EQ(RunNxcolor("--version", &out, &err), 0);
    EXPECT_EQ(out.rfind("nxcolor (NxBase) ", 0), 0u);
}

TEST(NxcolorProgram, CgatsOutputReadsBackWithItsSpectraAndIds) {
    nxtest::TempDir dir;
    const std::string written = dir.File("chart.ti3");
    std::string out;
    std::string err;
    ASSERT_EQ(
        RunNxcolor("-f cgats --keep-spectra -d 'Status T' -i D65 > " + written + "; cat " + written,
                   &out, &err),
        0)
        << err;
    EXPECT_THAT(out, HasSubstr("\nCREATED \""));
    EXPECT_THAT(out, HasSubstr("\nWEIGHTING_FUNCTION \"ILLUMINANT, D65\"\n"));
    EXPECT_THAT(out, HasSubstr("\nDENSITY_STANDARD \"Status T\"\n"));
    // LittleCMS reads it: ids and names apart, spectra to 6 decimals.
    cmsHANDLE it8 = cmsIT8LoadFromFile(nullptr, written.c_str());
    ASSERT_NE(it8, nullptr);
    EXPECT_EQ(cmsIT8GetPropertyDbl(it8, "NUMBER_OF_SETS"), 24.0);
    EXPECT_STREQ(cmsIT8GetData(it8, "1", "SAMPLE_NAME"), "dark skin");
    EXPECT_EQ(cmsIT8GetDataDbl(it8, "1", "SPEC_380"), 0.055);
    EXPECT_EQ(cmsIT8GetDataDbl(it8, "24", "SPEC_730"), 0.033);
    cmsIT8Free(it8);
    // And the library's reader gives the same spectra and ids back.
    nxbase::SpectraTable back;
    std::string error;
    ASSERT_TRUE(nxbase::ReadSpectralFile(written, {}, &back, &error)) << error;
    const auto chart = ParseSpectraCsv(nxcolor::EmbeddedChart(), "chart");
    ASSERT_EQ(back.rows.size(), 24u);
    for (std::size_t i = 0; i < 24; ++i) {
        EXPECT_EQ(back.rows[i].id, chart.rows[i].id);
        EXPECT_EQ(back.rows[i].values, chart.rows[i].values) << i;
    }

    // -f ti3: an ArgyllCMS measurement file. The real spec2cie reads it and
    // computes the same XYZ from its spectra; the library reads it back.
    const std::string ti3 = dir.File("argyll.ti3");
    ASSERT_EQ(RunNxcolor("-f ti3 -i D65 > " + ti3 + "; cat " + ti3, &out, &err), 0) << err;
    ASSERT_TRUE(ReadSpectralFile(ti3, {}, &back, &error)) << error;
    ASSERT_EQ(back.rows.size(), 24u);
    EXPECT_TRUE(back.scaleNote.empty()) << "a CTI3 file states its scale";
    for (std::size_t i = 0; i < 24; ++i) {
        for (int k = 0; k < 36; ++k)
            EXPECT_NEAR(back.rows[i].values[k], chart.rows[i].values[k], nxtest::kFloatNearOne)
                << i;
    }
    if (std::system("command -v spec2cie >/dev/null 2>&1") != 0) {
        GTEST_SKIP() << "ArgyllCMS (package argyll) is not installed: spec2cie not run";
    }
    const std::string converted = dir.File("spec2cie.ti3");
    ASSERT_EQ(
        std::system(("spec2cie -i D65 " + ti3 + " " + converted + " >/dev/null 2>&1").c_str()), 0);
    cmsHANDLE ours = cmsIT8LoadFromFile(nullptr, ti3.c_str());
    cmsHANDLE theirs = cmsIT8LoadFromFile(nullptr, converted.c_str());
    ASSERT_NE(ours, nullptr);
    ASSERT_NE(theirs, nullptr);
    ASSERT_EQ(cmsIT8GetPropertyDbl(theirs, "NUMBER_OF_SETS"), 24.0);
    for (int set = 0; set < 24; ++set) {
        for (const char* field : {"XYZ_X", "XYZ_Y", "XYZ_Z"}) {
            const int ourColumn = cmsIT8FindDataFormat(ours, field);
            const int theirColumn = cmsIT8FindDataFormat(theirs, field);
            // ASTM E308 10 nm tables here, ArgyllCMS's own integration there.
            EXPECT_NEAR(cmsIT8GetDataRowColDbl(theirs, set, theirColumn),
                        cmsIT8GetDataRowColDbl(ours, set, ourColumn), nxtest::kOtherIntegration)
                << set << " " << field;
        }
    }
    cmsIT8Free(ours);
    cmsIT8Free(theirs);
}

TEST(NxcolorProgram, ComparesSamplesWithTheirReferences) {
    nxtest::TempDir dir;
    const std::string reference = dir.File("ref.csv");
    const std::string sample = dir.File("sample.csv");
    std::ofstream(reference) << Header() << "\nA,paper," << Values(0.9f) << "\nB,grey,"
                             << Values(0.5f) << "\n";
    // In another order, one sample darker, and one without a reference.
    std::ofstream(sample) << Header() << "\nB,grey," << Values(0.45f) << "\nA,paper,"
                          << Values(0.9f) << "\nC,x," << Values(0.2f) << "\n";
    std::string out;
    std::string err;
    EXPECT_EQ(RunNxcolor("--compare " + reference + " " + sample + " -f csv", &out, &err), 1);
    EXPECT_THAT(out, HasSubstr("id,dL*,dC*,dH*,dE00\nB grey,-3.")) << out;
    EXPECT_THAT(out, HasSubstr("\nA paper,0.00,0.00,0.00,0.00\n")) << out;
    EXPECT_THAT(err, HasSubstr("sample \"C x\" has no reference")) << err;
    EXPECT_THAT(err, HasSubstr("# 2 pairs: mean dE00 ")) << err;
    EXPECT_EQ(RunNxcolor("--compare " + reference + " " + sample + " --tolerance 1", &out, &err),
              3);
    EXPECT_THAT(out, HasSubstr("# worst: B grey (")) << out;
    EXPECT_THAT(out, HasSubstr("# 1 of 2 pairs above the tolerance 1.00")) << out;
    EXPECT_EQ(
        RunNxcolor("--compare " + reference + " " + sample + " --tolerance 5 --de ab", &out, &err),
        1);
    // By order: A against B and B against A.
    EXPECT_EQ(RunNxcolor("--compare " + reference + " " + sample + " --by-order --de cmc -f csv",
                         &out, &err),
              1);
    EXPECT_THAT(out, HasSubstr("id,dL*,dC*,dH*,dE CMC(2:1)\nB grey,-")) << out;
    EXPECT_EQ(RunNxcolor("--compare " + reference, &out, &err), 2);
    EXPECT_EQ(RunNxcolor("--compare --de 77 " + reference + " " + sample, &out, &err), 2);

    // No sample with a reference is a usage error, and the unmatched ids are
    // listed within a bound.
    const std::string strangers = dir.File("strangers.csv");
    {
        std::ofstream file(strangers);
        file << Header();
        for (int i = 0; i < 1000; ++i) file << "\nS" << i << ",x," << Values(0.3f);
        file << "\n";
    }
    EXPECT_EQ(RunNxcolor("--compare " + reference + " " + strangers, &out, &err), 2);
    EXPECT_THAT(err, HasSubstr("no sample of " + strangers + " has a reference")) << err;
    EXPECT_THAT(err, HasSubstr("... and 990 more")) << err;
    EXPECT_LT(std::count(err.begin(), err.end(), '\n'), 20) << err;
    EXPECT_THAT(out, Not(HasSubstr("pairs"))) << out;
}

}  // namespace
