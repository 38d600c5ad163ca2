// qt-measure: a small Qt window that measures patches through LumaServer.
// The library's loop runs inside Qt's (nxbase::qt::Attach), its boxes and
// waiting dialog are Qt widgets (QtUserInterface); the server is started on
// demand from the registry (lumaserver --register does it).
//
//   qt-measure [--reference FILE] [--measure [--select N] [--screenshot PNG]]
//   --measure measures at once; --select then shows patch N's spectrum,
//   --screenshot saves the window and ends.
#include <nxbase/postoffice.h>
#include <nxbase/qtloop.h>
#include <nxbase/qtuserinterface.h>
#include <nxbase/singleton.h>
#include <nxbase/text.h>

#include <QApplication>
#include <QTimer>
#include <memory>

#include "measurewindow.h"

int main(int argc, char** argv) {
    QApplication app(argc, argv);
    QApplication::setApplicationDisplayName(QStringLiteral("qt-measure"));
    nxbase::qt::Attach();
    UserInterface::Install(std::make_shared<nxbase::qt::QtUserInterface>());
    Text::LoadLibraryTexts(1);
    PostOffice* office = PostOffice::CreatePostOffice("QtMeasure");
    int result = 0;
    {
        MeasureWindow window(*office);
        QStringList arguments = QApplication::arguments();
        int at = static_cast<int>(arguments.indexOf(QStringLiteral("--reference")));
        if (at > 0 && at + 1 < arguments.size())
            window.LoadReference(arguments[at + 1].toStdString());
        int shot = static_cast<int>(arguments.indexOf(QStringLiteral("--screenshot")));
        QString screenshot =
            shot > 0 && shot + 1 < arguments.size() ? arguments[shot + 1] : QString();
        int select = static_cast<int>(arguments.indexOf(QStringLiteral("--select")));
        const int patch =
            select > 0 && select + 1 < arguments.size() ? arguments[select + 1].toInt() : 0;
        if (arguments.contains(QStringLiteral("--measure"))) {
            window.SetMeasuredHandler([&window, screenshot, patch] {
                if (patch > 0) window.SelectPatch(patch - 1);
                if (screenshot.isEmpty()) return;
                bool saved = window.grab().save(screenshot);
                QApplication::exit(saved ? 0 : 1);
            });
            QTimer::singleShot(0, &window, [&window] { window.Measure(); });
        }
        window.show();
        result = QApplication::exec();
    }
    nxbase::qt::Detach();
    NxSingleton::DeleteAllSingleton();
    return result;
}
