// The one QApplication of a Qt test program, offscreen, with a private
// runtime directory in the build tree (never a shared /tmp/runtime-<user>).
#ifndef NXBASE_TESTS_QT_TEST_UTIL_H_
#define NXBASE_TESTS_QT_TEST_UTIL_H_

#include <stdlib.h>

#include <QApplication>

#include "test_util.h"

namespace nxtest {

inline QApplication& QtApp() {
    static int argc = 1;
    static char name[] = "nxbase_qt_test";
    static char* argv[] = {name, nullptr};
    static TempDir runtime;
    static QApplication* app = [] {
        ::setenv("QT_QPA_PLATFORM", "offscreen", 1);
        ::setenv("XDG_RUNTIME_DIR", runtime.path().c_str(), 1);
        return new QApplication(argc, argv);
    }();
    return *app;
}

}  // namespace nxtest

#endif  // NXBASE_TESTS_QT_TEST_UTIL_H_
