// The window of qt-measure: measures N patches through LumaServer on the
// event loop (a MeasurementSession) with a progress bar and an abort button, shows each patch as a
// swatch with its CIELAB values, compares with a reference file (CIEDE2000 per patch, the worst
// three marked), draws the spectrum of the selected patch (the latest while none is selected)
// with its reference, and lists the server's notices as they come.
#ifndef QT_MEASURE_MEASUREWINDOW_H_
#define QT_MEASURE_MEASUREWINDOW_H_

#include <nxbase/lumaclient.h>
#include <nxbase/qtspectrumview.h>
#include <nxbase/qtuserinterface.h>
#include <nxbase/spectrafile.h>

#include <QLabel>
#include <QListWidget>
#include <QProgressBar>
#include <QPushButton>
#include <QSpinBox>
#include <QTableWidget>
#include <QWidget>
#include <array>
#include <functional>
#include <memory>
#include <string>
#include <vector>

class PostOffice;

class MeasureWindow : public QWidget {
  public:
    explicit MeasureWindow(PostOffice& office);
    ~MeasureWindow() override;

    // Measures the number of patches in the spin box on the event loop; the
    // table shows each patch as it comes. `measured` is called at the end.
    void Measure();
    bool IsMeasuring() const { return session_ && session_->IsRunning(); }
    void SetMeasuredHandler(std::function<void()> measured) {
        measured_handler_ = std::move(measured);
    }
    // Reads a reference file (CSV or CGATS) and compares the table with it.
    bool LoadReference(const std::string& path);
    // The CIELAB values shown, one row per patch, and the status line.
    const std::vector<std::array<float, 3>>& Lab() const { return lab_; }
    QString Status() const { return status_->text(); }
    int NoticeCount() const { return notices_->count(); }
    const nxbase::qt::SpectrumView& Spectrum() const { return *spectrum_; }
    // Selects a patch (from 0): its spectrum is drawn.
    void SelectPatch(int row) { table_->selectRow(row); }

    // The server's notice that a patch was measured (MESSUNG_AUSGELOEST).
    long OnNotice(void* event);

  private:
    bool Subscribe();
    void Finished(bool ok, const std::string& error);
    void ShowMeasured();
    void Compare();
    void ShowSpectrum(int row);
    void SetStatus(const QString& text);

    PostOffice& office_;
    QSpinBox* patches_;
    QPushButton* measure_;
    QPushButton* abort_;
    QPushButton* reference_;
    QProgressBar* progress_;
    QTableWidget* table_;
    nxbase::qt::SpectrumView* spectrum_;
    QListWidget* notices_;
    QLabel* status_;
    std::vector<nxbase::MeasuredSpectrum> measured_;
    std::vector<std::array<float, 3>> lab_;
    nxbase::SpectraTable referenceTable_;
    std::unique_ptr<nxbase::MeasurementSession> session_;
    std::function<void()> measured_handler_;
    int lost_watch_ = 0;
    bool aborted_ = false;
    bool subscribed_ = false;
};

#endif  // QT_MEASURE_MEASUREWINDOW_H_
