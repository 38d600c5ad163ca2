// nxcolor's screen colours (--rgb, --icc-profile) and chart picture (--report).
#include <gtest/gtest.h>
#include <lcms2.h>

#include <algorithm>
#include <cmath>
#include <cstdlib>
#include <random>
#include <regex>
#include <string>

#include "color_test_util.h"
#include "report.h"
#include "screen.h"
#include "test_util.h"

namespace {

using nxtest::RunNxcolor;

std::vector<std::string> Lines(const std::string& text) {
    std::vector<std::string> lines;
    std::size_t start = 0;
    for (std::size_t end; (end = text.find('\n', start)) != std::string::npos; start = end + 1)
        lines.push_back(text.substr(start, end - start));
    return lines;
}

TEST(NxcolorScreen, RgbColumnsGiveLevelsAndTheirHex) {
    std::string out, err;
    ASSERT_EQ(RunNxcolor("--rgb --format csv", &out, &err), 0) << err;
    auto lines = Lines(out);
    ASSERT_EQ(lines.size(), 25u);
    EXPECT_EQ(lines[0], "id,name,X,Y,Z,L*,a*,b*,C*,h,R,G,B,hex");
    const std::regex row(R"(.*,(\d+),(\d+),(\d+),#([0-9A-F]{6}))");
    for (std::size_t i = 1; i < lines.size(); ++i) {
        std::smatch m;
        ASSERT_TRUE(std::regex_match(lines[i], m, row)) << lines[i];
        int r = std::stoi(m[1]), g = std::stoi(m[2]), b = std::stoi(m[3]);
        for (int v : {r, g, b}) EXPECT_TRUE(v >= 0 && v <= 255) << lines[i];
        EXPECT_EQ(std::stoi(m[4], nullptr, 16), (r << 16) | (g << 8) | b) << lines[i];
    }
    // Chart patch 19 is white, 24 black; 13 blue, 15 red.
    auto levels = [&](int patch) {
        std::smatch m;
        std::regex_match(lines[patch], m, row);
        return std::vector<int>{std::stoi(m[1]), std::stoi(m[2]), std::stoi(m[3])};
    };
    for (int v : levels(19)) EXPECT_GT(v, 225);
    for (int v : levels(24)) EXPECT_LT(v, 70);
    EXPECT_GT(levels(13)[2], levels(13)[0]);
    EXPECT_GT(levels(15)[0], levels(15)[2]);
}

TEST(NxcolorScreen, IccProfileAgreesWithTheFormulasAndBadOnesFallBack) {
    nxtest::TempDir dir;
    std::string profile = dir.File("srgb.icc");
    cmsHPROFILE p = cmsCreate_sRGBProfile();
    ASSERT_TRUE(cmsSaveProfileToFile(p, profile.c_str()));
    cmsCloseProfile(p);

    std::string formula, icc, err;
    ASSERT_EQ(RunNxcolor("--rgb --format csv -i D65", &formula, &err), 0) << err;
    ASSERT_EQ(RunNxcolor("--rgb --format csv -i D65 --icc-profile " + profile, &icc, &err), 0);
    EXPECT_TRUE(err.empty()) << err;
    // Under D65 the two paths differ only by the D50 PCS adaptation; the
    // neutral patches 19..24 agree to an 8-bit level or two.
    constexpr int kNeutralLevels = 2;
    auto f = Lines(formula), i = Lines(icc);
    ASSERT_EQ(f.size(), i.size());
    const std::regex row(R"(.*,(\d+),(\d+),(\d+),#[0-9A-F]{6})");
    for (int patch = 19; patch <= 24; ++patch) {
        std::smatch a, b;
        ASSERT_TRUE(std::regex_match(f[patch], a, row));
        ASSERT_TRUE(std::regex_match(i[patch], b, row));
        for (int c = 1; c <= 3; ++c)
            EXPECT_NEAR(std::stoi(a[c]), std::stoi(b[c]), kNeutralLevels)
                << f[patch] << " / " << i[patch];
    }

    std::string junk = dir.File("junk.icc");
    nxtest::WriteFile(junk, "not a profile");
    std::string out;
    // A profile named on the command line that cannot be used is a usage
    // error, not a silent fallback.
    ASSERT_EQ(RunNxcolor("--rgb --format csv -i D65 --icc-profile " + junk, &out, &err), 2);
    EXPECT_THAT(err, HasSubstr("ICC profile not used")) << err;
    EXPECT_TRUE(out.empty());
    EXPECT_EQ(RunNxcolor("--icc-profile", &out, &err), 2);
    EXPECT_EQ(RunNxcolor("--report", &out, &err), 2);
}

TEST(NxcolorScreen, ReportDrawsOneSwatchCurveAndLabelPerSample) {
    nxtest::TempDir dir;
    std::string svg = dir.File("chart.svg"), out, err;
    ASSERT_EQ(RunNxcolor("--report " + svg, &out, &err), 0) << err;
    EXPECT_THAT(err, HasSubstr("chart picture written to " + svg));
    std::string text = nxtest::ReadFile(svg);
    ASSERT_EQ(text.rfind("<?xml", 0), 0u);
    EXPECT_THAT(text, HasSubstr("</svg>\n"));
    auto count = [&](const std::string& needle) {
        std::size_t n = 0;
        for (std::size_t at = text.find(needle); at != std::string::npos;
             at = text.find(needle, at + 1))
            ++n;
        return n;
    };
    EXPECT_EQ(count("<polyline class=\"curve\""), 24u);
    EXPECT_EQ(count("class=\"lab\">L* "), 24u);
    EXPECT_EQ(count("rx=\"6\" fill=\"#"), 24u);
    EXPECT_THAT(text, HasSubstr(">1 dark skin<"));
    EXPECT_THAT(text, HasSubstr("24 samples"));
    // Every curve has the 36 points of the spectrum.
    const std::regex points("points=\"([^\"]*)\"");
    for (auto it = std::sregex_iterator(text.begin(), text.end(), points);
         it != std::sregex_iterator(); ++it) {
        std::string p = (*it)[1];
        EXPECT_EQ(std::count(p.begin(), p.end(), ','), 36);
    }
    // Nothing is left beside the picture.
    EXPECT_EQ(std::distance(std::filesystem::directory_iterator(dir.path()),
                            std::filesystem::directory_iterator()),
              1);
}

TEST(NxcolorScreen, ReportEscapesIdsAndFailsCleanlyOnAnUnwritablePath) {
    nxtest::TempDir dir;
    nxcolor::Report report;
    report.source = "a<b>&\"c\"";
    report.illuminant = "D50";
    report.observer = "2";
    nxcolor::ReportRow row;
    row.id = "<script>&x\x01";
    row.spectrum.fill(0.5f);
    row.spectrum[3] = 7.0f;  // fluorescent peak: clipped into the plot
    report.rows.push_back(row);
    std::string error;
    std::string svg = dir.File("x.svg");
    ASSERT_TRUE(nxcolor::WriteSvgReport(report, MeasuringCondition(), svg, &error)) << error;
    std::string text = nxtest::ReadFile(svg);
    EXPECT_THAT(text, Not(HasSubstr("<script>")));
    EXPECT_THAT(text, HasSubstr("&lt;script&gt;&amp;x "));
    EXPECT_THAT(text, HasSubstr("a&lt;b&gt;&amp;&quot;c&quot;"));

    // Windows-1252 names (a Windows export's "gr\xFCn") and file names that
    // are not UTF-8 become UTF-8: the SVG is well-formed for an XML parser.
    report.source = "messung-\xE9t\xE9.csv";
    report.rows[0].id = "gr\xFCn";
    ASSERT_TRUE(nxcolor::WriteSvgReport(report, MeasuringCondition(), svg, &error)) << error;
    text = nxtest::ReadFile(svg);
    EXPECT_THAT(text, HasSubstr("gr\xC3\xBCn"));
    EXPECT_THAT(text, HasSubstr("messung-\xC3\xA9t\xC3\xA9.csv"));
    if (std::system("python3 -c 'import xml.etree.ElementTree' 2>/dev/null") == 0) {
        EXPECT_EQ(
            std::system(
                ("python3 -c 'import sys, xml.etree.ElementTree as E; E.parse(sys.argv[1])' " + svg)
                    .c_str()),
            0);
    }
    EXPECT_FALSE(nxcolor::WriteSvgReport(report, MeasuringCondition(),
                                         dir.File("no/such/dir/x.svg"), &error));
    EXPECT_THAT(error, HasSubstr("cannot write"));
}

// The spectral plot of random reports: a line piece per run of finite
// values, every point inside the frame (nothing clipped, whatever the
// range), a legend entry for the first 24 samples, and well-formed XML.
TEST(NxcolorScreen, PlotDrawsEveryFiniteValueInsideItsFrame) {
    const unsigned seed = std::random_device{}();
    SCOPED_TRACE("seed " + std::to_string(seed));
    std::mt19937 random(seed);
    std::uniform_real_distribution<float> unit(0.0f, 1.0f);
    nxtest::TempDir dir;
    const std::string svg = dir.File("plot.svg");
    const bool python = std::system("python3 -c 'import xml.etree.ElementTree' 2>/dev/null") == 0;
    for (int round = 0; round < 12; ++round) {
        nxcolor::Report report;
        report.source = round % 2 ? "lot <" + std::to_string(round) + ">" : "chart.csv";
        report.illuminant = "D65";
        report.observer = "10";
        const std::size_t count = random() % 40;
        // Up to a range no instrument gives: the axis still has a dozen steps.
        const float scales[] = {1.0f, 3.0f, 250.0f, 3e37f};
        const float scale = scales[round % 4];
        std::size_t expectedPieces = 0;
        for (std::size_t i = 0; i < count; ++i) {
            nxcolor::ReportRow row;
            row.id = "s" + std::to_string(i) + (i % 7 == 0 ? " & <x>" : "");
            bool inPiece = false;
            for (float& v : row.spectrum) {
                const bool gap = random() % 30 == 0;
                v = gap ? NAN : scale * unit(random) - (random() % 10 == 0 ? 0.2f : 0.0f);
                if (!gap && !inPiece) ++expectedPieces;
                inPiece = !gap;
            }
            report.rows.push_back(row);
        }
        std::string error;
        ASSERT_TRUE(nxcolor::WriteSvgPlot(report, MeasuringCondition(), svg, &error)) << error;
        const std::string text = nxtest::ReadFile(svg);
        auto count_of = [&](const std::string& needle) {
            std::size_t n = 0;
            for (auto at = text.find(needle); at != std::string::npos;
                 at = text.find(needle, at + 1))
                ++n;
            return n;
        };
        EXPECT_EQ(count_of("<g class=\"curve\""), count);
        EXPECT_EQ(count_of("<polyline"), expectedPieces);
        EXPECT_EQ(count_of("<g class=\"legend\""), std::min<std::size_t>(count, 24));
        EXPECT_LE(count_of("class=\"tick\""), 7u + 13u);  // 400..700 nm, reflectance
        const std::regex frame(
            "<rect x=\"(\\d+)\" y=\"(\\d+)\" width=\"(\\d+)\" height=\"(\\d+)\"");
        std::smatch box;
        ASSERT_TRUE(std::regex_search(text, box, frame));
        const double left = std::stod(box[1]), top = std::stod(box[2]);
        const double right = left + std::stod(box[3]), bottom = top + std::stod(box[4]);
        const std::regex point("(-?[0-9.]+),(-?[0-9.]+)");
        const std::regex points("points=\"([^\"]*)\"");
        for (auto it = std::sregex_iterator(text.begin(), text.end(), points);
             it != std::sregex_iterator(); ++it) {
            const std::string list = (*it)[1];
            for (auto p = std::sregex_iterator(list.begin(), list.end(), point);
                 p != std::sregex_iterator(); ++p) {
                const double x = std::stod((*p)[1]), y = std::stod((*p)[2]);
                ASSERT_TRUE(x >= left && x <= right && y >= top - 0.05 && y <= bottom + 0.05)
                    << x << "," << y << " outside the frame";
            }
        }
        if (python) {
            EXPECT_EQ(std::system(("python3 -c 'import sys, xml.etree.ElementTree as E; "
                                   "E.parse(sys.argv[1])' " +
                                   svg)
                                      .c_str()),
                      0);
        }
    }
}

}  // namespace
