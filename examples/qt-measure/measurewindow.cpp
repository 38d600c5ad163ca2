#include "measurewindow.h"

#include <nxbase/colorbatch.h>
#include <nxbase/colorconverter.h>
#include <nxbase/colordiff.h>
#include <nxbase/postoffice.h>

#include <QFileDialog>
#include <QHBoxLayout>
#include <QHeaderView>
#include <QVBoxLayout>
#include <algorithm>
#include <cmath>
#include <numeric>

namespace {

enum Column { kSwatch, kPatch, kL, kA, kB, kDeltaE, kColumns };

QTableWidgetItem* Number(double value) {
    // A value that rounds to zero is shown as 0.00, never -0.00.
    if (std::abs(value) < 0.005) value = 0.0;
    auto* item = new QTableWidgetItem(QString::number(value, 'f', 2));
    item->setTextAlignment(Qt::AlignRight | Qt::AlignVCenter);
    return item;
}

// The patch's screen colour, from the library's Lab-to-sRGB converter.
QColor ScreenColour(const std::array<float, 3>& lab) {
    float rgb[3];
    nxbase::LabToScreenRGB(lab.data(), rgb, 1);
    auto channel = [](float percent) {
        return std::clamp(static_cast<int>(percent * 2.55f + 0.5f), 0, 255);
    };
    return QColor(channel(rgb[0]), channel(rgb[1]), channel(rgb[2]));
}

}  // namespace

MeasureWindow::MeasureWindow(PostOffice& office) : office_(office) {
    setWindowTitle(QStringLiteral("Measure with LumaServer"));
    patches_ = new QSpinBox(this);
    patches_->setObjectName(QStringLiteral("patches"));
    patches_->setRange(1, 240);
    patches_->setValue(24);
    measure_ = new QPushButton(QStringLiteral("Measure"), this);
    measure_->setObjectName(QStringLiteral("measure"));
    abort_ = new QPushButton(QStringLiteral("Abort"), this);
    abort_->setObjectName(QStringLiteral("abort"));
    abort_->setEnabled(false);
    reference_ = new QPushButton(QStringLiteral("Reference…"), this);
    reference_->setObjectName(QStringLiteral("reference"));
    progress_ = new QProgressBar(this);
    table_ = new QTableWidget(0, kColumns, this);
    table_->setObjectName(QStringLiteral("table"));
    table_->setHorizontalHeaderLabels({QString(), QStringLiteral("Patch"), QStringLiteral("L*"),
                                       QStringLiteral("a*"), QStringLiteral("b*"),
                                       QStringLiteral("ΔE00")});
    table_->horizontalHeader()->setSectionResizeMode(QHeaderView::ResizeToContents);
    table_->horizontalHeader()->setSectionResizeMode(kPatch, QHeaderView::Stretch);
    table_->setWordWrap(false);
    table_->setColumnWidth(kSwatch, 28);
    table_->verticalHeader()->hide();
    table_->setEditTriggers(QAbstractItemView::NoEditTriggers);
    table_->setSelectionBehavior(QAbstractItemView::SelectRows);
    table_->setSelectionMode(QAbstractItemView::SingleSelection);
    spectrum_ = new nxbase::qt::SpectrumView(this);
    spectrum_->setObjectName(QStringLiteral("spectrum"));
    spectrum_->setMinimumHeight(220);
    notices_ = new QListWidget(this);
    notices_->setMaximumHeight(80);
    status_ = new QLabel(this);
    status_->setObjectName(QStringLiteral("status"));
    status_->setWordWrap(true);

    auto* buttons = new QHBoxLayout;
    buttons->addWidget(new QLabel(QStringLiteral("Patches"), this));
    buttons->addWidget(patches_);
    buttons->addWidget(measure_);
    buttons->addWidget(abort_);
    buttons->addStretch();
    buttons->addWidget(reference_);
    auto* layout = new QVBoxLayout(this);
    layout->addLayout(buttons);
    layout->addWidget(progress_);
    layout->addWidget(table_, 1);
    layout->addWidget(spectrum_, 1);
    layout->addWidget(new QLabel(QStringLiteral("Notices from LumaServer"), this));
    layout->addWidget(notices_);
    layout->addWidget(status_);
    resize(560, 820);

    connect(measure_, &QPushButton::clicked, this, &MeasureWindow::Measure);
    connect(table_, &QTableWidget::currentCellChanged, this,
            [this](int row) { ShowSpectrum(row); });
    connect(abort_, &QPushButton::clicked, this, [this] {
        aborted_ = true;
        if (session_) session_->Abort();
    });
    connect(reference_, &QPushButton::clicked, this, [this] {
        QString path = QFileDialog::getOpenFileName(
            this, QStringLiteral("Reference spectra"), QString(),
            QStringLiteral("Spectra (*.csv *.txt *.ti3 *.cgats);;All files (*)"));
        if (!path.isEmpty()) LoadReference(path.toStdString());
    });
    Link notice = LINK(MeasureWindow, this, OnNotice);
    office_.ChangeMessageHdl(MESSUNG_AUSGELOEST, notice);
    // A lost server takes the window's subscription with it.
    lost_watch_ = office_.AddPeerLostFunction([this](const std::string& peer) {
        if (peer == "LumaServer") subscribed_ = false;
    });
    SetStatus(QStringLiteral("Press Measure: LumaServer is started when it does not run."));
}

MeasureWindow::~MeasureWindow() {
    session_.reset();
    office_.RemovePeerLostFunction(lost_watch_);
    Link none;
    office_.ChangeMessageHdl(MESSUNG_AUSGELOEST, none);
    if (!subscribed_) return;
    MyMemoryBlock empty;
    office_.Send("LumaServer", NOTIFY_MESSUNG_AUS, empty, {}, PeerStart::kNever);
    office_.Send("LumaServer", DISCONNECT, empty, {}, PeerStart::kNever);
}

// The window's own connection, which keeps the server and its notices
// between measurements; made again after the server was lost. Qt's loop
// runs while it waits (the server may have to be started first).
bool MeasureWindow::Subscribe() {
    if (subscribed_) return true;
    auto keepWaiting = [this] { return !aborted_; };
    MyMemoryBlock level, none, answer;
    level << static_cast<unsigned char>(2);
    subscribed_ = office_.SendAndReceive("LumaServer", CONNECT, level, answer, keepWaiting) &&
                  office_.SendAndReceive("LumaServer", NOTIFY_MESSUNG, none, answer, keepWaiting);
    return subscribed_;
}

void MeasureWindow::Measure() {
    if (IsMeasuring()) return;
    measure_->setEnabled(false);
    abort_->setEnabled(true);
    aborted_ = false;
    measured_.clear();
    ShowMeasured();
    const int count = patches_->value();
    progress_->setRange(0, count);
    progress_->setValue(0);
    SetStatus(QStringLiteral("Measuring…"));
    if (!Subscribe()) {
        Finished(false, "LumaServer cannot be reached: " + office_.GetLastError());
        return;
    }
    // Each patch comes on Qt's loop: the bar moves, Abort works, nothing waits.
    session_ = std::make_unique<nxbase::MeasurementSession>(
        office_, count,
        [this](const nxbase::MeasuredSpectrum& patch, int number, int) {
            measured_.push_back(patch);
            progress_->setValue(number);
            ShowMeasured();
        },
        [this](bool ok, const std::string& error) { Finished(ok, error); });
    session_->Start();
}

void MeasureWindow::Finished(bool ok, const std::string& error) {
    if (ok) {
        SetStatus(QStringLiteral("Measured %1 patches.").arg(measured_.size()));
    } else if (aborted_) {
        SetStatus(QStringLiteral("Aborted after %1 patches.").arg(measured_.size()));
    } else {
        // The server died or stopped answering: the next measurement starts it again.
        SetStatus(QStringLiteral("Measuring failed after %1 patches: %2. Measure again to "
                                 "restart LumaServer.")
                      .arg(measured_.size())
                      .arg(QString::fromStdString(error)));
    }
    abort_->setEnabled(false);
    measure_->setEnabled(true);
    if (measured_handler_) measured_handler_();
}

void MeasureWindow::ShowMeasured() {
    lab_.assign(measured_.size(), {});
    const nxbase::ColorBatch batch;  // D50, 2 degrees: what nxcolor prints by default
    table_->setRowCount(static_cast<int>(measured_.size()));
    for (std::size_t i = 0; i < measured_.size(); ++i) {
        batch.ToLab(measured_[i].values.data(), 1, lab_[i].data());
        int row = static_cast<int>(i);
        auto* swatch = new QTableWidgetItem;
        swatch->setBackground(ScreenColour(lab_[i]));
        table_->setItem(row, kSwatch, swatch);
        table_->setItem(row, kPatch, new QTableWidgetItem(QString::fromStdString(measured_[i].id)));
        for (int c = 0; c < 3; ++c) table_->setItem(row, kL + c, Number(lab_[i][c]));
    }
    Compare();
    ShowSpectrum(table_->currentRow());
}

// The patch's measured curve in its screen colour, and its reference
// (the row of the same position) dashed; the latest patch while no row is
// selected.
void MeasureWindow::ShowSpectrum(int row) {
    if (row < 0) row = static_cast<int>(measured_.size()) - 1;
    std::vector<nxbase::qt::SpectrumView::Curve> curves;
    std::vector<double> wavelengths(nxbase::kSpectrumSize);
    for (int k = 0; k < nxbase::kSpectrumSize; ++k) wavelengths[k] = 380.0 + 10.0 * k;
    const auto i = static_cast<std::size_t>(row);
    if (row >= 0 && i < measured_.size()) {
        const auto& values = measured_[i].values;
        curves.push_back({QString::fromStdString(measured_[i].id),
                          wavelengths,
                          {values.begin(), values.end()},
                          ScreenColour(lab_[i])});
    }
    if (row >= 0 && i < referenceTable_.rows.size()) {
        const auto& reference = referenceTable_.rows[i];
        curves.push_back({QStringLiteral("reference ") + QString::fromStdString(reference.id),
                          wavelengths,
                          {reference.values.begin(), reference.values.end()},
                          QColor(90, 90, 90),
                          true});
    }
    spectrum_->SetTitle(curves.empty() ? QStringLiteral("Spectrum")
                                       : QStringLiteral("Spectrum of patch %1").arg(row + 1));
    spectrum_->SetCurves(std::move(curves));
}

bool MeasureWindow::LoadReference(const std::string& path) {
    nxbase::SpectraTable table;
    std::string error;
    if (!nxbase::ReadSpectralFile(path, {}, &table, &error) || table.rows.empty()) {
        SetStatus(QStringLiteral("Reference not read: ") +
                  QString::fromStdString(error.empty() ? "no spectra" : error));
        return false;
    }
    referenceTable_ = std::move(table);
    SetStatus(QStringLiteral("Reference: %1 spectra from %2")
                  .arg(referenceTable_.rows.size())
                  .arg(QString::fromStdString(path)));
    Compare();
    ShowSpectrum(table_->currentRow());
    return true;
}

// ΔE00 of each patch against the reference row of the same position; the
// three largest are marked.
void MeasureWindow::Compare() {
    const std::size_t pairs = std::min(lab_.size(), referenceTable_.rows.size());
    std::vector<double> delta(pairs);
    const nxbase::ColorBatch batch;
    for (std::size_t i = 0; i < pairs; ++i) {
        float reference[3];
        batch.ToLab(referenceTable_.rows[i].values.data(), 1, reference);
        delta[i] = nxbase::DeltaE2000({reference[0], reference[1], reference[2]},
                                      {lab_[i][0], lab_[i][1], lab_[i][2]});
    }
    std::vector<std::size_t> order(pairs);
    std::iota(order.begin(), order.end(), 0);
    std::sort(order.begin(), order.end(),
              [&](std::size_t a, std::size_t b) { return delta[a] > delta[b]; });
    for (int row = 0; row < table_->rowCount(); ++row) {
        auto i = static_cast<std::size_t>(row);
        table_->setItem(row, kDeltaE, i < pairs ? Number(delta[i]) : new QTableWidgetItem);
    }
    for (std::size_t k = 0; k < std::min<std::size_t>(3, order.size()); ++k) {
        int row = static_cast<int>(order[k]);
        for (int c = kPatch; c < kColumns; ++c)
            table_->item(row, c)->setBackground(QColor(255, 214, 170));
    }
}

long MeasureWindow::OnNotice(void* event) {
    MyMemoryBlock data = static_cast<VELTRAEvent*>(event)->GetData();
    String id;
    int index = -1;
    data >> id >> index;
    notices_->addItem(QStringLiteral("measured: %1").arg(QString::fromStdString(id.str())));
    notices_->scrollToBottom();
    return 0;
}

void MeasureWindow::SetStatus(const QString& text) {
    status_->setText(text);
}
