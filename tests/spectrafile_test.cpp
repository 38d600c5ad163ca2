// Spectral files of any grid, their scale, and resampling onto 380..730/10 nm.
#include "nxbase/spectrafile.h"

#include <gtest/gtest.h>

#include <cmath>
#include <fstream>
#include <random>
#include <sstream>
#include <string>

#include "color_test_util.h"
#include "nxbase/colorbatch.h"
#include "nxbase/colordiff.h"
#include "nxbase/meascond.h"
#include "nxbase/resample.h"
#include "test_util.h"

namespace {

using nxbase::SpectralReadOptions;
using nxbase::SpectralScale;
using nxbase::SpectraTable;

std::string Values(double v, int count = 36, char separator = ',') {
    std::ostringstream text;
    for (int i = 0; i < count; ++i) text << (i ? std::string(1, separator) : "") << v;
    return text.str();
}

std::string Header(int first = 380, int last = 730, int step = 10, const char* prefix = "r") {
    std::string text = "patch_index,patch_name";
    for (int nm = first; nm <= last; nm += step)
        text += "," + std::string(prefix) + std::to_string(nm);
    return text;
}

SpectraTable Chart() {
    SpectraTable table;
    std::string error;
    EXPECT_TRUE(nxbase::ReadSpectralFile(nxtest::ChartPath(), {}, &table, &error)) << error;
    return table;
}

// The table holds exactly one error, and it says `expected`.
void ExpectOnlyError(const SpectraTable& table, const std::string& expected) {
    ASSERT_EQ(table.errors.size(), 1u) << expected;
    EXPECT_THAT(table.errors[0], HasSubstr(expected)) << table.errors[0];
}

TEST(SpectraFile, ReadsCsvRowsAndReportsBadOnesWithTheirLine) {
    const SpectraTable chart = Chart();
    ASSERT_EQ(chart.rows.size(), 24u);
    EXPECT_EQ(chart.rows[0].id, "1 dark skin");
    EXPECT_EQ(chart.rows[0].sampleId, "1");
    EXPECT_EQ(chart.rows[0].sampleName, "dark skin");
    EXPECT_EQ(chart.rows[0].values[0], 0.055f);
    EXPECT_EQ(chart.rows[0].values[35], 0.209f);
    EXPECT_EQ(chart.resampling, "as read");
    EXPECT_FALSE(chart.percent);

    const std::string text = Header() + "\n" + "1,good," + Values(0.5) + "\n" + "2,short," +
                             Values(0.5, 30) + "\n" + "3,text,0.1,abc," + Values(0.5, 34) + "\n" +
                             "4,nan," + Values(0.5, 35) + ",nan\n" + "5,\"quoted, name\"," +
                             Values(0.25) + "\r\n" + "6,huge,1e300," + Values(0.5, 35) + "\n" +
                             "7,wild,900," + Values(0.5, 35) + "\n" + "8,black," + Values(0.0) +
                             "\n" + "9,signs,+-0.5," + Values(0.5, 35) + "\n";
    const SpectraTable table = nxbase::ParseSpectraCsv(text, "bad.csv", {SpectralScale::kFraction});
    ASSERT_EQ(table.rows.size(), 2u);
    EXPECT_EQ(table.rows[1].id, "5 quoted, name");
    EXPECT_EQ(table.rows[1].values[35], 0.25f) << "CR of CR LF removed";
    ASSERT_EQ(table.errors.size(), 7u);
    EXPECT_EQ(table.errors[0], "bad.csv:3: 32 fields, expected 38");
    EXPECT_EQ(table.errors[1], "bad.csv:4: field 4 (390 nm): \"abc\" is not a number");
    EXPECT_EQ(table.errors[2], "bad.csv:5: field 38 (730 nm): \"nan\" is not a number");
    EXPECT_EQ(table.errors[3], "bad.csv:7: field 3 (380 nm): \"1e300\" is out of range");
    EXPECT_EQ(table.errors[4], "bad.csv:10: field 3 (380 nm): \"+-0.5\" is not a number");
    EXPECT_EQ(table.errors[5].rfind("bad.csv:8: value 900", 0), 0u) << table.errors[5];
    EXPECT_EQ(table.errors[6], "bad.csv:9: every value is zero");
}

TEST(SpectraFile, TakesAnyIncreasingGridAndNumericHeaders) {
    // 380..780 holds the 10 nm points: they are selected, bit for bit.
    std::string wide = Header(380, 780) + "\n1,x,";
    for (int i = 0; i <= 40; ++i) wide += (i ? "," : "") + std::to_string(0.01 * (i + 1));
    const SpectraTable table = nxbase::ParseSpectraCsv(wide + "\n", "wide.csv");
    ASSERT_TRUE(table.errors.empty()) << table.errors[0];
    ASSERT_EQ(table.rows.size(), 1u);
    EXPECT_EQ(table.resampling, "as read");
    EXPECT_EQ(table.rows[0].values[0], 0.01f);
    EXPECT_EQ(table.rows[0].values[35], static_cast<float>(0.36));

    // 400..700: the ends are held.
    std::string narrow = "id,400nm";
    for (int nm = 410; nm <= 700; nm += 10) narrow += "," + std::to_string(nm) + "nm";
    narrow += "\nA," + Values(0.3, 30) + ",0.6\n";
    const SpectraTable held = nxbase::ParseSpectraCsv(narrow, "narrow.csv");
    ASSERT_EQ(held.rows.size(), 1u) << (held.errors.empty() ? "" : held.errors[0]);
    EXPECT_EQ(held.rows[0].values[0], 0.3f);
    EXPECT_EQ(held.rows[0].values[1], 0.3f);
    EXPECT_EQ(held.rows[0].values[32], 0.6f);
    EXPECT_EQ(held.rows[0].values[35], 0.6f);

    // The header "380,390,...,730" that a spreadsheet writes is a header, not
    // a spectrum; with or without id columns.
    std::string numeric = "380";
    for (int nm = 390; nm <= 730; nm += 10) numeric += "," + std::to_string(nm);
    for (const std::string& header : {numeric, "name," + numeric}) {
        const std::string row = header[0] == 'n' ? "grey," + Values(0.2) : Values(0.2);
        const SpectraTable t = nxbase::ParseSpectraCsv(header + "\n" + row + "\n", "n.csv");
        EXPECT_TRUE(t.errors.empty()) << header;
        ASSERT_EQ(t.rows.size(), 1u) << header;
        EXPECT_EQ(t.rows[0].line, 2);
    }

    // European spreadsheets: ";" between fields, decimal commas, "380 nm"
    // headers, a name holding a comma; TAB-separated files alike. Headerless
    // ones too: decimal commas must not make the first row look like text.
    std::string european = "Probe;Name";
    for (int nm = 380; nm <= 730; nm += 10) european += ";" + std::to_string(nm) + " nm";
    std::string commaValues;
    for (int i = 0; i < 36; ++i) commaValues += (i ? ";" : "") + std::string("0,4512");
    european += "\nA1;\"Gr\u00fcn, hell\";" + commaValues + "\n";
    std::string tabbed = european;
    for (char& c : tabbed) c = c == ';' ? '\t' : c;
    for (const std::string& text : {european, tabbed, "A1;\"x, hell\";" + commaValues + "\n"}) {
        const SpectraTable t = nxbase::ParseSpectraCsv(text, "eu.csv");
        ASSERT_TRUE(t.errors.empty()) << t.errors[0];
        ASSERT_EQ(t.rows.size(), 1u);
        EXPECT_EQ(t.rows[0].values[7], 0.4512f);
        EXPECT_THAT(t.rows[0].id, HasSubstr(", hell")) << t.rows[0].id;
        ASSERT_FALSE(t.notes.empty());
        EXPECT_THAT(t.notes[0], HasSubstr("eu.csv: CSV with fields separated by")) << t.notes[0];
    }

    for (const std::string& bad :
         {std::string("id,r400,r390,r410"), std::string("id,r380,r380,r390"),
          std::string("id,SPEC_380,SPEC_385"), std::string("a,b,c")}) {
        const SpectraTable t =
            nxbase::ParseSpectraCsv("# c\n" + bad + "\n1," + Values(0.5, 3) + "\n", "g.csv");
        EXPECT_TRUE(t.unusable) << bad;
        EXPECT_TRUE(t.rows.empty()) << bad;
        ASSERT_EQ(t.errors.size(), 1u) << bad;
        EXPECT_EQ(t.errors[0].rfind("g.csv:2: ", 0), 0u) << t.errors[0];
    }
}

TEST(SpectraFile, LargeGridFilesAgreeWithTheTenNanometreChart) {
    const SpectraTable chart = Chart();
    for (const char* name : {"colorchecker_5nm_percent.csv", "colorchecker_1nm.csv"}) {
        SpectraTable table;
        std::string error;
        const std::string path = std::string(NXBASE_TEST_DATA_DIR) + "/spectra/" + name;
        ASSERT_TRUE(nxbase::ReadSpectralFile(path, {}, &table, &error)) << error;
        ASSERT_TRUE(table.errors.empty()) << table.errors[0];
        ASSERT_EQ(table.rows.size(), 24u) << name;
        EXPECT_EQ(table.percent, std::string(name).find("percent") != std::string::npos) << name;
        EXPECT_EQ(table.resampling, "as read");
        for (std::size_t i = 0; i < 24; ++i) {
            EXPECT_EQ(table.rows[i].id, chart.rows[i].id);
            for (int k = 0; k < 36; ++k) {
                // Written with 2 decimals of percent or 5 of a fraction.
                EXPECT_NEAR(table.rows[i].values[k], chart.rows[i].values[k], nxtest::kFileDecimals)
                    << name << " " << i << " " << k;
            }
        }
    }
}

TEST(SpectraFile, ChoosesTheScaleFromTheFileOrTheValues) {
    const std::string percent = Header() + "\n1,p," + Values(50.0) + "\n";
    const SpectraTable detected = nxbase::ParseSpectraCsv(percent, "p.csv");
    ASSERT_EQ(detected.rows.size(), 1u);
    EXPECT_TRUE(detected.percent);
    EXPECT_EQ(detected.rows[0].values[3], 0.5f);
    EXPECT_THAT(detected.scaleNote, HasSubstr("p.csv: read as percentages: 1 of 1 spectra"))
        << detected.scaleNote;

    // The whole file decides, never a vote among rows: a typo (50 for 0.50)
    // among reflectance factors and a white beside dark patches in percent
    // look alike, so spectra that disagree refuse the file, naming both sides.
    std::string typo = Header();
    for (int i = 1; i <= 7; ++i) typo += "\n" + std::to_string(i) + ",f," + Values(0.5);
    typo += "\n8,typo,50," + Values(0.5, 35) + "\n";
    const SpectraTable mixed = nxbase::ParseSpectraCsv(typo, "t.csv");
    EXPECT_TRUE(mixed.unusable);
    EXPECT_TRUE(mixed.rows.empty());
    ExpectOnlyError(mixed,
                    "t.csv: the scale is unclear: line 9 fits only percentages (values up to "
                    "50.00), lines 2, 3, 4, 5, 6 and 2 more read as reflectance factors (or as "
                    "dark patches in percent); --percent or --fraction says which");
    // With the scale given, the rows that do not fit it are refused at their line.
    const SpectraTable fractionTold =
        nxbase::ParseSpectraCsv(typo, "t.csv", {SpectralScale::kFraction});
    EXPECT_EQ(fractionTold.rows.size(), 7u);
    ExpectOnlyError(fractionTold, "t.csv:9: value 50.000000 is not a reflectance factor");
    // Rows beyond both scales take no part: rows of 1e4 do not outvote the
    // single percent row.
    const SpectraTable beyond = nxbase::ParseSpectraCsv(
        Header() + "\n1,p," + Values(40.0) + "\n2,x," + Values(1e4) + "\n3,y," + Values(1e4) + "\n",
        "b.csv");
    EXPECT_TRUE(beyond.percent);
    EXPECT_EQ(beyond.rows.size(), 1u);
    // Only such rows: each refused, and no scale note claims a choice.
    const SpectraTable none =
        nxbase::ParseSpectraCsv(Header() + "\n2,x," + Values(1e4) + "\n", "n.csv");
    EXPECT_TRUE(none.rows.empty() && none.scaleNote.empty());
    ExpectOnlyError(none, "n.csv:2: value 10000.000000 is not a reflectance factor");
    // Dark patches in percent beside a brighter one: 1.18 everywhere is
    // brighter than any reflectance as a factor, so only percent explains
    // it; 0.9 fits both: refused, not Y 118.
    std::string dark = Header() + "\n1,d," + Values(1.18) + "\n2,e," + Values(0.9) + "\n";
    const SpectraTable guessed = nxbase::ParseSpectraCsv(dark, "d.csv");
    ExpectOnlyError(guessed, "d.csv: the scale is unclear: line 2 fits only percentages");
    const SpectraTable allDark =
        nxbase::ParseSpectraCsv(Header() + "\n2,e," + Values(0.9) + "\n", "a.csv");
    EXPECT_THAT(
        allDark.scaleNote,
        HasSubstr("read as reflectance factors (white = 1): no value is above 1.5 and the file "
                  "does not give its scale; if it holds dark patches in percent, --percent"))
        << allDark.scaleNote;
    const SpectraTable told = nxbase::ParseSpectraCsv(dark, "d.csv", {SpectralScale::kPercent});
    EXPECT_EQ(told.rows.size(), 2u);
    EXPECT_TRUE(told.scaleNote.empty());
    // Forced fraction: 50 is not a reflectance factor.
    const SpectraTable forced =
        nxbase::ParseSpectraCsv(percent, "p.csv", {SpectralScale::kFraction});
    EXPECT_TRUE(forced.rows.empty());
    ASSERT_EQ(forced.errors.size(), 1u);
    EXPECT_THAT(forced.errors[0], HasSubstr("p.csv:2: value 50")) << forced.errors[0];
    // Readers for other users name the choices their way.
    SpectralReadOptions keyword;
    keyword.percentChoice = "scale=\"percent\"";
    keyword.fractionChoice = "scale=\"fraction\"";
    EXPECT_THAT(nxbase::ParseSpectraCsv(dark, "d.csv", keyword).errors.at(0),
                HasSubstr("scale=\"percent\" or scale=\"fraction\" says which"));
    // A fraction file stays as it is: 1.25 in the blue is a fluorescent
    // paper's brightener, not percent, and its Y stays below the limit.
    const std::string paper = Values(1.25, 11) + "," + Values(0.92, 25);
    const SpectraTable fraction =
        nxbase::ParseSpectraCsv(Header() + "\n1,f," + paper + "\n", "f.csv");
    ASSERT_EQ(fraction.rows.size(), 1u);
    EXPECT_FALSE(fraction.percent);
    EXPECT_EQ(fraction.rows[0].values[0], 1.25f);

    // CGATS: SPECTRAL_NORM, and ArgyllCMS's CTI3 convention of percent even
    // for a dark set whose values stay below 1.5.
    auto cgats = [](const std::string& identifier, const std::string& extra, double value) {
        std::string text = identifier + "\n" + extra +
                           "NUMBER_OF_FIELDS 38\nBEGIN_DATA_FORMAT\nSAMPLE_ID SAMPLE_NAME";
        for (int nm = 380; nm <= 730; nm += 10) text += " SPEC_" + std::to_string(nm);
        return text + "\nEND_DATA_FORMAT\nNUMBER_OF_SETS 1\nBEGIN_DATA\nA1 dark " +
               Values(value, 36, ' ') + "\nEND_DATA\n";
    };
    const SpectraTable ti3 = nxbase::ParseSpectra(cgats("CTI3", "", 1.2), "m.ti3");
    ASSERT_EQ(ti3.rows.size(), 1u);
    EXPECT_TRUE(ti3.percent);
    EXPECT_EQ(ti3.rows[0].values[0], 0.012f);
    EXPECT_EQ(ti3.rows[0].sampleId, "A1");
    EXPECT_EQ(ti3.rows[0].sampleName, "dark");
    const SpectraTable norm =
        nxbase::ParseSpectra(cgats("CGATS.17", "SPECTRAL_NORM \"100.0\"\n", 40.0), "n.txt");
    ASSERT_EQ(norm.rows.size(), 1u);
    EXPECT_EQ(norm.rows[0].values[0], 0.4f);
    const SpectraTable plain = nxbase::ParseSpectra(cgats("CGATS.17", "", 0.4), "f.txt");
    ASSERT_EQ(plain.rows.size(), 1u);
    EXPECT_EQ(plain.rows[0].values[0], 0.4f);
}

// A CGATS file as ArgyllCMS or X-Rite software writes it.
std::string Cgats(const std::vector<std::string>& sets, const std::string& prefix = "SPECTRAL_NM",
                  int first = 380, int last = 730, int step = 10, const std::string& extra = "") {
    std::string text = "CGATS.17\nORIGINATOR \"test\"\n" + extra + "NUMBER_OF_FIELDS " +
                       std::to_string(2 + (last - first) / step + 1) +
                       "\nBEGIN_DATA_FORMAT\nSAMPLE_ID SAMPLE_NAME";
    for (int nm = first; nm <= last; nm += step) text += " " + prefix + std::to_string(nm);
    text += "\nEND_DATA_FORMAT\nNUMBER_OF_SETS " + std::to_string(sets.size()) + "\nBEGIN_DATA\n";
    for (const std::string& set : sets) text += set + "\n";
    return text + "END_DATA\n";
}

TEST(SpectraFile, ReadsCgatsSpellingsAndReportsBadSets) {
    const std::string text = Cgats({"A1 \"paper white\" " + Values(0.9, 36, ' '),
                                    "A2 \"bad\" 0.5 abc " + Values(0.5, 34, ' '),
                                    "A3 \"grey\" " + Values(0.2, 36, ' ')});
    const SpectraTable table = nxbase::ParseSpectra(text, "m.cgats");
    ASSERT_EQ(table.rows.size(), 2u);
    EXPECT_EQ(table.rows[0].id, "A1 paper white");
    EXPECT_EQ(table.rows[1].line, 11);
    ASSERT_EQ(table.errors.size(), 1u);
    EXPECT_EQ(table.errors[0], "m.cgats:10: SPECTRAL_NM390: \"abc\" is not a number");

    for (const char* prefix : {"SPEC_", "nm", "SPECTRAL_NM_"}) {
        const SpectraTable t =
            nxbase::ParseSpectra(Cgats({"1 x " + Values(0.5, 36, ' ')}, prefix), "s");
        EXPECT_EQ(t.rows.size(), 1u) << prefix;
    }
    // 5 nm steps at x.5 nm named by rounded wavelengths: the declared range
    // gives the grid, and no 10 nm point is on it.
    std::string argyll =
        "SPECT\nSPECTRAL_BANDS \"71\"\nSPECTRAL_START_NM \"377.5\"\nSPECTRAL_END_NM \"727.5\"\n"
        "NUMBER_OF_FIELDS 72\nBEGIN_DATA_FORMAT\nSAMPLE_ID";
    std::string values;
    for (int i = 0; i < 71; ++i) {
        const double nm = 377.5 + 5.0 * i;
        argyll += " SPEC_" + std::to_string(static_cast<int>(std::lround(nm)));
        values += " " + std::to_string(0.2 + 0.001 * (nm - 380.0));
    }
    argyll += "\nEND_DATA_FORMAT\nNUMBER_OF_SETS 1\nBEGIN_DATA\nS1" + values + "\nEND_DATA\n";
    nxbase::SpectralSet set = nxbase::ReadSpectralText(argyll, "a.sp");
    ASSERT_EQ(set.wavelengths.size(), 71u) << (set.errors.empty() ? "" : set.errors[0]);
    EXPECT_EQ(set.wavelengths[1], 382.5);
    const SpectraTable resampled = nxbase::ToStandardGrid(set);
    ASSERT_EQ(resampled.rows.size(), 1u);
    EXPECT_EQ(resampled.resampling, "Sprague");
    for (int k = 0; k < 35; ++k)
        EXPECT_NEAR(resampled.rows[0].values[k], 0.2 + 0.01 * k, nxtest::kFloatInterpolation) << k;
    EXPECT_NEAR(resampled.rows[0].values[35], 0.2 + 0.001 * 347.5, nxtest::kFloatInterpolation)
        << "730 nm: the last value held";

    // Faults the CGATS parser would report far from their place, or in its
    // own words: each names its line and says what is wrong.
    const std::string format =
        "BEGIN_DATA_FORMAT\nSAMPLE_ID SAMPLE_NAME R380 R390 R400\nEND_DATA_FORMAT\n";
    const std::string rows =
        "BEGIN_DATA\n1 a 0.1 0.2 0.3\n2 \"\" 0.1 0.2 0.3\n3 c 0.1 0.2 0.3 \"\"\n4 d 0.1 0.2 "
        "0.3\nEND_DATA\n";
    const std::pair<std::string, std::string> faults[] = {
        {"CGATS.17\n" + format + "NUMBER_OF_SETS 4\n" + rows, "c:2: NUMBER_OF_FIELDS is missing"},
        {"CGATS.17\nNUMBER_OF_FIELDS x\n" + format + "NUMBER_OF_SETS 4\n" + rows,
         "c:2: NUMBER_OF_FIELDS \"x\" is not a number of fields"},
        {"CGATS.17\nNUMBER_OF_FIELDS 5\n" + format + "NUMBER_OF_SETS abc\n" + rows,
         "c:6: NUMBER_OF_SETS \"abc\" is not a number of sets"},
        // A trailing "" on line 10 is a sixth value, not a fault at END_DATA.
        {"CGATS.17\nNUMBER_OF_FIELDS 5\n" + format + "NUMBER_OF_SETS 4\n" + rows,
         "c:10: 6 values where the data format has 5 fields"},
        {"CGATS.17\nNUMBER_OF_FIELDS 5\n" + format +
             "NUMBER_OF_SETS 3\nBEGIN_DATA\n1 a 0.1 0.2 0.3\nEND_DATA\n",
         "c:6: NUMBER_OF_SETS says 3, the data holds 1 sets"},
        // LittleCMS's limit, said in words instead of "AllocateDataSet: too much data".
        {"CGATS.17\nNUMBER_OF_FIELDS 5\n" + format + "NUMBER_OF_SETS 40000\n" + rows,
         "c:6: more than 32766 sets, which the CGATS parser (LittleCMS) does not take"},
        {"CGATS.17\nNUMBER_OF_FIELDS 5\n" + format +
             "NUMBER_OF_SETS 32766\nBEGIN_DATA\n1 a 0.1 0.2 0.3\nEND_DATA\n",
         "c:6: NUMBER_OF_SETS says 32766, the data holds 1 sets"},
    };
    // A header grid the fields contradict is refused, as ArgyllCMS does.
    std::string contradicted = argyll;
    contradicted.replace(contradicted.find("\"71\""), 4, "\"36\"");
    const SpectraTable refused = nxbase::ParseSpectra(contradicted, "x.sp");
    EXPECT_TRUE(refused.unusable);
    ExpectOnlyError(
        refused,
        "x.sp: the header (SPECTRAL_BANDS 36, SPECTRAL_START_NM 377.5, SPECTRAL_END_NM 727.5) "
        "contradicts the data format's 71 spectral fields (378..728 nm)");
    for (const auto& [text, expected] : faults) {
        const SpectraTable t = nxbase::ParseSpectra(text, "c");
        EXPECT_TRUE(t.unusable) << expected;
        ExpectOnlyError(t, expected);
    }
    const SpectraTable broken = nxbase::ParseSpectra("CGATS.17\nBEGIN_DATA_FORMAT\nKEYWORD\n", "b");
    EXPECT_TRUE(broken.unusable);
    ASSERT_EQ(broken.errors.size(), 1u);
    EXPECT_EQ(broken.errors[0].rfind("b:", 0), 0u) << broken.errors[0];
    EXPECT_NE(broken.errors[0].back(), '\n') << "LittleCMS's own line end is dropped";
}

// Files whose layout once read into wrong numbers: each is read as it
// stands or refused with a reason.
TEST(SpectraFile, ReadsEveryValueUnderItsOwnWavelengthOrRefuses) {
    // Irregular SPEC_nnn names: the names give the grid; keywords that
    // contradict them refuse the file, naming both.
    const int irregular[] = {380, 390, 400, 415, 430, 450, 480, 520, 560, 600, 650, 700, 730};
    auto argyll = [&](const std::string& keywords) {
        std::string text =
            "CGATS.17\n" + keywords + "NUMBER_OF_FIELDS 14\nBEGIN_DATA_FORMAT\nSAMPLE_ID";
        for (int nm : irregular) text += " SPEC_" + std::to_string(nm);
        text += "\nEND_DATA_FORMAT\nNUMBER_OF_SETS 1\nBEGIN_DATA\nA";
        for (int nm : irregular) text += " " + std::to_string(nm / 1000.0);
        return text + "\nEND_DATA\n";
    };
    const nxbase::SpectralSet named = nxbase::ReadSpectralText(argyll(""), "i.ti3");
    ASSERT_EQ(named.samples.size(), 1u) << named.errors.at(0);
    for (std::size_t k = 0; k < named.wavelengths.size(); ++k)
        EXPECT_FLOAT_EQ(named.samples[0].values[k], named.wavelengths[k] / 1000.0) << k;
    ExpectOnlyError(
        nxbase::ParseSpectra(
            argyll("SPECTRAL_BANDS 13\nSPECTRAL_START_NM 380\nSPECTRAL_END_NM 730\n"), "i.ti3"),
        "i.ti3: the header (SPECTRAL_BANDS 13, SPECTRAL_START_NM 380, SPECTRAL_END_NM 730) "
        "contradicts the data format's field SPEC_390 (390 nm where they put 409.17 nm)");

    // CSV headers that descend or carry decimals: each value stays under
    // its wavelength, so both read as the ascending integer header does.
    auto header = [](int from, int to, int step, const char* format) {
        std::string text = "id";
        char field[32];
        for (int nm = from; step > 0 ? nm <= to : nm >= to; nm += step) {
            std::snprintf(field, sizeof field, format, static_cast<double>(nm));
            text += std::string(",") + field;
        }
        return text;
    };
    std::string ascending, descending;
    for (int nm = 380; nm <= 730; nm += 10) ascending += "," + std::to_string(nm / 1000.0);
    for (int nm = 730; nm >= 380; nm -= 10) descending += "," + std::to_string(nm / 1000.0);
    const SpectraTable reference =
        nxbase::ParseSpectraCsv(header(380, 730, 10, "%.0f") + "\nA" + ascending + "\n", "a.csv");
    for (const std::string& text : {header(730, 380, -10, "%.0f") + "\nA" + descending,
                                    header(380, 730, 10, "%.1f") + "\nA" + ascending,
                                    header(730, 380, -10, "%.1f nm") + "\nA" + descending}) {
        const SpectraTable t = nxbase::ParseSpectraCsv(text + "\n", "h.csv");
        ASSERT_EQ(t.rows.size(), 1u) << text.substr(0, 40);
        EXPECT_EQ(t.rows[0].values, reference.rows.at(0).values) << text.substr(0, 40);
        EXPECT_TRUE(t.errors.empty() && t.assumptions.empty()) << text.substr(0, 40);
    }

    // Coverage: outside the visible refused; short of 380..730 said.
    for (const auto& [first, last] : {std::pair{900, 1000}, {200, 300}, {420, 700}, {400, 690}}) {
        const SpectraTable t = nxbase::ParseSpectraCsv(
            header(first, last, 10, "%.0f") + "\nA," + Values(0.5, (last - first) / 10 + 1) + "\n",
            "c.csv");
        EXPECT_TRUE(t.unusable && t.rows.empty()) << first;
        ExpectOnlyError(t, "c.csv: the spectra cover " + std::to_string(first) + ".." +
                               std::to_string(last) + " nm, ");
    }
    const SpectraTable held = nxbase::ParseSpectraCsv(
        header(400, 700, 10, "%.0f") + "\nA," + Values(0.5, 31) + "\n", "v.csv");
    ASSERT_EQ(held.rows.size(), 1u);
    EXPECT_EQ(held.assumptions, std::vector<std::string>{
                                    "v.csv: the spectra cover 400..700 nm: the value at 400 nm is "
                                    "held down to 380 nm, the value at 700 nm up to 730 nm"});

    // A headerless row's id fields are said; a UTF-8 byte order mark before
    // CGATS is skipped; UTF-16 is named.
    const SpectraTable headerless = nxbase::ParseSpectraCsv("7," + Values(0.5) + "\n", "n.csv");
    ASSERT_EQ(headerless.rows.size(), 1u);
    EXPECT_EQ(headerless.rows[0].sampleId, "7");
    ASSERT_EQ(headerless.assumptions.size(), 1u);
    EXPECT_THAT(headerless.assumptions[0],
                HasSubstr("n.csv:1: no header: the last 36 of the 37 fields"))
        << headerless.assumptions[0];
    EXPECT_EQ(nxbase::ParseSpectra("\xEF\xBB\xBF" + argyll(""), "b.ti3").rows.size(), 1u);
    std::string utf16 = "\xFF\xFE";
    for (char c : Header()) utf16 += std::string{c, '\0'};
    ExpectOnlyError(nxbase::ParseSpectra(utf16, "u.csv"),
                    "u.csv: UTF-16 text; save the file as UTF-8");
    ExpectOnlyError(nxbase::ParseSpectra(utf16.substr(2), "u.csv"), "u.csv: UTF-16 text");

    // A file that gives nothing is false with its reason, never an empty success.
    nxtest::TempDir dir;
    const std::string broken = dir.File("broken.txt");
    std::ofstream(broken) << "CGATS.17\nBEGIN_DATA_FORMAT\nKEYWORD\n";
    nxbase::SpectralSet set;
    std::string error;
    EXPECT_FALSE(nxbase::ReadSpectralFile(broken, {}, &set, &error));
    EXPECT_EQ(error.rfind(broken + ":", 0), 0u) << error;
    std::ofstream(broken, std::ios::trunc) << Header() << "\n";
    EXPECT_FALSE(nxbase::ReadSpectralFile(broken, {}, &set, &error));
    EXPECT_EQ(error, broken + ": no spectra");
}

TEST(SpectraFile, StreamsAreBoundedAndAgreeWithText) {
    std::string text = Header() + "\n";
    for (int i = 0; i < 2000; ++i)
        text += std::to_string(i) + ",p," + Values(0.001 * (i % 900 + 1)) + "\n";
    std::istringstream stream(text);
    const nxbase::SpectralSet streamed = nxbase::ReadSpectralStream(stream, "s");
    const nxbase::SpectralSet whole = nxbase::ReadSpectralText(text, "s");
    ASSERT_EQ(streamed.samples.size(), 2000u);
    ASSERT_EQ(whole.samples.size(), 2000u);
    for (std::size_t i = 0; i < 2000; i += 97)
        EXPECT_EQ(streamed.samples[i].values, whole.samples[i].values);

    SpectralReadOptions few;
    few.maxSamples = 10;
    std::istringstream limited(text);
    const nxbase::SpectralSet capped = nxbase::ReadSpectralStream(limited, "s", few);
    EXPECT_EQ(capped.samples.size(), 10u);
    ASSERT_EQ(capped.errors.size(), 1u);
    EXPECT_THAT(capped.errors[0], HasSubstr("more than 10 spectra"));

    std::istringstream binary(std::string(1 << 20, '\0'));
    const nxbase::SpectralSet zeros = nxbase::ReadSpectralStream(binary, "/dev/zero");
    EXPECT_TRUE(zeros.unusable);
    ASSERT_EQ(zeros.errors.size(), 1u);
    EXPECT_THAT(zeros.errors[0], HasSubstr("binary data"));
    // One endless line stops at the line limit instead of filling memory.
    std::istringstream endless(std::string(4 * nxbase::kMaxLineLength, '1'));
    const nxbase::SpectralSet line = nxbase::ReadSpectralStream(endless, "e");
    ASSERT_EQ(line.errors.size(), 1u);
    EXPECT_THAT(line.errors[0], HasSubstr("line longer than"));
    // Errors are bounded too.
    std::string junk;
    for (int i = 0; i < 1000; ++i) junk += "x,1,2\n";
    const nxbase::SpectralSet many =
        nxbase::ReadSpectralText(junk, "j", {SpectralScale::kFraction});
    EXPECT_EQ(many.errors.size(), nxbase::kMaxErrorMessages);
    EXPECT_EQ(many.suppressedErrors, 1000u - nxbase::kMaxErrorMessages);
}

TEST(SpectraFile, SurvivesArbitraryBytes) {
    std::mt19937 random(3);
    std::uniform_int_distribution<int> byte(0, 255);
    const std::string seeds[] = {Header() + "\n1,a," + Values(0.5) + "\n",
                                 Cgats({"A1 x " + Values(0.5, 36, ' ')}, "SPEC_", 400, 700, 20)};
    for (int round = 0; round < 400; ++round) {
        std::string text = seeds[round % 2];
        for (int k = 0; k < 20; ++k) text[random() % text.size()] = static_cast<char>(byte(random));
        if (round % 5 == 0) text = std::string(random() % 5000, static_cast<char>(byte(random)));
        const SpectraTable table = nxbase::ParseSpectra(text, "junk");
        EXPECT_LE(table.rows.size(), 1u + text.size() / 36);
        for (const auto& row : table.rows) {
            for (float v : row.values) ASSERT_TRUE(std::isfinite(v));
        }
    }
}

TEST(Resample, SpragueFollowsSmoothCurvesAndHoldsEnds) {
    // A cubic is interpolated exactly by the quintic Sprague polynomial away
    // from the ends, and closely near them (extrapolated support points).
    auto cubic = [](double nm) {
        const double x = (nm - 550.0) / 200.0;
        return 0.5 + 0.3 * x - 0.2 * x * x + 0.25 * x * x * x;
    };
    std::vector<double> grid;
    std::vector<double> values;
    for (double nm = 360.0; nm <= 760.0; nm += 20.0) {
        grid.push_back(nm);
        values.push_back(cubic(nm));
    }
    const nxbase::SpectralResampler sprague(grid);
    EXPECT_EQ(sprague.GetMethod(), nxbase::SpectralResampler::Method::kSprague);
    std::vector<double> out(36);
    sprague.Resample(values.data(), out.data());
    for (int k = 0; k < 36; ++k) {
        // The support points beyond the data are extrapolated: near the ends
        // the curve is followed closely, not exactly.
        const double tolerance = (k == 1 || k == 35) ? 5e-4 : 1e-9;
        EXPECT_NEAR(out[k], cubic(380.0 + 10 * k), tolerance) << k;
    }

    // Uneven grid: linear; outside the data: the end values.
    const nxbase::SpectralResampler linear({400.0, 410.0, 430.0, 700.0});
    EXPECT_EQ(linear.GetMethod(), nxbase::SpectralResampler::Method::kLinear);
    const float in[] = {0.1f, 0.2f, 0.4f, 0.8f};
    float result[36];
    linear.Resample(in, result);
    EXPECT_EQ(result[0], 0.1f);
    EXPECT_EQ(result[2], 0.1f);
    EXPECT_EQ(result[3], 0.2f);
    EXPECT_NEAR(result[4], 0.3f, nxtest::kFloatNearOne);
    EXPECT_EQ(result[35], 0.8f);

    // Many spectra at once give what one at a time gives, for copies and for
    // interpolation.
    for (const double step : {5.0, 20.0}) {
        std::vector<double> fine;
        for (double nm = 380.0; nm <= 730.0; nm += step) fine.push_back(nm);
        const nxbase::SpectralResampler many(fine);
        std::vector<float> in(3 * fine.size());
        for (std::size_t i = 0; i < in.size(); ++i) in[i] = 0.001f * static_cast<float>(i % 997);
        std::vector<float> together(3 * 36), single(3 * 36);
        many.ResampleMany(in.data(), 3, together.data());
        for (int s = 0; s < 3; ++s)
            many.Resample(in.data() + s * fine.size(), single.data() + 36 * s);
        EXPECT_EQ(together, single) << step;
    }

    EXPECT_THROW(nxbase::SpectralResampler({500.0}), std::invalid_argument);
    EXPECT_THROW(nxbase::SpectralResampler({500.0, 490.0, 510.0}), std::invalid_argument);
    EXPECT_THROW(nxbase::SpectralResampler({500.0, NAN}), std::invalid_argument);
}

TEST(Resample, TwentyNanometreChartComesBackCloseToItsTenNanometreValues) {
    // Every other point of the chart, brought back onto 10 nm: Sprague follows
    // the curves better than straight lines do, and the colours stay within
    // 0.3 dE00 of the 10 nm measurement.
    const SpectraTable chart = Chart();
    std::vector<double> grid;
    for (int nm = 380; nm <= 720; nm += 20) grid.push_back(nm);
    std::vector<double> uneven = grid;
    uneven.back() += 1e-3;  // an uneven step forces linear interpolation
    const nxbase::SpectralResampler sprague(grid), linear(uneven);
    ASSERT_EQ(linear.GetMethod(), nxbase::SpectralResampler::Method::kLinear);
    std::vector<float> original, viaSprague, viaLinear;
    for (const auto& row : chart.rows) {
        std::vector<float> coarse;
        for (int k = 0; k < 36; k += 2) coarse.push_back(row.values[k]);
        float a[36], b[36];
        sprague.Resample(coarse.data(), a);
        linear.Resample(coarse.data(), b);
        original.insert(original.end(), row.values.begin(), row.values.end());
        viaSprague.insert(viaSprague.end(), a, a + 36);
        viaLinear.insert(viaLinear.end(), b, b + 36);
    }
    double spragueSquares = 0.0, linearSquares = 0.0;
    for (std::size_t i = 0; i < original.size(); ++i) {
        if (i % 36 == 35) continue;  // 730 nm lies beyond the coarse data
        spragueSquares += std::pow(viaSprague[i] - original[i], 2);
        linearSquares += std::pow(viaLinear[i] - original[i], 2);
    }
    EXPECT_LT(spragueSquares, linearSquares);
    const nxbase::ColorBatch batch(
        MeasuringCondition(IllumClass("D50"), ObserverClass(OBSERVER_2DEG), PhysicalConditions()));
    std::vector<float> labOriginal(3 * 24), labSprague(3 * 24);
    batch.ToLab(original.data(), 24, labOriginal.data());
    batch.ToLab(viaSprague.data(), 24, labSprague.data());
    double worst = 0.0;
    for (int i = 0; i < 24; ++i) {
        const float* p = &labOriginal[3 * i];
        const float* q = &labSprague[3 * i];
        worst = std::max(worst, nxbase::DeltaE2000({p[0], p[1], p[2]}, {q[0], q[1], q[2]}));
    }
    EXPECT_LT(worst, 0.3);
}

}  // namespace
