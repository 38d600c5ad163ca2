// What the messaging fuzz targets share: a private runtime directory, log
// and registry hives (removed at exit), no session bus, and a user
// interface that answers every box at once.
#ifndef NXBASE_FUZZ_MESSAGING_FUZZ_ENV_H_
#define NXBASE_FUZZ_MESSAGING_FUZZ_ENV_H_

#include <unistd.h>

#include <cstdlib>
#include <filesystem>
#include <memory>
#include <string>

#include "toolkit/userinterface.h"

namespace nxfuzz {

class SilentUserInterface : public UserInterface {
  public:
    void ErrorBox(const std::string&) override {}
    void InfoBox(const std::string&) override {}
    bool QueryBox(const std::string&, bool answer) override { return answer; }
};

inline void PrepareMessagingEnvironment(const char* tag) {
    static bool done = false;
    if (done) return;
    done = true;
    static std::string root = std::filesystem::temp_directory_path() /
                              (std::string(tag) + "-" + std::to_string(::getpid()));
    std::filesystem::create_directories(root);
    std::atexit([] {
        std::error_code ignored;
        std::filesystem::remove_all(root, ignored);
    });
    ::setenv("NXBASE_RUNTIME_DIR", (root + "/run").c_str(), 1);
    ::setenv("NXBASE_LOG_PATH", root.c_str(), 1);
    ::setenv("NXBASE_MACHINE_REGISTRY", (root + "/machine.sqlite").c_str(), 1);
    ::setenv("NXBASE_USER_REGISTRY", (root + "/user.sqlite").c_str(), 1);
    ::setenv("DBUS_SESSION_BUS_ADDRESS", "", 1);
    ::setenv("XDG_RUNTIME_DIR", "", 1);
    static ScopedUserInterface silent(std::make_shared<SilentUserInterface>());
}

}  // namespace nxfuzz

#endif  // NXBASE_FUZZ_MESSAGING_FUZZ_ENV_H_
