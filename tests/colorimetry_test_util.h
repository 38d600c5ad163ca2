// Helpers of the colorimetry tests: reading the reference tables below
// tests/data/colorimetry.
#ifndef NXBASE_TESTS_COLORIMETRY_TEST_UTIL_H_
#define NXBASE_TESTS_COLORIMETRY_TEST_UTIL_H_

#include <gtest/gtest.h>

#include <boost/make_shared.hpp>
#include <cstdlib>
#include <memory>
#include <string>
#include <vector>

#include "log_test_util.h"
#include "nxbase/logfile.h"
#include "test_util.h"

namespace nxtest {

inline std::string ColorimetryData(const std::string& name) {
    return std::string(NXBASE_TEST_DATA_DIR) + "/colorimetry/" + name;
}

inline double ToDouble(const std::string& text) {
    return std::strtod(text.c_str(), nullptr);
}

// Records the log lines written while it exists ("key|text" each).
class LogCapture {
  public:
    LogCapture() { LogFile::Instance()->AddLogListener(amLog); }
    ~LogCapture() { LogFile::Instance()->RemoveLogListener(amLog); }
    LogCapture(const LogCapture&) = delete;
    LogCapture& operator=(const LogCapture&) = delete;

    std::string Text() const {
        std::string text;
        for (const std::string& line : amLog->lines) text += line + "\n";
        return text;
    }

  private:
    boost::shared_ptr<RecordingLog> amLog = boost::make_shared<RecordingLog>();
};

}  // namespace nxtest

#endif  // NXBASE_TESTS_COLORIMETRY_TEST_UTIL_H_
