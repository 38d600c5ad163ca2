// The qt-measure example, headless: it measures the built-in chart through
// LumaServer with the numbers nxcolor prints, marks the three patches
// farthest from a reference, shows the server's notices, and survives the
// server being killed mid-measurement.
#include <gtest/gtest.h>

#include <QApplication>
#include <QPushButton>
#include <QSpinBox>
#include <QTableWidget>
#include <QTest>
#include <QTimer>
#include <fstream>
#include <sstream>

#include "gui_test_util.h"
#include "measurewindow.h"
#include "nxbase/qtloop.h"
#include "qt_test_util.h"

namespace {

using namespace std::chrono_literals;

class QtMeasureTest : public ::testing::Test {
  protected:
    void SetUp() override {
        nxbase::qt::Attach();
        UserInterface::Install(std::make_shared<nxbase::qt::QtUserInterface>());
        office = PostOffice::CreatePostOffice("QtMeasureTest");
        window = std::make_unique<MeasureWindow>(*office);
        window->show();
    }
    void TearDown() override {
        window.reset();
        nxbase::qt::Detach();
        UserInterface::Install(nullptr);
    }
    void Click(const char* button) {
        QTest::mouseClick(window->findChild<QPushButton*>(QString::fromLatin1(button)),
                          Qt::LeftButton);
    }
    void SetPatches(int count) {
        window->findChild<QSpinBox*>(QStringLiteral("patches"))->setValue(count);
    }
    bool ProcessUntil(const std::function<bool()>& done, std::chrono::milliseconds limit = 10s) {
        return nxtest::Until(done, limit, [] {
            QCoreApplication::processEvents(QEventLoop::WaitForMoreEvents, 20);
        });
    }

    nxtest::GuiSandbox gui;
    QApplication& app = nxtest::QtApp();
    PostOffice* office = nullptr;
    std::unique_ptr<MeasureWindow> window;
};

TEST_F(QtMeasureTest, MeasuresTheChartAsNxcolorDoesAndMarksTheThreeFarthestFromTheReference) {
    SetPatches(24);
    Click("measure");
    ASSERT_TRUE(ProcessUntil([&] { return !window->IsMeasuring(); }));
    ASSERT_EQ(window->Lab().size(), 24u) << window->Status().toStdString();
    EXPECT_TRUE(window->Status().startsWith(QStringLiteral("Measured 24")))
        << window->Status().toStdString();

    // The table shows what nxcolor, through the same server, prints: id, L*, a*, b*.
    auto* table = window->findChild<QTableWidget*>(QStringLiteral("table"));
    std::istringstream lines(
        nxtest::ShellOutput(NXBASE_BINARY_DIR "/tools/nxcolor --measure 24 -f csv -p 2"));
    std::string line;
    std::getline(lines, line);  // header
    int rows = 0;
    for (; rows < 24 && std::getline(lines, line); ++rows) {
        std::string shown = table->item(rows, 1)->text().toStdString() + ",";
        std::string lab;
        for (int c = 2; c <= 4; ++c) lab += "," + table->item(rows, c)->text().toStdString();
        EXPECT_EQ(line.rfind(shown, 0), 0u) << line << " vs " << shown;
        EXPECT_THAT(line, HasSubstr(lab + ",")) << line << " vs " << lab;
    }
    EXPECT_EQ(rows, 24);
    // Notices of every measured patch reached the window.
    ASSERT_TRUE(ProcessUntil([&] { return window->NoticeCount() >= 24; })) << window->NoticeCount();

    // A reference equal to the chart but for three darker patches: exactly those are marked.
    std::ifstream chart(NXBASE_SOURCE_DIR
                        "/tools/nxcolor/data/colorchecker_babelcolor_average.csv");
    std::string reference = gui.sandbox.root() + "/reference.csv";
    std::ofstream out(reference);
    for (int row = 0; std::getline(chart, line); ++row) {
        if (row == 5 || row == 11 || row == 17) {
            std::istringstream fields(line);
            std::string field;
            for (int f = 0; std::getline(fields, field, ','); ++f)
                out << (f ? "," : "") << (f < 2 ? field : std::to_string(std::stod(field) * 0.8));
            out << "\n";
        } else {
            out << line << "\n";
        }
    }
    out.close();
    ASSERT_TRUE(window->LoadReference(reference)) << window->Status().toStdString();
    std::vector<int> marked;
    for (int row = 0; row < table->rowCount(); ++row) {
        if (table->item(row, 1)->background().style() != Qt::NoBrush) marked.push_back(row);
        double delta = table->item(row, 5)->text().toDouble();
        if (row == 4 || row == 10 || row == 16) {
            EXPECT_GT(delta, 3.0) << row;
        } else {
            EXPECT_LT(delta, 0.01) << row;
        }
    }
    EXPECT_EQ(marked, (std::vector<int>{4, 10, 16}));

    // A selected patch's spectrum is drawn with its reference, dashed: here
    // the chart's, four fifths of it.
    window->SelectPatch(4);
    const auto& curves = window->Spectrum().Curves();
    ASSERT_EQ(curves.size(), 2u);
    EXPECT_EQ(curves[0].name.toStdString(), "5 blue flower");
    EXPECT_TRUE(curves[1].dashed && !curves[0].dashed);
    ASSERT_EQ(curves[1].values.size(), 36u);
    for (std::size_t k = 0; k < 36; ++k)
        EXPECT_NEAR(curves[1].values[k], 0.8 * curves[0].values[k], 1e-4) << k;
}

TEST_F(QtMeasureTest, SurvivesTheServerKilledMidMeasurementAndTheNextMeasurementRestartsIt) {
    SetPatches(240);
    auto* progress = window->findChild<QProgressBar*>();
    // Killed as soon as the first patch shows on the bar, whatever the machine's speed.
    pid_t killed = 0;
    QObject::connect(progress, &QProgressBar::valueChanged, [&](int value) {
        if (value <= 0 || killed != 0) return;
        killed = nxtest::FindProcess(gui.server);
        if (killed != 0) ::kill(killed, SIGKILL);
    });
    Click("measure");
    ASSERT_TRUE(ProcessUntil([&] { return !window->IsMeasuring(); }));
    ASSERT_NE(killed, 0);
    EXPECT_GT(window->Lab().size(), 0u);
    EXPECT_LT(window->Lab().size(), 240u);
    EXPECT_TRUE(window->Status().contains(QStringLiteral("Measure again to restart LumaServer")))
        << window->Status().toStdString();

    EXPECT_TRUE(window->Status().contains(QStringLiteral("LumaServer was lost at patch")))
        << window->Status().toStdString();
    SetPatches(3);
    Click("measure");
    ASSERT_TRUE(ProcessUntil([&] { return !window->IsMeasuring(); }));
    EXPECT_EQ(window->Status().toStdString(), "Measured 3 patches.");
    EXPECT_EQ(window->Lab().size(), 3u);
    EXPECT_NE(nxtest::FindProcess(gui.server), killed);
}

}  // namespace
